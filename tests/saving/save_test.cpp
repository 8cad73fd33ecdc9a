// The two save operations against the fake platform: what runs in which
// order, what the directories hold afterwards and how the request is answered.
#include <deque>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "ORVI.Core.Network.TrafficControl.h"
#include "fake_platform.h"
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

Json::Value ParseJson(const std::string& text) {
  Json::Value value;
  Json::CharReaderBuilder builder;
  std::string errors;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &value, &errors)) << text;
  return value;
}

// Two rules that pass validation: an "ALL" rule and a "SELF" one.
const char kTwoRules[] =
    R"([{"enabled":true,"protocol":"tcp","minrate":100,"maxrate":200,"source":"all",)"
    R"("ip_direction":"src","port_type":"ALL","port_direction":"src"},)"
    R"({"enabled":false,"protocol":"udp","minrate":5,"maxrate":0,"source":"10.0.0.0/8",)"
    R"("ip_direction":"dest","port_type":"SELF","port_num":"80","port_direction":"dest"}])";

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
    before_ = fake::S().dirs["/etc/tc"];
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

  void Save(const std::string& params) {
    ORVI::APIRequest req(ParseJson(params));
    TCHandler h(&req, &resp_);
    h.RulesSave();
  }
  void RouterSave(const std::string& params) {
    ORVI::APIRequest req(ParseJson(params));
    TCHandler h(&req, &resp_);
    h.RouterRulesSave();
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
  static std::vector<int> Ids(const fake::RuleFile& file) {
    std::vector<int> ids;
    for (const auto& r : file) ids.push_back(r.id);
    return ids;
  }
  void ExpectLive(Live live, const std::vector<std::string>& written) {
    auto& dirs = fake::S().dirs;
    switch (live) {
      case Live::kGone:
        EXPECT_EQ(dirs.count("/etc/tc"), 0u);
        break;
      case Live::kOld:
        ASSERT_EQ(dirs.count("/etc/tc"), 1u);
        EXPECT_EQ(dirs["/etc/tc"].size(), before_.size());
        for (const auto& f : before_) EXPECT_EQ(Ids(dirs["/etc/tc"][f.first]), Ids(f.second));
        for (const auto& a : written) {
          if (before_.count(a) == 0) {
            EXPECT_EQ(dirs["/etc/tc"].count(a), 0u) << a;
          }
        }
        break;
      case Live::kNew:
        ASSERT_EQ(dirs.count("/etc/tc"), 1u);
        for (const auto& a : written) EXPECT_EQ(Ids(dirs["/etc/tc"][a]), (std::vector<int>{1, 2}));
        for (const auto& f : before_) {
          bool rewritten = false;
          for (const auto& a : written) rewritten = rewritten || a == f.first;
          if (!rewritten) {
            EXPECT_EQ(dirs["/etc/tc"][f.first].front().ports, f.second.front().ports);
          }
        }
        break;
    }
  }

  ORVI::APIResponse resp_;
  fake::Dir before_;
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
  bool stagingLeft;
  bool rescued;
};

