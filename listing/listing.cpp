// The load methods of both APIs: stored rule records of "/etc/tc" turned into
// rule objects.
#include <stdint.h>
#include <stdio.h>
#include <string.h>

#include <string>
#include <utility>

#include "ORVI.Core.Network.TrafficControl.h"
#include "conflock.h"
#include "olibc.h"
#include "orvi_fw_tc.h"
#include "preconditions.h"
#include "tclog.h"

namespace {

const size_t kAdapterBufSize = 16;
const int kAdapterListSize = 512;

// One adapter's rule list from the store. The store's free accepts NULL and
// every read is paired with a free, so the destructor always calls it.
class RuleListHolder {
 public:
  RuleListHolder() = default;
  ~RuleListHolder() { ORVIFwTcRulesFreeByAdapter(list_); }
  RuleListHolder(const RuleListHolder&) = delete;
  RuleListHolder& operator=(const RuleListHolder&) = delete;

  TcRuleList** Out() { return &list_; }
  const TcRule* Head() const { return list_ != nullptr ? list_->rules : nullptr; }

 private:
  TcRuleList* list_ = nullptr;
};

// One stored record into one rule object. The rule object is reused across
// records, so it is emptied first: a member of one record must never carry
// over to the next. -1 when the stored ports text cannot be read (logged
// where it is found).
int RecordConvert(TCHandler& h, const TcRule& record, Json::Value& rule) {
  rule.clear();
  Json::Value port;
  rule["enabled"] = record.enabled != 0;
  if (h.PortsParseGet(record.ports, port) < 0) return -1;
  // The port object is discarded afterwards, so its strings are moved over.
  rule["port_type"] = std::move(port["port_type"]);
  // The two are written together; the bare "ALL" form has neither.
  if (port.isMember("port_num")) {
    rule["port_num"] = std::move(port["port_num"]);
    rule["port_direction"] = std::move(port["port_direction"]);
  }
  // Read as a plain integer: a damaged or foreign store may hold a number
  // outside the enumeration, and loading that as the enum type is undefined.
  int32_t protocol = 0;
  static_assert(sizeof protocol == sizeof record.protocol, "protocol is a 32-bit field");
  memcpy(&protocol, &record.protocol, sizeof protocol);
  rule["protocol"] = h.ProtocolParse(static_cast<_tag_orvi_firewall_protocol_>(protocol));
  rule["minrate"] = Json::Value(static_cast<Json::UInt>(static_cast<uint32_t>(record.minrate)));
  rule["maxrate"] = Json::Value(static_cast<Json::UInt>(static_cast<uint32_t>(record.maxrate)));
  // Bounded: a record from a damaged store may lack its terminator.
  rule["source"] =
      Json::Value(record.source, record.source + strnlen(record.source, sizeof record.source));
  rule["ip_direction"] = record.ipDirection == 1 ? "src" : "dest";
  return 0;
}

// Reads one adapter's rules from the live directory and appends one rule
// object per record to rules, in chain order. Returns the store's count,
// which need not match the records (clients rely on it as "total"), or -1
// with the handler's error code set. The store's list is released before
// this returns, on every path.
int AdapterRulesRead(TCHandler& h, const char* adapter, Json::Value& rules) {
  RuleListHolder list;
  const int count = ORVIFwTcRuleGetByAdapter(kLiveDir, adapter, list.Out());
  if (count < 0) {
    TC_LOG_ERR("Failed to load Tc rules for adapter [%s]", adapter);
    h._errCode = TC_ERR_FAILED;
    return -1;
  }
  if (count == 0) return 0;
  Json::Value rule(Json::objectValue);
  for (const TcRule* record = list.Head(); record != nullptr; record = record->next) {
    if (RecordConvert(h, *record, rule) < 0) {
      h._errCode = TC_ERR_FAILED;
      return -1;
    }
    // Moved, not copied: the next record empties the object anyway.
    rules.append(std::move(rule));
  }
  return count;
}

// Success carries the gathered rules; a failure carries nothing of them.
void LoadAnswer(TCHandler& h, bool ok, Json::Value&& rules, int total) {
  if (!ok) {
    h._pResponse->SetError(h._errCode, Json::Value());
    return;
  }
  h._respData["rules"] = std::move(rules);
  h._respData["total"] = total;
  h._pResponse->SetSuccess(h._respData);
}

// Resolves "direction" into the adapters to read and gathers their rules.
// The name list is released before this returns.
bool RouterRulesGather(TCHandler& h, Json::Value& rules, int& total) {
  SzListHolder names;
  if (!RouterAdaptersSelect(h, kAdapterListSize, names)) return false;

  total = 0;
  {
    // Reads of the live directory.
    conflock::LiveReader reading;
    for (int i = 0; i < names.Get()->count; ++i) {
      const char* item = OLIBCSzListGet(names.Get(), i);
      const std::string name = item != nullptr ? item : "";
      const int count = AdapterRulesRead(h, name.c_str(), rules);
      if (count < 0) return false;
      // The last adapter's count, not a sum; an adapter without rules ends
      // the walk with what was gathered so far. Clients rely on both.
      total = count;
      if (count == 0) break;
    }
  }
  return true;
}

}  // namespace

void TCHandler::RulesLoad() {
  if (InterfaceCheck() < 0) return;  // already answered

  char adapter[kAdapterBufSize] = {0};
  snprintf(adapter, sizeof adapter, "%s", _adapter.c_str());
  Json::Value rules(Json::arrayValue);
  int total = 0;
  {
    // Reads of the live directory.
    conflock::LiveReader reading;
    total = AdapterRulesRead(*this, adapter, rules);
  }
  LoadAnswer(*this, total >= 0, std::move(rules), total);
}

void TCHandler::RouterRulesLoad() {
  Json::Value rules(Json::arrayValue);
  int total = 0;
  // Not in router mode: "direction" is not even read, and the code stays the
  // initial one.
  const bool ok = IsRouterMode() && RouterRulesGather(*this, rules, total);
  LoadAnswer(*this, ok, std::move(rules), total);
}
