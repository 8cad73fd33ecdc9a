// Saves and loads from several threads of one process, through the module's
// entry table and the real platform in a demo appliance root.
#include <stdlib.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "orvi_api.h"
#include "tc_support.h"

namespace {

const APITableEntry* Entry(const char* api, const char* method) {
  for (const APITableEntry* e = GetAPITable(); e->api != nullptr; ++e) {
    if (std::string(e->api) == api && std::string(e->method) == method) return e;
  }
  return nullptr;
}

// Loads answer rates as unsigned numbers, which JsonCpp never finds equal to
// signed ones: compare the text.
std::string Text(const Json::Value& value) { return tcsupport::ToCompactJson(value); }

// The one rule that round `round` of `adapter` saves; loads give it back as is.
Json::Value RuleOf(int adapter, int round) {
  Json::Value rule(Json::objectValue);
  rule["enabled"] = true;
  rule["port_type"] = "SELF";
  rule["port_num"] = std::to_string(1000 + round);
  rule["port_direction"] = "dest";
  rule["protocol"] = "tcp";
  rule["minrate"] = 10 + round;
  rule["maxrate"] = 1000 + adapter;
  rule["source"] = "10.0." + std::to_string(adapter) + "." + std::to_string(round);
  rule["ip_direction"] = "src";
  return rule;
}

class ConcurrentSaves : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(setenv("ORVI_ROOT", root_.path().c_str(), 1), 0); }
  void TearDown() override { unsetenv("ORVI_ROOT"); }

  tcsupport::TempDir root_ = tcsupport::MakeDemoRoot();
};

// What one thread saves to: an adapter, or the router's upload rules.
struct Target {
  const char* api;
  const char* key;
  const char* value;
};

const char kRules[] = "ORVI.Core.Network.TrafficControl.Rules";
const char kRouterRules[] = "ORVI.Core.Network.TrafficControl.RouterRules";

TEST_F(ConcurrentSaves, EveryAdapterKeepsItsOwnRules) {
  const std::vector<Target> targets = {
      {kRules, "adapter", "eth0"},
      {kRules, "adapter", "eth1"},
      {kRules, "adapter", "wan0"},
      {kRules, "adapter", "br0"},
      {kRules, "adapter", "br1"},
      {kRules, "adapter", "gbr"},
      {kRouterRules, "direction", "upload"},
  };
  const int kRounds = 6;
  for (const Target& t : targets) {
    ASSERT_NE(Entry(t.api, "save"), nullptr) << t.api;
    ASSERT_NE(Entry(t.api, "load"), nullptr) << t.api;
  }

  std::atomic<int> failedSaves{0};
  std::atomic<int> failedLoads{0};
  std::atomic<int> wrongLoads{0};
  std::atomic<int> loads{0};
  std::atomic<bool> saving{true};

  auto call = [](const Target& t, const char* method, Json::Value params) {
    params[t.key] = t.value;
    ORVI::APIRequest req(params);
    ORVI::APIResponse resp;
    Entry(t.api, method)->handler(&req, &resp);
    return resp;
  };
  auto loadOf = [&](const Target& t, Json::Value* rules) {
    ORVI::APIResponse resp = call(t, "load", Json::Value(Json::objectValue));
    ++loads;
    if (!resp.Success() || resp.AnswerCount() != 1) {
      ++failedLoads;
      return false;
    }
    *rules = resp.Data()["rules"];
    return true;
  };

  std::vector<std::thread> threads;
  for (int a = 0; a < static_cast<int>(targets.size()); ++a) {
    threads.emplace_back([&, a] {
      for (int round = 0; round < kRounds; ++round) {
        Json::Value params(Json::objectValue);
        params["rules"].append(RuleOf(a, round));
        ORVI::APIResponse resp = call(targets[a], "save", params);
        if (!resp.Success() || resp.AnswerCount() != 1) ++failedSaves;
        // Only this thread writes these rules: its last save must be what
        // a load gives back, whatever the others are doing.
        Json::Value rules;
        if (loadOf(targets[a], &rules) && Text(rules) != Text(params["rules"])) ++wrongLoads;
      }
    });
  }
  std::thread reader([&] {
    for (size_t i = 0; saving; ++i) {
      Json::Value rules;
      loadOf(targets[i % targets.size()], &rules);
    }
  });
  for (auto& t : threads) t.join();
  saving = false;
  reader.join();

  EXPECT_EQ(failedSaves, 0);
  EXPECT_EQ(failedLoads, 0) << "of " << loads << " loads";
  EXPECT_EQ(wrongLoads, 0);
  for (int a = 0; a < static_cast<int>(targets.size()); ++a) {
    Json::Value rules;
    ASSERT_TRUE(loadOf(targets[a], &rules)) << targets[a].value;
    Json::Value expected(Json::arrayValue);
    expected.append(RuleOf(a, kRounds - 1));
    EXPECT_EQ(Text(rules), Text(expected)) << targets[a].value;
  }
  EXPECT_FALSE(tcsupport::PathExists(root_.Join("etc/tc_tmp")));
}

}  // namespace
