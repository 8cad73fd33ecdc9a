// The rule validator of a save over 100 rules, on the module's own objects
// (the handler class is not exported by the shared library).
#include <chrono>

#include <benchmark/benchmark.h>
#include <json/json.h>

#include "ORVI.Core.Network.TrafficControl.h"
#include "bench_support.h"
#include "orvi_api.h"

namespace {

using Clock = std::chrono::steady_clock;

const int kRules = 100;
const int kPortsPerRule = 10;

// The validator rewrites the rules in place, so each run gets a fresh copy;
// only the validator itself is timed (the copy has its own row below).
void BM_RuleValidator100(benchmark::State& state) {
  const Json::Value rules = tcbench::RuleSet(kRules, kPortsPerRule);
  ORVI::APIRequest request;
  ORVI::APIResponse response;
  TCHandler handler(&request, &response);
  {
    Json::Value copy(rules);
    if (handler.RuleValidator(copy) < 0 || response.Answered()) {
      tcbench::Fail(state, "the validator refused the rule set");
      return;
    }
    // A normalised list that differs from the input would mean the rules are
    // not the simple case this row claims to measure.
    if (copy[0]["port_num"] != rules[0]["port_num"]) {
      tcbench::Fail(state, "unexpected normalisation: " + copy[0]["port_num"].asString());
      return;
    }
  }
  for (auto _ : state) {
    Json::Value copy(rules);
    Clock::time_point t0 = Clock::now();
    int result = handler.RuleValidator(copy);
    Clock::time_point t1 = Clock::now();
    if (result < 0) {
      tcbench::Fail(state, "the validator refused the rule set");
      break;
    }
    state.SetIterationTime(std::chrono::duration<double>(t1 - t0).count());
  }
}
BENCHMARK(BM_RuleValidator100)->UseManualTime()->Unit(benchmark::kMicrosecond);

// What the fresh copy of the 100 rules costs (made and released), which the
// row above leaves out.
void BM_RuleSetCopy100(benchmark::State& state) {
  const Json::Value rules = tcbench::RuleSet(kRules, kPortsPerRule);
  for (auto _ : state) {
    Json::Value copy(rules);
    benchmark::DoNotOptimize(copy);
  }
}
BENCHMARK(BM_RuleSetCopy100)->Unit(benchmark::kMicrosecond);

}  // namespace

TC_BENCHMARK_MAIN();
