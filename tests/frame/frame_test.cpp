// The module's frame: entry table, handler construction, request
// preconditions and protocol names, against the fake platform.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "ORVI.Core.Network.TrafficControl.h"
#include "fake_platform.h"
#include "test_json.h"
#include "preconditions.h"

using Lines = std::vector<std::string>;

namespace {

class FrameTest : public ::testing::Test {
 protected:
  void SetUp() override { fake::Reset(); }
  void TearDown() override {
    EXPECT_TRUE(fake::BadFrames().empty()) << fake::BadFrames().front();
    EXPECT_EQ(fake::S().szListsOut, 0);
  }
};

TEST_F(FrameTest, TableHasFourRowsAndAZeroTerminator) {
  struct Row {
    const char* api;
    const char* method;
  } want[] = {{"ORVI.Core.Network.TrafficControl.Rules", "load"},
              {"ORVI.Core.Network.TrafficControl.Rules", "save"},
              {"ORVI.Core.Network.TrafficControl.RouterRules", "load"},
              {"ORVI.Core.Network.TrafficControl.RouterRules", "save"}};
  const APITableEntry* table = GetAPITable();
  ASSERT_NE(table, nullptr);
  EXPECT_EQ(GetAPITable(), table);
  for (int i = 0; i < 4; ++i) {
    SCOPED_TRACE(i);
    EXPECT_STREQ(table[i].api, want[i].api);
    EXPECT_STREQ(table[i].method, want[i].method);
    EXPECT_EQ(table[i].version, 1);
    EXPECT_NE(table[i].handler, nullptr);
  }
  EXPECT_EQ(table[4].api, nullptr);
  EXPECT_EQ(table[4].version, 0);
  EXPECT_EQ(table[4].method, nullptr);
  EXPECT_EQ(table[4].handler, nullptr);
  // Each row runs a different operation.
  for (int i = 0; i < 4; ++i)
    for (int j = i + 1; j < 4; ++j) EXPECT_NE(table[i].handler, table[j].handler);
}

TEST_F(FrameTest, ConstructionReadsAdapterOnlyFromNonEmptyText) {
  struct Case {
    const char* params;
    const char* adapter;
  } cases[] = {
      {R"({"adapter":5})", ""},
      {R"({"adapter":true})", ""},
      {R"({"adapter":""})", ""},
      {R"({})", ""},
      {R"({"adapter":null})", ""},
      {R"({"adapter":["eth0"]})", ""},
      {R"({"adapter":"eth0"})", "eth0"},
      {R"({"adapter":"  Eth0"})", "  Eth0"},
      {R"({"adapter":"ETH0 "})", "ETH0 "},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.params);
    ORVI::APIRequest req(J(c.params));
    ORVI::APIResponse resp;
    TCHandler h(&req, &resp);
    EXPECT_EQ(h._adapter, c.adapter);
    EXPECT_EQ(h._errCode, 1200);
    EXPECT_TRUE(h._respData.isObject());
    EXPECT_EQ(h._respData.size(), 0u);
    EXPECT_EQ(h._pRequest, &req);
    EXPECT_EQ(h._pResponse, &resp);
    EXPECT_FALSE(resp.Answered());  // construction alone never answers
  }
  EXPECT_TRUE(fake::S().logs.empty());
}

TEST_F(FrameTest, ProtocolNumberToName) {
  ORVI::APIRequest req;
  ORVI::APIResponse resp;
  TCHandler h(&req, &resp);
  struct Case {
    int value;
    const char* name;
    bool logged;
  } cases[] = {{1, "tcp", false}, {2, "udp", false}, {3, "all", false},
               {0, "tcp", true},  {4, "tcp", true},  {-1, "tcp", true}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.value);
    fake::S().logs.clear();
    EXPECT_EQ(h.ProtocolParse(static_cast<_tag_orvi_firewall_protocol_>(c.value)), c.name);
    if (c.logged) {
      EXPECT_EQ(fake::LogBodies(), Lines{"bad parameters of protocol: " + std::to_string(c.value)});
    } else {
      EXPECT_TRUE(fake::S().logs.empty());
    }
  }
}

