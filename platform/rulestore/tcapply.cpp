// Applying a device's batch: written to <root>/run/tc/<dev>.tc in plan mode,
// run by one `tc -batch -` in kernel mode, with the last batch that tc
// accepted kept in the same file and re-applied when tc refuses a new one.
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>

#include <cstring>
#include <map>
#include <memory>
#include <mutex>

#include "olibc.h"
#include "orvi_root.h"
#include "tcgen.h"
#include "tcgen_detail.h"

extern char** environ;

namespace tcgen {
namespace {

class Fd {
 public:
  explicit Fd(int fd = -1) : fd_(fd) {}
  ~Fd() { Reset(); }
  Fd(const Fd&) = delete;
  Fd& operator=(const Fd&) = delete;
  int Get() const { return fd_; }
  bool Valid() const { return fd_ >= 0; }
  void Reset(int fd = -1) {
    if (fd_ >= 0) close(fd_);
    fd_ = fd;
  }

 private:
  int fd_;
};

class SpawnActions {
 public:
  SpawnActions() { ok_ = posix_spawn_file_actions_init(&fa_) == 0; }
  ~SpawnActions() {
    if (ok_) posix_spawn_file_actions_destroy(&fa_);
  }
  SpawnActions(const SpawnActions&) = delete;
  SpawnActions& operator=(const SpawnActions&) = delete;
  bool ok() const { return ok_; }
  posix_spawn_file_actions_t* get() { return &fa_; }

 private:
  posix_spawn_file_actions_t fa_;
  bool ok_;
};

class SpawnAttr {
 public:
  SpawnAttr() { ok_ = posix_spawnattr_init(&attr_) == 0; }
  ~SpawnAttr() {
    if (ok_) posix_spawnattr_destroy(&attr_);
  }
  SpawnAttr(const SpawnAttr&) = delete;
  SpawnAttr& operator=(const SpawnAttr&) = delete;
  bool ok() const { return ok_; }
  posix_spawnattr_t* get() { return &attr_; }

 private:
  posix_spawnattr_t attr_;
  bool ok_;
};

constexpr int kTcTimeoutMs = 60000;  // a batch of 1000 filters takes well under a second
constexpr size_t kMaxErrText = 4096;
constexpr size_t kMaxBatchFile = 16u << 20;

const char* TcPath() {
  static const char* const candidates[] = {"/sbin/tc", "/usr/sbin/tc"};
  for (const char* p : candidates) {
    if (access(p, X_OK) == 0) return p;
  }
  return nullptr;
}

long long NowMs() {
  struct timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return static_cast<long long>(ts.tv_sec) * 1000 + ts.tv_nsec / 1000000;
}

// Runs `tc -batch -` with the batch on standard input. true when tc exits 0;
// otherwise *err says why (tc's own messages when it printed any).
bool RunTcBatch(const std::string& batch, std::string* err) {
  err->clear();
  const char* tc = TcPath();
  if (tc == nullptr) {
    *err = "tc not found in /sbin or /usr/sbin";
    return false;
  }
  // A socket rather than a pipe for tc's input: send(MSG_NOSIGNAL) reports a
  // tc that stopped reading without raising SIGPIPE in the caller.
  int sv[2];
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv) != 0) {
    *err = std::string("socketpair: ") + std::strerror(errno);
    return false;
  }
  Fd in(sv[0]), childIn(sv[1]);
  int ep[2];
  if (pipe2(ep, O_CLOEXEC) != 0) {
    *err = std::string("pipe: ") + std::strerror(errno);
    return false;
  }
  Fd errRead(ep[0]), errWrite(ep[1]);

  SpawnActions fa;
  SpawnAttr attr;
  if (!fa.ok() || !attr.ok()) {
    *err = "posix_spawn setup failed";
    return false;
  }
  sigset_t none, defaults;
  sigemptyset(&none);
  sigemptyset(&defaults);
  sigaddset(&defaults, SIGPIPE);
  if (posix_spawn_file_actions_adddup2(fa.get(), childIn.Get(), 0) != 0 ||
      posix_spawn_file_actions_addopen(fa.get(), 1, "/dev/null", O_WRONLY, 0) != 0 ||
      posix_spawn_file_actions_adddup2(fa.get(), errWrite.Get(), 2) != 0 ||
#if defined(__GLIBC__) && (__GLIBC__ > 2 || (__GLIBC__ == 2 && __GLIBC_MINOR__ >= 34))
      posix_spawn_file_actions_addclosefrom_np(fa.get(), 3) != 0 ||  // nothing else leaks to tc
#endif
      posix_spawnattr_setsigmask(attr.get(), &none) != 0 ||
      posix_spawnattr_setsigdefault(attr.get(), &defaults) != 0 ||
      posix_spawnattr_setflags(attr.get(), POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF) != 0) {
    *err = "posix_spawn setup failed";
    return false;
  }
  char arg0[] = "tc", arg1[] = "-batch", arg2[] = "-";
  char* argv[] = {arg0, arg1, arg2, nullptr};
  pid_t pid = -1;
  int rc = posix_spawn(&pid, tc, fa.get(), attr.get(), argv, environ);
  childIn.Reset();
  errWrite.Reset();
  if (rc != 0) {
    *err = std::string("cannot start tc: ") + std::strerror(rc);
    return false;
  }

