// The generator's golden rule sets: one rule of each shape, for device br0
// with a 125000 KB/s (1 Gbit/s) bound. The expected batches are the files
// tests/tcgen/golden/<name>.tc; the kernel tests apply every one of them.
#ifndef TC_TESTS_TCGEN_GOLDEN_CASES_H
#define TC_TESTS_TCGEN_GOLDEN_CASES_H

#include <string>
#include <vector>

#include "rule_builder.h"

namespace tctest {

constexpr int kTcp = ORVI_FW_PROTO_TCP;
constexpr int kUdp = ORVI_FW_PROTO_UDP;
constexpr int kAll = ORVI_FW_PROTO_ALL;

struct GoldenCase {
  const char* name;
  std::vector<RuleDef> rules;
};

inline const std::vector<GoldenCase>& GoldenCases() {
  static const std::vector<GoldenCase> cases = {
      {"empty", {}},
      {"all_disabled", {{0, "all", "SELF:22:dest", kTcp, 100, 1000, 1}}},
      {"single_port", {{1, "all", "SELF:80:dest", kTcp, 100, 1000, 1}}},
      // Blanks and a repeated port in the stored list; source address as source.
      {"port_list", {{1, "192.168.1.0/24", "SELF:53, 123,53:src", kUdp, 200, 2000, 1}}},
      // A lone address is a /32; ipDirection 0 makes it the destination.
      {"port_range", {{1, "10.0.0.5", "SELF:1000-2000:dest", kTcp, 500, 5000, 0}}},
      {"sys", {{1, "all", "SYS:cifs,dns:dest", kAll, 300, 3000, 1}}},
      {"mac", {{1, "AA-BB-CC-DD-EE-FF", "ALL::src", kTcp, 100, 1000, 0}}},
      // Host bits of a prefix are cleared.
      {"ipv6_prefix", {{1, "2001:db8:abcd:12::1/48", "SELF:5000:src", kUdp, 1000, 10000, 1}}},
      {"protocol_all", {{1, "all", "SELF:8080:dest", kAll, 100, 1000, 1}}},
      {"maxrate_zero", {{1, "all", "ALL", kAll, 1000, 0, 1}}},
      // A disabled rule takes no class or prio; "SYS:ssh" has no direction: src.
      {"disabled_and_order",
       {{0, "all", "SELF:22:dest", kTcp, 100, 1000, 1},
        {1, "10.1.0.0/16", "ALL::dest", kUdp, 200, 0, 0},
        {1, "all", "SYS:ssh", kTcp, 100, 500, 1}}},
  };
  return cases;
}

inline std::string GoldenPath(const std::string& sourceDir, const std::string& name) {
  return sourceDir + "/tests/tcgen/golden/" + name + ".tc";
}

}  // namespace tctest

#endif
