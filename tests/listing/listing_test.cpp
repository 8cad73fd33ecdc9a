// The load methods of both APIs against the fake platform.
#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "ORVI.Core.Network.TrafficControl.h"
#include "fake_platform.h"
#include "test_json.h"

namespace {

using Strings = std::vector<std::string>;
using fake::Rule;
using fake::S;

// Compact text: compares numbers by value whatever their signedness.
std::string Text(const Json::Value& v) {
  Json::StreamWriterBuilder w;
  w["indentation"] = "";
  return Json::writeString(w, v);
}

void Fresh() {
  fake::Reset();
  S().interfaces = {"eth0", "eth1", "br0"};
  S().keys = {{"support_net_topology", "yes"}, {"net_topology", "router"}};
}

// Runs one load and checks what must hold on every path: one answer, every
// list handed out released, every log line properly framed.
ORVI::APIResponse Load(void (TCHandler::*load)(), const std::string& params) {
  ORVI::APIRequest req(J(params));
  ORVI::APIResponse resp;
  {
    TCHandler h(&req, &resp);
    (h.*load)();
  }
  EXPECT_EQ(resp.AnswerCount(), 1);
  EXPECT_FALSE(resp.Conflicting());
  EXPECT_EQ(S().ruleListsOut, 0);
  EXPECT_EQ(S().szListsOut, 0);
  EXPECT_TRUE(fake::BadFrames().empty());
  if (!resp.Success()) {
    EXPECT_TRUE(resp.Data().isNull());
  }
  return resp;
}

// The rule store calls, shortened: "get br0", "free br0", "free NULL". A read
// of any directory but "/etc/tc" keeps its full text.
Strings StoreCalls() {
  const std::string get = "ORVIFwTcRuleGetByAdapter(/etc/tc,";
  const std::string release = "ORVIFwTcRulesFreeByAdapter(";
  Strings out;
  for (const std::string& c : fake::CallsOf("ORVIFwTc")) {
    if (c.compare(0, get.size(), get) == 0) {
      out.push_back("get " + c.substr(get.size(), c.size() - get.size() - 1));
    } else if (c.compare(0, release.size(), release) == 0) {
      out.push_back("free " + c.substr(release.size(), c.size() - release.size() - 1));
    } else {
      out.push_back(c);
    }
  }
  return out;
}

Strings Sources(const ORVI::APIResponse& resp) {
  Strings out;
  for (const Json::Value& r : resp.Data()["rules"]) out.push_back(r["source"].asString());
  return out;
}

TEST(RulesLoad, ConvertsEveryRecordField) {
  Fresh();
  S().dirs["/etc/tc"]["eth0"] = {
      Rule(1, "SELF:80:src", 2, 100, 0, "192.168.1.0/24", 7, 1),
      Rule(2, "ALL", 3, 1, 200000, "all", 0, 0),  // after a record with a port list
      Rule(3, "ALL::src", 9, -1, 5, "aa:bb:cc:dd:ee:ff", 1, 2),
      Rule(4, "sys:cifs", 1, 10, 20, std::string(127, 'x'), 1, 1),
  };
  ORVI::APIResponse resp = Load(&TCHandler::RulesLoad, R"({"adapter":"eth0"})");
  ASSERT_TRUE(resp.Success());
  EXPECT_EQ(Text(resp.Data()), Text(J(R"({"total":4,"rules":[
    {"enabled":true,"port_type":"SELF","port_num":"80","port_direction":"src","protocol":"udp",
     "minrate":100,"maxrate":0,"source":"192.168.1.0/24","ip_direction":"src"},
    {"enabled":false,"port_type":"ALL","protocol":"all","minrate":1,"maxrate":200000,
     "source":"all","ip_direction":"dest"},
    {"enabled":true,"port_type":"ALL","port_num":"","port_direction":"src","protocol":"tcp",
     "minrate":4294967295,"maxrate":5,"source":"aa:bb:cc:dd:ee:ff","ip_direction":"dest"},
    {"enabled":true,"port_type":"SYS","port_num":"cifs","port_direction":"src","protocol":"tcp",
     "minrate":10,"maxrate":20,"source":")" +
                                      std::string(127, 'x') + R"(","ip_direction":"src"}
  ]})")));
  for (const Json::Value& r : resp.Data()["rules"]) {
    EXPECT_EQ(r["minrate"].type(), Json::uintValue);
    EXPECT_EQ(r["maxrate"].type(), Json::uintValue);
  }
  EXPECT_EQ(fake::LogBodies(), Strings{"bad parameters of protocol: 9"});
  EXPECT_EQ(StoreCalls(), (Strings{"get eth0", "free eth0"}));
}

struct StoreCase {
  const char* name;
  fake::RuleFile rules;  // stored for eth0
  bool scripted;
  fake::GetScript script;
  const char* answer;  // success body, or nullptr for error 1201
  Strings logs;
  Strings calls;
};

TEST(RulesLoad, StoreOutcomes) {
  const std::string hint =
      "port format should be one of ALL/SELF/SYS, ex: ALL::src, SELF:777:src, SYS:cifs[0x0000 :0]";
  fake::StoredRule nullPorts = Rule(2, "");
  nullPorts.portsNull = true;
  const Strings both = {"get eth0", "free eth0"};
  // clang-format off
  const StoreCase cases[] = {
      {"nothing stored", {}, false, {}, R"({"rules":[],"total":0})", {}, both},
      {"count 2, no chain", {}, true, {2, true}, R"({"rules":[],"total":2})", {}, both},
      {"total is the store's count", {Rule(1, "ALL")}, true, {5, false},
       R"({"total":5,"rules":[{"enabled":true,"port_type":"ALL","protocol":"tcp","minrate":100,
           "maxrate":200,"source":"all","ip_direction":"dest"}]})", {}, both},
      {"read fails", {Rule(1, "ALL")}, true, {-1, false}, nullptr,
       {"Failed to load Tc rules for adapter [eth0][0x0201 ORVIFwTcRuleGetByAdapter:1]"},
       {"get eth0", "free NULL"}},
      {"second of three empty", {Rule(1, "ALL"), Rule(2, ""), Rule(3, "ALL")}, false, {}, nullptr,
       {"Ports format error[0x0000 :0]"}, both},
      {"second of three NULL", {Rule(1, "ALL"), nullPorts, Rule(3, "ALL")}, false, {}, nullptr,
       {"Ports format error[0x0000 :0]"}, both},
      {"unknown prefix", {Rule(1, "ALL"), Rule(2, "TCP:80:src")}, false, {}, nullptr, {hint}, both},
      {"empty direction", {Rule(1, "SELF:80:")}, false, {}, nullptr, {hint}, both},
  };
  // clang-format on
  for (const StoreCase& c : cases) {
    SCOPED_TRACE(c.name);
    Fresh();
    S().dirs["/etc/tc"]["eth0"] = c.rules;
    if (c.scripted) S().getScript["eth0"] = c.script;
    ORVI::APIResponse resp = Load(&TCHandler::RulesLoad, R"({"adapter":"eth0"})");
    if (c.answer) {
      EXPECT_TRUE(resp.Success());
      EXPECT_EQ(Text(resp.Data()), Text(J(c.answer)));
      EXPECT_TRUE(resp.Data()["rules"].isArray());
    } else {
      EXPECT_EQ(resp.ErrorCode(), 1201);
    }
    EXPECT_EQ(fake::LogBodies(), c.logs);
    EXPECT_EQ(StoreCalls(), c.calls);
  }
}

