// Real traffic through the appliance namespace: what the applied rules hold
// back, and which class each kind of packet ends up in.
#include <cstdio>
#include <sstream>

#include "golden_cases.h"
#include "kernel_fixture.h"
#include "tcgen.h"
#include "traffic.h"

namespace kerneltest {
namespace {

using tctest::kTcp;
using tctest::kUdp;
using tctest::RuleSet;

// Packets sent through each class so far, from `tc -s class show`.
std::map<std::string, long long> ClassPackets(Topology& t) {
  std::map<std::string, long long> out;
  std::istringstream lines(t.Tc(t.R(), {"-s", "class", "show", "dev", "br0"}));
  std::string line, current;
  while (std::getline(lines, line)) {
    std::istringstream w(line);
    std::string word;
    w >> word;
    if (word == "class") {
      w >> word >> current;
    } else if (word == "Sent" && !current.empty()) {
      long long bytes = 0, packets = 0;
      std::string unit;
      w >> bytes >> unit >> packets;
      out[current] = packets;
    }
  }
  return out;
}

int Apply(const RuleSet& set, Topology& t) {
  InNamespace in(t.R());
  if (!in.ok() || tcgen::Check(set.dev()) != 0) return -1;
  return tcgen::Apply("br0", tcgen::Generate(set.dev()), tcgen::ApplyMode::kKernel);
}

using Shaping = KernelTest;

TEST_F(Shaping, MatchedTrafficIsHeldNearItsCeiling) {
  RuleSet set("br0", 125000, {{1, "all", "SELF:5001:dest", kTcp, 100, 1000, 1}});
  ASSERT_EQ(Apply(set, topo()), 0);
  std::string error;
  double rate = TcpRateKBps(topo(), 5001, TcpLimits(), &error);
  ASSERT_GT(rate, 0) << error;
  std::printf("matched stream: %.0f KB/s\n", rate);
  EXPECT_GE(rate, 850);
  EXPECT_LE(rate, 1050);
}

TEST_F(Shaping, UnmatchedTrafficIsNotHeld) {
  RuleSet set("br0", 125000, {{1, "all", "SELF:5001:dest", kTcp, 100, 1000, 1}});
  ASSERT_EQ(Apply(set, topo()), 0);
  TcpLimits limits;
  limits.seconds = 3;
  limits.maxBytes = 32 << 20;
  limits.skipSeconds = 0;
  std::string error;
  double rate = TcpRateKBps(topo(), 5002, limits, &error);
  ASSERT_GT(rate, 0) << error;
  std::printf("unmatched stream: %.0f KB/s\n", rate);
  EXPECT_GT(rate, 3000);  // held at 1000 KB/s it could not come near this
}

using Classification = KernelTest;

TEST_F(Classification, EachPacketLandsInTheFirstMatchingRulesClass) {
  const std::string lanMac = topo().LanHostMac();
  ASSERT_EQ(lanMac.size(), 17u) << lanMac;
  RuleSet set("br0", 125000,
              {
                  // 1:10 — by the LAN host's MAC as destination, both families.
                  {1, lanMac, "SELF:7001:dest", kUdp, 100, 0, 0},
                  // 1:11 — by destination address and a range.
                  {1, Addr::kL4, "SELF:7002-7003:dest", kUdp, 100, 0, 0},
                  // 1:12 — by an IPv6 destination prefix.
                  {1, "fd00:211:2::/64", "SELF:7004:dest", kUdp, 100, 0, 0},
                  // 1:13 — overlaps all of the above and must lose to them.
                  {1, "all", "SELF:7001-7004:dest", kUdp, 100, 0, 1},
                  // 1:14 — by source address and source port.
                  {1, Addr::kW4, "SELF:7010:src", kUdp, 100, 0, 1},
              });
  ASSERT_EQ(Apply(set, topo()), 0);

  struct Probe {
    const char* dst;
    uint16_t dport, sport;
  } probes[] = {{Addr::kL4, 7001, 0}, {Addr::kL6, 7001, 0},    {Addr::kL4, 7003, 0},
                {Addr::kL6, 7004, 0}, {Addr::kL4, 9999, 7010}, {Addr::kL4, 7005, 0}};
  const int kEach = 5;
  std::string error;
  for (const Probe& p : probes) {
    ASSERT_TRUE(SendUdp(topo(), p.dst, p.dport, p.sport, kEach, &error)) << error;
  }
  std::map<std::string, long long> pkts;
  for (int i = 0; i < 20; ++i) {  // forwarding is quick; allow a moment anyway
    pkts = ClassPackets(topo());
    if (pkts["1:14"] >= kEach) break;
    usleep(50000);
  }
  EXPECT_EQ(pkts["1:10"], 2 * kEach);
  EXPECT_EQ(pkts["1:11"], kEach);
  EXPECT_EQ(pkts["1:12"], kEach);
  EXPECT_EQ(pkts["1:13"], 0);
  EXPECT_EQ(pkts["1:14"], kEach);
  EXPECT_GE(pkts["1:2"], kEach);  // 7005 and the neighbour discovery traffic
}

}  // namespace
}  // namespace kerneltest
