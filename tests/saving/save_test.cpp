// The two save operations against the fake platform: what runs in which
// order, what the directories hold afterwards and how the request is answered.
#include <deque>
#include <map>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "ORVI.Core.Network.TrafficControl.h"
#include "fake_platform.h"
#include "test_json.h"
#include "tcalloc.h"

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

const char kRmTmp[] = "OLIBCExec(/bin/rm,-rf,/etc/tc_tmp)";
const char kCp[] = "OLIBCExec(/bin/cp,-rf,/etc/tc,/etc/tc_tmp)";
const char kReloadTmp[] = "ORVIFwTcRuleReload(/etc/tc_tmp)";
const char kRmLive[] = "OLIBCExec(/bin/rm,-rf,/etc/tc)";
const char kMv[] = "OLIBCExec(/bin/mv,-f,/etc/tc_tmp,/etc/tc)";
const char kReloadLive[] = "ORVIFwTcRuleReload(/etc/tc)";
const char kRmRescue[] = "OLIBCExec(/bin/rm,-rf,/etc/tc_rescue)";
const char kMvRescue[] = "OLIBCExec(/bin/mv,-f,/etc/tc_tmp,/etc/tc_rescue)";

// Two rules that pass validation, and how they are stored.
const char kTwoRules[] =
    R"([{"enabled":true,"protocol":"tcp","minrate":100,"maxrate":200,"source":"all",)"
    R"("ip_direction":"src","port_type":"ALL","port_direction":"src"},)"
    R"({"enabled":false,"protocol":"udp","minrate":5,"maxrate":0,"source":"10.0.0.0/8",)"
    R"("ip_direction":"dest","port_type":"SELF","port_num":"80","port_direction":"dest"}])";
const char kTwoStored[] = "1 ALL::src 1/1/100/200/all/1 2 SELF:80:dest 0/2/5/0/10.0.0.0/8/0 ";

// A directory in short: adapter -> its rules, every field.
using Summary = std::map<std::string, std::string>;
Summary Summarize(const fake::Dir& dir) {
  Summary out;
  for (const auto& f : dir) {
    std::string& text = out[f.first];
    for (const fake::StoredRule& r : f.second) {
      text += std::to_string(r.id) + " " + r.ports + " " + std::to_string(r.enabled) + "/" +
              std::to_string(r.protocol) + "/" + std::to_string(r.minrate) + "/" +
              std::to_string(r.maxrate) + "/" + r.source + "/" + std::to_string(r.ipDirection) +
              " ";
    }
  }
  return out;
}

enum class Live { kOld, kNew, kGone };

class SaveTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fake::Reset();
    tcalloc::FailAfter(-1);
    fake::S().interfaces = {"eth0", "eth1", "br0", "br1", "gbr"};
    fake::S().bridges = {"gbr", "br0", "br1"};
    fake::S().keys = {{"support_net_topology", "yes"}, {"net_topology", "router"}};
    fake::S().dirs["/etc/tc"]["eth1"] = {fake::Rule(1, "SYS:ssh:src", 1, 300, 400)};
    fake::S().dirs["/etc/tc"]["gbr"] = {fake::Rule(1, "ALL::src", 3, 50, 60)};
    fake::S().dirs["/etc/tc"]["br0"] = {fake::Rule(1, "SELF:443:dest")};
    before_ = Summarize(fake::S().dirs["/etc/tc"]);
  }
  void TearDown() override {
    tcalloc::FailAfter(-1);
    EXPECT_EQ(fake::S().ruleBufsOut, 0);
    EXPECT_EQ(fake::S().filesOut, 0);
    EXPECT_EQ(fake::S().ruleListsOut, 0);
    EXPECT_EQ(fake::S().szListsOut, 0);
    EXPECT_THAT(fake::BadFrames(), IsEmpty());
    EXPECT_FALSE(resp_.Conflicting());
  }

  void Save(const std::string& params, bool router = false) {
    ORVI::APIRequest req(J(params));
    TCHandler h(&req, &resp_);
    if (router) {
      h.RouterRulesSave();
    } else {
      h.RulesSave();
    }
  }
  // The programs run and the reloads asked for, in order.
  static std::vector<std::string> Steps() {
    std::vector<std::string> out;
    for (const auto& c : fake::S().calls) {
      if (c.rfind("OLIBCExec(", 0) == 0 || c.rfind("ORVIFwTcRuleReload(", 0) == 0) {
        out.push_back(c);
      }
    }
    return out;
  }
  // The live rules before the save, with `written` holding the two new rules.
  Summary With(const std::vector<std::string>& written) const {
    Summary s = before_;
    for (const auto& a : written) s[a] = kTwoStored;
    return s;
  }
  static Summary Dir(const char* path) {
    auto d = fake::S().dirs.find(path);
    return d == fake::S().dirs.end() ? Summary() : Summarize(d->second);
  }
  bool Exists(const char* path) { return fake::S().dirs.count(path) == 1; }

  ORVI::APIResponse resp_;
  Summary before_;
};