TEST(RulesLoad, LongAdapterNameReachesStoreCut) {
  const std::string full = "abcdefghijklmnopqrst";
  Fresh();
  S().interfaces.push_back(full);
  S().dirs["/etc/tc"]["abcdefghijklmno"] = {Rule(1, "ALL", 1, 1, 2, "cut")};
  ORVI::APIResponse resp = Load(&TCHandler::RulesLoad, R"({"adapter":")" + full + R"("})");
  EXPECT_EQ(Sources(resp), Strings{"cut"});
  EXPECT_EQ(StoreCalls(), (Strings{"get abcdefghijklmno", "free abcdefghijklmno"}));

  Fresh();
  S().interfaces.push_back(full);
  S().getScript["abcdefghijklmno"] = {-1, false};
  resp = Load(&TCHandler::RulesLoad, R"({"adapter":")" + full + R"("})");
  EXPECT_EQ(resp.ErrorCode(), 1201);
  EXPECT_EQ(fake::LogBodies(),
            Strings{"Failed to load Tc rules for adapter [abcdefghijklmno][0x0201 "
                    "ORVIFwTcRuleGetByAdapter:1]"});
}

TEST(RulesLoad, FailedInterfaceCheckIsTheOnlyAnswer) {
  const struct {
    const char* params;
    bool enumFails;
    int code;
  } cases[] = {{"{}", false, 114},
               {R"({"adapter":"eth9"})", false, 4311},
               {R"({"adapter":"eth0"})", true, 1201}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.params);
    Fresh();
    if (c.enumFails) fake::FailCall("EnumInterfacesStatus");
    EXPECT_EQ(Load(&TCHandler::RulesLoad, c.params).ErrorCode(), c.code);
    EXPECT_TRUE(StoreCalls().empty());
  }
}

