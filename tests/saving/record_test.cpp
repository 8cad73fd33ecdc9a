// Building the rule store's record from a validated rule object.
#include <stdlib.h>
#include <string.h>

#include <regex>
#include <string>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "ORVI.Core.Network.TrafficControl.h"
#include "fake_platform.h"
#include "test_json.h"
#include "tcalloc.h"

namespace {

// A validated rule; each case replaces some of its members ("-" removes one).
Json::Value Rule(const std::string& patch = "{}") {
  Json::Value rule =
      J(R"({"enabled":true,"protocol":"tcp","minrate":100,"maxrate":200,"source":"all",)"
        R"("ip_direction":"src","port_type":"SELF","port_num":"80","port_direction":"src"})");
  Json::Value p = J(patch);
  for (const auto& key : p.getMemberNames()) {
    if (p[key] == "-") {
      rule.removeMember(key);
    } else {
      rule[key] = p[key];
    }
  }
  return rule;
}

// A record as the store hands it out: zeroed, no ports block yet.
struct Record {
  Record() : rule(static_cast<TcRule*>(calloc(1, sizeof(TcRule)))) {}
  ~Record() {
    free(rule->ports);
    free(rule);
  }
  TcRule* rule;
};

class RecordTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fake::Reset();
    tcalloc::FailAfter(-1);
  }
  void TearDown() override {
    tcalloc::FailAfter(-1);
    EXPECT_THAT(fake::BadFrames(), ::testing::IsEmpty());
  }
  ORVI::APIRequest req_;
  ORVI::APIResponse resp_;
  TCHandler h_{&req_, &resp_};
};

struct FieldCase {
  const char* name;
  const char* patch;
  const char* ports;
  int enabled, protocol, ipDirection;
  std::vector<std::string> logs;
};

// clang-format off
const FieldCase kFieldCases[] = {
  {"AllWithoutPortNum",  R"({"port_type":"ALL","port_num":"-"})", "ALL::src", 1, 1, 1, {}},
  {"AllPortsDest",       R"({"port_type":"ALL","port_direction":"dest"})", "ALL:80:dest", 1, 1, 1, {}},
  {"SelfList",           R"({"port_num":"80,443","port_direction":"dest"})", "SELF:80,443:dest", 1, 1, 1, {}},
  {"SysService",         R"({"port_type":"SYS","port_num":"cifs"})", "SYS:cifs:src", 1, 1, 1, {}},
  {"AllPortNumArray",    R"({"port_type":"ALL","port_num":[80,443]})", "ALL::src", 1, 1, 1, {}},
  {"AllPortNumObject",   R"({"port_type":"ALL","port_num":{"from":80}})", "ALL::src", 1, 1, 1, {}},
  {"AllPortNumNumber",   R"({"port_type":"ALL","port_num":80})", "ALL:80:src", 1, 1, 1, {}},
  {"IpDirectionDest",    R"({"ip_direction":"dest"})", "SELF:80:src", 1, 1, 0, {}},
  {"IpDirectionUpper",   R"({"ip_direction":"SRC"})", "SELF:80:src", 1, 1, 0, {}},
  {"IpDirectionInteger", R"({"ip_direction":1})", "SELF:80:src", 1, 1, 0, {}},
  {"DisabledUdp",        R"({"enabled":false,"protocol":"udp"})", "SELF:80:src", 0, 2, 1, {}},
  {"ProtocolUpperCase",  R"({"protocol":"TCP"})", "SELF:80:src", 1, 3, 1, {"bad parameters of protocol: TCP"}},
  {"NothingButId",       R"({"enabled":"-","protocol":"-","ip_direction":"-","port_type":"-",)"
                         R"("port_num":"-","port_direction":"-"})", "::", 0, 3, 0, {}},
};
// clang-format on

class RecordFields : public RecordTest, public ::testing::WithParamInterface<FieldCase> {};

