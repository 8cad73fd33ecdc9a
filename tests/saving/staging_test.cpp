// Writing one adapter's rule file, and removing, moving and copying whole
// configuration directories.
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "ORVI.Core.Network.TrafficControl.h"
#include "fake_platform.h"
#include "tcalloc.h"

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

Json::Value AllRule(const std::string& source) {
  Json::Value rule(Json::objectValue);
  rule["enabled"] = true;
  rule["protocol"] = "tcp";
  rule["minrate"] = 10;
  rule["maxrate"] = 20;
  rule["source"] = source;
  rule["ip_direction"] = "src";
  rule["port_type"] = "ALL";
  rule["port_direction"] = "src";
  return rule;
}

class StagingTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fake::Reset();
    tcalloc::FailAfter(-1);
    fake::S().dirs["/etc/tc_tmp"]["eth0"] = {fake::Rule(1, "SELF:22:src")};
  }
  void TearDown() override {
    tcalloc::FailAfter(-1);
    EXPECT_EQ(fake::S().ruleBufsOut, 0);
    EXPECT_EQ(fake::S().filesOut, 0);
    EXPECT_THAT(fake::BadFrames(), IsEmpty());
  }
  // The one adapter whose file a directory holds, "" when it is gone.
  static std::string Holds(const std::string& dir) {
    auto d = fake::S().dirs.find(dir);
    if (d == fake::S().dirs.end()) return "";
    std::string names;
    for (const auto& f : d->second) names += f.first;
    return names;
  }
  std::vector<int> StoredIds(const std::string& dir, const std::string& adapter) {
    std::vector<int> ids;
    for (const auto& r : fake::S().dirs[dir][adapter]) ids.push_back(r.id);
    return ids;
  }
  ORVI::APIRequest req_;
  ORVI::APIResponse resp_;
  TCHandler h_{&req_, &resp_};
};

TEST_F(StagingTest, EmptyArrayWritesEmptyFile) {
  EXPECT_TRUE(h_.Dump2Conf("/etc/tc_tmp", "eth0", Json::Value(Json::arrayValue)));
  EXPECT_THAT(fake::S().calls,
              ElementsAre("ORVIFwTcRuleOpen(/etc/tc_tmp,eth0)", "ORVIFwTcBufRuleInit()",
                          "ORVIFwTcBufRulesFree(rule)", "ORVIFwTcRuleClose(/etc/tc_tmp,eth0)"));
  EXPECT_THAT(fake::S().dirs["/etc/tc_tmp"]["eth0"], IsEmpty());
  EXPECT_THAT(fake::LogBodies(), IsEmpty());
}

TEST_F(StagingTest, RulesKeepTheirPositionsAndFields) {
  Json::Value rules(Json::arrayValue);
  rules.append(AllRule("10.0.0.1"));
  rules.append(AllRule("10.0.0.2"));
  Json::Value third = AllRule("10.0.0.3");
  third["port_type"] = "SELF";
  third["port_num"] = "8080";
  third["port_direction"] = "dest";
  rules.append(third);
  // A long adapter name reaches the store whole.
  const std::string adapter = "a-very-long-adapter-name";
  EXPECT_TRUE(h_.Dump2Conf("/etc/tc_tmp", adapter, rules));
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleWrite"),
              ElementsAre("ORVIFwTcRuleWrite(1)", "ORVIFwTcRuleWrite(2)", "ORVIFwTcRuleWrite(3)"));
  const fake::RuleFile& file = fake::S().dirs["/etc/tc_tmp"][adapter];
  ASSERT_EQ(file.size(), 3u);
  EXPECT_EQ(file[0].source, "10.0.0.1");
  EXPECT_EQ(file[1].ports, "ALL::src");
  EXPECT_EQ(file[2].ports, "SELF:8080:dest");
  EXPECT_EQ(file[2].source, "10.0.0.3");
  // One record serves every rule.
  EXPECT_THAT(fake::CallsOf("ORVIFwTcBufRuleInit"), ElementsAre("ORVIFwTcBufRuleInit()"));
}

TEST_F(StagingTest, RuleThatCannotBeBuiltLeavesGapInIds) {
  Json::Value rules(Json::arrayValue);
  for (const char* source : {"10.0.0.1", "10.0.0.2", "10.0.0.3"}) rules.append(AllRule(source));
  tcalloc::FailAfter(1);
  EXPECT_TRUE(h_.Dump2Conf("/etc/tc_tmp", "eth0", rules));
  EXPECT_EQ(StoredIds("/etc/tc_tmp", "eth0"), (std::vector<int>{1, 3}));
  EXPECT_EQ(fake::S().dirs["/etc/tc_tmp"]["eth0"][1].source, "10.0.0.3");
  EXPECT_EQ(fake::LogBodies().size(), 1u);
}

