// Requests through `tcapi serve` over loopback HTTP: the latency of one load
// and one save (median and 99th percentile of the samples), and the server's
// peak resident size after many mixed requests against after a few.
//
// Every request goes to 127.0.0.1 only, on a fresh connection (the client does
// not keep connections alive), with connect and read timeouts; every
// benchmark sends a fixed number of requests and gives up past a deadline.
#include <signal.h>
#include <stdlib.h>

#include <chrono>
#include <fstream>
#include <memory>
#include <sstream>
#include <string>
#include <vector>

#include <benchmark/benchmark.h>
#include <httplib.h>
#include <json/json.h>

#include "bench_support.h"
#include "tc_support.h"

namespace {

using Clock = std::chrono::steady_clock;

const int kRules = 100;
const int kPortsPerRule = 10;
const int kLoadRequests = 1000;
const int kSaveRequests = 200;
const int kFewRequests = 100;
const int kManyRequests = 10000;
const std::chrono::seconds kLatencyDeadline(300);
const std::chrono::seconds kMemoryDeadline(900);

const char kListening[] = "listening on http://127.0.0.1:";

std::string Path(const char* api, const char* method) {
  return std::string("/api/") + api + "/1/" + method;
}

// `tcapi serve` on a free loopback port in a fresh demo appliance root.
class Server {
 public:
  Server()
      : root_(tcsupport::MakeDemoRoot()),
        process_(new tcsupport::Background(
            {tcsupport::TcapiPath(), "serve", "--listen", "127.0.0.1:0", "--root", root_.path()},
            {{"ORVI_TC_APPLY", "plan"}})) {}
  ~Server() { process_->Stop(SIGTERM, std::chrono::seconds(10)); }
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  // Waits for the server to listen; false with the reason when it does not.
  bool Start(std::string* error) {
    // The line is complete once the module path that follows the port shows.
    if (!process_->WaitForOutput(" (module ", std::chrono::seconds(20))) {
      *error = "tcapi serve did not start: " + process_->Err().substr(0, 300);
      return false;
    }
    const std::string out = process_->Out();
    size_t at = out.find(kListening);
    if (at == std::string::npos) {
      *error = "no listening line in: " + out.substr(0, 300);
      return false;
    }
    port_ = atoi(out.c_str() + at + sizeof kListening - 1);
    if (port_ <= 0 || port_ > 65535) {
      *error = "no port in: " + out.substr(0, 300);
      return false;
    }
    client_.reset(new httplib::Client("127.0.0.1", port_));
    client_->set_keep_alive(false);
    client_->set_connection_timeout(5, 0);
    client_->set_read_timeout(30, 0);
    client_->set_write_timeout(30, 0);
    return true;
  }

  // One POST; the HTTP status (0 when no answer came) and the body.
  int Post(const std::string& path, const std::string& body, std::string* answer) {
    httplib::Result res = client_->Post(path.c_str(), body, "application/json");
    if (!res) return 0;
    *answer = res->body;
    return res->status;
  }

  // Peak resident size of the server so far, in KiB; -1 when unreadable.
  long PeakResidentKiB() {
    std::ifstream status("/proc/" + std::to_string(process_->pid()) + "/status");
    std::string line;
    while (std::getline(status, line)) {
      if (line.compare(0, 6, "VmHWM:") == 0) return atol(line.c_str() + 6);
    }
    return -1;
  }

  bool Running() { return process_->Running(); }