// What happens from the staging copy on, for both saves.
struct OutcomeCase {
  const char* name;
  std::deque<int> reloads;
  std::vector<std::pair<std::string, int>> fails;
  int code;  // 0: success
  std::vector<std::string> steps;
  std::vector<std::string> logs;
  Live live;
  const char* kept;  // where the applied rules survive when the live ones are gone
};

bool Kept(const OutcomeCase& c, const std::string& dir) {
  return c.kept != nullptr && dir == c.kept;
}

const char kRmLiveFailed[] = "Failed to rm -rf /etc/tc. ret=-1";
const char kMvFailed[] = "Failed to mv -f (/etc/tc_tmp) (/etc/tc)";
const char kKeptRescue[] =
    "/etc/tc may be gone or incomplete: the applied rules are kept in /etc/tc_rescue";
const char kKeptStaging[] =
    "/etc/tc may be gone or incomplete: the applied rules are kept in /etc/tc_tmp";
const char kDumpFailed[] = "failed to open rule file of %s";
const std::vector<std::string> kApplied = {kRmTmp, kCp, kReloadTmp, kRmLive, kMv, kRmTmp};
const std::vector<std::string> kRefused = {kRmTmp, kCp, kReloadTmp, kRmTmp};
// The removal of the live directory failed: it may be partly gone, so the
// applied rules are kept too.
const std::vector<std::string> kLiveKept = {kRmTmp,    kCp,       kReloadTmp, kRmLive,
                                            kRmRescue, kMvRescue, kRmTmp,     kReloadLive};
const std::vector<std::string> kRescued = {kRmTmp,    kCp,       kReloadTmp, kRmLive,    kMv,
                                           kRmRescue, kMvRescue, kRmTmp,     kReloadLive};

// clang-format off
const OutcomeCase kOutcomes[] = {
  {"Applied",            {0},     {},                          0,    kApplied, {}, Live::kNew, nullptr},
  {"AppliedPositive",    {1},     {},                          0,    kApplied, {}, Live::kNew, nullptr},
  {"CeilingOverBound",   {-2},    {},                          1202, kRefused, {"ceil exceed system upper bound![0x0301 ORVIFwTcRuleReload:1]"}, Live::kOld, nullptr},
  {"CeilingTooLarge",    {-3},    {},                          1203, kRefused, {"max ceil too large[0x0301 ORVIFwTcRuleReload:1]"}, Live::kOld, nullptr},
  {"ApplyFails",         {-1},    {},                          1201, kRefused, {"operation fail[0x0301 ORVIFwTcRuleReload:1]"}, Live::kOld, nullptr},
  {"ApplyFailsOddly",    {-9},    {},                          1201, kRefused, {"operation fail[0x0301 ORVIFwTcRuleReload:1]"}, Live::kOld, nullptr},
  {"LiveStaysReapply0",  {0, 0},  {{"OLIBCExec /bin/rm", 2}},  1201, kLiveKept, {kRmLiveFailed, kKeptRescue}, Live::kOld, "/etc/tc_rescue"},
  {"LiveStaysReapply1",  {0, 1},  {{"OLIBCExec /bin/rm", 2}},  1204, kLiveKept, {kRmLiveFailed, kKeptRescue}, Live::kOld, "/etc/tc_rescue"},
  {"LiveStaysReapplyM1", {0, -1}, {{"OLIBCExec /bin/rm", 2}},  1204, kLiveKept, {kRmLiveFailed, kKeptRescue}, Live::kOld, "/etc/tc_rescue"},
  {"MoveFailsKept",      {0, 0},  {{"OLIBCExec /bin/mv", 1}},  1201, kRescued, {kMvFailed, kKeptRescue}, Live::kGone, "/etc/tc_rescue"},
  {"MoveFailsKeptM1",    {0, -1}, {{"OLIBCExec /bin/mv", 1}},  1204, kRescued, {kMvFailed, kKeptRescue}, Live::kGone, "/etc/tc_rescue"},
  {"MoveFailsInStaging", {0, 0},  {{"OLIBCExec /bin/mv", 1}, {"OLIBCExec /bin/mv", 2}}, 1201,
   {kRmTmp, kCp, kReloadTmp, kRmLive, kMv, kRmRescue, kMvRescue, kReloadLive}, {kMvFailed, kKeptStaging}, Live::kGone, "/etc/tc_tmp"},
  {"CopyFails",          {},      {{"OLIBCExec /bin/cp", 1}},  1201, {kRmTmp, kCp, kRmTmp}, {"Failed to cp -rf (/etc/tc) (/etc/tc_tmp)"}, Live::kOld, nullptr},
  {"OldStagingStays",    {},      {{"OLIBCExec /bin/rm", 1}},  1201, {kRmTmp, kRmTmp}, {"Failed to rm -rf /etc/tc_tmp. ret=-1"}, Live::kOld, nullptr},
  {"DumpFails",          {},      {{"ORVIFwTcRuleOpen", 1}},   1201, {kRmTmp, kCp, kRmTmp}, {kDumpFailed}, Live::kOld, nullptr},
};
// clang-format on

