// Rules written with the real rule store into a demo appliance root, listed
// through tcapi and the real module.
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>

#include <string>
#include <vector>

#include "orvi_fw_tc.h"
#include "tc_support.h"

namespace {

struct Stored {
  int enabled;
  const char* ports;
  int protocol;
  int minrate;
  int maxrate;
  const char* source;
  int ipDirection;
};

const std::vector<Stored> kLan = {
    {1, "SELF:80,443:src", 1, 1000, 5000, "192.168.1.20", 1},
    {0, "SYS:cifs,afp:dest", 3, 200, 0, "all", 0},
    {1, "ALL::src", 2, 50, 100, "10.0.0.0/8", 1},
};
const char kLanJson[] = R"([
  {"enabled":true,"port_type":"SELF","port_num":"80,443","port_direction":"src",
   "protocol":"tcp","minrate":1000,"maxrate":5000,"source":"192.168.1.20","ip_direction":"src"},
  {"enabled":false,"port_type":"SYS","port_num":"cifs,afp","port_direction":"dest",
   "protocol":"all","minrate":200,"maxrate":0,"source":"all","ip_direction":"dest"},
  {"enabled":true,"port_type":"ALL","port_num":"","port_direction":"src",
   "protocol":"udp","minrate":50,"maxrate":100,"source":"10.0.0.0/8","ip_direction":"src"}])";

Json::Value J(const std::string& text) {
  Json::Value v;
  EXPECT_TRUE(tcsupport::ParseJson(text, &v)) << text;
  return v;
}

class LoadThroughTcapi : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(setenv("ORVI_ROOT", root_.path().c_str(), 1), 0); }
  void TearDown() override { unsetenv("ORVI_ROOT"); }

  // Writes the adapter's rule file into the live directory the way a save does:
  // one reused record, ids by position.
  void Store(const char* adapter, const std::vector<Stored>& rules) {
    TcRuleFile* file = ORVIFwTcRuleOpen("/etc/tc", adapter);
    ASSERT_NE(file, nullptr) << adapter;
    TcRule* record = nullptr;
    ASSERT_EQ(ORVIFwTcBufRuleInit(&record), 0);
    int id = 0;
    for (const Stored& s : rules) {
      record->id = ++id;
      record->enabled = s.enabled;
      snprintf(record->source, sizeof record->source, "%s", s.source);
      free(record->ports);
      record->ports = strdup(s.ports);
      record->protocol = static_cast<_tag_orvi_firewall_protocol_>(s.protocol);
      record->minrate = s.minrate;
      record->maxrate = s.maxrate;
      record->ipDirection = s.ipDirection;
      EXPECT_EQ(ORVIFwTcRuleWrite(file, record), 0);
    }
    ORVIFwTcBufRulesFree(record);
    ASSERT_EQ(ORVIFwTcRuleClose("/etc/tc", file, adapter), 0) << adapter;
  }

  // One `tcapi call ... load`, which must succeed with exactly `data`.
  void ExpectLoad(const char* api, const std::string& params, const std::string& data) {
    tcsupport::RunResult r = tcsupport::CallTcapi(api, "load", J(params), root_.path());
    EXPECT_EQ(r.exitCode, 0) << r.err;
    ASSERT_TRUE(r.jsonValid) << r.out;
    Json::Value expected(Json::objectValue);
    expected["success"] = true;
    expected["data"] = J(data);
    EXPECT_EQ(tcsupport::ToCompactJson(r.json), tcsupport::ToCompactJson(expected));
  }

  tcsupport::TempDir root_ = tcsupport::MakeDemoRoot();
};

const char kRules[] = "ORVI.Core.Network.TrafficControl.Rules";
const char kRouterRules[] = "ORVI.Core.Network.TrafficControl.RouterRules";

TEST_F(LoadThroughTcapi, Adapter) {
  ExpectLoad(kRules, R"({"adapter":"eth0"})", R"({"rules":[],"total":0})");
  Store("eth0", kLan);
  Store("eth1", {{1, "ALL", 1, 1, 2, "all", 0}});
  ExpectLoad(kRules, R"({"adapter":"eth0"})",
             std::string(R"({"total":3,"rules":)") + kLanJson + "}");
  ExpectLoad(kRules, R"({"adapter":"eth1"})",
             R"({"total":1,"rules":[{"enabled":true,"port_type":"ALL","protocol":"tcp",
                 "minrate":1,"maxrate":2,"source":"all","ip_direction":"dest"}]})");
}

TEST_F(LoadThroughTcapi, Upload) {
  ExpectLoad(kRouterRules, R"({"direction":"upload"})", R"({"rules":[],"total":0})");
  Store("upload", kLan);
  Store("wan0", {{1, "ALL", 1, 1, 2, "all", 0}});
  ExpectLoad(kRouterRules, R"({"direction":"upload"})",
             std::string(R"({"total":3,"rules":)") + kLanJson + "}");
}

TEST_F(LoadThroughTcapi, DownloadGathersEveryBridgeButGbr) {
  // As a router save leaves them: the same rules under each bridge.
  Store("br0", kLan);
  Store("br1", kLan);
  Store("gbr", {{1, "ALL", 1, 1, 2, "guest", 0}});
  const Json::Value lan = J(kLanJson);
  Json::Value both(Json::arrayValue);
  for (int i = 0; i < 2; ++i)
    for (const Json::Value& rule : lan) both.append(rule);
  ExpectLoad(kRouterRules, R"({"direction":"download"})",
             R"({"total":3,"rules":)" + tcsupport::ToCompactJson(both) + "}");
}

}  // namespace