const OutcomeCase kOutcomes[] = {
    {"Applied",
     {0},
     {},
     0,
     {kRmTmp, kCp, kReloadTmp, kRmLive, kMv, kRmTmp},
     {},
     Live::kNew,
     false,
     false},
    {"AppliedPositive",
     {1},
     {},
     0,
     {kRmTmp, kCp, kReloadTmp, kRmLive, kMv, kRmTmp},
     {},
     Live::kNew,
     false,
     false},
    {"CeilingOverBound",
     {-2},
     {},
     1202,
     {kRmTmp, kCp, kReloadTmp, kRmTmp},
     {"ceil exceed system upper bound![0x0301 ORVIFwTcRuleReload:1]"},
     Live::kOld,
     false,
     false},
    {"CeilingTooLarge",
     {-3},
     {},
     1203,
     {kRmTmp, kCp, kReloadTmp, kRmTmp},
     {"max ceil too large[0x0301 ORVIFwTcRuleReload:1]"},
     Live::kOld,
     false,
     false},
    {"ApplyFails",
     {-1},
     {},
     1201,
     {kRmTmp, kCp, kReloadTmp, kRmTmp},
     {"operation fail[0x0301 ORVIFwTcRuleReload:1]"},
     Live::kOld,
     false,
     false},
    {"ApplyFailsOtherwise",
     {-9},
     {},
     1201,
     {kRmTmp, kCp, kReloadTmp, kRmTmp},
     {"operation fail[0x0301 ORVIFwTcRuleReload:1]"},
     Live::kOld,
     false,
     false},
    {"LiveNotRemovedReapplyOk",
     {0, 0},
     {{"OLIBCExec /bin/rm", 2}},
     1201,
     {kRmTmp, kCp, kReloadTmp, kRmLive, kRmTmp, kReloadLive},
     {"Failed to rm -rf /etc/tc. ret=-1"},
     Live::kOld,
     false,
     false},
    {"LiveNotRemovedReapplyPositive",
     {0, 1},
     {{"OLIBCExec /bin/rm", 2}},
     1204,
     {kRmTmp, kCp, kReloadTmp, kRmLive, kRmTmp, kReloadLive},
     {"Failed to rm -rf /etc/tc. ret=-1"},
     Live::kOld,
     false,
     false},
    {"LiveNotRemovedReapplyFails",
     {0, -1},
     {{"OLIBCExec /bin/rm", 2}},
     1204,
     {kRmTmp, kCp, kReloadTmp, kRmLive, kRmTmp, kReloadLive},
     {"Failed to rm -rf /etc/tc. ret=-1"},
     Live::kOld,
     false,
     false},
    {"MoveFailsCopyKept",
     {0, 0},
     {{"OLIBCExec /bin/mv", 1}},
     1201,
     {kRmTmp, kCp, kReloadTmp, kRmLive, kMv, kRmRescue, kMvRescue, kRmTmp, kReloadLive},
     {"Failed to mv -f (/etc/tc_tmp) (/etc/tc)",
      "/etc/tc is missing: the applied rules are kept in /etc/tc_rescue"},
     Live::kGone,
     false,
     true},
    {"MoveFailsCopyKeptReapplyFails",
     {0, -1},
     {{"OLIBCExec /bin/mv", 1}},
     1204,
     {kRmTmp, kCp, kReloadTmp, kRmLive, kMv, kRmRescue, kMvRescue, kRmTmp, kReloadLive},
     {"Failed to mv -f (/etc/tc_tmp) (/etc/tc)",
      "/etc/tc is missing: the applied rules are kept in /etc/tc_rescue"},
     Live::kGone,
     false,
     true},
    {"MoveFailsCopyStaysInStaging",
     {0, 0},
     {{"OLIBCExec /bin/mv", 1}, {"OLIBCExec /bin/mv", 2}},
     1201,
     {kRmTmp, kCp, kReloadTmp, kRmLive, kMv, kRmRescue, kMvRescue, kReloadLive},
     {"Failed to mv -f (/etc/tc_tmp) (/etc/tc)",
      "/etc/tc is missing: the applied rules are kept in /etc/tc_tmp"},
     Live::kGone,
     true,
     false},
    {"CopyFails",
     {},
     {{"OLIBCExec /bin/cp", 1}},
     1201,
     {kRmTmp, kCp, kRmTmp},
     {"Failed to cp -rf (/etc/tc) (/etc/tc_tmp)"},
     Live::kOld,
     false,
     false},
    {"OldStagingNotRemoved",
     {},
     {{"OLIBCExec /bin/rm", 1}},
     1201,
     {kRmTmp, kRmTmp},
     {"Failed to rm -rf /etc/tc_tmp. ret=-1"},
     Live::kOld,
     false,
     false},
    {"DumpFails",
     {},
     {{"ORVIFwTcRuleOpen", 1}},
     1201,
     {kRmTmp, kCp, kRmTmp},
     {"failed to open rule file of %s"},
     Live::kOld,
     false,
     false},
};

