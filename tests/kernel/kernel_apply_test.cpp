// Kernel-mode applies on the appliance's bridge br0, read back with tc.
#include <algorithm>
#include <fstream>
#include <set>
#include <sstream>
#include <thread>

#include "golden_cases.h"
#include "kernel_fixture.h"
#include "olibc.h"
#include "tcgen.h"

namespace kerneltest {
namespace {

using tctest::kAll;
using tctest::kTcp;
using tctest::kUdp;
using tctest::RuleSet;

struct ClassInfo {
  std::string parent;  // "root" for the top class
  double rateBits = 0;
  double ceilBits = 0;
  bool operator==(const ClassInfo& o) const {
    return parent == o.parent && rateBits == o.rateBits && ceilBits == o.ceilBits;
  }
};

double Bits(const std::string& text) {
  size_t end = 0;
  double v = std::stod(text, &end);
  std::string unit = text.substr(end);
  if (unit == "Kbit") return v * 1e3;
  if (unit == "Mbit") return v * 1e6;
  if (unit == "Gbit") return v * 1e9;
  if (unit == "Tbit") return v * 1e12;
  return v;
}

double KBps(long long kbps) { return static_cast<double>(kbps) * 8000; }

// classid -> parent, rate and ceil, from `tc class show`.
std::map<std::string, ClassInfo> Classes(Topology& t) {
  std::map<std::string, ClassInfo> out;
  std::istringstream lines(t.Tc(t.R(), {"class", "show", "dev", "br0"}));
  std::string line;
  while (std::getline(lines, line)) {
    std::istringstream w(line);
    std::string word, kind, id;
    w >> word >> kind >> id;
    if (word != "class") continue;
    ClassInfo c;
    while (w >> word) {
      if (word == "parent") w >> c.parent;
      if (word == "root") c.parent = "root";
      if (word == "rate" && w >> word) c.rateBits = Bits(word);
      if (word == "ceil" && w >> word) c.ceilBits = Bits(word);
    }
    out[id] = c;
  }
  return out;
}

struct FilterInfo {
  std::string protocol;
  int pref = 0;
  std::string flowid;
  std::multiset<std::string> keys;  // "vvvvvvvv/mmmmmmmm at OFF"
  bool operator<(const FilterInfo& o) const {
    return std::tie(protocol, pref, flowid, keys) < std::tie(o.protocol, o.pref, o.flowid, o.keys);
  }
  bool operator==(const FilterInfo& o) const {
    return protocol == o.protocol && pref == o.pref && flowid == o.flowid && keys == o.keys;
  }
};

std::ostream& operator<<(std::ostream& os, const FilterInfo& f) {
  os << f.protocol << " pref " << f.pref << " -> " << f.flowid << " {";
  for (const auto& k : f.keys) os << " " << k << ";";
  return os << " }";
}

// Every u32 filter that sends to a class, from `tc filter show`.
std::vector<FilterInfo> Filters(Topology& t) {
  std::vector<FilterInfo> out;
  std::istringstream lines(t.Tc(t.R(), {"filter", "show", "dev", "br0"}));
  std::string line;
  while (std::getline(lines, line)) {
    std::istringstream w(line);
    std::string word;
    w >> word;
    if (word == "match" && !out.empty()) {
      std::string key, at, off;
      w >> key >> at >> off;
      out.back().keys.insert(key + " at " + off);
      continue;
    }
    if (word != "filter" || line.find("flowid") == std::string::npos) continue;
    FilterInfo f;
    while (w >> word) {
      if (word == "protocol") w >> f.protocol;
      if (word == "pref") w >> f.pref;
      if (word == "flowid" || word == "*flowid") w >> f.flowid;
    }
    out.push_back(f);
  }
  std::sort(out.begin(), out.end());
  return out;
}

std::string RootQdisc(Topology& t) {
  std::string q = t.Tc(t.R(), {"qdisc", "show", "dev", "br0"});
  return q.substr(0, q.find('\n'));
}

size_t Count(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t p = text.find(what); p != std::string::npos; p = text.find(what, p + 1)) ++n;
  return n;
}

int ApplyRules(const tcgen::DeviceRules& dev) {
  return tcgen::Apply(dev.device, tcgen::Generate(dev), tcgen::ApplyMode::kKernel);
}

using ApplyKernel = KernelTest;

TEST_F(ApplyKernel, CreatesExactlyTheExpectedClassesAndFilters) {
  InNamespace in(topo().R());
  ASSERT_TRUE(in.ok());
  RuleSet set("br0", 125000,
              {{1, "10.211.2.0/24", "SELF:80:dest", kTcp, 100, 1000, 0},
               {1, "all", "SELF:53:src", kUdp, 200, 0, 1}});
  ASSERT_EQ(tcgen::Check(set.dev()), 0);
  ASSERT_EQ(ApplyRules(set.dev()), 0);

  const std::map<std::string, ClassInfo> expectedClasses = {
      {"1:1", {"root", KBps(125000), KBps(125000)}},
      {"1:2", {"1:1", KBps(124700), KBps(125000)}},
      {"1:10", {"1:1", KBps(100), KBps(1000)}},
      {"1:11", {"1:1", KBps(200), KBps(125000)}},
  };
  EXPECT_EQ(Classes(topo()), expectedClasses);

  // u32 keys as the kernel holds them: 32-bit words at offsets from the
  // network header (IPv4: 8 protocol, 0 IHL, 4 fragment offset, 16 daddr,
  // 20 ports; IPv6: 4 next header, 40 ports).
  const std::string ihl = "05000000/0f000000 at 0", frag = "00000000/00001fff at 4";
  std::vector<FilterInfo> expected = {
      {"ip",
       1,
       "1:10",
       {"0ad30200/ffffff00 at 16", "00060000/00ff0000 at 8", ihl, frag, "00000050/0000ffff at 20"}},
      {"ip", 3, "1:11", {"00110000/00ff0000 at 8", ihl, frag, "00350000/ffff0000 at 20"}},
      {"ipv6", 4, "1:11", {"00001100/0000ff00 at 4", "00350000/ffff0000 at 40"}},
  };
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(Filters(topo()), expected);
  EXPECT_NE(RootQdisc(topo()).find("htb 1: root"), std::string::npos) << RootQdisc(topo());
}

TEST_F(ApplyKernel, EveryGoldenBatchIsAcceptedWhateverWasThereBefore) {
  InNamespace in(topo().R());
  ASSERT_TRUE(in.ok());
  // One after the other on the same device: each replaces the previous tree.
  for (const tctest::GoldenCase& c : tctest::GoldenCases()) {
    RuleSet set("br0", 125000, c.rules);
    ASSERT_EQ(tcgen::Check(set.dev()), 0) << c.name;
    const std::string batch = tcgen::Generate(set.dev());
    ASSERT_EQ(tcgen::Apply("br0", batch, tcgen::ApplyMode::kKernel), 0) << c.name;
    size_t enabled = std::count_if(set.dev().rules.begin(), set.dev().rules.end(),
                                   [](const TcRule* r) { return r->enabled != 0; });
    if (enabled == 0) {
      EXPECT_NE(RootQdisc(topo()).find("noqueue"), std::string::npos) << c.name;
      continue;
    }
    EXPECT_EQ(Classes(topo()).size(), enabled + 2) << c.name;
    EXPECT_EQ(Filters(topo()).size(), Count(batch, "filter add")) << c.name;
  }
  // The golden files themselves, as a bare tc reads them: no line fails and
  // tc has nothing to warn about (such as a derived HTB quantum).
  for (const tctest::GoldenCase& c : tctest::GoldenCases()) {
    ProcResult r =
        topo().Exec(topo().R(), {TcPath(), "-batch", tctest::GoldenPath(TC_SOURCE_DIR, c.name)});
    EXPECT_EQ(r.exitCode, 0) << c.name << ": " << r.err;
    EXPECT_EQ(r.err, "") << c.name;
  }
}

TEST_F(ApplyKernel, RejectedBatchLeavesThePreviousConfiguration) {
  InNamespace in(topo().R());
  ASSERT_TRUE(in.ok());
  RuleSet good("br0", 125000, {{1, "all", "SYS:https", kTcp, 100, 2000, 1}});
  ASSERT_EQ(ApplyRules(good.dev()), 0);
  const auto classesBefore = Classes(topo());
  const auto filtersBefore = Filters(topo());
  ASSERT_EQ(classesBefore.size(), 3u);

  // A different tree that tc gives up on in its last line, after it has
  // already replaced the device's tree.
  RuleSet other("br0", 125000,
                {{1, "all", "SELF:22:dest", kTcp, 100, 500, 1},
                 {1, "all", "SELF:23:dest", kTcp, 100, 500, 1}});
  const std::string bad =
      tcgen::Generate(other.dev()) + "class add dev br0 parent 1:1 classid 1:ff htb rate bogus\n";
  OLIBCErrSetEx(0, "", 0);
  EXPECT_LT(tcgen::Apply("br0", bad, tcgen::ApplyMode::kKernel), 0);
  EXPECT_EQ(OLIBCErrGet(), ORVI_TC_ERR_APPLY);
  EXPECT_EQ(Classes(topo()), classesBefore);
  EXPECT_EQ(Filters(topo()), filtersBefore);
  std::ifstream kept(root().dir() + "/run/tc/br0.tc");
  std::stringstream keptText;
  keptText << kept.rdbuf();
  EXPECT_EQ(keptText.str(), tcgen::Generate(good.dev()));  // still the last good one
}

TEST_F(ApplyKernel, RejectedFirstBatchFallsBackToTheDefaultQdisc) {
  InNamespace in(topo().R());
  ASSERT_TRUE(in.ok());
  RuleSet set("br0", 125000, {{1, "all", "ALL", kAll, 100, 0, 1}});
  const std::string bad = tcgen::Generate(set.dev()) + "filter add dev br0 bogus\n";
  EXPECT_LT(tcgen::Apply("br0", bad, tcgen::ApplyMode::kKernel), 0);
  EXPECT_NE(RootQdisc(topo()).find("noqueue"), std::string::npos) << RootQdisc(topo());
  EXPECT_TRUE(Classes(topo()).empty());
}

TEST_F(ApplyKernel, EmptyRuleSetRestoresTheDefaultQdisc) {
  InNamespace in(topo().R());
  ASSERT_TRUE(in.ok());
  RuleSet empty("br0", 125000, {});
  // Also on a device that has nothing to delete yet.
  ASSERT_EQ(ApplyRules(empty.dev()), 0);
  RuleSet some("br0", 125000, {{1, "all", "ALL", kTcp, 100, 0, 1}});
  ASSERT_EQ(ApplyRules(some.dev()), 0);
  ASSERT_EQ(Classes(topo()).size(), 3u);
  ASSERT_EQ(ApplyRules(empty.dev()), 0);
  EXPECT_NE(RootQdisc(topo()).find("noqueue"), std::string::npos) << RootQdisc(topo());
  EXPECT_TRUE(Classes(topo()).empty());
  EXPECT_TRUE(Filters(topo()).empty());
}

TEST_F(ApplyKernel, ConcurrentAppliesKeepKernelAndLastGoodBatchTogether) {
  // Rule sets of 1..4 rules, applied from four threads at once; afterwards
  // the kernel's tree and the kept batch must come from the same set.
  std::vector<std::unique_ptr<RuleSet>> sets;
  for (int n = 1; n <= 4; ++n) {
    sets.emplace_back(new RuleSet("br0", 125000, {}));
    for (int i = 0; i < n; ++i) {
      std::string ports = "SELF:" + std::to_string(1000 + i) + ":dest";
      sets.back()->Add({1, "all", ports.c_str(), kTcp, 100, 1000, 1});
    }
  }
  std::vector<int> results(sets.size(), -1);
  std::vector<std::thread> threads;
  for (size_t i = 0; i < sets.size(); ++i) {
    threads.emplace_back([&, i] {
      InNamespace in(topo().R());
      int worst = in.ok() ? 0 : -1;
      for (int round = 0; round < 3 && worst == 0; ++round) worst = ApplyRules(sets[i]->dev());
      results[i] = worst;
    });
  }
  for (auto& t : threads) t.join();
  for (size_t i = 0; i < results.size(); ++i) EXPECT_EQ(results[i], 0) << "set " << i;

  std::ifstream kept(root().dir() + "/run/tc/br0.tc");
  std::stringstream keptText;
  keptText << kept.rdbuf();
  const size_t rules = Classes(topo()).size() - 2;
  ASSERT_GE(rules, 1u);
  ASSERT_LE(rules, sets.size());
  EXPECT_EQ(keptText.str(), tcgen::Generate(sets[rules - 1]->dev()));
}

}  // namespace
}  // namespace kerneltest