// How the key file is read is the frame's test; here: outside router mode
// the answer is 1200 and neither the direction nor the store is looked at.
TEST(RouterRulesLoad, OutsideRouterModeReadsNothing) {
  Fresh();
  S().keys["net_topology"] = "bridge";
  ORVI::APIResponse resp = Load(&TCHandler::RouterRulesLoad, R"({"direction":"upload"})");
  EXPECT_EQ(resp.ErrorCode(), 1200);
  EXPECT_TRUE(StoreCalls().empty());
  EXPECT_EQ(fake::LogBodies(), Strings{"QS is not in router mode"});
}

TEST(RouterRulesLoad, UnknownDirection) {
  const struct {
    const char* params;
    Strings logs;
  } cases[] = {
      {"{}", {"Bad parameters", "Unknown direction "}},
      {R"({"adapter":"upload"})", {"Bad parameters", "Unknown direction "}},
      {R"({"direction":null})", {"Bad parameters", "Unknown direction "}},
      {R"({"direction":""})", {"Unknown direction "}},
      {R"({"direction":"Upload"})", {"Unknown direction Upload"}},
      {R"({"direction":"DOWNLOAD"})", {"Unknown direction DOWNLOAD"}},
      {R"({"direction":5})", {"Bad parameters", "Unknown direction 5"}},
      {R"({"direction":{"a":[1,true]}})",
       {"Bad parameters", R"(Unknown direction {"a":[1,true]})"}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.params);
    Fresh();
    EXPECT_EQ(Load(&TCHandler::RouterRulesLoad, c.params).ErrorCode(), 1200);
    EXPECT_EQ(fake::LogBodies(), c.logs);
    EXPECT_TRUE(StoreCalls().empty());
    EXPECT_EQ(fake::CallsOf("OLIBCSzList"),
              (Strings{"OLIBCSzListAlloc(512)", "OLIBCSzListFree(list)"}));
  }
}

// A router answer in short: "a1,a2 total 2", or "error 1201".
std::string Summary(const ORVI::APIResponse& resp) {
  if (!resp.Success()) return "error " + std::to_string(resp.ErrorCode());
  std::string out;
  for (const std::string& s : Sources(resp)) out += (out.empty() ? "" : ",") + s;
  EXPECT_TRUE(resp.Data()["rules"].isArray());
  return out + " total " + Text(resp.Data()["total"]);
}

struct WalkCase {
  const char* name;
  const char* direction;
  Strings bridges;
  std::map<std::string, fake::RuleFile> stored;
  std::map<std::string, fake::GetScript> scripts;
  const char* failCall;  // its first call fails; nullptr: none
  const char* answer;    // Summary()
  Strings logs;
  Strings calls;
};