class Outcomes : public SaveTest,
                 public ::testing::WithParamInterface<std::tuple<OutcomeCase, bool>> {};

TEST_P(Outcomes, StateAndAnswer) {
  const OutcomeCase& c = std::get<0>(GetParam());
  const bool router = std::get<1>(GetParam());
  fake::S().reloadResults = c.reloads;
  for (const auto& f : c.fails) fake::FailCall(f.first, f.second);
  const std::string rules = kTwoRules;
  if (router) {
    RouterSave(R"({"direction":"download","rules":)" + rules + "}");
  } else {
    Save(R"({"adapter":"eth0","rules":)" + rules + "}");
  }
  const std::vector<std::string> written =
      router ? std::vector<std::string>{"br0", "br1"} : std::vector<std::string>{"eth0"};

  EXPECT_EQ(resp_.AnswerCount(), 1);
  if (c.code == 0) {
    EXPECT_TRUE(resp_.Success());
    EXPECT_TRUE(resp_.Data().isNull());
  } else {
    EXPECT_FALSE(resp_.Success());
    EXPECT_EQ(resp_.ErrorCode(), c.code);
    EXPECT_TRUE(resp_.Data().isNull());
  }
  EXPECT_EQ(Steps(), c.steps);
  std::vector<std::string> logs = c.logs;
  for (auto& l : logs) {
    if (l == "failed to open rule file of %s") l = "failed to open rule file of " + written[0];
  }
  EXPECT_EQ(fake::LogBodies(), logs);
  ExpectLive(c.live, written);
  EXPECT_EQ(fake::S().dirs.count("/etc/tc_tmp") == 1, c.stagingLeft);
  const char* kept = c.stagingLeft ? "/etc/tc_tmp" : c.rescued ? "/etc/tc_rescue" : nullptr;
  if (kept != nullptr) {
    // The kept copy holds the applied rules: the new ones and every other file.
    fake::Dir& dir = fake::S().dirs[kept];
    for (const auto& a : written) EXPECT_EQ(Ids(dir[a]), (std::vector<int>{1, 2})) << kept;
    EXPECT_EQ(dir.count("eth1"), 1u);
  } else {
    EXPECT_EQ(fake::S().dirs.count("/etc/tc_rescue"), 0u);
  }
  // Whatever was applied held the new rules next to the untouched ones.
  if (!fake::S().reloadSnapshots.empty()) {
    fake::Dir& applied = fake::S().reloadSnapshots[0]["/etc/tc_tmp"];
    for (const auto& a : written) EXPECT_EQ(Ids(applied[a]), (std::vector<int>{1, 2}));
    EXPECT_EQ(applied["eth1"].front().ports, "SYS:ssh:src");
  }
}

INSTANTIATE_TEST_SUITE_P(Cases, Outcomes,
                         ::testing::Combine(::testing::ValuesIn(kOutcomes), ::testing::Bool()),
                         [](const ::testing::TestParamInfo<std::tuple<OutcomeCase, bool>>& info) {
                           return std::string(std::get<0>(info.param).name) +
                                  (std::get<1>(info.param) ? "_Router" : "_Adapter");
                         });

// Requests refused before anything is staged.
struct RefusedCase {
  const char* name;
  const char* params;
  int code;
};

const RefusedCase kRefused[] = {
    {"NoAdapter", R"({"rules":[]})", 114},
    {"UnknownAdapter", R"({"adapter":"eth9","rules":[]})", 4311},
    {"RulesNotArray", R"({"adapter":"eth0","rules":{"a":1}})", 114},
    {"BadRule", R"({"adapter":"eth0","rules":[{"enabled":"yes"}]})", 101},
};

