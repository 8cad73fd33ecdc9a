// Load and save of the Rules API in process: the module's shared library,
// called through its method table as the host calls it, against the real
// platform libraries in a temporary demo appliance root.
#include <errno.h>
#include <signal.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <vector>

#include <benchmark/benchmark.h>
#include <json/json.h>

#include "bench_support.h"
#include "orvi_api.h"
#include "tc_support.h"

extern char** environ;

namespace {

using Clock = std::chrono::steady_clock;

const int kRules = 100;
const int kPortsPerRule = 10;

APIHandler FindHandler(const char* api, const char* method) {
  for (const APITableEntry* row = GetAPITable(); row != nullptr && row->api != nullptr; ++row) {
    if (std::string(row->api) == api && row->version == 1 && std::string(row->method) == method) {
      return row->handler;
    }
  }
  return nullptr;
}

// A demo appliance root that the platform libraries of this process use.
struct Appliance {
  Appliance() : root(tcsupport::MakeDemoRoot()) {
    setenv("ORVI_ROOT", root.path().c_str(), 1);
    // Plan mode: the reload writes its batches under run/tc and touches no device.
    setenv("ORVI_TC_APPLY", "plan", 1);
  }
  ~Appliance() { unsetenv("ORVI_ROOT"); }
  tcsupport::TempDir root;
};

// Runs a program as the module's program runs are made (posix_spawn, signal
// mask cleared, default dispositions) and waits for it; true when it exits 0.
bool RunProgram(const std::vector<std::string>& args) {
  std::vector<char*> argv;
  std::vector<std::string> copy(args);
  for (std::string& a : copy) argv.push_back(&a[0]);
  argv.push_back(nullptr);

  posix_spawnattr_t attr;
  if (posix_spawnattr_init(&attr) != 0) return false;
  sigset_t none;
  sigset_t all;
  sigemptyset(&none);
  sigfillset(&all);
  sigdelset(&all, SIGKILL);
  sigdelset(&all, SIGSTOP);
  pid_t pid = -1;
  bool spawned =
      posix_spawnattr_setsigmask(&attr, &none) == 0 &&
      posix_spawnattr_setsigdefault(&attr, &all) == 0 &&
      posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF) == 0 &&
      posix_spawn(&pid, argv[0], nullptr, &attr, argv.data(), environ) == 0;
  posix_spawnattr_destroy(&attr);
  if (!spawned) return false;
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) return false;
  }
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// The program runs of one save, in its order, on the same directories: the
// staging copy (remove, copy), the commit (remove live, move staging in) and
// the final removal of the staging directory.
bool RunSavePrograms(const std::string& root) {
  const std::string live = root + "/etc/tc";
  const std::string staging = root + "/etc/tc_tmp";
  return RunProgram({"/bin/rm", "-rf", staging}) && RunProgram({"/bin/cp", "-rf", live, staging}) &&
         RunProgram({"/bin/rm", "-rf", live}) && RunProgram({"/bin/mv", "-f", staging, live}) &&
         RunProgram({"/bin/rm", "-rf", staging});
}

double Micros(Clock::duration d) { return std::chrono::duration<double, std::micro>(d).count(); }

// Rules load of an adapter with 100 stored rules.
void BM_RulesLoad100(benchmark::State& state) {
  Appliance appliance;
  std::string error;
  if (!tcbench::StoreRules("/etc/tc", "eth0", kRules, kPortsPerRule, &error)) {
    tcbench::Fail(state, error);
    return;
  }
  APIHandler load = FindHandler(tcbench::kRulesApi, "load");
  if (load == nullptr) {
    tcbench::Fail(state, "the module has no Rules load");
    return;
  }
  Json::Value params(Json::objectValue);
  params["adapter"] = "eth0";
  ORVI::APIRequest request(params);
  {
    ORVI::APIResponse response;
    load(&request, &response);
    const Json::Value& data = response.Data();
    if (!response.Success() || !data.isObject() || data["total"] != kRules ||
        data["rules"].size() != kRules) {
      tcbench::Fail(state, "load did not answer the 100 stored rules: " +
                               tcbench::Compact(response.ToJson()).substr(0, 200));
      return;
    }
  }
  for (auto _ : state) {
    ORVI::APIResponse response;
    load(&request, &response);
    if (!response.Success()) {
      tcbench::Fail(state, "load failed");
      break;
    }
    benchmark::DoNotOptimize(response);
  }
}
BENCHMARK(BM_RulesLoad100)->Unit(benchmark::kMicrosecond);