TEST_F(StagingTest, OpenFailureWritesAndClosesNothing) {
  fake::FailCall("ORVIFwTcRuleOpen");
  Json::Value rules(Json::arrayValue);
  rules.append(AllRule("all"));
  EXPECT_FALSE(h_.Dump2Conf("/etc/tc_tmp", "eth0", rules));
  EXPECT_THAT(fake::S().calls,
              ElementsAre("ORVIFwTcRuleOpen(/etc/tc_tmp,eth0)", "ORVIFwTcBufRulesFree(NULL)"));
  EXPECT_THAT(fake::LogBodies(), ElementsAre("failed to open rule file of eth0"));
  EXPECT_EQ(StoredIds("/etc/tc_tmp", "eth0"), (std::vector<int>{1}));
}

TEST_F(StagingTest, InitFailureStillClosesTheFile) {
  fake::FailCall("ORVIFwTcBufRuleInit");
  Json::Value rules(Json::arrayValue);
  rules.append(AllRule("all"));
  EXPECT_FALSE(h_.Dump2Conf("/etc/tc_tmp", "eth0", rules));
  EXPECT_THAT(fake::S().calls,
              ElementsAre("ORVIFwTcRuleOpen(/etc/tc_tmp,eth0)", "ORVIFwTcBufRuleInit()",
                          "ORVIFwTcBufRulesFree(NULL)", "ORVIFwTcRuleClose(/etc/tc_tmp,eth0)"));
  EXPECT_THAT(fake::LogBodies(),
              ElementsAre("failed to init tc rule structure[0x0201 ORVIFwTcBufRuleInit:1]"));
}

// Directory operations: which programs run, what is logged, what the
// directories hold afterwards ("/etc/a" holds eth0's file, "/etc/b" eth1's).
struct DirCase {
  const char* name;
  const char* op;    // "rm" (of /etc/b), "mv" or "cp" (from /etc/a to /etc/b)
  const char* fail;  // failing program, or nullptr
  bool result;
  std::vector<std::string> execs;
  std::vector<std::string> logs;
  const char* a;  // what "/etc/a" then holds: "eth0", or "" when it is gone
  const char* b;  // the same for "/etc/b"
};

const char kRm[] = "OLIBCExec(/bin/rm,-rf,/etc/b)";
const char kMv[] = "OLIBCExec(/bin/mv,-f,/etc/a,/etc/b)";
const char kCp[] = "OLIBCExec(/bin/cp,-rf,/etc/a,/etc/b)";
const char kRmFailed[] = "Failed to rm -rf /etc/b. ret=-1";

// clang-format off
const DirCase kDirCases[] = {
  {"RemoveOk",         "rm", nullptr,             true,  {kRm},      {},          "eth0", ""},
  {"RemoveFails",      "rm", "OLIBCExec /bin/rm", false, {kRm},      {kRmFailed}, "eth0", "eth1"},
  {"MoveReplaces",     "mv", nullptr,             true,  {kRm, kMv}, {},          "",     "eth0"},
  {"MoveRemovalFails", "mv", "OLIBCExec /bin/rm", false, {kRm},      {kRmFailed}, "eth0", "eth1"},
  {"MoveProgramFails", "mv", "OLIBCExec /bin/mv", false, {kRm, kMv}, {"Failed to mv -f (/etc/a) (/etc/b)"}, "eth0", ""},
  {"CopyReplaces",     "cp", nullptr,             true,  {kRm, kCp}, {},          "eth0", "eth0"},
  {"CopyRemovalFails", "cp", "OLIBCExec /bin/rm", false, {kRm},      {kRmFailed}, "eth0", "eth1"},
  {"CopyProgramFails", "cp", "OLIBCExec /bin/cp", false, {kRm, kCp}, {"Failed to cp -rf (/etc/a) (/etc/b)"}, "eth0", ""},
};
// clang-format on

class DirOps : public StagingTest, public ::testing::WithParamInterface<DirCase> {};

TEST_P(DirOps, RunsProgramsAndReports) {
  const DirCase& c = GetParam();
  fake::S().dirs["/etc/a"]["eth0"] = {fake::Rule(1, "ALL::src")};
  fake::S().dirs["/etc/b"]["eth1"] = {fake::Rule(1, "SYS:ssh:src")};
  if (c.fail != nullptr) fake::FailCall(c.fail);

  const std::string op = c.op;
  const bool result = op == "rm"   ? h_.ConfRemove("/etc/b")
                      : op == "mv" ? h_.ConfMove("/etc/a", "/etc/b")
                                   : h_.ConfCopy("/etc/a", "/etc/b");
  EXPECT_EQ(result, c.result);
  EXPECT_EQ(fake::CallsOf("OLIBCExec"), c.execs);
  EXPECT_EQ(fake::LogBodies(), c.logs);
  EXPECT_EQ(Holds("/etc/a"), c.a);
  EXPECT_EQ(Holds("/etc/b"), c.b);
}

INSTANTIATE_TEST_SUITE_P(Cases, DirOps, ::testing::ValuesIn(kDirCases),
                         [](const ::testing::TestParamInfo<DirCase>& info) {
                           return std::string(info.param.name);
                         });

}  // namespace
