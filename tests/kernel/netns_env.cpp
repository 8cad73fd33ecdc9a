#include "netns_env.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <fstream>

extern char** environ;

namespace kerneltest {
namespace {

constexpr size_t kMaxOutput = 1 << 20;

std::string FirstExecutable(const std::vector<const char*>& paths) {
  for (const char* p : paths) {
    if (access(p, X_OK) == 0) return p;
  }
  return "";
}

const char kPrefix[] = "tck-";

// Namespaces of earlier test processes that died before cleaning up.
void RemoveStaleNamespaces() {
  DIR* d = opendir("/run/netns");
  if (d == nullptr) return;
  std::vector<std::string> stale;
  while (struct dirent* e = readdir(d)) {
    std::string name = e->d_name;
    if (name.rfind(kPrefix, 0) != 0) continue;
    long pid = std::strtol(name.c_str() + sizeof kPrefix - 1, nullptr, 10);
    if (pid > 0 && kill(static_cast<pid_t>(pid), 0) != 0 && errno == ESRCH) stale.push_back(name);
  }
  closedir(d);
  for (const std::string& name : stale) Run({IpPath(), "netns", "del", name});
}

}  // namespace

ProcResult Run(const std::vector<std::string>& argv, std::chrono::milliseconds timeout,
               const std::map<std::string, std::string>& extraEnv) {
  ProcResult result;
  int outPipe[2], errPipe[2];
  if (argv.empty() || pipe2(outPipe, O_CLOEXEC) != 0) return result;
  if (pipe2(errPipe, O_CLOEXEC) != 0) {
    close(outPipe[0]);
    close(outPipe[1]);
    return result;
  }
  std::map<std::string, std::string> env;
  for (char** e = environ; *e != nullptr; ++e) {
    const char* eq = std::strchr(*e, '=');
    if (eq != nullptr) env[std::string(*e, static_cast<size_t>(eq - *e))] = eq + 1;
  }
  for (const auto& kv : extraEnv) env[kv.first] = kv.second;
  std::vector<std::string> envText;
  for (const auto& kv : env) envText.push_back(kv.first + "=" + kv.second);
  std::vector<char*> cargv, cenv;
  for (const auto& a : argv) cargv.push_back(const_cast<char*>(a.c_str()));
  cargv.push_back(nullptr);
  for (const auto& e : envText) cenv.push_back(const_cast<char*>(e.c_str()));
  cenv.push_back(nullptr);

  posix_spawn_file_actions_t fa;
  posix_spawn_file_actions_init(&fa);
  posix_spawn_file_actions_addopen(&fa, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_adddup2(&fa, outPipe[1], 1);
  posix_spawn_file_actions_adddup2(&fa, errPipe[1], 2);
  pid_t pid = -1;
  int rc = posix_spawn(&pid, cargv[0], &fa, nullptr, cargv.data(), cenv.data());
  posix_spawn_file_actions_destroy(&fa);
  close(outPipe[1]);
  close(errPipe[1]);
  if (rc != 0) {
    close(outPipe[0]);
    close(errPipe[0]);
    result.err = std::string("cannot start ") + argv[0] + ": " + std::strerror(rc);
    return result;
  }
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  int fds[2] = {outPipe[0], errPipe[0]};
  std::string* sinks[2] = {&result.out, &result.err};
  bool killed = false;
  while (fds[0] >= 0 || fds[1] >= 0) {
    struct pollfd p[2];
    for (int i = 0; i < 2; ++i) p[i] = {fds[i], POLLIN, 0};
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                    deadline - std::chrono::steady_clock::now())
                    .count();
    if (left <= 0) {
      kill(pid, SIGKILL);
      killed = true;
      break;
    }
    if (poll(p, 2, static_cast<int>(left)) < 0 && errno != EINTR) break;
    for (int i = 0; i < 2; ++i) {
      if (fds[i] < 0 || p[i].revents == 0) continue;
      char buf[4096];
      ssize_t n = read(fds[i], buf, sizeof buf);
      if (n > 0) {
        if (sinks[i]->size() < kMaxOutput) sinks[i]->append(buf, static_cast<size_t>(n));
      } else if (n == 0 || errno != EINTR) {
        close(fds[i]);
        fds[i] = -1;
      }
    }
  }
  for (int fd : fds) {
    if (fd >= 0) close(fd);
  }
  int status = 0;
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  if (!killed && WIFEXITED(status)) result.exitCode = WEXITSTATUS(status);
  return result;
}

std::string IpPath() { return FirstExecutable({"/usr/sbin/ip", "/sbin/ip", "/bin/ip"}); }
std::string TcPath() { return FirstExecutable({"/usr/sbin/tc", "/sbin/tc"}); }

std::string KernelTestsUnavailable() {
  if (geteuid() != 0) return "kernel tests need root";
  if (IpPath().empty()) return "the ip program (iproute2) is missing";
  if (TcPath().empty()) return "the tc program (iproute2) is missing";
  return "";
}

Topology::Topology() {
  const std::string base = kPrefix + std::to_string(getpid()) + "-";
  static int serial = 0;  // several topologies in one process stay apart
  const std::string n = std::to_string(serial++);
  w_ = base + "w" + n;
  r_ = base + "r" + n;
  l_ = base + "l" + n;
}

Topology::~Topology() { Destroy(); }

bool Topology::Ip(const std::vector<std::string>& args, std::string* error) {
  std::vector<std::string> argv{IpPath()};
  argv.insert(argv.end(), args.begin(), args.end());
  ProcResult r = Run(argv);
  if (r.exitCode == 0) return true;
  std::string cmd;
  for (const auto& a : args) cmd += " " + a;
  *error = "ip" + cmd + ": " + r.err;
  return false;
}

bool Topology::Create(std::string* error) {
  RemoveStaleNamespaces();
  for (const std::string* ns : {&w_, &r_, &l_}) {
    if (!Ip({"netns", "add", *ns}, error)) return false;
    made_.push_back(*ns);
  }
  const std::vector<std::vector<std::string>> steps = {
      {"-n", w_, "link", "add", "w0", "type", "veth", "peer", "name", "rw0", "netns", r_},
      {"-n", l_, "link", "add", "l0", "type", "veth", "peer", "name", "rl0", "netns", r_},
      {"-n", r_, "link", "add", "br0", "type", "bridge"},
      {"-n", r_, "link", "set", "rl0", "master", "br0"},
      {"-n", w_, "addr", "add", "10.211.1.2/24", "dev", "w0"},
      {"-n", w_, "addr", "add", "fd00:211:1::2/64", "dev", "w0", "nodad"},
      {"-n", r_, "addr", "add", "10.211.1.1/24", "dev", "rw0"},
      {"-n", r_, "addr", "add", "fd00:211:1::1/64", "dev", "rw0", "nodad"},
      {"-n", r_, "addr", "add", "10.211.2.1/24", "dev", "br0"},
      {"-n", r_, "addr", "add", "fd00:211:2::1/64", "dev", "br0", "nodad"},
      {"-n", l_, "addr", "add", "10.211.2.2/24", "dev", "l0"},
      {"-n", l_, "addr", "add", "fd00:211:2::2/64", "dev", "l0", "nodad"},
      {"-n", w_, "link", "set", "lo", "up"},
      {"-n", r_, "link", "set", "lo", "up"},
      {"-n", l_, "link", "set", "lo", "up"},
      {"-n", w_, "link", "set", "w0", "up"},
      {"-n", r_, "link", "set", "rw0", "up"},
      {"-n", r_, "link", "set", "rl0", "up"},
      {"-n", r_, "link", "set", "br0", "up"},
      {"-n", l_, "link", "set", "l0", "up"},
      {"-n", w_, "route", "add", "default", "via", "10.211.1.1"},
      {"-n", w_, "-6", "route", "add", "default", "via", "fd00:211:1::1"},
      {"-n", l_, "route", "add", "default", "via", "10.211.2.1"},
      {"-n", l_, "-6", "route", "add", "default", "via", "fd00:211:2::1"},
  };
  for (const auto& step : steps) {
    if (!Ip(step, error)) return false;
  }
  // Fixed neighbour entries: no test waits for, or counts, ARP and neighbour
  // discovery (which right after the links come up does not always succeed).
  const std::string wMac = Mac(w_, "w0"), rwMac = Mac(r_, "rw0"), brMac = Mac(r_, "br0"),
                    lMac = Mac(l_, "l0");
  const std::vector<std::vector<std::string>> neighbours = {
      {w_, "10.211.1.1", rwMac, "w0"}, {w_, "fd00:211:1::1", rwMac, "w0"},
      {r_, "10.211.1.2", wMac, "rw0"}, {r_, "fd00:211:1::2", wMac, "rw0"},
      {r_, "10.211.2.2", lMac, "br0"}, {r_, "fd00:211:2::2", lMac, "br0"},
      {l_, "10.211.2.1", brMac, "l0"}, {l_, "fd00:211:2::1", brMac, "l0"},
  };
  for (const auto& n : neighbours) {
    if (n[2].size() != 17) {
      *error = "cannot read the MAC address of a test device";
      return false;
    }
    if (!Ip({"-n", n[0], "neigh", "replace", n[1], "lladdr", n[2], "dev", n[3], "nud", "permanent"},
            error))
      return false;
  }
  if (!SetSysctl(r_, "/proc/sys/net/ipv4/ip_forward") ||
      !SetSysctl(r_, "/proc/sys/net/ipv6/conf/all/forwarding")) {
    *error = "cannot enable forwarding in the appliance namespace";
    return false;
  }
  return true;
}

void Topology::Destroy() {
  for (const std::string& ns : made_) Run({IpPath(), "netns", "del", ns});
  made_.clear();
}

std::string Topology::LanHostMac() const { return Mac(l_, "l0"); }

std::string Topology::Mac(const std::string& ns, const std::string& dev) const {
  ProcResult r = Run({IpPath(), "-n", ns, "-br", "link", "show", dev});
  // "l0@if5   UP   aa:bb:cc:dd:ee:ff <...>"
  size_t pos = 0;
  for (int field = 0; field < 2; ++field) {
    pos = r.out.find_first_of(" \t", pos);
    pos = r.out.find_first_not_of(" \t", pos);
    if (pos == std::string::npos) return "";
  }
  return r.out.substr(pos, 17);
}

ProcResult Topology::Exec(const std::string& ns, const std::vector<std::string>& argv,
                          const std::map<std::string, std::string>& extraEnv) const {
  std::vector<std::string> full{IpPath(), "netns", "exec", ns};
  full.insert(full.end(), argv.begin(), argv.end());
  return Run(full, std::chrono::seconds(60), extraEnv);
}

std::string Topology::Tc(const std::string& ns, const std::vector<std::string>& args) const {
  std::vector<std::string> argv{TcPath()};
  argv.insert(argv.end(), args.begin(), args.end());
  ProcResult r = Exec(ns, argv);
  return r.exitCode == 0 ? r.out : std::string();
}

std::string Topology::TrafficControlUnavailable() const {
  const std::vector<std::vector<std::string>> probe = {
      {"qdisc", "add", "dev", "br0", "root", "handle", "1:", "htb", "default", "2"},
      {"class", "add", "dev", "br0", "parent", "1:", "classid", "1:2", "htb", "rate", "1mbit"},
      {"qdisc", "add", "dev", "br0", "parent", "1:2", "handle", "2:", "pfifo", "limit", "10"},
      {"filter", "add", "dev", "br0", "parent", "1:", "protocol", "ip", "prio", "1", "u32",
       "match", "u32", "0", "0", "flowid", "1:2"},
  };
  std::string why;
  for (const auto& args : probe) {
    std::vector<std::string> argv{TcPath()};
    argv.insert(argv.end(), args.begin(), args.end());
    ProcResult r = Exec(r_, argv);
    if (r.exitCode != 0) {
      why = "tc " + args[0] + " " + args[1] + " failed: " + r.err;
      break;
    }
  }
  Exec(r_, {TcPath(), "qdisc", "del", "dev", "br0", "root"});
  return why;
}

InNamespace::InNamespace(const std::string& ns) {
  original_ = open("/proc/thread-self/ns/net", O_RDONLY | O_CLOEXEC);
  int target = open(("/run/netns/" + ns).c_str(), O_RDONLY | O_CLOEXEC);
  if (original_ >= 0 && target >= 0) ok_ = setns(target, CLONE_NEWNET) == 0;
  if (target >= 0) close(target);
}

InNamespace::~InNamespace() {
  if (original_ < 0) return;
  if (ok_ && setns(original_, CLONE_NEWNET) != 0) std::abort();  // never run on in a test ns
  close(original_);
}

bool SetSysctl(const std::string& ns, const std::string& procPath) {
  InNamespace in(ns);
  if (!in.ok()) return false;
  std::ofstream f(procPath);
  f << "1\n";
  f.close();
  return !f.fail();
}

ApplianceRoot::ApplianceRoot(const std::map<std::string, long long>& bandwidthKBps) {
  std::string tmpl = (std::filesystem::temp_directory_path() / "tck-root-XXXXXX").string();
  if (mkdtemp(&tmpl[0]) == nullptr) return;
  dir_ = tmpl;
  namespace fs = std::filesystem;
  std::error_code ec;
  fs::create_directories(dir_ + "/etc/tc", ec);
  std::ofstream conf(dir_ + "/etc/orviinfo.conf");
  conf << "support_net_topology=yes\nnet_topology=router\nwan_interface=rw0\n";
  for (const auto& kv : bandwidthKBps)
    conf << "tc_bandwidth_" << kv.first << "=" << kv.second << "\n";
  for (const char* dev : {"br0", "rw0", "rl0"}) {
    fs::create_directories(dir_ + "/sys/class/net/" + dev, ec);
    std::ofstream(dir_ + "/sys/class/net/" + dev + "/type") << "1\n";
  }
  fs::create_directories(dir_ + "/sys/class/net/br0/bridge", ec);
  if (ec || !conf) {
    fs::remove_all(dir_, ec);
    dir_.clear();
  }
}

ApplianceRoot::~ApplianceRoot() {
  std::error_code ec;
  if (!dir_.empty()) std::filesystem::remove_all(dir_, ec);
}

std::map<std::string, std::string> ApplianceRoot::KernelEnv() const {
  return {{"ORVI_ROOT", dir_}, {"ORVI_TC_APPLY", "kernel"}};
}

}  // namespace kerneltest