class Outcomes : public SaveTest,
                 public ::testing::WithParamInterface<std::tuple<OutcomeCase, bool>> {};

TEST_P(Outcomes, StateAndAnswer) {
  const OutcomeCase& c = std::get<0>(GetParam());
  const bool router = std::get<1>(GetParam());
  fake::S().reloadResults = c.reloads;
  for (const auto& f : c.fails) fake::FailCall(f.first, f.second);
  const std::vector<std::string> written =
      router ? std::vector<std::string>{"br0", "br1"} : std::vector<std::string>{"eth0"};
  Save(std::string(router ? R"({"direction":"download",)" : R"({"adapter":"eth0",)") +
           R"("rules":)" + kTwoRules + "}",
       router);

  EXPECT_EQ(resp_.AnswerCount(), 1);
  EXPECT_EQ(resp_.Success(), c.code == 0);
  EXPECT_EQ(resp_.Success() ? 0 : resp_.ErrorCode(), c.code);
  EXPECT_TRUE(resp_.Data().isNull());
  EXPECT_EQ(Steps(), c.steps);
  std::vector<std::string> logs = c.logs;
  for (auto& l : logs) {
    if (l == kDumpFailed) l = "failed to open rule file of " + written[0];
  }
  EXPECT_EQ(fake::LogBodies(), logs);
  EXPECT_EQ(Exists("/etc/tc"), c.live != Live::kGone);
  EXPECT_EQ(Dir("/etc/tc"), c.live == Live::kGone  ? Summary()
                            : c.live == Live::kOld ? before_
                                                   : With(written));
  // Whatever was applied held the new rules beside the untouched ones.
  if (!fake::S().reloadSnapshots.empty()) {
    EXPECT_EQ(Summarize(fake::S().reloadSnapshots[0]["/etc/tc_tmp"]), With(written));
  }
  EXPECT_EQ(Exists("/etc/tc_tmp"), Kept(c, "/etc/tc_tmp"));
  EXPECT_EQ(Exists("/etc/tc_rescue"), Kept(c, "/etc/tc_rescue"));
  if (c.kept != nullptr) {
    EXPECT_EQ(Dir(c.kept), With(written));
  }
}

INSTANTIATE_TEST_SUITE_P(Cases, Outcomes,
                         ::testing::Combine(::testing::ValuesIn(kOutcomes), ::testing::Bool()),
                         [](const ::testing::TestParamInfo<std::tuple<OutcomeCase, bool>>& info) {
                           return std::string(std::get<0>(info.param).name) +
                                  (std::get<1>(info.param) ? "_Router" : "_Adapter");
                         });

// Requests refused before anything is staged. A router save still clears the
// staging directory, and answers once more after a check that answered.
struct RefusedCase {
  const char* name;
  bool router;
  const char* params;
  const char* topology;  // net_topology; nullptr: the key is missing
  const char* fail;      // failing call, or nullptr
  int code;
  std::vector<std::string> logs;  // empty: the validator's own, not checked
};