class Refused : public SaveTest, public ::testing::WithParamInterface<RefusedCase> {};

TEST_P(Refused, TouchesNothing) {
  Save(GetParam().params);
  EXPECT_EQ(resp_.AnswerCount(), 1);
  EXPECT_FALSE(resp_.Success());
  EXPECT_EQ(resp_.ErrorCode(), GetParam().code);
  EXPECT_THAT(Steps(), IsEmpty());
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleOpen"), IsEmpty());
  ExpectLive(Live::kOld, {"eth0"});
}

INSTANTIATE_TEST_SUITE_P(Cases, Refused, ::testing::ValuesIn(kRefused),
                         [](const ::testing::TestParamInfo<RefusedCase>& info) {
                           return std::string(info.param.name);
                         });

TEST_F(SaveTest, WithoutRulesTheAdapterEndsEmpty) {
  for (const char* params : {R"({"adapter":"br0"})", R"({"adapter":"br0","rules":[]})"}) {
    SetUp();
    resp_ = ORVI::APIResponse();
    Save(params);
    EXPECT_TRUE(resp_.Success()) << params;
    EXPECT_THAT(fake::S().dirs["/etc/tc"]["br0"], IsEmpty()) << params;
    EXPECT_EQ(fake::S().dirs["/etc/tc"]["eth1"].size(), 1u) << params;
  }
}

TEST_F(SaveTest, RuleThatCannotBeBuiltIsLeftOut) {
  Json::Value rules = ParseJson(kTwoRules);
  Json::Value third = rules[0];
  third["source"] = "10.9.9.9";
  rules.append(third);
  rules[1]["port_type"] = "ALL";  // no port list to allocate while validating
  Json::Value params(Json::objectValue);
  params["adapter"] = "eth0";
  params["rules"] = rules;
  tcalloc::FailAfter(1);
  ORVI::APIRequest req(params);
  TCHandler h(&req, &resp_);
  h.RulesSave();
  EXPECT_TRUE(resp_.Success());
  EXPECT_EQ(Ids(fake::S().dirs["/etc/tc"]["eth0"]), (std::vector<int>{1, 3}));
  EXPECT_EQ(fake::S().dirs["/etc/tc"]["eth0"][1].source, "10.9.9.9");
}

TEST_F(SaveTest, StoredRecordsCarryTheValidatedRules) {
  Save(std::string(R"({"adapter":"eth0","rules":)") + kTwoRules + "}");
  ASSERT_TRUE(resp_.Success());
  const fake::RuleFile& file = fake::S().dirs["/etc/tc"]["eth0"];
  ASSERT_EQ(file.size(), 2u);
  EXPECT_EQ(file[0].ports, "ALL::src");
  EXPECT_EQ(file[0].ipDirection, 1);
  EXPECT_EQ(file[0].enabled, 1);
  EXPECT_EQ(file[1].ports, "SELF:80:dest");
  EXPECT_EQ(file[1].protocol, 2);
  EXPECT_EQ(file[1].minrate, 5);
  EXPECT_EQ(file[1].maxrate, 0);
  EXPECT_EQ(file[1].source, "10.0.0.0/8");
  EXPECT_EQ(file[1].ipDirection, 0);
  EXPECT_EQ(file[1].enabled, 0);
}

TEST_F(SaveTest, MissingIpDirectionIsStoredAsDestination) {
  Save(R"({"adapter":"eth0","rules":[{"enabled":true,"protocol":"tcp","minrate":1,)"
       R"("maxrate":2,"port_type":"ALL"}]})");
  ASSERT_TRUE(resp_.Success());
  ASSERT_EQ(fake::S().dirs["/etc/tc"]["eth0"].size(), 1u);
  EXPECT_EQ(fake::S().dirs["/etc/tc"]["eth0"][0].ipDirection, 0);
  EXPECT_EQ(fake::S().dirs["/etc/tc"]["eth0"][0].source, "all");
}