 private:
  tcsupport::TempDir root_;
  std::unique_ptr<tcsupport::Background> process_;
  int port_ = 0;
  std::unique_ptr<httplib::Client> client_;
};

// The module's answer in a 200 reply: "ok" for success, the code for an API
// error, "" for anything else.
std::string Outcome(int status, const std::string& body) {
  if (status != 200) return "";
  Json::Value answer;
  if (!tcsupport::ParseJson(body, &answer) || !answer.isObject()) return "";
  if (answer["success"] == true) return "ok";
  const Json::Value& code = answer["error"]["code"];
  return code.isInt() ? std::to_string(code.asInt()) : "";
}

std::string SaveBody(const char* key, const char* value, const Json::Value& rules) {
  Json::Value params(Json::objectValue);
  params[key] = value;
  params["rules"] = rules;
  return tcbench::Compact(params);
}

std::string AdapterBody(const char* adapter) {
  Json::Value params(Json::objectValue);
  params["adapter"] = adapter;
  return tcbench::Compact(params);
}

// Sends `count` copies of one request, one sample per request; the rows show
// the mean (time), median and 99th percentile.
void Latency(benchmark::State& state, Server& server, const std::string& path,
             const std::string& body, int count) {
  std::vector<double> samples;
  samples.reserve(static_cast<size_t>(count));
  const Clock::time_point deadline = Clock::now() + kLatencyDeadline;
  for (auto _ : state) {
    std::string answer;
    Clock::time_point t0 = Clock::now();
    int status = server.Post(path, body, &answer);
    Clock::time_point t1 = Clock::now();
    if (Outcome(status, answer) != "ok") {
      tcbench::Fail(state,
                    "request failed: HTTP " + std::to_string(status) + " " + answer.substr(0, 200));
      break;
    }
    if (t1 > deadline) {
      tcbench::Fail(state, "gave up: over the deadline");
      break;
    }
    std::chrono::duration<double> took = t1 - t0;
    state.SetIterationTime(took.count());
    samples.push_back(took.count() * 1e6);
  }
  if (samples.empty()) return;
  state.counters["p50_us"] = tcbench::Percentile(samples, 0.50);
  state.counters["p99_us"] = tcbench::Percentile(samples, 0.99);
}

bool StartWithRules(benchmark::State& state, Server& server) {
  std::string error;
  if (!server.Start(&error)) {
    tcbench::Fail(state, error);
    return false;
  }
  std::string answer;
  int status =
      server.Post(Path(tcbench::kRulesApi, "save"),
                  SaveBody("adapter", "eth0", tcbench::RuleSet(kRules, kPortsPerRule)), &answer);
  if (Outcome(status, answer) != "ok") {
    tcbench::Fail(state, "the first save failed: HTTP " + std::to_string(status) + " " +
                             answer.substr(0, 200));
    return false;
  }
  return true;
}

// Rules load of 100 stored rules.
void BM_HttpRulesLoad100(benchmark::State& state) {
  Server server;
  if (!StartWithRules(state, server)) return;
  Latency(state, server, Path(tcbench::kRulesApi, "load"), AdapterBody("eth0"), kLoadRequests);
}
BENCHMARK(BM_HttpRulesLoad100)
    ->Iterations(kLoadRequests)
    ->UseManualTime()
    ->Unit(benchmark::kMicrosecond);

// Rules save of 100 rules.
void BM_HttpRulesSave100(benchmark::State& state) {
  Server server;
  if (!StartWithRules(state, server)) return;
  Latency(state, server, Path(tcbench::kRulesApi, "save"),
          SaveBody("adapter", "eth0", tcbench::RuleSet(kRules, kPortsPerRule)), kSaveRequests);
}
BENCHMARK(BM_HttpRulesSave100)
    ->Iterations(kSaveRequests)
    ->UseManualTime()
    ->Unit(benchmark::kMicrosecond);

// One request of the mixed workload and the answer it must get.
struct MixedRequest {
  std::string path;
  std::string body;
  std::string expect;  // "ok", an API error code, or "400" for an HTTP refusal
};

// Loads and saves of both APIs, successes and each kind of refusal, with rule
// lists of varying length so that allocations of many sizes come and go.
MixedRequest Mixed(int i) {
  const std::string rulesSave = Path(tcbench::kRulesApi, "save");
  const std::string routerSave = Path(tcbench::kRouterRulesApi, "save");
  const std::string routerLoad = Path(tcbench::kRouterRulesApi, "load");
  const int n = 1 + (i * 37) % kRules;
  switch (i % 10) {
    case 0:
      return {Path(tcbench::kRulesApi, "load"), AdapterBody("eth0"), "ok"};
    case 1:
      return {rulesSave, SaveBody("adapter", "eth0", tcbench::RuleSet(n, kPortsPerRule)), "ok"};
    case 2:
      return {routerLoad, "{\"direction\":\"upload\"}", "ok"};
    case 3:
      return {routerSave, SaveBody("direction", "upload", tcbench::RuleSet(n, 2)), "ok"};
    case 4:
      return {routerLoad, "{\"direction\":\"download\"}", "ok"};
    case 5:
      return {routerSave, SaveBody("direction", "download", tcbench::RuleSet(1 + i % 5, 3)), "ok"};
    case 6:
      return {Path(tcbench::kRulesApi, "load"), AdapterBody("eth9"), "4311"};
    case 7: {
      Json::Value rules = tcbench::RuleSet(3, 2);
      rules[1]["minrate"] = 0;
      return {rulesSave, SaveBody("adapter", "eth1", rules), "101"};
    }
    case 8: {
      // Above the 1000 Mbit/s link of eth1: the rule store refuses the ceiling.
      Json::Value rules = tcbench::RuleSet(2, 2);
      rules[0]["maxrate"] = 200000;
      return {rulesSave, SaveBody("adapter", "eth1", rules), "1202"};
    }
    default:
      return {rulesSave, "{\"adapter\":", "400"};
  }
}

// Peak resident size of the server after 100 mixed requests and after 10,000.
void BM_ServeMemory10k(benchmark::State& state) {
  for (auto _ : state) {
    Server server;
    std::string error;
    if (!server.Start(&error)) {
      tcbench::Fail(state, error);
      break;
    }
    const Clock::time_point deadline = Clock::now() + kMemoryDeadline;
    long afterFew = -1;
    bool failed = false;
    for (int i = 0; i < kManyRequests && !failed; ++i) {
      MixedRequest request = Mixed(i);
      std::string answer;
      int status = server.Post(request.path, request.body, &answer);
      std::string got = status == 400 ? "400" : Outcome(status, answer);
      if (got != request.expect) {
        tcbench::Fail(state, "request " + std::to_string(i) + " answered HTTP " +
                                 std::to_string(status) + " " + answer.substr(0, 200) +
                                 ", expected " + request.expect);
        failed = true;
      } else if (Clock::now() > deadline) {
        tcbench::Fail(state, "gave up: over the deadline");
        failed = true;
      }
      if (i + 1 == kFewRequests) afterFew = server.PeakResidentKiB();
    }
    if (failed) break;
    const long afterMany = server.PeakResidentKiB();
    if (afterFew <= 0 || afterMany <= 0 || !server.Running()) {
      tcbench::Fail(state, "cannot read the server's peak resident size");
      break;
    }
    state.counters["hwm100_KiB"] = static_cast<double>(afterFew);
    state.counters["hwm10k_KiB"] = static_cast<double>(afterMany);
    state.counters["growth_KiB"] = static_cast<double>(afterMany - afterFew);
  }
}
BENCHMARK(BM_ServeMemory10k)
    ->Iterations(1)
    ->Repetitions(1)
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);

}  // namespace

TC_BENCHMARK_MAIN();