  fcntl(in.Get(), F_SETFL, fcntl(in.Get(), F_GETFL) | O_NONBLOCK);
  fcntl(errRead.Get(), F_SETFL, fcntl(errRead.Get(), F_GETFL) | O_NONBLOCK);
  size_t sent = 0;
  if (batch.empty()) in.Reset();
  const long long deadline = NowMs() + kTcTimeoutMs;
  bool timedOut = false;
  std::string tcErr;
  while (in.Valid() || errRead.Valid()) {
    struct pollfd fds[2];
    nfds_t n = 0;
    int inIdx = -1, errIdx = -1;
    if (in.Valid()) {
      inIdx = static_cast<int>(n);
      fds[n++] = {in.Get(), POLLOUT, 0};
    }
    if (errRead.Valid()) {
      errIdx = static_cast<int>(n);
      fds[n++] = {errRead.Get(), POLLIN, 0};
    }
    long long left = deadline - NowMs();
    if (left <= 0) {
      timedOut = true;
      break;
    }
    int pr = poll(fds, n, static_cast<int>(left));
    if (pr < 0) {
      if (errno == EINTR) continue;
      timedOut = true;  // cannot wait for tc any more: treat like a hang
      break;
    }
    if (inIdx >= 0 && fds[inIdx].revents != 0) {
      ssize_t w = send(in.Get(), batch.data() + sent, batch.size() - sent, MSG_NOSIGNAL);
      if (w > 0) {
        sent += static_cast<size_t>(w);
        if (sent == batch.size()) in.Reset();  // EOF ends the batch
      } else if (w < 0 && errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) {
        in.Reset();  // tc stopped reading: its exit status tells the rest
      }
    }
    if (errIdx >= 0 && fds[errIdx].revents != 0) {
      char buf[1024];
      ssize_t r = read(errRead.Get(), buf, sizeof buf);
      if (r > 0) {
        size_t room = kMaxErrText - std::min(kMaxErrText, tcErr.size());
        tcErr.append(buf, std::min(room, static_cast<size_t>(r)));
      } else if (r == 0 || (errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR)) {
        errRead.Reset();
      }
    }
  }
  if (timedOut) kill(pid, SIGKILL);
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) {
      *err = std::string("waitpid: ") + std::strerror(errno);
      return false;
    }
  }
  if (!timedOut && WIFEXITED(status) && WEXITSTATUS(status) == 0) return true;
  if (timedOut) {
    *err = "tc did not finish in time";
  } else if (WIFSIGNALED(status)) {
    *err = "tc killed by signal " + std::to_string(WTERMSIG(status));
  } else {
    *err = "tc exit status " + std::to_string(WEXITSTATUS(status));
  }
  if (!tcErr.empty()) *err += ": " + tcErr;
  return false;
}

// tc's messages on one log line.
std::string OneLine(const std::string& s) {
  std::string out;
  for (char c : s) {
    unsigned char u = static_cast<unsigned char>(c);
    out += c == '\n' ? ' ' : (u >= 0x20 && u < 0x7f) ? c : '?';
  }
  while (!out.empty() && out.back() == ' ') out.pop_back();
  return out;
}

bool MakeDir(const std::string& path) {
  if (mkdir(path.c_str(), 0755) == 0 || errno == EEXIST) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
  }
  return false;
}

bool EnsureRunDir(std::string* dir) {
  *dir = orvi::RootPath("/run/tc");
  return MakeDir(orvi::RootPath("/run")) && MakeDir(*dir);
}

