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
#include "tcalloc.h"

namespace {

Json::Value ParseJson(const std::string& text) {
  Json::Value value;
  Json::CharReaderBuilder builder;
  std::string errors;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &value, &errors)) << text;
  return value;
}

// A validated rule; each case replaces or removes some of its members.
Json::Value BaseRule() {
  return ParseJson(
      R"({"enabled":true,"protocol":"tcp","minrate":100,"maxrate":200,"source":"all",)"
      R"("ip_direction":"src","port_type":"SELF","port_num":"80","port_direction":"src"})");
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
  const char* patch;                 // members replacing those of BaseRule()
  std::vector<const char*> removed;  // members taken out of BaseRule()
  const char* ports;
  int enabled;
  int protocol;
  int minrate;
  int maxrate;
  std::string source;
  int ipDirection;
  std::vector<std::string> logs;
};

const std::string k200(200, 's');

const FieldCase kFieldCases[] = {
    {"AllWithoutPortNum",
     R"({"port_type":"ALL"})",
     {"port_num"},
     "ALL::src",
     1,
     1,
     100,
     200,
     "all",
     1,
     {}},
    {"AllWithPortsDest",
     R"({"port_type":"ALL","port_num":"80","port_direction":"dest"})",
     {},
     "ALL:80:dest",
     1,
     1,
     100,
     200,
     "all",
     1,
     {}},
    {"SelfList",
     R"({"port_num":"80,443","port_direction":"dest"})",
     {},
     "SELF:80,443:dest",
     1,
     1,
     100,
     200,
     "all",
     1,
     {}},
    {"SysService",
     R"({"port_type":"SYS","port_num":"cifs"})",
     {},
     "SYS:cifs:src",
     1,
     1,
     100,
     200,
     "all",
     1,
     {}},
    {"AllPortNumArray",
     R"({"port_type":"ALL","port_num":[80,443]})",
     {},
     "ALL::src",
     1,
     1,
     100,
     200,
     "all",
     1,
     {}},
    {"AllPortNumObject",
     R"({"port_type":"ALL","port_num":{"from":80}})",
     {},
     "ALL::src",
     1,
     1,
     100,
     200,
     "all",
     1,
     {}},
    {"AllPortNumNumber",
     R"({"port_type":"ALL","port_num":80})",
     {},
     "ALL:80:src",
     1,
     1,
     100,
     200,
     "all",
     1,
     {}},
    {"AllPortNumNull",
     R"({"port_type":"ALL","port_num":null})",
     {},
     "ALL::src",
     1,
     1,
     100,
     200,
     "all",
     1,
     {}},
    {"IpDirectionDest",
     R"({"ip_direction":"dest"})",
     {},
     "SELF:80:src",
     1,
     1,
     100,
     200,
     "all",
     0,
     {}},
    {"IpDirectionUpperSrc",
     R"({"ip_direction":"SRC"})",
     {},
     "SELF:80:src",
     1,
     1,
     100,
     200,
     "all",
     0,
     {}},
    {"IpDirectionIntegerDefault",
     R"({"ip_direction":1})",
     {},
     "SELF:80:src",
     1,
     1,
     100,
     200,
     "all",
     0,
     {}},
    {"IpDirectionArray",
     R"({"ip_direction":["src"]})",
     {},
     "SELF:80:src",
     1,
     1,
     100,
     200,
     "all",
     0,
     {}},
    {"Disabled", R"({"enabled":false})", {}, "SELF:80:src", 0, 1, 100, 200, "all", 1, {}},
    {"UdpNoCeiling",
     R"({"protocol":"udp","maxrate":0,"minrate":200000})",
     {},
     "SELF:80:src",
     1,
     2,
     200000,
     0,
     "all",
     1,
     {}},
    {"ProtocolAll", R"({"protocol":"all"})", {}, "SELF:80:src", 1, 3, 100, 200, "all", 1, {}},
    {"ProtocolUpperCase",
     R"({"protocol":"TCP"})",
     {},
     "SELF:80:src",
     1,
     3,
     100,
     200,
     "all",
     1,
     {"bad parameters of protocol: TCP"}},
    {"SourceAddress",
     R"({"source":"192.168.1.0/24"})",
     {},
     "SELF:80:src",
     1,
     1,
     100,
     200,
     "192.168.1.0/24",
     1,
     {}},
    {"Source200Chars", nullptr, {}, "SELF:80:src", 1, 1, 100, 200, k200.substr(0, 127), 1, {}},
    {"SourceObject", R"({"source":{"a":"b"}})", {}, "SELF:80:src", 1, 1, 100, 200, "", 1, {}},
    {"MissingMembers",
     "{}",
     {"enabled", "protocol", "minrate", "maxrate", "source", "ip_direction", "port_type",
      "port_num", "port_direction"},
     "::",
     0,
     3,
     0,
     0,
     "",
     0,
     {}},
};