TEST(RouterRulesLoad, WalksAdaptersInOrder) {
  const fake::RuleFile three = {Rule(1, "ALL", 1, 1, 2, "r1"),
                                Rule(2, "SELF:80:src", 1, 1, 2, "r2"),
                                Rule(3, "SYS:ssh:dest", 1, 1, 2, "r3")};
  const fake::RuleFile a2 = {Rule(1, "ALL", 1, 1, 2, "a1"), Rule(2, "ALL", 1, 1, 2, "a2")};
  const fake::RuleFile b1 = {Rule(1, "ALL", 1, 1, 2, "b1")};
  const fake::RuleFile bBad = {Rule(1, "ALL", 1, 1, 2, "b1"), Rule(2, "ALL::")};
  const Strings two = {"get br0", "free br0", "get br1", "free br1"};
  // clang-format off
  const WalkCase cases[] = {
      {"upload, nothing stored", "upload", {}, {}, {}, nullptr, " total 0", {},
       {"get upload", "free upload"}},
      {"upload", "upload", {"br0"}, {{"upload", a2}, {"br0", b1}}, {}, nullptr, "a1,a2 total 2", {},
       {"get upload", "free upload"}},
      {"only gbr", "download", {"gbr"}, {{"gbr", a2}}, {}, nullptr, " total 0", {}, {}},
      {"same three twice", "download", {"br0", "gbr", "br1"},
       {{"br0", three}, {"br1", three}, {"gbr", a2}}, {}, nullptr, "r1,r2,r3,r1,r2,r3 total 3", {},
       two},
      {"last count wins", "download", {"br0", "br1"}, {{"br0", three}, {"br1", a2}}, {}, nullptr,
       "r1,r2,r3,a1,a2 total 2", {}, two},
      {"second empty", "download", {"br0", "br1"}, {{"br0", a2}}, {}, nullptr, "a1,a2 total 0", {},
       two},
      {"first empty stops", "download", {"br0", "br1"}, {{"br1", a2}}, {}, nullptr, " total 0", {},
       {"get br0", "free br0"}},
      {"count without chain", "download", {"br0", "br1"}, {{"br1", b1}}, {{"br0", {2, true}}},
       nullptr, "b1 total 1", {}, two},
      {"first gbr in any case removed", "download", {"br0", "GBR", "gbr"},
       {{"br0", b1}, {"gbr", a2}}, {}, nullptr, "b1,a1,a2 total 2", {},
       {"get br0", "free br0", "get gbr", "free gbr"}},
      {"second read fails", "download", {"br0", "br1"}, {{"br0", a2}, {"br1", b1}},
       {{"br1", {-1, false}}}, nullptr, "error 1201",
       {"Failed to load Tc rules for adapter [br1][0x0201 ORVIFwTcRuleGetByAdapter:1]"},
       {"get br0", "free br0", "get br1", "free NULL"}},
      {"second unreadable ports field", "download", {"br0", "br1"}, {{"br0", a2}, {"br1", bBad}}, {},
       nullptr, "error 1201", {"port format should be one of ALL/SELF/SYS, ex: ALL::src, "
                               "SELF:777:src, SYS:cifs[0x0000 :0]"}, two},
      {"enumeration fails", "download", {"br0"}, {{"br0", a2}}, {}, "OLIBNetEnumBridge",
       "error 1200", {"Failed to OLIBNetEnumBridge [0x0201 OLIBNetEnumBridge:1]", "Bad parameters"},
       {}},
      {"gbr removal fails", "download", {"br0", "gbr"}, {{"br0", a2}}, {}, "OLIBCSzListRemove",
       "error 1200", {"Bad parameters"}, {}},
      {"name list not allocated", "upload", {}, {{"upload", a2}}, {}, "OLIBCSzListAlloc",
       "error 1201", {"Failed to OLIBCSzListAlloc [0x0201 OLIBCSzListAlloc:1]"}, {}},
      {"upload not pushed", "upload", {}, {{"upload", a2}}, {}, "OLIBCSzListPush", "error 1201",
       {"Failed to OLIBCSzListPush [0x0201 OLIBCSzListPush:1]"}, {}},
  };
  // clang-format on
  for (const WalkCase& c : cases) {
    SCOPED_TRACE(c.name);
    Fresh();
    S().bridges = c.bridges;
    for (const auto& s : c.stored) S().dirs["/etc/tc"][s.first] = s.second;
    S().getScript = c.scripts;
    if (c.failCall) fake::FailCall(c.failCall);
    const std::string params = std::string(R"({"direction":")") + c.direction + "\"}";
    EXPECT_EQ(Summary(Load(&TCHandler::RouterRulesLoad, params)), c.answer);
    EXPECT_EQ(fake::LogBodies(), c.logs);
    EXPECT_EQ(StoreCalls(), c.calls);
  }
}

}  // namespace