TEST_F(SaveTest, AllRuleWithArrayPortNumIsStored) {
  Save(R"({"adapter":"eth0","rules":[{"enabled":true,"protocol":"tcp","minrate":1,)"
       R"("maxrate":2,"port_type":"ALL","port_num":[1,2]},)"
       R"({"enabled":true,"protocol":"tcp","minrate":1,)"
       R"("maxrate":2,"port_type":"ALL","port_num":{"x":1},"port_direction":"dest"}]})");
  ASSERT_TRUE(resp_.Success());
  const fake::RuleFile& file = fake::S().dirs["/etc/tc"]["eth0"];
  ASSERT_EQ(file.size(), 2u);
  EXPECT_EQ(file[0].ports, "ALL::src");
  EXPECT_EQ(file[1].ports, "ALL::dest");
}

// Router saves refused before anything is staged: the staging directory is
// still cleared, and a check that answered itself is answered once more.
struct RouterRefusedCase {
  const char* name;
  const char* params;
  const char* topology;  // value of net_topology; nullptr: the key is missing
  const char* fail;      // failing call, or nullptr
  int code;
  int answers;
  std::vector<std::string> logs;  // empty: not checked (the validator's own lines)
};

const RouterRefusedCase kRouterRefused[] = {
    {"NoTopologyKey",
     R"({"direction":"upload"})",
     nullptr,
     nullptr,
     1200,
     1,
     {"Failed to get [net_topology] info from [/etc/orviinfo.conf], or key not found"}},
    {"NotRouter",
     R"({"direction":"upload"})",
     "bridge",
     nullptr,
     1200,
     1,
     {"QS is not in router mode"}},
    {"NoDirection",
     R"({"rules":[]})",
     "router",
     nullptr,
     1200,
     1,
     {"Bad parameters", "Unknown direction "}},
    {"DirectionNotText",
     R"({"direction":["upload"]})",
     "router",
     nullptr,
     1200,
     1,
     {"Bad parameters", "Unknown direction [\"upload\"]"}},
    {"DirectionCapitalised",
     R"({"direction":"Upload"})",
     "router",
     nullptr,
     1200,
     1,
     {"Unknown direction Upload"}},
    {"BridgesUnknown",
     R"({"direction":"download"})",
     "router",
     "OLIBNetEnumBridge",
     1200,
     1,
     {"Failed to OLIBNetEnumBridge [0x0201 OLIBNetEnumBridge:1]", "Bad parameters"}},
    {"NoAdapterList",
     R"({"direction":"upload"})",
     "router",
     "OLIBCSzListAlloc",
     1201,
     1,
     {"Failed to OLIBCSzListAlloc [0x0201 OLIBCSzListAlloc:1]"}},
    {"UploadNotListed",
     R"({"direction":"upload"})",
     "router",
     "OLIBCSzListPush",
     1201,
     1,
     {"Failed to OLIBCSzListPush [0x0201 OLIBCSzListPush:1]"}},
    {"RulesNotArray",
     R"({"direction":"upload","rules":"x"})",
     "router",
     nullptr,
     114,
     2,
     {"Required parameter error![0x0000 :0]"}},
    {"BadRule",
     R"({"direction":"download","rules":[{"enabled":1}]})",
     "router",
     nullptr,
     101,
     2,
     {}},
};

class RouterRefused : public SaveTest, public ::testing::WithParamInterface<RouterRefusedCase> {};

