// Saves through tcapi in kernel mode, inside the appliance namespace: what
// the web API accepts is what the kernel ends up holding, and what it refuses
// leaves the kernel as it was.
#include <string>
#include <vector>

#include "kernel_fixture.h"

namespace kerneltest {
namespace {

const char kRules[] = "ORVI.Core.Network.TrafficControl.Rules";
const char kRouterRules[] = "ORVI.Core.Network.TrafficControl.RouterRules";

class TcapiKernel : public KernelTest {
 protected:
  ProcResult Call(const char* api, const char* method, const std::string& params) {
    return topo().Exec(
        topo().R(),
        {std::string(TC_BIN_DIR) + "/tcapi", "call", api, method, params, "--root", root().dir()},
        root().KernelEnv());
  }
  std::string ClassShow() { return topo().Tc(topo().R(), {"class", "show", "dev", "br0"}); }
  std::string QdiscShow() { return topo().Tc(topo().R(), {"qdisc", "show", "dev", "br0"}); }
  std::string FilterShow() { return topo().Tc(topo().R(), {"filter", "show", "dev", "br0"}); }
};

size_t Count(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t p = text.find(what); p != std::string::npos; p = text.find(what, p + 1)) ++n;
  return n;
}

const char kTwoRules[] =
    R"({"adapter":"br0","rules":[)"
    R"({"enabled":true,"protocol":"tcp","minrate":100,"maxrate":1000,"port_type":"SELF",)"
    R"("port_num":"80,443","port_direction":"dest","source":"10.211.2.0/24","ip_direction":"dest"},)"
    R"({"enabled":true,"protocol":"udp","minrate":200,"maxrate":0,"port_type":"ALL"}]})";

TEST_F(TcapiKernel, SavedRulesBecomeTheDevicesClassesAndFilters) {
  ProcResult save = Call(kRules, "save", kTwoRules);
  ASSERT_EQ(save.exitCode, 0) << save.out << save.err;
  EXPECT_EQ(save.out, "{\"data\":null,\"success\":true}\n");

  const std::string classes = ClassShow();
  // Parent and default class, then one class per rule: 100/1000 KB/s and
  // 200 KB/s up to the device's 125000 KB/s bound.
  EXPECT_EQ(Count(classes, "class htb"), 4u) << classes;
  EXPECT_NE(classes.find("class htb 1:10 parent 1:1"), std::string::npos) << classes;
  EXPECT_NE(classes.find("rate 800Kbit ceil 8Mbit"), std::string::npos) << classes;
  EXPECT_NE(classes.find("rate 1600Kbit ceil 1Gbit"), std::string::npos) << classes;
  const std::string filters = FilterShow();
  // Two ports of the first rule (IPv4 destination), and the second rule for
  // IPv4 and IPv6 alike.
  EXPECT_EQ(Count(filters, "flowid 1:10"), 2u) << filters;
  EXPECT_EQ(Count(filters, "flowid 1:11"), 2u) << filters;

  ProcResult load = Call(kRules, "load", R"({"adapter":"br0"})");
  EXPECT_EQ(load.exitCode, 0) << load.err;
  EXPECT_NE(load.out.find("\"total\":2"), std::string::npos) << load.out;
}

TEST_F(TcapiKernel, RefusedSaveLeavesTheKernelAsItWas) {
  ASSERT_EQ(Call(kRules, "save", kTwoRules).exitCode, 0);
  const std::string classes = ClassShow(), filters = FilterShow();

  // A ceiling above the device's bound: refused before any device is touched.
  ProcResult save = Call(kRules, "save",
                         R"({"adapter":"br0","rules":[{"enabled":true,"protocol":"tcp",)"
                         R"("minrate":100,"maxrate":200000,"port_type":"ALL"}]})");
  EXPECT_EQ(save.exitCode, 1);
  EXPECT_EQ(save.out, "{\"error\":{\"code\":1202},\"success\":false}\n");
  EXPECT_EQ(ClassShow(), classes);
  EXPECT_EQ(FilterShow(), filters);
}

TEST_F(TcapiKernel, EmptyDownloadRulesRestoreTheDefaultQdisc) {
  ASSERT_EQ(Call(kRules, "save", kTwoRules).exitCode, 0);
  ASSERT_NE(QdiscShow().find("qdisc htb 1: root"), std::string::npos) << QdiscShow();

  ProcResult save = Call(kRouterRules, "save", R"({"direction":"download","rules":[]})");
  EXPECT_EQ(save.exitCode, 0) << save.out << save.err;
  const std::string qdisc = QdiscShow();
  EXPECT_EQ(qdisc.find("htb"), std::string::npos) << qdisc;
  EXPECT_EQ(Count(ClassShow(), "class htb"), 0u);
}

}  // namespace
}  // namespace kerneltest