// clang-format off
const RefusedCase kRefusedCases[] = {
  {"NoAdapter",           false, R"({"rules":[]})", "router", nullptr, 114, {"Required parameter error![0x0000 :0]"}},
  {"UnknownAdapter",      false, R"({"adapter":"eth9","rules":[]})", "router", nullptr, 4311, {"No such interface [eth9][0x0000 :0]"}},
  {"RulesNotArray",       false, R"({"adapter":"eth0","rules":{"a":1}})", "router", nullptr, 114, {"Required parameter error![0x0000 :0]"}},
  {"BadRule",             false, R"({"adapter":"eth0","rules":[{"enabled":"yes"}]})", "router", nullptr, 101, {}},
  {"NoTopologyKey",       true,  R"({"direction":"upload"})", nullptr, nullptr, 1200, {"Failed to get [net_topology] info from [/etc/orviinfo.conf], or key not found"}},
  {"NotRouter",           true,  R"({"direction":"upload"})", "bridge", nullptr, 1200, {"QS is not in router mode"}},
  {"NoDirection",         true,  R"({"rules":[]})", "router", nullptr, 1200, {"Bad parameters", "Unknown direction "}},
  {"DirectionNotText",    true,  R"({"direction":["upload"]})", "router", nullptr, 1200, {"Bad parameters", "Unknown direction [\"upload\"]"}},
  {"DirectionCapital",    true,  R"({"direction":"Upload"})", "router", nullptr, 1200, {"Unknown direction Upload"}},
  {"BridgesUnknown",      true,  R"({"direction":"download"})", "router", "OLIBNetEnumBridge", 1200, {"Failed to OLIBNetEnumBridge [0x0201 OLIBNetEnumBridge:1]", "Bad parameters"}},
  {"NoAdapterList",       true,  R"({"direction":"upload"})", "router", "OLIBCSzListAlloc", 1201, {"Failed to OLIBCSzListAlloc [0x0201 OLIBCSzListAlloc:1]"}},
  {"UploadNotListed",     true,  R"({"direction":"upload"})", "router", "OLIBCSzListPush", 1201, {"Failed to OLIBCSzListPush [0x0201 OLIBCSzListPush:1]"}},
  {"RouterRulesNotArray", true,  R"({"direction":"upload","rules":"x"})", "router", nullptr, 114, {"Required parameter error![0x0000 :0]"}},
  {"RouterBadRule",       true,  R"({"direction":"download","rules":[{"enabled":1}]})", "router", nullptr, 101, {}},
};
// clang-format on

class Refused : public SaveTest, public ::testing::WithParamInterface<RefusedCase> {};

TEST_P(Refused, StagesNothing) {
  const RefusedCase& c = GetParam();
  if (c.topology == nullptr) {
    fake::S().keys.erase("net_topology");
  } else {
    fake::S().keys["net_topology"] = c.topology;
  }
  if (c.fail != nullptr) fake::FailCall(c.fail);
  Save(c.params, c.router);
  const bool checkAnswered = c.code == 114 || c.code == 101;
  EXPECT_EQ(resp_.AnswerCount(), c.router && checkAnswered ? 2 : 1);
  EXPECT_FALSE(resp_.Success());
  EXPECT_EQ(resp_.ErrorCode(), c.code);
  EXPECT_EQ(Steps(), c.router ? std::vector<std::string>{kRmTmp} : std::vector<std::string>{});
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleOpen"), IsEmpty());
  if (!c.logs.empty()) {
    EXPECT_EQ(fake::LogBodies(), c.logs);
  }
  EXPECT_EQ(Dir("/etc/tc"), before_);
}

INSTANTIATE_TEST_SUITE_P(Cases, Refused, ::testing::ValuesIn(kRefusedCases),
                         [](const ::testing::TestParamInfo<RefusedCase>& info) {
                           return std::string(info.param.name);
                         });

TEST_F(SaveTest, RuleThatCannotBeBuiltIsLeftOut) {
  // "ALL" rules: validating them allocates nothing, so the 2nd allocation is
  // the 2nd record's port text.
  Json::Value params = J(std::string(R"({"adapter":"eth0","rules":)") + kTwoRules + "}");
  params["rules"][1]["port_type"] = "ALL";
  params["rules"].append(params["rules"][0]);
  tcalloc::FailAfter(1);
  ORVI::APIRequest req(params);
  TCHandler(&req, &resp_).RulesSave();
  EXPECT_TRUE(resp_.Success());
  const fake::RuleFile& file = fake::S().dirs["/etc/tc"]["eth0"];
  ASSERT_EQ(file.size(), 2u);
  EXPECT_EQ(file[0].id, 1);
  EXPECT_EQ(file[1].id, 3);
}

TEST_F(SaveTest, DownloadWithOnlyGbrReappliesUnchangedRules) {
  fake::S().bridges = {"GBR"};
  Save(std::string(R"({"direction":"download","rules":)") + kTwoRules + "}", true);
  EXPECT_TRUE(resp_.Success());
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleOpen"), IsEmpty());
  EXPECT_EQ(Steps(), kApplied);
  EXPECT_EQ(Dir("/etc/tc"), before_);
}

TEST_F(SaveTest, LaterBridgeDumpFailureStopsTheWalk) {
  fake::FailCall("ORVIFwTcRuleOpen", 2);
  fake::S().bridges = {"br0", "br1", "br2"};
  Save(std::string(R"({"direction":"download","rules":)") + kTwoRules + "}", true);
  EXPECT_EQ(resp_.ErrorCode(), 1201);
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleOpen"), ElementsAre("ORVIFwTcRuleOpen(/etc/tc_tmp,br0)",
                                                             "ORVIFwTcRuleOpen(/etc/tc_tmp,br1)"));
  EXPECT_EQ(Steps(), (std::vector<std::string>{kRmTmp, kCp, kRmTmp}));
  EXPECT_EQ(Dir("/etc/tc"), before_);
  EXPECT_FALSE(Exists("/etc/tc_tmp"));
}

}  // namespace
