// The test helpers other integration tests rely on: a fault here would show
// up as a hang or a misleading failure somewhere else.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>

#include "tc_support.h"

namespace {

using tcsupport::RunResult;

TEST(SupportRun, LargeInputAndOutputDoNotDeadlock) {
  // Far beyond a pipe buffer in both directions at once.
  std::string input;
  for (int i = 0; input.size() < (3u << 20); ++i) input += std::to_string(i) + "\n";
  RunResult r = tcsupport::Run({"/bin/cat"}, {}, input, std::chrono::seconds(60));
  EXPECT_FALSE(r.timedOut);
  EXPECT_EQ(r.exitCode, 0);
  EXPECT_TRUE(r.out == input) << r.out.size() << " of " << input.size() << " bytes";
}

TEST(SupportRun, ReportsStatusOutputsAndEnvironment) {
  RunResult r = tcsupport::Run({"/bin/sh", "-c", "echo \"$A\"; echo \"$HOME-x\" >&2; exit 3"},
                               {{"A", "one two"}, {"HOME", "h"}});
  EXPECT_EQ(r.exitCode, 3);
  EXPECT_EQ(r.termSignal, 0);
  EXPECT_EQ(r.out, "one two\n");
  EXPECT_EQ(r.err, "h-x\n");
  EXPECT_FALSE(r.jsonValid);

  // A child that never reads its input still gets it without killing us.
  RunResult ignored = tcsupport::Run({"/bin/true"}, {}, std::string(1 << 20, 'x'));
  EXPECT_EQ(ignored.exitCode, 0);

  RunResult slow = tcsupport::Run({"/bin/sleep", "30"}, {}, "", std::chrono::milliseconds(200));
  EXPECT_TRUE(slow.timedOut);
  EXPECT_EQ(slow.termSignal, SIGKILL);
  EXPECT_EQ(slow.exitCode, -1);

  EXPECT_THROW(tcsupport::Run({"/nonexistent/program"}), std::runtime_error);
}

TEST(SupportJson, OnlyOneWholeValueCounts) {
  struct Case {
    const char* text;
    bool valid;
  } cases[] = {{"{\"a\":1}\n", true}, {"[]", true},     {"", false},
               {"  \n", false},       {"{} {}", false}, {"{\"a\":1,\"a\":2}", false}};
  for (const Case& c : cases) {
    Json::Value v;
    EXPECT_EQ(tcsupport::ParseJson(c.text, &v), c.valid) << c.text;
  }
}

TEST(SupportTempDir, RemovesEverythingEvenWithoutPermissions) {
  std::string path;
  {
    tcsupport::TempDir dir;
    path = dir.path();
    ASSERT_EQ(mkdir(dir.Join("locked").c_str(), 0700), 0);
    tcsupport::WriteFile(dir.Join("locked/file"), "x");
    ASSERT_EQ(chmod(dir.Join("locked").c_str(), 0), 0);
    tcsupport::TempDir moved = std::move(dir);
    EXPECT_EQ(dir.path(), "");
    EXPECT_EQ(moved.path(), path);
  }
  EXPECT_FALSE(tcsupport::PathExists(path));
}

}  // namespace