class RecordFields : public RecordTest, public ::testing::WithParamInterface<FieldCase> {};

TEST_P(RecordFields, FillsEveryField) {
  const FieldCase& c = GetParam();
  Json::Value rule = BaseRule();
  if (c.patch != nullptr) {
    Json::Value patch = ParseJson(c.patch);
    for (const auto& key : patch.getMemberNames()) rule[key] = patch[key];
  } else {
    rule["source"] = k200;
  }
  for (const char* key : c.removed) rule.removeMember(key);

  Record rec;
  TcRule* sentinel = reinterpret_cast<TcRule*>(0x1234);
  rec.rule->next = sentinel;
  ASSERT_TRUE(h_.RuleCreate(7, rule, rec.rule));
  ASSERT_NE(rec.rule->ports, nullptr);
  EXPECT_STREQ(rec.rule->ports, c.ports);
  EXPECT_EQ(rec.rule->id, 7);
  EXPECT_EQ(rec.rule->enabled, c.enabled);
  EXPECT_EQ(static_cast<int>(rec.rule->protocol), c.protocol);
  EXPECT_EQ(rec.rule->minrate, c.minrate);
  EXPECT_EQ(rec.rule->maxrate, c.maxrate);
  EXPECT_EQ(std::string(rec.rule->source), c.source);
  EXPECT_EQ(rec.rule->ipDirection, c.ipDirection);
  EXPECT_EQ(rec.rule->next, sentinel);
  EXPECT_EQ(fake::LogBodies(), c.logs);
}

INSTANTIATE_TEST_SUITE_P(Cases, RecordFields, ::testing::ValuesIn(kFieldCases),
                         [](const ::testing::TestParamInfo<FieldCase>& info) {
                           return std::string(info.param.name);
                         });

TEST_F(RecordTest, ReusedRecordTakesEachRuleWholly) {
  Record rec;
  Json::Value first = BaseRule();
  first["port_num"] = "1000-2000,3000,4000";
  first["source"] = "10.0.0.0/8";
  ASSERT_TRUE(h_.RuleCreate(1, first, rec.rule));
  ASSERT_STREQ(rec.rule->ports, "SELF:1000-2000,3000,4000:src");

  Json::Value second = BaseRule();
  second["port_type"] = "ALL";
  second.removeMember("port_num");
  second["enabled"] = false;
  second["ip_direction"] = "dest";
  ASSERT_TRUE(h_.RuleCreate(2, second, rec.rule));
  // The shorter text replaces the longer one without a tail.
  EXPECT_EQ(std::string(rec.rule->ports), "ALL::src");
  EXPECT_STREQ(rec.rule->source, "all");
  EXPECT_EQ(rec.rule->id, 2);
  EXPECT_EQ(rec.rule->enabled, 0);
  EXPECT_EQ(rec.rule->ipDirection, 0);
}

TEST_F(RecordTest, NullRecordIsRefusedSilently) {
  EXPECT_FALSE(h_.RuleCreate(1, BaseRule(), nullptr));
  EXPECT_THAT(fake::LogBodies(), ::testing::IsEmpty());
}

TEST_F(RecordTest, FailedAllocationLeavesRecordAsItWas) {
  Record rec;
  Json::Value first = BaseRule();
  first["source"] = "10.1.2.3";
  ASSERT_TRUE(h_.RuleCreate(3, first, rec.rule));
  TcRule before = *rec.rule;
  std::string portsBefore = rec.rule->ports;

  Json::Value second = BaseRule();
  second["port_type"] = "ALL";
  second["port_num"] = "1,2,3,4,5,6,7,8,9,10";
  second["enabled"] = false;
  second["protocol"] = "udp";
  second["minrate"] = 5;
  second["maxrate"] = 6;
  second["source"] = "all";
  second["ip_direction"] = "dest";
  tcalloc::FailAfter(0);
  EXPECT_FALSE(h_.RuleCreate(4, second, rec.rule));

  EXPECT_EQ(memcmp(&before, rec.rule, sizeof before), 0);  // ports pointer included
  EXPECT_EQ(std::string(rec.rule->ports), portsBefore);
  std::vector<std::string> logs = fake::LogBodies();
  ASSERT_EQ(logs.size(), 1u);
  EXPECT_TRUE(std::regex_match(logs[0], std::regex(R"(Failed to alloc memory\[0x0200 \S+:\d+\])")))
      << logs[0];
}

}  // namespace