// Rules save of 100 rules, interleaved with the bare program runs the save
// makes, so both see the same machine load. The reported time is the save's;
// the counters give the programs' share and the module's own part, and how
// much of that own part is the durable commit of one 100-rule file (fsync of
// the file and its directory), timed alone through the rule store as well.
void BM_RulesSave100(benchmark::State& state) {
  Appliance appliance;
  APIHandler save = FindHandler(tcbench::kRulesApi, "save");
  if (save == nullptr) {
    tcbench::Fail(state, "the module has no Rules save");
    return;
  }
  Json::Value params(Json::objectValue);
  params["adapter"] = "eth0";
  params["rules"] = tcbench::RuleSet(kRules, kPortsPerRule);
  ORVI::APIRequest request(params);
  // The first save leaves the live rule file that every later one copies.
  {
    ORVI::APIResponse response;
    save(&request, &response);
    if (!response.Success()) {
      tcbench::Fail(state, "save failed: " + tcbench::Compact(response.ToJson()).substr(0, 200));
      return;
    }
    if (!tcsupport::PathExists(appliance.root.Join("etc/tc/eth0.rules")) ||
        !tcsupport::PathExists(appliance.root.Join("run/tc/eth0.tc"))) {
      tcbench::Fail(state, "save answered success but left no rule file or plan");
      return;
    }
  }
  const std::string scratch = appliance.root.Join("etc/tc_bench");
  if (mkdir(scratch.c_str(), 0755) != 0) {
    tcbench::Fail(state, "cannot create " + scratch);
    return;
  }
  double saveMicros = 0;
  double programMicros = 0;
  double durableMicros = 0;
  for (auto _ : state) {
    Clock::time_point t0 = Clock::now();
    ORVI::APIResponse response;
    save(&request, &response);
    Clock::time_point t1 = Clock::now();
    if (!response.Success()) {
      tcbench::Fail(state, "save failed");
      break;
    }
    Clock::time_point t2 = Clock::now();
    bool ran = RunSavePrograms(appliance.root.path());
    Clock::time_point t3 = Clock::now();
    if (!ran) {
      tcbench::Fail(state, "a bare program run failed");
      break;
    }
    std::string error;
    bool stored = tcbench::StoreRules("/etc/tc_bench", "eth0", kRules, kPortsPerRule, &error);
    Clock::time_point t4 = Clock::now();
    if (!stored) {
      tcbench::Fail(state, error);
      break;
    }
    state.SetIterationTime(std::chrono::duration<double>(t1 - t0).count());
    saveMicros += Micros(t1 - t0);
    programMicros += Micros(t3 - t2);
    durableMicros += Micros(t4 - t3);
  }
  if (saveMicros <= 0) return;
  state.counters["programs_us"] =
      benchmark::Counter(programMicros, benchmark::Counter::kAvgIterations);
  state.counters["own_us"] =
      benchmark::Counter(saveMicros - programMicros, benchmark::Counter::kAvgIterations);
  state.counters["own_pct"] = 100.0 * (saveMicros - programMicros) / saveMicros;
  state.counters["file_us"] = benchmark::Counter(durableMicros, benchmark::Counter::kAvgIterations);
  // The own part without that one durable file write.
  state.counters["own_nofile_pct"] =
      100.0 * (saveMicros - programMicros - durableMicros) / saveMicros;
}
BENCHMARK(BM_RulesSave100)->UseManualTime()->Unit(benchmark::kMicrosecond);

// The program runs of a save alone, as their own row.
void BM_SavePrograms(benchmark::State& state) {
  Appliance appliance;
  std::string error;
  if (!tcbench::StoreRules("/etc/tc", "eth0", kRules, kPortsPerRule, &error)) {
    tcbench::Fail(state, error);
    return;
  }
  for (auto _ : state) {
    if (!RunSavePrograms(appliance.root.path())) {
      tcbench::Fail(state, "a bare program run failed");
      break;
    }
  }
}
BENCHMARK(BM_SavePrograms)->UseRealTime()->Unit(benchmark::kMicrosecond);

}  // namespace

TC_BENCHMARK_MAIN();