TEST_P(RouterRefused, StagesNothing) {
  const RouterRefusedCase& c = GetParam();
  if (c.topology == nullptr) {
    fake::S().keys.erase("net_topology");
  } else {
    fake::S().keys["net_topology"] = c.topology;
  }
  if (c.fail != nullptr) fake::FailCall(c.fail);
  RouterSave(c.params);
  EXPECT_EQ(resp_.AnswerCount(), c.answers);
  EXPECT_FALSE(resp_.Success());
  EXPECT_EQ(resp_.ErrorCode(), c.code);
  EXPECT_THAT(Steps(), ElementsAre(kRmTmp));
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleOpen"), IsEmpty());
  if (!c.logs.empty()) {
    EXPECT_EQ(fake::LogBodies(), c.logs);
  }
  ExpectLive(Live::kOld, {"upload"});
}

INSTANTIATE_TEST_SUITE_P(Cases, RouterRefused, ::testing::ValuesIn(kRouterRefused),
                         [](const ::testing::TestParamInfo<RouterRefusedCase>& info) {
                           return std::string(info.param.name);
                         });

TEST_F(SaveTest, UploadWritesOneFile) {
  RouterSave(std::string(R"({"direction":"upload","rules":)") + kTwoRules + "}");
  ASSERT_TRUE(resp_.Success());
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleOpen"),
              ElementsAre("ORVIFwTcRuleOpen(/etc/tc_tmp,upload)"));
  ExpectLive(Live::kNew, {"upload"});
}

TEST_F(SaveTest, DownloadWritesEveryBridgeButGbr) {
  RouterSave(std::string(R"({"direction":"download","rules":)") + kTwoRules + "}");
  ASSERT_TRUE(resp_.Success());
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleOpen"), ElementsAre("ORVIFwTcRuleOpen(/etc/tc_tmp,br0)",
                                                             "ORVIFwTcRuleOpen(/etc/tc_tmp,br1)"));
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleReload"), ElementsAre(kReloadTmp));
  ExpectLive(Live::kNew, {"br0", "br1"});
  EXPECT_EQ(fake::S().dirs["/etc/tc"]["gbr"].front().ports, "ALL::src");
}

TEST_F(SaveTest, DownloadWithOnlyGbrReappliesUnchangedRules) {
  fake::S().bridges = {"GBR"};
  RouterSave(std::string(R"({"direction":"download","rules":)") + kTwoRules + "}");
  ASSERT_TRUE(resp_.Success());
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleOpen"), IsEmpty());
  EXPECT_EQ(Steps(), (std::vector<std::string>{kRmTmp, kCp, kReloadTmp, kRmLive, kMv, kRmTmp}));
  ExpectLive(Live::kOld, {});
}

TEST_F(SaveTest, DownloadWithoutRulesEmptiesEveryBridge) {
  RouterSave(R"({"direction":"download"})");
  ASSERT_TRUE(resp_.Success());
  EXPECT_THAT(fake::S().dirs["/etc/tc"]["br0"], IsEmpty());
  EXPECT_THAT(fake::S().dirs["/etc/tc"]["br1"], IsEmpty());
  EXPECT_EQ(fake::S().dirs["/etc/tc"]["gbr"].size(), 1u);
}

TEST_F(SaveTest, LaterBridgeDumpFailureStopsTheWalk) {
  fake::FailCall("ORVIFwTcRuleOpen", 2);
  fake::S().bridges = {"br0", "br1", "br2"};
  RouterSave(std::string(R"({"direction":"download","rules":)") + kTwoRules + "}");
  EXPECT_EQ(resp_.AnswerCount(), 1);
  EXPECT_EQ(resp_.ErrorCode(), 1201);
  EXPECT_THAT(fake::CallsOf("ORVIFwTcRuleOpen"), ElementsAre("ORVIFwTcRuleOpen(/etc/tc_tmp,br0)",
                                                             "ORVIFwTcRuleOpen(/etc/tc_tmp,br1)"));
  EXPECT_EQ(Steps(), (std::vector<std::string>{kRmTmp, kCp, kRmTmp}));
  ExpectLive(Live::kOld, {"br1", "br2"});
  EXPECT_EQ(fake::S().dirs.count("/etc/tc_tmp"), 0u);
}

}  // namespace
