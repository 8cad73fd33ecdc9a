#include "validation_fixture.h"

namespace {

const std::string kTypeStr = "ports -> port_type must be of type string" + kNoErr;
const std::string kNumStr = "ports -> port_num must be of type string" + kNoErr;
const std::string kBadType = "port -> port_type must be ALL/SYS/SELF" + kNoErr;
const std::string kSys = "Failed to parse type SYS" + kNoErr;
const std::string kSelf = "Failed to parse type SELF" + kNoErr;
std::string Dir(const std::string& shown) {
  return "port direction(" + shown + ") is error must be dest or src" + kNoErr;
}

struct ParseCase {
  const char* rule;
  const char* after;  // the rule after the call, passed or refused
  Lines lines;        // empty: the rule passes
};

TEST_F(ValidationTest, PortsParseSetTable) {
  const ParseCase cases[] = {
      {R"({"port_type":"ALL"})", R"({"port_type":"ALL","port_direction":"src"})", {}},
      {R"({"port_type":"ALL","port_num":[80],"port_direction":"dest"})",
       R"({"port_type":"ALL","port_num":[80],"port_direction":"dest"})",
       {}},
      {R"({"port_type":"SELF","port_num":" 80 , 443 "})",
       R"({"port_type":"SELF","port_num":"80,443","port_direction":"src"})",
       {}},
      {R"({"port_type":"SELF","port_num":"","port_direction":"dest"})",
       R"({"port_type":"SELF","port_num":"","port_direction":"dest"})",
       {}},
      {R"({"port_type":"SYS","port_num":" cifs ,afp,, x"})",
       R"({"port_type":"SYS","port_num":"cifs,afp,,x","port_direction":"src"})",
       {}},
      // Refused; a default direction written before the type is tested stays.
      {R"({"port_type":"all"})", R"({"port_type":"all","port_direction":"src"})", {kBadType}},
      {R"({"port_type":5})", R"({"port_type":5})", {kTypeStr}},
      {R"({"port_num":"80"})", R"({"port_num":"80"})", {kTypeStr}},
      {R"({"port_type":"ALL","port_direction":"SRC"})",
       R"({"port_type":"ALL","port_direction":"SRC"})",
       {Dir("SRC")}},
      {R"({"port_type":"ALL","port_direction":"up"})",
       R"({"port_type":"ALL","port_direction":"up"})",
       {Dir("up")}},
      {R"({"port_type":"ALL","port_direction":1})",
       R"({"port_type":"ALL","port_direction":1})",
       {Dir("1")}},
      {R"({"port_type":"ALL","port_direction":null})",
       R"({"port_type":"ALL","port_direction":null})",
       {Dir("null")}},
      {R"({"port_type":"ALL","port_direction":["src"]})",
       R"({"port_type":"ALL","port_direction":["src"]})",
       {Dir(R"(["src"])")}},
      {R"({"port_type":"SELF","port_num":80})",
       R"({"port_type":"SELF","port_num":80,"port_direction":"src"})",
       {kNumStr, kSelf}},
      {R"({"port_type":"SYS"})", R"({"port_type":"SYS","port_direction":"src"})", {kNumStr, kSys}},
      // The check runs on the normalised text, which the rule keeps.
      {R"({"port_type":"SELF","port_num":" 80 , 1000-2000"})",
       R"({"port_type":"SELF","port_num":"80,1000-2000","port_direction":"src"})",
       {"Format error! (1000-2000) You can input just one port range setting without other ports" +
            kNoErr,
        "Failed to PortsSELFCheck() (80,1000-2000)" + kNoErr, kSelf}},
      {R"({"port_type":"SELF","port_num":",,,"})",
       R"({"port_type":"SELF","port_num":",,,","port_direction":"src"})",
       {"Format error! () 0 <= port number < 65536 " + kNoErr,
        "Failed to PortsSELFCheck() (,,,)" + kNoErr, kSelf}},
  };
  for (const auto& c : cases) {
    fake::Reset();
    Json::Value rule = J(c.rule);
    EXPECT_EQ(h.PortsParseSet(rule), c.lines.empty() ? 0 : -1) << c.rule;
    EXPECT_EQ(rule, J(c.after)) << c.rule << " became " << rule.toStyledString();
    EXPECT_EQ(fake::LogBodies(), c.lines) << c.rule;
    EXPECT_EQ(fake::S().szListsOut, 0) << c.rule;
  }
}

TEST_F(ValidationTest, PortsParseSetRefusesNonObjectsWithoutThrowing) {
  for (const char* text : {"5", "\"SELF\"", "[\"port_type\"]", "null", "true"}) {
    fake::Reset();
    Json::Value rule = J(text);
    EXPECT_EQ(h.PortsParseSet(rule), -1) << text;
    EXPECT_EQ(rule, J(text)) << text;
    EXPECT_EQ(fake::LogBodies(), Lines{kTypeStr}) << text;
  }
}

// Only the first 1023 characters of a long list reach the rule.
TEST_F(ValidationTest, LongListsAreCutBeforeNormalising) {
  for (const char* type : {"SYS", "SELF"}) {
    std::string list;
    while (list.size() < 1500) list += "1,";
    Json::Value rule(Json::objectValue);
    rule["port_type"] = type;
    rule["port_num"] = list;
    EXPECT_EQ(h.PortsParseSet(rule), 0) << type;
    EXPECT_EQ(rule["port_num"].asString(), list.substr(0, 1023)) << type;
  }
  EXPECT_TRUE(fake::LogBodies().empty());
}

TEST_F(ValidationTest, NormaliseFailureKeepsPortNumAndLogsEveryLevel) {
  tcalloc::FailAfter(0);
  Json::Value rule = J(R"({"port_type":"SELF","port_num":" 80"})");
  EXPECT_EQ(h.PortsParseSet(rule), -1);
  EXPECT_EQ(rule["port_num"], " 80");
  const std::string oom = CurrentErr();
  EXPECT_EQ(OLIBCErrGet(), 0x0200);
  EXPECT_EQ(fake::LogBodies(), (Lines{"Failed to alloc memory" + kNoErr,
                                      "Failed to PortsFormatNormalize() ( 80)" + oom,
                                      "Failed to parse type SELF" + oom}));
}

}  // namespace
