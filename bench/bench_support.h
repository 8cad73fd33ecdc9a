// Shared pieces of the request benchmarks: the rule sets they send or store,
// and a failure flag that makes a benchmark program exit non-zero when any
// benchmark measured something other than the path it claims to measure.
#ifndef TC_BENCH_SUPPORT_H
#define TC_BENCH_SUPPORT_H

#include <string>
#include <vector>

#include <benchmark/benchmark.h>
#include <json/json.h>

namespace tcbench {

extern const char kRulesApi[];
extern const char kRouterRulesApi[];

// `count` valid rule objects as a save request carries them: SELF port lists
// of `portsPerRule` distinct destination ports each, distinct sources, rates
// that fit a 1000 Mbit/s link together.
Json::Value RuleSet(int count, int portsPerRule);

// Writes `count` stored rules for `adapter` into the rule directory `dir`
// (an appliance path such as "/etc/tc", resolved under ORVI_ROOT) through the
// rule store, so a load reads exactly what a save would have left. False with
// a message in *error when the store refuses.
bool StoreRules(const char* dir, const char* adapter, int count, int portsPerRule,
                std::string* error);

// Marks the benchmark failed (reported in its row) and the program as failed.
void Fail(benchmark::State& state, const std::string& why);
bool AnyFailed();

// Value at quantile q (0 < q <= 1) of the samples by the nearest-rank method;
// sorts the samples. 0 for no samples.
double Percentile(std::vector<double>& samples, double q);

// Compact one-line JSON text.
std::string Compact(const Json::Value& value);

}  // namespace tcbench

// main() of a benchmark program: the usual flags, exit status 1 when a
// benchmark failed.
#define TC_BENCHMARK_MAIN()                                           \
  int main(int argc, char** argv) {                                   \
    benchmark::Initialize(&argc, argv);                               \
    if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 2; \
    benchmark::RunSpecifiedBenchmarks();                              \
    benchmark::Shutdown();                                            \
    return tcbench::AnyFailed() ? 1 : 0;                              \
  }                                                                   \
  int main(int, char**)

#endif