TEST_P(RecordFields, FillsEveryField) {
  const FieldCase& c = GetParam();
  Record rec;
  TcRule* sentinel = reinterpret_cast<TcRule*>(0x1234);
  rec.rule->next = sentinel;
  ASSERT_TRUE(h_.RuleCreate(7, Rule(c.patch), rec.rule));
  ASSERT_NE(rec.rule->ports, nullptr);
  EXPECT_STREQ(rec.rule->ports, c.ports);
  EXPECT_EQ(rec.rule->id, 7);
  EXPECT_EQ(rec.rule->enabled, c.enabled);
  EXPECT_EQ(static_cast<int>(rec.rule->protocol), c.protocol);
  EXPECT_EQ(rec.rule->minrate, 100);
  EXPECT_EQ(rec.rule->maxrate, 200);
  EXPECT_STREQ(rec.rule->source, "all");
  EXPECT_EQ(rec.rule->ipDirection, c.ipDirection);
  EXPECT_EQ(rec.rule->next, sentinel);
  EXPECT_EQ(fake::LogBodies(), c.logs);
}

INSTANTIATE_TEST_SUITE_P(Cases, RecordFields, ::testing::ValuesIn(kFieldCases),
                         [](const ::testing::TestParamInfo<FieldCase>& info) {
                           return std::string(info.param.name);
                         });

TEST_F(RecordTest, LongSourceIsCut) {
  Record rec;
  Json::Value rule = Rule();
  rule["source"] = std::string(200, 's');
  ASSERT_TRUE(h_.RuleCreate(1, rule, rec.rule));
  EXPECT_EQ(std::string(rec.rule->source), std::string(127, 's'));
}

TEST_F(RecordTest, ReusedRecordTakesEachRuleWholly) {
  Record rec;
  ASSERT_TRUE(
      h_.RuleCreate(1, Rule(R"({"port_num":"1000-2000,3000","source":"10.0.0.0/8"})"), rec.rule));
  ASSERT_STREQ(rec.rule->ports, "SELF:1000-2000,3000:src");
  ASSERT_TRUE(
      h_.RuleCreate(2, Rule(R"({"port_type":"ALL","port_num":"-","minrate":5})"), rec.rule));
  // The shorter text replaces the longer one without a tail.
  EXPECT_EQ(std::string(rec.rule->ports), "ALL::src");
  EXPECT_STREQ(rec.rule->source, "all");
  EXPECT_EQ(rec.rule->id, 2);
  EXPECT_EQ(rec.rule->minrate, 5);
}

TEST_F(RecordTest, NullRecordIsRefusedSilently) {
  EXPECT_FALSE(h_.RuleCreate(1, Rule(), nullptr));
  EXPECT_THAT(fake::LogBodies(), ::testing::IsEmpty());
}

TEST_F(RecordTest, FailedAllocationLeavesRecordAsItWas) {
  Record rec;
  ASSERT_TRUE(h_.RuleCreate(3, Rule(R"({"source":"10.1.2.3"})"), rec.rule));
  const TcRule before = *rec.rule;
  const std::string portsBefore = rec.rule->ports;

  tcalloc::FailAfter(0);
  EXPECT_FALSE(
      h_.RuleCreate(4,
                    Rule(R"({"port_type":"ALL","port_num":"1,2,3,4,5,6,7,8","enabled":false,)"
                         R"("protocol":"udp","minrate":5,"maxrate":6,"ip_direction":"dest"})"),
                    rec.rule));
  EXPECT_EQ(memcmp(&before, rec.rule, sizeof before), 0);  // ports pointer included
  EXPECT_EQ(std::string(rec.rule->ports), portsBefore);
  // The suffix shows the error stack as it stands: the allocation records nothing.
  EXPECT_EQ(fake::LogBodies(), std::vector<std::string>{"Failed to alloc memory[0x0000 :0]"});
}

}  // namespace
