// tcapi plan: the batch that a save's reload planned for an adapter's device
// is the batch that plan prints for the live rules, byte for byte.
#include <gtest/gtest.h>

#include <string>

#include "tc_support.h"

namespace {

const char kRules[] = "ORVI.Core.Network.TrafficControl.Rules";
const char kRouterRules[] = "ORVI.Core.Network.TrafficControl.RouterRules";

Json::Value Rules(const std::string& text) {
  Json::Value v;
  EXPECT_TRUE(tcsupport::ParseJson(text, &v)) << text;
  return v;
}

TEST(TcapiPlan, PrintsWhatTheSavePlannedForEachDevice) {
  tcsupport::TempDir root = tcsupport::MakeDemoRoot();
  const Json::Value rules = Rules(
      R"([{"enabled":true,"protocol":"tcp","minrate":100,"maxrate":1000,"port_type":"SELF",)"
      R"("port_num":"80,443","port_direction":"dest","source":"10.1.0.0/16","ip_direction":"src"},)"
      R"({"enabled":false,"protocol":"udp","minrate":10,"maxrate":0,"port_type":"ALL"}])");
  Json::Value adapterSave(Json::objectValue);
  adapterSave["adapter"] = "eth1";
  adapterSave["rules"] = rules;
  ASSERT_EQ(tcsupport::CallTcapi(kRules, "save", adapterSave, root.path()).exitCode, 0);
  Json::Value upload(Json::objectValue);
  upload["direction"] = "upload";
  upload["rules"] = rules;
  ASSERT_EQ(tcsupport::CallTcapi(kRouterRules, "save", upload, root.path()).exitCode, 0);

  struct Case {
    const char* adapter;
    const char* device;  // where the reload planned it
  } cases[] = {{"eth1", "eth1"}, {"upload", "wan0"}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.adapter);
    tcsupport::RunResult plan = tcsupport::RunTcapi({"plan", c.adapter}, root.path());
    EXPECT_EQ(plan.exitCode, 0) << plan.err;
    EXPECT_EQ(plan.out, tcsupport::ReadFile(root.Join(std::string("run/tc/") + c.device + ".tc")));
    EXPECT_NE(plan.out.find(std::string("dev ") + c.device + " "), std::string::npos);
    EXPECT_NE(plan.out.find("rate 100kbps ceil 1000kbps"), std::string::npos) << plan.out;
    // The disabled rule is stored but shapes nothing.
    EXPECT_EQ(plan.out.find("rate 10kbps"), std::string::npos) << plan.out;
  }
}

TEST(TcapiPlan, RefusesWhatTheReloadWouldRefuse) {
  tcsupport::TempDir root = tcsupport::MakeDemoRoot();
  struct Case {
    const char* tag;
    std::vector<std::string> args;
    int exitCode;
  } cases[] = {
      {"no such device", {"plan", "eth9"}, 1},
      {"not an interface name", {"plan", "../x"}, 1},
      {"adapter missing", {"plan"}, 2},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.tag);
    tcsupport::RunResult r = tcsupport::RunTcapi(c.args, root.path());
    EXPECT_EQ(r.exitCode, c.exitCode);
    EXPECT_TRUE(r.out.empty()) << r.out;
    EXPECT_EQ(r.err.rfind("tcapi: ", 0), 0u) << r.err;
    EXPECT_EQ(r.err.find('\n'), r.err.size() - 1) << "one line: " << r.err;
  }
}

}  // namespace
