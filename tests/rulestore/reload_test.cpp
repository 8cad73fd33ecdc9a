// The reload's checks: rule files, device mapping, upper bounds from the
// simulated sysfs and key file, and the -1/-2/-3 results.
#include <map>

#include "store_fixture.h"

using storetest::Disabled;
using storetest::Enabled;
using storetest::Rule;

namespace {

constexpr const char* kDir = "/etc/tc";
constexpr const char* kNoSpeed = nullptr;

struct Case {
  const char* name;
  std::map<std::string, const char*> devices;  // device -> speed file text (or none)
  std::string conf;                            // etc/orviinfo.conf
  std::map<std::string, std::vector<Rule>> files;
  std::map<std::string, std::string> raw;  // more files of etc/tc, byte for byte
  int expect;
  int error;        // on the error stack when expect < 0
  const char* log;  // a log line that must appear, or nullptr
};

// Bounds: speed 1 Mbit/s = 125 KB/s with a reserve of 1; no speed = 1250000 KB/s.
// clang-format off
const Case kCases[] = {
  {"all within bounds", {{"eth0", "1000"}}, "", {{"eth0", {Enabled(100, 200)}}}, {}, 0, 0, nullptr},
  {"garbage file", {{"eth0", "1000"}}, "", {}, {{"eth0.rules", "garbage\n"}},
   -1, ORVI_TC_ERR_FORMAT, nullptr},
  {"ceiling at the bound", {{"eth0", "1"}}, "", {{"eth0", {Enabled(10, 125)}}}, {}, 0, 0, nullptr},
  {"ceiling above the bound", {{"eth0", "1"}}, "", {{"eth0", {Enabled(10, 126)}}}, {},
   -2, ORVI_TC_ERR_CEIL, nullptr},
  {"minrate is the ceiling when maxrate is 0", {{"eth0", "1"}}, "", {{"eth0", {Enabled(126, 0)}}},
   {}, -2, ORVI_TC_ERR_CEIL, nullptr},
  {"disabled rules are not checked", {{"eth0", "1"}}, "",
   {{"eth0", {Disabled(0, 999), Disabled(999, 0)}}}, {}, 0, 0, nullptr},
  {"guarantees plus reserve at the bound", {{"eth0", "1"}}, "",
   {{"eth0", {Enabled(62, 0), Enabled(62, 100)}}}, {}, 0, 0, nullptr},
  {"guarantees plus reserve above the bound", {{"eth0", "1"}}, "",
   {{"eth0", {Enabled(62, 0), Enabled(63, 100)}}}, {}, -3, ORVI_TC_ERR_RATESUM, nullptr},
  {"guarantees add up per device", {{"eth0", "1"}, {"eth1", "1"}}, "",
   {{"eth0", {Enabled(100, 0)}}, {"eth1", {Enabled(100, 0)}}}, {}, 0, 0, nullptr},
  {"missing speed counts as 10 Gbit/s", {{"eth0", kNoSpeed}}, "",
   {{"eth0", {Enabled(10, 1250000)}}}, {}, 0, 0, nullptr},
  {"missing speed is not unlimited", {{"eth0", kNoSpeed}}, "",
   {{"eth0", {Enabled(10, 1250001)}}}, {}, -2, ORVI_TC_ERR_CEIL, nullptr},
  {"zero speed counts as 10 Gbit/s", {{"eth0", "0\n"}}, "",
   {{"eth0", {Enabled(10, 1250000)}}}, {}, 0, 0, nullptr},
  {"negative speed counts as 10 Gbit/s", {{"eth0", "-1\n"}}, "",
   {{"eth0", {Enabled(10, 1250001)}}}, {}, -2, ORVI_TC_ERR_CEIL, nullptr},
  {"unreadable speed counts as 10 Gbit/s", {{"eth0", "fast\n"}}, "",
   {{"eth0", {Enabled(10, 1250000)}}}, {}, 0, 0, nullptr},
  {"override lowers the bound", {{"eth0", "1000"}}, "tc_bandwidth_eth0=50\n",
   {{"eth0", {Enabled(10, 51)}}}, {}, -2, ORVI_TC_ERR_CEIL, nullptr},
  {"override raises the bound", {{"eth0", "1"}}, "tc_bandwidth_eth0 = 1000\n",
   {{"eth0", {Enabled(10, 990)}}}, {}, 0, 0, nullptr},
  {"override of another device", {{"eth0", "1"}}, "tc_bandwidth_eth1=1000\n",
   {{"eth0", {Enabled(10, 990)}}}, {}, -2, ORVI_TC_ERR_CEIL, nullptr},
  {"garbage override ignored", {{"eth0", "1"}}, "tc_bandwidth_eth0=lots\n",
   {{"eth0", {Enabled(10, 126)}}}, {}, -2, ORVI_TC_ERR_CEIL, "ignoring tc_bandwidth_eth0"},
  {"upload goes to wan_interface", {{"wan0", "1"}, {"upload", "1000"}}, "wan_interface=wan0\n",
   {{"upload", {Enabled(10, 200)}}}, {}, -2, ORVI_TC_ERR_CEIL, nullptr},
  {"upload without wan_interface is skipped", {{"wan0", "1"}}, "",
   {{"upload", {Enabled(10, 200)}}}, {}, 0, 0, "no wan_interface set"},
  {"upload to a missing device is skipped", {{"wan0", "1"}}, "wan_interface=wan9\n",
   {{"upload", {Enabled(10, 200)}}}, {}, 0, 0, "device wan9 of adapter upload does not exist"},
  {"upload merges with its device's own file", {{"wan0", "1"}}, "wan_interface=wan0\n",
   {{"upload", {Enabled(62, 0)}}, {"wan0", {Enabled(63, 0)}}}, {}, -3, ORVI_TC_ERR_RATESUM, nullptr},
  {"gone device is skipped", {{"eth0", "1"}}, "", {{"eth9", {Enabled(10, 2000000000)}}}, {},
   0, 0, "device eth9 of adapter eth9 does not exist"},
  {"gone device's file is still read", {{"eth0", "1"}}, "", {},
   {{"eth9.rules", "orvi-tc-rules 1\n"}}, -1, ORVI_TC_ERR_FORMAT, nullptr},
  {"temporary and foreign files ignored", {{"eth0", "1"}}, "", {{"eth0", {Enabled(10, 100)}}},
   {{"eth0.rules.tmp-a1B2c3", "torn"}, {"README", "x"}, {".rules", "x"},
    {"sixteen-chars-xx.rules", "x"}}, 0, 0, nullptr},
  {"enabled minrate 0", {{"eth0", "1000"}}, "", {{"eth0", {Enabled(0, 100)}}}, {},
   -1, ORVI_TC_ERR_RATE, nullptr},
  {"maxrate below minrate", {{"eth0", "1000"}}, "", {{"eth0", {Enabled(100, 50)}}}, {},
   -1, ORVI_TC_ERR_RATE, nullptr},
  {"negative maxrate", {{"eth0", "1000"}}, "", {{"eth0", {Enabled(10, -1)}}}, {},
   -1, ORVI_TC_ERR_RATE, nullptr},
  {"empty rule file", {{"eth0", "1"}}, "", {{"eth0", {}}}, {}, 0, 0, nullptr},
};
// clang-format on

class Reload : public storetest::StoreRoot {
 protected:
  void Build(const Case& c) {
    for (const auto& dev : c.devices) {
      Put("/sys/class/net/" + dev.first + "/uevent", "");
      if (dev.second != nullptr) Put("/sys/class/net/" + dev.first + "/speed", dev.second);
    }
    if (!c.conf.empty()) Put("/etc/orviinfo.conf", c.conf);
    for (const auto& f : c.files) ASSERT_EQ(Save(kDir, f.first.c_str(), f.second), 0);
    for (const auto& f : c.raw) Put("/etc/tc/" + f.first, f.second);
  }
};

TEST_F(Reload, Table) {
  for (const Case& c : kCases) {
    SCOPED_TRACE(c.name);
    TearDown();
    SetUp();
    Build(c);
    OLIBCErrSetEx(0, "", 0);
    testing::internal::CaptureStderr();
    int result = ORVIFwTcRuleReload(kDir);
    std::string log = testing::internal::GetCapturedStderr();
    EXPECT_EQ(result, c.expect);
    if (c.expect < 0) {
      EXPECT_EQ(OLIBCErrGet(), c.error);
    }
    if (c.log != nullptr) {
      EXPECT_NE(log.find(c.log), std::string::npos) << log;
    }
  }
}

TEST_F(Reload, UnknownApplyModeIsRefused) {
  Put("/sys/class/net/eth0/speed", "1000");
  ASSERT_EQ(Save(kDir, "eth0", {Enabled(10, 100)}), 0);
  setenv("ORVI_TC_APPLY", "dry", 1);
  EXPECT_EQ(ORVIFwTcRuleReload(kDir), -1);
  EXPECT_EQ(OLIBCErrGet(), OLIBC_ERR_INVAL);
}

Rule WithSource(const char* source) {
  Rule r = Enabled(10, 100);
  r.source = source;
  return r;
}

// Plan mode writes one batch per device, and none unless every device passes.
struct PlanCase {
  const char* name;
  std::map<std::string, std::vector<Rule>> files;
  const char* conf;
  const char* mode;  // ORVI_TC_APPLY, nullptr for unset
  int expect;
  int error;
  std::vector<std::string> plans;  // files of run/tc afterwards
};

// clang-format off
const PlanCase kPlanCases[] = {
  {"every device planned", {{"eth0", {Enabled(10, 100)}}, {"eth1", {Enabled(10, 125)}}}, "",
   "plan", 0, 0, {"eth0.tc", "eth1.tc"}},
  {"a bound failure plans nothing", {{"eth0", {Enabled(10, 100)}}, {"eth1", {Enabled(10, 126)}}},
   "", "plan", -2, ORVI_TC_ERR_CEIL, {}},
  {"a refused source plans nothing",
   {{"eth0", {Enabled(10, 100)}}, {"eth1", {WithSource("10.0.0.300")}}}, "", "plan", -1,
   ORVI_TC_ERR_SOURCE, {}},
  {"upload planned on the WAN device", {{"upload", {Enabled(10, 100)}}}, "wan_interface=wan0\n",
   "plan", 0, 0, {"wan0.tc"}},
  {"plan is the default under a root", {{"eth0", {Enabled(10, 100)}}}, "", nullptr, 0, 0,
   {"eth0.tc"}},
  {"an empty rule file is planned too", {{"eth0", {}}}, "", "plan", 0, 0, {"eth0.tc"}},
};
// clang-format on

TEST_F(Reload, PlansEveryDeviceOrNone) {
  for (const PlanCase& c : kPlanCases) {
    SCOPED_TRACE(c.name);
    TearDown();
    SetUp();
    for (const char* dev : {"eth0", "eth1", "wan0"})
      Put(std::string("/sys/class/net/") + dev + "/speed", "1");
    Put("/etc/orviinfo.conf", c.conf);
    for (const auto& f : c.files) ASSERT_EQ(Save(kDir, f.first.c_str(), f.second), 0);
    if (c.mode == nullptr)
      unsetenv("ORVI_TC_APPLY");
    else
      setenv("ORVI_TC_APPLY", c.mode, 1);
    EXPECT_EQ(ORVIFwTcRuleReload(kDir), c.expect);
    if (c.expect < 0) {
      EXPECT_EQ(OLIBCErrGet(), c.error);
    }
    EXPECT_EQ(List("/run/tc"), c.plans);
  }
}

TEST_F(Reload, EmptyRuleFileRestoresTheDefaultQdisc) {
  Put("/sys/class/net/eth0/speed", "1");
  ASSERT_EQ(Save(kDir, "eth0", {Enabled(10, 100)}), 0);
  ASSERT_EQ(ORVIFwTcRuleReload(kDir), 0);
  EXPECT_NE(Get("/run/tc/eth0.tc").find("htb"), std::string::npos);
  ASSERT_EQ(Save(kDir, "eth0", {}), 0);
  ASSERT_EQ(ORVIFwTcRuleReload(kDir), 0);
  EXPECT_NE(Get("/run/tc/eth0.tc").find("qdisc del dev eth0 root"), std::string::npos);
  EXPECT_EQ(Get("/run/tc/eth0.tc").find("htb"), std::string::npos);
}

}  // namespace