TEST_F(FrameTest, ProtocolNameToNumber) {
  ORVI::APIRequest req;
  ORVI::APIResponse resp;
  TCHandler h(&req, &resp);
  struct Case {
    const char* name;
    int value;
    bool logged;
  } cases[] = {{"tcp", 1, false}, {"udp", 2, false}, {"all", 3, false}, {"", 3, false},
               {"TCP", 3, true},  {"icmp", 3, true}, {"tcp ", 3, true}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    fake::S().logs.clear();
    EXPECT_EQ(h.ProtocolParse(std::string(c.name)), c.value);
    if (c.logged) {
      EXPECT_EQ(fake::LogBodies(), Lines{std::string("bad parameters of protocol: ") + c.name});
    } else {
      EXPECT_TRUE(fake::S().logs.empty());
    }
  }
}

TEST_F(FrameTest, InterfaceCheckMissingAdapterAnswers114BeforeEnumerating) {
  ORVI::APIRequest req(J(R"({"adapter":7})"));
  ORVI::APIResponse resp;
  TCHandler h(&req, &resp);
  fake::S().interfaces = {"eth0"};
  EXPECT_EQ(h.InterfaceCheck(), -1);
  EXPECT_EQ(resp.AnswerCount(), 1);
  EXPECT_FALSE(resp.Success());
  EXPECT_EQ(resp.ErrorCode(), 114);
  EXPECT_TRUE(resp.Data().isNull());
  EXPECT_EQ(h._errCode, 114);
  EXPECT_TRUE(fake::CallsOf("EnumInterfacesStatus").empty());
  EXPECT_EQ(fake::LogBodies(), Lines{"Required parameter error![0x0000 :0]"});
}

TEST_F(FrameTest, InterfaceCheckOutcomes) {
  struct Case {
    const char* tag;
    std::string adapter;
    bool enumFails;
    int result;
    int code;  // 0: no answer
    Lines logs;
  } cases[] = {
      {"found", "eth1", false, 0, 0, {}},
      {"enumeration fails", "eth0", true, -1, 1201, {"enum interface failed"}},
      {"case differs", "ETH0", false, -1, 4311, {"No such interface [ETH0][0x0000 :0]"}},
      {"blank kept", " eth0", false, -1, 4311, {"No such interface [ eth0][0x0000 :0]"}},
      {"20 characters shown cut to 15",
       "abcdefghijklmnopqrst",
       false,
       -1,
       4311,
       {"No such interface [abcdefghijklmno][0x0000 :0]"}},
      // The comparison uses the whole name: its first 15 characters are an
      // interface, the name is not.
      {"prefix of a long name",
       "abcdefghijklmnoXYZ",
       false,
       -1,
       4311,
       {"No such interface [abcdefghijklmno][0x0000 :0]"}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.tag);
    fake::Reset();
    fake::S().interfaces = {"eth0", "eth1", "abcdefghijklmno"};
    if (c.enumFails) fake::FailCall("EnumInterfacesStatus");
    Json::Value params(Json::objectValue);
    params["adapter"] = c.adapter;
    ORVI::APIRequest req(params);
    ORVI::APIResponse resp;
    TCHandler h(&req, &resp);
    EXPECT_EQ(h.InterfaceCheck(), c.result);
    if (c.code == 0) {
      EXPECT_FALSE(resp.Answered());
      EXPECT_EQ(h._errCode, 1200);
    } else {
      EXPECT_EQ(resp.AnswerCount(), 1);
      EXPECT_EQ(resp.ErrorCode(), c.code);
      EXPECT_EQ(h._errCode, c.code);
      EXPECT_TRUE(resp.Data().isNull());
    }
    EXPECT_EQ(fake::LogBodies(), c.logs);
  }
}

TEST_F(FrameTest, RulesCheckLooksOnlyAtTheType) {
  struct Case {
    const char* params;
    int result;
  } cases[] = {{R"({})", 0},
               {R"({"rules":[]})", 0},
               {R"({"rules":[1,"x",{}]})", 0},
               {R"({"rules":"x"})", -1},
               {R"({"rules":{}})", -1},
               {R"({"rules":null})", -1},
               {R"({"rules":3})", -1}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.params);
    fake::Reset();
    ORVI::APIRequest req(J(c.params));
    ORVI::APIResponse resp;
    TCHandler h(&req, &resp);
    EXPECT_EQ(h.RulesCheck(), c.result);
    if (c.result == 0) {
      EXPECT_FALSE(resp.Answered());
      EXPECT_TRUE(fake::S().logs.empty());
    } else {
      EXPECT_EQ(resp.AnswerCount(), 1);
      EXPECT_EQ(resp.ErrorCode(), 114);
      EXPECT_EQ(fake::LogBodies(), Lines{"Required parameter error![0x0000 :0]"});
    }
  }
}

