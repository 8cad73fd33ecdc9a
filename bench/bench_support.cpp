#include "bench_support.h"

#include <math.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <atomic>

#include "orvi_fw_tc.h"

namespace tcbench {

const char kRulesApi[] = "ORVI.Core.Network.TrafficControl.Rules";
const char kRouterRulesApi[] = "ORVI.Core.Network.TrafficControl.RouterRules";

namespace {

std::atomic<bool> gFailed(false);

std::string PortList(int rule, int portsPerRule) {
  std::string ports;
  for (int k = 0; k < portsPerRule; ++k) {
    if (k > 0) ports += ',';
    ports += std::to_string(1000 + rule * portsPerRule + k);
  }
  return ports;
}

std::string Source(int rule) {
  return "10." + std::to_string(rule / 256) + "." + std::to_string(rule % 256) + ".0/24";
}

// The record the store keeps, released on every way out.
class Record {
 public:
  Record() = default;
  ~Record() { ORVIFwTcBufRulesFree(rule_); }
  Record(const Record&) = delete;
  Record& operator=(const Record&) = delete;
  TcRule** Out() { return &rule_; }
  TcRule* Get() const { return rule_; }

 private:
  TcRule* rule_ = nullptr;
};

}  // namespace

Json::Value RuleSet(int count, int portsPerRule) {
  Json::Value rules(Json::arrayValue);
  for (int i = 0; i < count; ++i) {
    Json::Value rule(Json::objectValue);
    rule["enabled"] = true;
    rule["protocol"] = "tcp";
    rule["minrate"] = 100;
    rule["maxrate"] = 2000;
    rule["source"] = Source(i);
    rule["ip_direction"] = "src";
    rule["port_type"] = "SELF";
    rule["port_num"] = PortList(i, portsPerRule);
    rule["port_direction"] = "dest";
    rules.append(rule);
  }
  return rules;
}

bool StoreRules(const char* dir, const char* adapter, int count, int portsPerRule,
                std::string* error) {
  TcRuleFile* file = ORVIFwTcRuleOpen(dir, adapter);
  if (file == nullptr) {
    *error = std::string("cannot open the rule file of ") + adapter;
    return false;
  }
  bool ok = true;
  {
    Record record;
    if (ORVIFwTcBufRuleInit(record.Out()) < 0) {
      *error = "cannot allocate a rule record";
      ok = false;
    }
    for (int i = 0; ok && i < count; ++i) {
      TcRule* r = record.Get();
      const std::string text = "SELF:" + PortList(i, portsPerRule) + ":dest";
      // The store frees the ports text with the record, so it comes from malloc.
      char* block = static_cast<char*>(realloc(r->ports, text.size() + 1));
      if (block == nullptr) {
        *error = "out of memory";
        ok = false;
        break;
      }
      r->ports = block;
      memcpy(r->ports, text.c_str(), text.size() + 1);
      r->id = i + 1;
      r->enabled = 1;
      snprintf(r->source, sizeof r->source, "%s", Source(i).c_str());
      r->protocol = ORVI_FW_PROTO_TCP;
      r->minrate = 100;
      r->maxrate = 2000;
      r->ipDirection = 1;
      if (ORVIFwTcRuleWrite(file, r) < 0) {
        *error = "the rule store refused rule " + std::to_string(i + 1);
        ok = false;
      }
    }
  }
  // Closing commits the file; a failed write has poisoned the handle already.
  if (ORVIFwTcRuleClose(dir, file, adapter) < 0 && ok) {
    *error = std::string("cannot commit the rule file of ") + adapter;
    ok = false;
  }
  return ok;
}

void Fail(benchmark::State& state, const std::string& why) {
  gFailed = true;
  state.SkipWithError(why.c_str());
}

bool AnyFailed() { return gFailed; }

double Percentile(std::vector<double>& samples, double q) {
  if (samples.empty()) return 0;
  std::sort(samples.begin(), samples.end());
  size_t rank = static_cast<size_t>(ceil(q * static_cast<double>(samples.size())));
  rank = std::min(std::max<size_t>(rank, 1), samples.size());
  return samples[rank - 1];
}

std::string Compact(const Json::Value& value) {
  Json::StreamWriterBuilder writer;
  writer["indentation"] = "";
  return Json::writeString(writer, value);
}

}  // namespace tcbench
