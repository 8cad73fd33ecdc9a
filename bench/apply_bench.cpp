// Applying 100 rules to one device three ways, on a veth device in a network
// namespace of the benchmark's own (root only):
//   OneBatch           tcgen::Apply in kernel mode: one `tc -batch -`
//   OneProcessPerCmd   the same commands, one `tc` process each
//   BareBatchFile      the same batch from a file with a bare `tc -batch FILE`
// Prints the medians and the ratios after the runs.
#include <fcntl.h>
#include <sched.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <deque>
#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include <benchmark/benchmark.h>

#include "tcgen.h"

extern char** environ;

namespace {

const char kDev[] = "bench0";

std::string First(const std::vector<const char*>& paths) {
  for (const char* p : paths) {
    if (access(p, X_OK) == 0) return p;
  }
  return "";
}

// Runs argv with posix_spawn, output discarded; the exit status, or -1.
int Spawn(const std::vector<std::string>& args) {
  std::vector<char*> argv;
  for (const auto& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  posix_spawn_file_actions_t fa;
  posix_spawn_file_actions_init(&fa);
  posix_spawn_file_actions_addopen(&fa, 1, "/dev/null", O_WRONLY, 0);
  posix_spawn_file_actions_addopen(&fa, 2, "/dev/null", O_WRONLY, 0);
  pid_t pid = -1;
  int rc = posix_spawn(&pid, argv[0], &fa, nullptr, argv.data(), environ);
  posix_spawn_file_actions_destroy(&fa);
  if (rc != 0) return -1;
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) return -1;
  }
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

struct Env {
  std::string ip, tc;
  std::string ns;
  std::string dir;    // temporary appliance root and batch file
  std::string batch;  // the 100-rule batch
  std::string batchFile;
  std::vector<std::vector<std::string>> commands;  // one tc argv per batch line
  bool inNs = false;
  int originalNs = -1;
};

Env* gEnv = nullptr;

// 100 enabled rules, one IPv4 filter each: distinct hosts, ports and rates.
std::string HundredRuleBatch() {
  std::deque<TcRule> rules;
  std::deque<std::string> ports;
  tcgen::DeviceRules dev;
  dev.device = kDev;
  dev.upperKBps = 1250000;
  for (int i = 0; i < 100; ++i) {
    rules.emplace_back();
    TcRule& r = rules.back();
    std::memset(&r, 0, sizeof r);
    r.id = i + 1;
    r.enabled = 1;
    std::snprintf(r.source, sizeof r.source, "10.0.%d.%d", i / 50, i % 50 + 1);
    ports.push_back("SELF:" + std::to_string(2000 + i) + ":dest");
    r.ports = &ports.back()[0];
    r.protocol = ORVI_FW_PROTO_TCP;
    r.minrate = 100 + i;
    r.maxrate = 1000 + 10 * i;
    r.ipDirection = 0;
    dev.rules.push_back(&r);
  }
  if (tcgen::Check(dev) != 0) return "";
  return tcgen::Generate(dev);
}

bool SetUpEnv(Env* env, std::string* why) {
  if (geteuid() != 0) return *why = "needs root for a network namespace", false;
  env->ip = First({"/usr/sbin/ip", "/sbin/ip", "/bin/ip"});
  env->tc = First({"/usr/sbin/tc", "/sbin/tc"});
  if (env->ip.empty() || env->tc.empty()) return *why = "ip or tc (iproute2) is missing", false;

  std::string tmpl = (std::filesystem::temp_directory_path() / "apply-bench-XXXXXX").string();
  if (mkdtemp(&tmpl[0]) == nullptr) return *why = "mkdtemp failed", false;
  env->dir = tmpl;
  setenv("ORVI_ROOT", env->dir.c_str(), 1);

  env->ns = "tcb-" + std::to_string(getpid());
  if (Spawn({env->ip, "netns", "add", env->ns}) != 0) return *why = "ip netns add failed", false;
  env->inNs = true;
  if (Spawn({env->ip, "-n", env->ns, "link", "add", kDev, "type", "veth", "peer", "name",
             "bench1"}) != 0 ||
      Spawn({env->ip, "-n", env->ns, "link", "set", kDev, "up"}) != 0)
    return *why = "cannot create a veth device in the namespace", false;

  // The benchmarks run on this thread: it and every tc it starts live in the namespace.
  env->originalNs = open("/proc/thread-self/ns/net", O_RDONLY | O_CLOEXEC);
  int target = open(("/run/netns/" + env->ns).c_str(), O_RDONLY | O_CLOEXEC);
  bool entered = env->originalNs >= 0 && target >= 0 && setns(target, CLONE_NEWNET) == 0;
  if (target >= 0) close(target);
  if (!entered) return *why = "cannot enter the namespace", false;

  env->batch = HundredRuleBatch();
  if (env->batch.empty()) return *why = "the rule set does not pass Check", false;
  env->batchFile = env->dir + "/bench0.batch";
  std::ofstream(env->batchFile) << env->batch;
  std::istringstream lines(env->batch);
  std::string line;
  while (std::getline(lines, line)) {
    std::vector<std::string> argv{env->tc};
    std::istringstream words(line);
    std::string w;
    while (words >> w) argv.push_back(w);
    env->commands.push_back(argv);
  }
  return true;
}

void TearDownEnv(Env* env) {
  if (env->originalNs >= 0) {
    if (setns(env->originalNs, CLONE_NEWNET) != 0) std::perror("setns");
    close(env->originalNs);
  }
  if (env->inNs) Spawn({env->ip, "netns", "del", env->ns});
  if (!env->dir.empty()) {
    std::error_code ec;
    std::filesystem::remove_all(env->dir, ec);
  }
  unsetenv("ORVI_ROOT");
}

void OneBatch(benchmark::State& state) {
  for (auto _ : state) {
    if (tcgen::Apply(kDev, gEnv->batch, tcgen::ApplyMode::kKernel) != 0) {
      state.SkipWithError("tc refused the batch");
      break;
    }
  }
  state.counters["commands"] = static_cast<double>(gEnv->commands.size());
}

void OneProcessPerCmd(benchmark::State& state) {
  for (auto _ : state) {
    for (const auto& argv : gEnv->commands) {
      if (Spawn(argv) != 0) {
        state.SkipWithError("a tc command failed");
        return;
      }
    }
  }
  state.counters["commands"] = static_cast<double>(gEnv->commands.size());
}

void BareBatchFile(benchmark::State& state) {
  for (auto _ : state) {
    if (Spawn({gEnv->tc, "-batch", gEnv->batchFile}) != 0) {
      state.SkipWithError("tc -batch FILE failed");
      break;
    }
  }
}

BENCHMARK(OneBatch)->Unit(benchmark::kMillisecond)->UseRealTime()->Repetitions(7);
BENCHMARK(OneProcessPerCmd)
    ->Unit(benchmark::kMillisecond)
    ->UseRealTime()
    ->Repetitions(5)
    ->Iterations(1);
BENCHMARK(BareBatchFile)->Unit(benchmark::kMillisecond)->UseRealTime()->Repetitions(7);

// Console output plus the medians, for the ratios printed at the end.
class MedianReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& r : runs) {
      if (r.run_type == Run::RT_Aggregate && r.aggregate_name == "median" && !r.error_occurred) {
        medians[r.run_name.function_name] = r.GetAdjustedRealTime();
      }
    }
    ConsoleReporter::ReportRuns(runs);
  }
  std::map<std::string, double> medians;  // milliseconds
};

}  // namespace

