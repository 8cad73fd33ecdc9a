#include "validation_fixture.h"

namespace {

const char kBase[] =
    R"({"enabled":true,"protocol":"tcp","minrate":100,"maxrate":200,"port_type":"ALL"})";

// The base rule with the patch's keys replaced; a value "<absent>" removes
// the key. A patch that is not an object is the whole rule.
Json::Value Rule(const char* patch = "{}") {
  Json::Value p = J(patch);
  if (!p.isObject()) return p;
  Json::Value rule = J(kBase);
  for (const auto& key : p.getMemberNames()) {
    if (p[key] == "<absent>")
      rule.removeMember(key);
    else
      rule[key] = p[key];
  }
  return rule;
}

Json::Value Array(int n) {
  Json::Value rules(Json::arrayValue);
  for (int i = 0; i < n; ++i) rules.append(Rule());
  return rules;
}

class Validator : public ValidationTest {
 protected:
  void ExpectRefused(const Lines& lines, const std::string& what) {
    EXPECT_EQ(fake::LogBodies(), lines) << what;
    EXPECT_EQ(resp.ErrorCode(), 101) << what;
    EXPECT_EQ(h._errCode, 101) << what;
    EXPECT_FALSE(resp.Success()) << what;
    EXPECT_TRUE(resp.Data().isNull()) << what;
  }
};

TEST_F(Validator, PassingRulesGainDefaults) {
  const struct {
    const char* patch;
    const char* after;
  } cases[] = {
      {"{}", R"({"source":"all","ip_direction":1,"port_direction":"src"})"},
      {R"({"minrate":1,"maxrate":0,"source":"","extra":[1]})",
       R"({"source":"all","ip_direction":1,"port_direction":"src","extra":[1]})"},
      {R"({"minrate":200000,"maxrate":200000,"source":null,"ip_direction":"dest"})",
       R"({"source":"all","ip_direction":"dest","port_direction":"src"})"},
      {R"({"protocol":"udp","source":"10.0.0.1","ip_direction":"sideways"})",
       R"({"source":"10.0.0.1","ip_direction":"sideways","port_direction":"src"})"},
      // A real with an integral value is an integer rate; it is kept as given.
      {R"({"protocol":"all","minrate":100.0,"maxrate":0,"enabled":false})",
       R"({"source":"all","ip_direction":1,"port_direction":"src"})"},
  };
  for (const auto& c : cases) {
    Json::Value rules(Json::arrayValue);
    rules.append(Rule(c.patch));
    EXPECT_EQ(h.RuleValidator(rules), 0) << c.patch;
    Json::Value want = Rule(c.patch);
    for (const auto& key : J(c.after).getMemberNames()) want[key] = J(c.after)[key];
    ASSERT_EQ(rules.size(), 1u) << c.patch;
    EXPECT_EQ(rules[0], want) << c.patch;
  }
  EXPECT_FALSE(resp.Answered());
  EXPECT_TRUE(fake::LogBodies().empty());
}

TEST_F(Validator, RefusedRulesAndTheirLines) {
  const std::string enable = "Fail to EnableCheck()!!" + kNoErr;
  const std::string proto = "Fail to ProtocolCheck()!!" + kNoErr;
  const std::string rate = "Fail to RateCheck()!!" + kNoErr;
  const std::string minMsg = "minrate should between: 0 < minrate <= 200000" + kNoErr;
  const std::string maxMsg = "maxrate should between: 0 <= maxrate <= 200000" + kNoErr;
  const std::string src = "Fail to SrcSet()!!" + kNoErr;
  const std::string ipdir = "Fail to IpDirectSet()!!" + kNoErr;
  const struct {
    const char* patch;
    Lines lines;
  } cases[] = {
      {"5", {enable}},
      {"\"rule\"", {enable}},
      {"[true]", {enable}},
      {"null", {enable}},
      {R"({"enabled":"<absent>"})", {enable}},
      {R"({"enabled":1})", {enable}},
      {R"({"protocol":"<absent>"})", {proto}},
      {R"({"protocol":["tcp"]})", {proto}},
      {R"({"protocol":"TCP"})", {"protocol must be one of tcp/udp/all" + kNoErr, proto}},
      {R"({"minrate":"100"})", {rate}},
      {R"({"maxrate":"<absent>"})", {rate}},
      {R"({"minrate":1.5})", {rate}},
      {R"({"minrate":1e20})", {rate}},
      {R"({"maxrate":4294967296})", {rate}},
      {R"({"minrate":4294967297})", {rate}},  // would read as 1 if cut to 32 bits
      {R"({"minrate":-1})", {minMsg, rate}},
      {R"({"minrate":0,"maxrate":200001})", {minMsg, rate}},
      {R"({"maxrate":200001})", {maxMsg, rate}},
      {R"({"maxrate":-1})", {maxMsg, rate}},
      {R"({"minrate":500,"maxrate":400})",
       {"mixrate must <= maxrate (min: 500, max: 400)" + kNoErr, rate}},
      {R"({"source":true})", {"Bad src value true", src}},
      {R"({"source":7})", {"Bad src value 7", src}},
      {R"({"source":1.5})", {"Bad src value 1.5", src}},
      {R"({"source":[1,"a"]})", {R"(Bad src value [1,"a"])", src}},
      {R"({"source":{"ip":"all"}})", {R"(Bad src value {"ip":"all"})", src}},
      {R"({"ip_direction":1})", {ipdir}},
      {R"({"ip_direction":null})", {ipdir}},
      {R"({"port_type":"<absent>"})",
       {"ports -> port_type must be of type string" + kNoErr,
        "Fail to PortsParseSet()!!" + kNoErr}},
  };
  for (const auto& c : cases) {
    fake::Reset();
    Json::Value rules(Json::arrayValue);
    rules.append(Rule(c.patch));
    EXPECT_EQ(h.RuleValidator(rules), -1) << c.patch;
    ExpectRefused(c.lines, c.patch);
  }
}

TEST_F(Validator, CountLimitIsCheckedBeforeAnyRule) {
  Json::Value hundred = Array(100);
  EXPECT_EQ(h.RuleValidator(hundred), 0);
  EXPECT_EQ(hundred[99]["source"], "all");
  EXPECT_FALSE(resp.Answered());

  Json::Value tooMany = Array(101);
  tooMany[0] = 5;  // would fail its own check if it were looked at
  const Json::Value before = tooMany;
  EXPECT_EQ(h.RuleValidator(tooMany), -1);
  EXPECT_EQ(tooMany, before);
  ExpectRefused({"The count of rules should be between: 0 ~ 100 !!" + kNoErr}, "101 rules");
}

TEST_F(Validator, EmptyAndNullPassNonArraysAreRefused) {
  Json::Value empty(Json::arrayValue), null;
  EXPECT_EQ(h.RuleValidator(empty), 0);
  EXPECT_EQ(h.RuleValidator(null), 0);
  EXPECT_EQ(empty, Json::Value(Json::arrayValue));
  EXPECT_FALSE(resp.Answered());
  for (const char* text : {"{\"a\":1}", "5", "\"rules\""}) {
    fake::Reset();
    Json::Value rules = J(text);
    EXPECT_EQ(h.RuleValidator(rules), -1) << text;
    ExpectRefused({"The rules should be an array !!" + kNoErr}, text);
  }
}

TEST_F(Validator, FailureInThirdOfFiveStopsThere) {
  Json::Value rules = Array(5);
  rules[2]["protocol"] = "icmp";
  const Json::Value before = rules;
  EXPECT_EQ(h.RuleValidator(rules), -1);
  for (int i : {0, 1}) {
    EXPECT_EQ(rules[i]["source"], "all") << i;
    EXPECT_EQ(rules[i]["ip_direction"], 1) << i;
    EXPECT_EQ(rules[i]["port_direction"], "src") << i;
  }
  for (int i : {2, 3, 4}) EXPECT_EQ(rules[i], before[i]) << i;
  ExpectRefused(
      {"protocol must be one of tcp/udp/all" + kNoErr, "Fail to ProtocolCheck()!!" + kNoErr},
      "third rule");
  EXPECT_EQ(resp.AnswerCount(), 1);
}

}  // namespace