bool WriteAll(int fd, const std::string& data) {
  size_t off = 0;
  while (off < data.size()) {
    ssize_t w = write(fd, data.data() + off, data.size() - off);
    if (w < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    off += static_cast<size_t>(w);
  }
  return true;
}

// Written beside the target and renamed over it: readers never see half a
// batch. No fsync: run/ does not outlive a reboot (and the kernel's tree does
// not either), so it would only slow every apply down.
bool WriteFileAtomic(const std::string& path, const std::string& data) {
  std::string tmpl = path + ".XXXXXX";
  std::unique_ptr<char[]> name(new char[tmpl.size() + 1]);
  std::memcpy(name.get(), tmpl.c_str(), tmpl.size() + 1);
  Fd fd(mkostemp(name.get(), O_CLOEXEC));
  if (!fd.Valid()) return false;
  bool ok = fchmod(fd.Get(), 0644) == 0 && WriteAll(fd.Get(), data);
  fd.Reset();
  if (ok) ok = rename(name.get(), path.c_str()) == 0;
  if (!ok) unlink(name.get());
  return ok;
}

// false when the file is missing, unreadable or implausibly large.
bool ReadFile(const std::string& path, std::string* out) {
  Fd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd.Valid()) return false;
  out->clear();
  char buf[8192];
  for (;;) {
    ssize_t r = read(fd.Get(), buf, sizeof buf);
    if (r < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    if (r == 0) return true;
    out->append(buf, static_cast<size_t>(r));
    if (out->size() > kMaxBatchFile) return false;
  }
}

// One mutex per device for the threads of this process; the flock on the
// device's lock file keeps other processes out as well.
std::mutex& DeviceMutex(const std::string& dev) {
  static std::mutex mapMutex;
  static std::map<std::string, std::unique_ptr<std::mutex>> mutexes;
  std::lock_guard<std::mutex> guard(mapMutex);
  std::unique_ptr<std::mutex>& m = mutexes[dev];
  if (!m) m.reset(new std::mutex);
  return *m;
}

int ApplyPlan(const std::string& dev, const std::string& batch) {
  std::string dir;
  if (!EnsureRunDir(&dir) || !WriteFileAtomic(dir + "/" + dev + ".tc", batch)) {
    syslog(LOG_ERR, "tcgen: cannot write the planned batch of %s: %s", dev.c_str(),
           std::strerror(errno));
    ORVI_ERR(OLIBC_ERR_IO);
    return -1;
  }
  return 0;
}

int ApplyKernel(const std::string& dev, const std::string& batch) {
  std::lock_guard<std::mutex> guard(DeviceMutex(dev));
  std::string dir;
  if (!EnsureRunDir(&dir)) {
    syslog(LOG_ERR, "tcgen: cannot create the run directory for %s: %s", dev.c_str(),
           std::strerror(errno));
    ORVI_ERR(OLIBC_ERR_IO);
    return -1;
  }
  Fd lock(open((dir + "/" + dev + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
  if (!lock.Valid()) {
    syslog(LOG_ERR, "tcgen: cannot open the lock file of %s: %s", dev.c_str(),
           std::strerror(errno));
    ORVI_ERR(OLIBC_ERR_IO);
    return -1;
  }
  while (flock(lock.Get(), LOCK_EX) != 0) {
    if (errno != EINTR) {
      syslog(LOG_ERR, "tcgen: cannot lock %s: %s", dev.c_str(), std::strerror(errno));
      ORVI_ERR(OLIBC_ERR_IO);
      return -1;
    }
  }
  const std::string goodPath = dir + "/" + dev + ".tc";
  std::string err;
  if (RunTcBatch(batch, &err)) {
    if (!WriteFileAtomic(goodPath, batch)) {
      // The device has the new tree; only a later rollback would miss it.
      syslog(LOG_WARNING, "tcgen: applied to %s but could not keep the batch: %s", dev.c_str(),
             std::strerror(errno));
    }
    return 0;
  }
  syslog(LOG_ERR, "tcgen: tc refused the batch of %s: %s", dev.c_str(), OneLine(err).c_str());

  // A refused batch may have stopped halfway: put back the last good tree,
  // or the default qdisc when there never was one, never a partial tree.
  std::string previous;
  const bool havePrevious = ReadFile(goodPath, &previous) && !previous.empty();
  const std::string restore = havePrevious ? previous : detail::RestoreDefaultCommands(dev);
  if (RunTcBatch(restore, &err)) {
    syslog(LOG_WARNING, "tcgen: %s: %s", dev.c_str(),
           havePrevious ? "re-applied the last good batch" : "restored the default qdisc");
  } else {
    syslog(LOG_ERR, "tcgen: %s: restoring the previous configuration failed too: %s", dev.c_str(),
           OneLine(err).c_str());
  }
  ORVI_ERR(ORVI_TC_ERR_APPLY);
  return -1;
}

}  // namespace

int Apply(const std::string& device, const std::string& batch, ApplyMode mode) {
  if (!detail::ValidDeviceName(device)) {
    syslog(LOG_ERR, "tcgen: device name is not usable with tc");
    ORVI_ERR(0x0016);
    return -1;
  }
  if (batch.empty()) {
    // Every generated batch has commands; an empty one would also become a
    // last good batch that restores nothing.
    syslog(LOG_ERR, "tcgen: %s: refusing an empty batch", device.c_str());
    ORVI_ERR(0x0016);
    return -1;
  }
  return mode == ApplyMode::kPlan ? ApplyPlan(device, batch) : ApplyKernel(device, batch);
}

}  // namespace tcgen