TEST_F(FrameTest, RouterModeFromKeyFile) {
  const std::string missing =
      "Failed to get [net_topology] info from [/etc/orviinfo.conf], or key not found";
  struct Case {
    const char* tag;
    const char* support;  // nullptr: key missing
    const char* topology;
    bool router;
    Lines logs;
    bool errRecorded;
  } cases[] = {
      {"plain", "yes", "router", true, {}, false},
      {"letter case ignored", "YES", "Router", true, {}, false},
      {"support missing", nullptr, "router", false, {missing}, false},
      {"topology missing", "yes", nullptr, false, {missing}, false},
      {"support empty", "", "router", false, {missing}, false},
      {"support no", "no", "router", false, {"QS is not in router mode"}, true},
      {"bridge mode", "yes", "bridge", false, {"QS is not in router mode"}, true},
      {"trailing text", "yes", "routers", false, {"QS is not in router mode"}, true},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.tag);
    fake::Reset();
    if (c.support) fake::S().keys["support_net_topology"] = c.support;
    if (c.topology) fake::S().keys["net_topology"] = c.topology;
    EXPECT_EQ(IsRouterMode(), c.router);
    EXPECT_EQ(fake::LogBodies(), c.logs);
    EXPECT_EQ(fake::CallsOf("OLIBCErrSetEx").size(), c.errRecorded ? 1u : 0u);
    if (c.errRecorded) {
      EXPECT_EQ(fake::CallsOf("OLIBCErrSetEx")[0], "OLIBCErrSetEx(55552)");
      EXPECT_STREQ(OLIBCErrorGetFile(), "ORVI.Core.Network.TrafficControl.cpp");
    }
  }
}

TEST_F(FrameTest, BridgeListDropsFirstGbrInAnyCase) {
  struct Case {
    const char* tag;
    std::vector<std::string> bridges;
    const char* failing;  // fake call made to fail, or nullptr
    int result;
    std::vector<std::string> left;
    Lines logs;
  } cases[] = {
      {"gbr removed", {"br0", "gbr", "br1"}, nullptr, 0, {"br0", "br1"}, {}},
      {"capitals", {"GBR", "br0"}, nullptr, 0, {"br0"}, {}},
      {"only the first", {"gbr", "Gbr"}, nullptr, 0, {"Gbr"}, {}},
      {"none", {"br0", "br1"}, nullptr, 0, {"br0", "br1"}, {}},
      {"empty", {}, nullptr, 0, {}, {}},
      {"removal fails", {"br0", "gbr"}, "OLIBCSzListRemove", -1, {"br0", "gbr"}, {}},
      {"enumeration fails",
       {"br0"},
       "OLIBNetEnumBridge",
       -1,
       {},
       {"Failed to OLIBNetEnumBridge [0x0201 OLIBNetEnumBridge:1]"}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.tag);
    fake::Reset();
    fake::S().bridges = c.bridges;
    if (c.failing) fake::FailCall(c.failing);
    SzList* list = OLIBCSzListAlloc(512);
    ASSERT_NE(list, nullptr);
    EXPECT_EQ(BridgeListGet(&list), c.result);
    std::vector<std::string> left;
    for (int i = 0; i < list->count; ++i) left.push_back(OLIBCSzListGet(list, i));
    EXPECT_EQ(left, c.left);
    EXPECT_EQ(fake::LogBodies(), c.logs);
    OLIBCSzListFree(list);
  }
}

TEST_F(FrameTest, EntryFunctionAnswersOnceAndLeavesNothingBehind) {
  // A Rules request without an adapter fails in the precondition, whichever
  // operation runs, with exactly one answer.
  const APITableEntry* table = GetAPITable();
  for (int i = 0; i < 2; ++i) {
    SCOPED_TRACE(table[i].method);
    fake::Reset();
    ORVI::APIRequest req(J(R"({"rules":[]})"));
    ORVI::APIResponse resp;
    table[i].handler(&req, &resp);
    EXPECT_EQ(resp.AnswerCount(), 1);
    EXPECT_EQ(resp.ErrorCode(), 114);
    EXPECT_TRUE(resp.Data().isNull());
    EXPECT_TRUE(fake::CallsOf("ORVIFwTc").empty());
  }
}

}  // namespace
