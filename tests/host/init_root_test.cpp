// `tcapi init-root`: the simulated appliance layout the platform reads.
#include <map>
#include <sstream>

#include "host_test_util.h"

using hosttest::ExpectOneLineFailure;
using tcsupport::IsDirectory;
using tcsupport::PathExists;
using tcsupport::ReadFile;
using tcsupport::RunResult;
using tcsupport::RunTcapi;
using tcsupport::TempDir;

namespace {

std::map<std::string, std::string> KeyValues(const std::string& text) {
  std::map<std::string, std::string> out;
  std::istringstream in(text);
  std::string line;
  while (std::getline(in, line)) {
    size_t eq = line.find('=');
    if (eq != std::string::npos) out[line.substr(0, eq)] = line.substr(eq + 1);
  }
  return out;
}

void ExpectBaseLayout(const std::string& root) {
  for (const char* dir : {"etc/tc", "sys/class/net", "run/tc"}) {
    EXPECT_TRUE(IsDirectory(root + "/" + dir)) << dir;
  }
  EXPECT_TRUE(PathExists(root + "/etc/orviinfo.conf"));
  EXPECT_FALSE(PathExists(root + "/etc/tc_tmp"));
}

TEST(InitRoot, DemoIsARouterWithSixInterfaces) {
  TempDir root = tcsupport::MakeDemoRoot();
  ExpectBaseLayout(root.path());
  EXPECT_EQ(
      KeyValues(ReadFile(root.Join("etc/orviinfo.conf"))),
      (std::map<std::string, std::string>{
          {"support_net_topology", "yes"}, {"net_topology", "router"}, {"wan_interface", "wan0"}}));
  struct Itf {
    const char* name;
    bool bridge;
    bool speed;
  } interfaces[] = {{"eth0", false, true}, {"eth1", false, true}, {"wan0", false, true},
                    {"br0", true, false},  {"br1", true, false},  {"gbr", true, false}};
  for (const Itf& itf : interfaces) {
    SCOPED_TRACE(itf.name);
    const std::string dev = root.Join(std::string("sys/class/net/") + itf.name);
    ASSERT_TRUE(IsDirectory(dev));
    EXPECT_EQ(IsDirectory(dev + "/bridge"), itf.bridge);
    EXPECT_EQ(ReadFile(dev + "/operstate"), "up\n");
    if (itf.speed) {
      EXPECT_EQ(ReadFile(dev + "/speed"), "1000\n");
    } else {
      EXPECT_FALSE(PathExists(dev + "/speed"));
    }
  }
  RunResult listing =
      tcsupport::Run({"/bin/ls", "-A", root.Join("sys/class/net"), root.Join("etc/tc")});
  EXPECT_EQ(listing.out, root.Join("etc/tc") + ":\n\n" + root.Join("sys/class/net") +
                             ":\nbr0\nbr1\neth0\neth1\ngbr\nwan0\n");
}

TEST(InitRoot, PlainRootHasNoInterfacesAndAnEmptyKeyFile) {
  TempDir parent;
  const std::string root = parent.Join("a/b/root");  // parents are created too
  RunResult r = RunTcapi({"init-root", root});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  ExpectBaseLayout(root);
  EXPECT_EQ(ReadFile(root + "/etc/orviinfo.conf"), "");
  EXPECT_EQ(tcsupport::Run({"/bin/ls", "-A", root + "/sys/class/net"}).out, "");
  // The platform sees no interface there.
  Json::Value params(Json::objectValue);
  params["adapter"] = "eth0";
  hosttest::ExpectAnswer(tcsupport::CallTcapi(hosttest::RulesApi(), "load", params, root), 1,
                         hosttest::ErrorAnswer(4311));
}

TEST(InitRoot, CompletesAnExistingRootAndKeepsItsFiles) {
  TempDir root;
  ASSERT_EQ(RunTcapi({"init-root", root.path()}).exitCode, 0);  // empty directory is fine
  tcsupport::WriteFile(root.Join("etc/orviinfo.conf"), "net_topology=bridge\n");
  tcsupport::WriteFile(root.Join("etc/tc/eth0"), "kept\n");
  RunResult again = RunTcapi({"init-root", root.path(), "--demo"});
  ASSERT_EQ(again.exitCode, 0) << again.err;
  EXPECT_EQ(ReadFile(root.Join("etc/orviinfo.conf")), "net_topology=bridge\n");
  EXPECT_EQ(ReadFile(root.Join("etc/tc/eth0")), "kept\n");
  EXPECT_TRUE(IsDirectory(root.Join("sys/class/net/gbr/bridge")));
  EXPECT_EQ(RunTcapi({"init-root", root.path(), "--demo"}).exitCode, 0);
}

TEST(InitRoot, RefusesWhatIsNotARoot) {
  TempDir busy;
  tcsupport::WriteFile(busy.Join("notes.txt"), "mine\n");
  ExpectOneLineFailure(RunTcapi({"init-root", busy.path(), "--demo"}), "not an appliance root");
  EXPECT_FALSE(PathExists(busy.Join("etc")));
  EXPECT_EQ(ReadFile(busy.Join("notes.txt")), "mine\n");

  ExpectOneLineFailure(RunTcapi({"init-root", busy.Join("notes.txt")}), "not a directory");
  ExpectOneLineFailure(RunTcapi({"init-root", busy.Join("notes.txt/sub")}), "notes.txt");
  ExpectOneLineFailure(RunTcapi({"init-root"}), "DIR");
}

}  // namespace