int main(int argc, char** argv) {
  // Interleaved repetitions by default: run one after the other, the three
  // ways would each meet a different machine load and kernel clean-up backlog.
  static char interleave[] = "--benchmark_enable_random_interleaving=true";
  std::vector<char*> args(argv, argv + argc);
  args.insert(args.begin() + 1, interleave);  // a later flag of the caller still wins
  int n = static_cast<int>(args.size());
  args.push_back(nullptr);
  benchmark::Initialize(&n, args.data());
  if (benchmark::ReportUnrecognizedArguments(n, args.data())) return 1;
  Env env;
  gEnv = &env;
  std::string why;
  if (!SetUpEnv(&env, &why)) {
    std::printf("SKIPPED: apply_bench: %s\n", why.c_str());
    TearDownEnv(&env);
    return 0;
  }
  MedianReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  TearDownEnv(&env);

  const auto& m = reporter.medians;
  auto get = [&](const char* name) {
    auto it = m.find(name);
    return it == m.end() ? 0.0 : it->second;
  };
  const double batch = get("OneBatch"), perCmd = get("OneProcessPerCmd"),
               bare = get("BareBatchFile");
  std::printf(
      "\n100 rules, %zu tc commands; medians: one batch %.2f ms, one process per "
      "command %.2f ms, bare tc -batch FILE %.2f ms\n",
      env.commands.size(), batch, perCmd, bare);
  if (batch > 0 && perCmd > 0) {
    std::printf("one process per command / one batch = %.1fx (target: at least 50x)\n",
                perCmd / batch);
  }
  if (batch > 0 && bare > 0) {
    std::printf("one batch / bare tc -batch FILE = %.2fx (target: at most 1.3x)\n", batch / bare);
  }
  return 0;
}
