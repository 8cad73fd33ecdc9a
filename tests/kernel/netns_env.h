// A small routed appliance in network namespaces of the test's own, for tests
// that need the real kernel:
//
//   ns W (WAN host)          ns R (the appliance)                ns L (LAN host)
//   w0 10.211.1.2/24 ---veth--- rw0 10.211.1.1/24
//   fd00:211:1::2/64             fd00:211:1::1/64
//                               br0 10.211.2.1/24  [port rl0] ---veth--- l0 10.211.2.2/24
//                               fd00:211:2::1/64                       fd00:211:2::2/64
//
// R forwards between rw0 and br0, so traffic from W to L leaves R through
// br0's egress, where the appliance shapes "download" traffic. Namespace
// names carry the test's pid; they are deleted when the object goes away,
// and stale ones of dead test processes are removed on creation.
#ifndef TC_TESTS_KERNEL_NETNS_ENV_H
#define TC_TESTS_KERNEL_NETNS_ENV_H

#include <chrono>
#include <map>
#include <string>
#include <vector>

namespace kerneltest {

struct ProcResult {
  int exitCode = -1;  // -1 when it did not exit normally
  std::string out;
  std::string err;
};

// Runs argv (argv[0] an absolute path) with posix_spawn, no shell; output
// captured (bounded), killed after `timeout`. extraEnv adds/overrides.
ProcResult Run(const std::vector<std::string>& argv,
               std::chrono::milliseconds timeout = std::chrono::seconds(30),
               const std::map<std::string, std::string>& extraEnv = {});

// Absolute paths of ip and tc, "" when missing.
std::string IpPath();
std::string TcPath();

// "" when kernel tests can run here, otherwise why not.
std::string KernelTestsUnavailable();

// Addresses of the topology.
struct Addr {
  static constexpr const char* kW4 = "10.211.1.2";
  static constexpr const char* kL4 = "10.211.2.2";
  static constexpr const char* kW6 = "fd00:211:1::2";
  static constexpr const char* kL6 = "fd00:211:2::2";
};

class Topology {
 public:
  Topology();
  ~Topology();
  Topology(const Topology&) = delete;
  Topology& operator=(const Topology&) = delete;

  // Builds the namespaces; false with *error set when that fails (whatever
  // was made is removed again by the destructor).
  bool Create(std::string* error);

  const std::string& W() const { return w_; }
  const std::string& R() const { return r_; }
  const std::string& L() const { return l_; }
  // MAC address of l0 in L, as ip prints it.
  std::string LanHostMac() const;
  // MAC address of a device in a namespace ("" when unknown).
  std::string Mac(const std::string& ns, const std::string& dev) const;

  // `ip netns exec NS argv...`.
  ProcResult Exec(const std::string& ns, const std::vector<std::string>& argv,
                  const std::map<std::string, std::string>& extraEnv = {}) const;
  // `tc ARGS...` inside NS; the standard output (empty on failure).
  std::string Tc(const std::string& ns, const std::vector<std::string>& args) const;
  // "" when the kernel takes an HTB root, a u32 filter and a pfifo leaf on
  // the bridge of R; else why not (a kernel built without them).
  std::string TrafficControlUnavailable() const;

 private:
  bool Ip(const std::vector<std::string>& args, std::string* error);
  void Destroy();

  std::string w_, r_, l_;
  std::vector<std::string> made_;
};

// While alive, the calling thread is inside the namespace: sockets it makes
// and programs it starts belong there. Restores the previous one on exit.
class InNamespace {
 public:
  explicit InNamespace(const std::string& ns);
  ~InNamespace();
  InNamespace(const InNamespace&) = delete;
  InNamespace& operator=(const InNamespace&) = delete;
  bool ok() const { return ok_; }

 private:
  int original_ = -1;
  bool ok_ = false;
};

// Writes "1" to a /proc/sys file as seen from the namespace.
bool SetSysctl(const std::string& ns, const std::string& procPath);

// An appliance root for programs run inside R (e.g. tcapi in kernel mode):
// router mode, wan_interface rw0, the devices br0 (a bridge), rw0 and rl0 as
// Ethernet links, an empty etc/tc/, and tc_bandwidth_<dev> overrides for the
// given devices so that bounds are the test's choice, not the veth speed.
// Removed with everything in it when destroyed.
class ApplianceRoot {
 public:
  explicit ApplianceRoot(const std::map<std::string, long long>& bandwidthKBps = {});
  ~ApplianceRoot();
  ApplianceRoot(const ApplianceRoot&) = delete;
  ApplianceRoot& operator=(const ApplianceRoot&) = delete;
  const std::string& dir() const { return dir_; }
  bool ok() const { return !dir_.empty(); }
  // Environment for a program that should use this root in kernel mode.
  std::map<std::string, std::string> KernelEnv() const;

 private:
  std::string dir_;
};

}  // namespace kerneltest

#endif
