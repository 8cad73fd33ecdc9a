// Rule sets for generator tests: TcRule records built from short literals,
// owning their port strings, in the order they are given.
#ifndef TC_TESTS_TCGEN_RULE_BUILDER_H
#define TC_TESTS_TCGEN_RULE_BUILDER_H

#include <algorithm>
#include <cstring>
#include <deque>
#include <string>
#include <vector>

#include "orvi_fw_tc.h"
#include "tcgen.h"

namespace tctest {

struct RuleDef {
  int enabled;
  std::string source;
  const char* ports;  // nullptr: a record without a ports field
  int protocol;
  int minrate;
  int maxrate;
  int ipDirection;
};

class RuleSet {
 public:
  RuleSet(std::string device, long long upperKBps, const std::vector<RuleDef>& defs) {
    dev_.device = std::move(device);
    dev_.upperKBps = upperKBps;
    for (const RuleDef& d : defs) Add(d);
  }
  RuleSet(const RuleSet&) = delete;
  RuleSet& operator=(const RuleSet&) = delete;

  void Add(const RuleDef& d) {
    rules_.emplace_back();
    TcRule& r = rules_.back();
    std::memset(&r, 0, sizeof r);
    r.id = static_cast<int32_t>(rules_.size());
    r.enabled = d.enabled;
    std::memcpy(r.source, d.source.data(), std::min(d.source.size(), sizeof r.source));
    if (d.ports != nullptr) {
      ports_.emplace_back(d.ports);
      r.ports = &ports_.back()[0];
    }
    r.protocol = static_cast<_tag_orvi_firewall_protocol_>(d.protocol);
    r.minrate = d.minrate;
    r.maxrate = d.maxrate;
    r.ipDirection = d.ipDirection;
    dev_.rules.push_back(&r);
  }
  // The last rule's source field, for filling it byte by byte.
  TcRule& Last() { return rules_.back(); }
  const tcgen::DeviceRules& dev() const { return dev_; }

 private:
  std::deque<TcRule> rules_;  // stable addresses
  std::deque<std::string> ports_;
  tcgen::DeviceRules dev_;
};

}  // namespace tctest

#endif
