#include "tc_support.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <sstream>
#include <stdexcept>
#include <thread>

extern char** environ;

namespace tcsupport {

namespace {

using Clock = std::chrono::steady_clock;

std::runtime_error SysError(const std::string& what) {
  return std::runtime_error(what + ": " + strerror(errno));
}

// Owns a file descriptor.
class Fd {
 public:
  Fd() = default;
  explicit Fd(int fd) : fd_(fd) {}
  ~Fd() { Close(); }
  Fd(const Fd&) = delete;
  Fd& operator=(const Fd&) = delete;
  int get() const { return fd_; }
  void Reset(int fd) {
    Close();
    fd_ = fd;
  }
  void Close() {
    if (fd_ >= 0) close(fd_);
    fd_ = -1;
  }

 private:
  int fd_ = -1;
};

struct Pipe {
  Fd read;
  Fd write;
};

void MakePipe(Pipe* p) {
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) throw SysError("pipe2");
  p->read.Reset(fds[0]);
  p->write.Reset(fds[1]);
}

// Owns the spawn attribute objects.
class SpawnSetup {
 public:
  SpawnSetup() {
    posix_spawn_file_actions_init(&actions);
    posix_spawnattr_init(&attr);
    // The child starts with no blocked signals and SIGPIPE at its default,
    // whatever this test process does with them.
    sigset_t none, dflt;
    sigemptyset(&none);
    sigemptyset(&dflt);
    sigaddset(&dflt, SIGPIPE);
    sigaddset(&dflt, SIGINT);
    sigaddset(&dflt, SIGTERM);
    posix_spawnattr_setsigmask(&attr, &none);
    posix_spawnattr_setsigdefault(&attr, &dflt);
    posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF);
  }
  ~SpawnSetup() {
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attr);
  }
  SpawnSetup(const SpawnSetup&) = delete;
  SpawnSetup& operator=(const SpawnSetup&) = delete;

  posix_spawn_file_actions_t actions;
  posix_spawnattr_t attr;
};

std::vector<std::string> MergedEnv(const std::map<std::string, std::string>& extra) {
  std::vector<std::string> env;
  for (char** e = environ; e != nullptr && *e != nullptr; ++e) {
    std::string entry(*e);
    std::string key = entry.substr(0, entry.find('='));
    if (extra.count(key) == 0) env.push_back(entry);
  }
  for (const auto& kv : extra) env.push_back(kv.first + "=" + kv.second);
  return env;
}

std::vector<char*> CStrings(std::vector<std::string>& strings) {
  std::vector<char*> out;
  for (std::string& s : strings) out.push_back(&s[0]);
  out.push_back(nullptr);
  return out;
}

pid_t Spawn(const std::vector<std::string>& argv, const std::map<std::string, std::string>& extra,
            SpawnSetup* setup) {
  if (argv.empty()) throw std::runtime_error("Run: empty argument vector");
  std::vector<std::string> args = argv;
  std::vector<std::string> env = MergedEnv(extra);
  std::vector<char*> cargs = CStrings(args);
  std::vector<char*> cenv = CStrings(env);
  pid_t pid = -1;
  int rc = posix_spawn(&pid, cargs[0], &setup->actions, &setup->attr, cargs.data(), cenv.data());
  if (rc != 0) {
    errno = rc;
    throw SysError("posix_spawn " + argv[0]);
  }
  return pid;
}

void FillOutcome(int status, RunResult* r) {
  if (WIFEXITED(status)) {
    r->exitCode = WEXITSTATUS(status);
  } else if (WIFSIGNALED(status)) {
    r->termSignal = WTERMSIG(status);
  }
}

void FillJson(RunResult* r) { r->jsonValid = ParseJson(r->out, &r->json); }

int WaitPid(pid_t pid, int flags, int* status) {
  for (;;) {
    pid_t got = waitpid(pid, status, flags);
    if (got >= 0 || errno != EINTR) return got;
  }
}

}  // namespace

// ---------------------------------------------------------------- files

TempDir::TempDir(const std::string& prefix) {
  std::string pattern = "/tmp/" + prefix + "XXXXXX";
  std::vector<char> buf(pattern.begin(), pattern.end());
  buf.push_back('\0');
  if (mkdtemp(buf.data()) == nullptr) throw SysError("mkdtemp " + pattern);
  path_ = buf.data();
}

TempDir::~TempDir() {
  if (!path_.empty()) RemoveTree(path_);
}

TempDir::TempDir(TempDir&& other) noexcept : path_(std::move(other.path_)) { other.path_.clear(); }

TempDir& TempDir::operator=(TempDir&& other) noexcept {
  if (this != &other) {
    if (!path_.empty()) RemoveTree(path_);
    path_ = std::move(other.path_);
    other.path_.clear();
  }
  return *this;
}

std::string TempDir::Join(const std::string& relative) const { return path_ + "/" + relative; }

void RemoveTree(const std::string& path) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) return;
  if (!S_ISDIR(st.st_mode)) {
    unlink(path.c_str());
    return;
  }
  // A test may have taken away permissions to provoke a failure.
  chmod(path.c_str(), 0700);
  std::vector<std::string> names;
  if (DIR* dir = opendir(path.c_str())) {
    while (struct dirent* entry = readdir(dir)) {
      std::string name = entry->d_name;
      if (name != "." && name != "..") names.push_back(name);
    }
    closedir(dir);
  }
  for (const std::string& name : names) RemoveTree(path + "/" + name);
  rmdir(path.c_str());
}

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) throw std::runtime_error("cannot read " + path);
  std::ostringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

void WriteFile(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  if (!out) throw std::runtime_error("cannot write " + path);
  out << text;
  if (!out.flush()) throw std::runtime_error("cannot write " + path);
}

bool PathExists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

bool IsDirectory(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// ---------------------------------------------------------------- JSON

std::string ToCompactJson(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, value);
}

bool ParseJson(const std::string& text, Json::Value* value) {
  Json::CharReaderBuilder builder;
  builder["failIfExtra"] = true;
  builder["rejectDupKeys"] = true;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string errors;
  Json::Value parsed;
  bool ok = false;
  try {
    ok = reader->parse(text.data(), text.data() + text.size(), &parsed, &errors);
  } catch (const std::exception&) {
    ok = false;
  }
  // An empty output parses as nothing, not as null.
  if (!ok || text.find_first_not_of(" \t\r\n") == std::string::npos) {
    *value = Json::Value();
    return false;
  }
  *value = parsed;
  return true;
}

// ---------------------------------------------------------------- running

RunResult Run(const std::vector<std::string>& argv,
              const std::map<std::string, std::string>& extraEnv, const std::string& stdinText,
              std::chrono::milliseconds timeout) {
  Pipe in, out, err;
  MakePipe(&in);
  MakePipe(&out);
  MakePipe(&err);
  SpawnSetup setup;
  posix_spawn_file_actions_adddup2(&setup.actions, in.read.get(), 0);
  posix_spawn_file_actions_adddup2(&setup.actions, out.write.get(), 1);
  posix_spawn_file_actions_adddup2(&setup.actions, err.write.get(), 2);
  pid_t pid = Spawn(argv, extraEnv, &setup);
  in.read.Close();
  out.write.Close();
  err.write.Close();
  // Our ends must never block: a blocking write of a large input would wait
  // for a child that is itself waiting for us to read its output.
  for (int fd : {in.write.get(), out.read.get(), err.read.get()}) {
    fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
  }

  // Writing to a child that has already closed its input must give EPIPE,
  // not kill the test: block SIGPIPE in this thread while feeding it.
  sigset_t pipeSet, oldSet;
  sigemptyset(&pipeSet);
  sigaddset(&pipeSet, SIGPIPE);
  pthread_sigmask(SIG_BLOCK, &pipeSet, &oldSet);

  RunResult result;
  size_t fed = 0;
  if (stdinText.empty()) in.write.Close();
  const Clock::time_point deadline = Clock::now() + timeout;
  bool killed = false;
  while (out.read.get() >= 0 || err.read.get() >= 0) {
    struct pollfd fds[3];
    nfds_t n = 0;
    Fd* owners[3];
    auto add = [&](Fd& fd, short events) {
      if (fd.get() < 0) return;
      fds[n].fd = fd.get();
      fds[n].events = events;
      fds[n].revents = 0;
      owners[n++] = &fd;
    };
    add(in.write, POLLOUT);
    add(out.read, POLLIN);
    add(err.read, POLLIN);
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now());
    if (left.count() <= 0) {
      if (!killed) kill(pid, SIGKILL);
      killed = true;
      result.timedOut = true;
      break;
    }
    int ready = poll(fds, n, static_cast<int>(std::min<long long>(left.count(), 1000)));
    if (ready < 0 && errno != EINTR) break;
    for (nfds_t i = 0; ready > 0 && i < n; ++i) {
      if (fds[i].revents == 0) continue;
      Fd* fd = owners[i];
      if (fd == &in.write) {
        ssize_t w = write(fd->get(), stdinText.data() + fed, stdinText.size() - fed);
        if (w > 0) fed += static_cast<size_t>(w);
        if (w < 0 && errno != EINTR && errno != EAGAIN) fd->Close();
        if (fed >= stdinText.size()) fd->Close();
        continue;
      }
      char buf[65536];
      ssize_t r = read(fd->get(), buf, sizeof buf);
      if (r > 0) {
        (fd == &out.read ? result.out : result.err).append(buf, static_cast<size_t>(r));
      } else if (r == 0 || (errno != EINTR && errno != EAGAIN)) {
        fd->Close();
      }
    }
  }
  in.write.Close();
  // Swallow a SIGPIPE raised by the feeding above before unblocking it.
  struct timespec zero = {0, 0};
  while (sigtimedwait(&pipeSet, nullptr, &zero) > 0) {
  }
  pthread_sigmask(SIG_SETMASK, &oldSet, nullptr);

  int status = 0;
  if (WaitPid(pid, 0, &status) == pid) FillOutcome(status, &result);
  FillJson(&result);
  return result;
}

std::string TcapiPath() { return std::string(TC_BIN_DIR) + "/tcapi"; }

std::string LibDir() { return TC_LIB_DIR; }

RunResult RunTcapi(const std::vector<std::string>& args, const std::string& root,
                   const std::map<std::string, std::string>& extraEnv) {
  std::vector<std::string> argv{TcapiPath()};
  argv.insert(argv.end(), args.begin(), args.end());
  if (!root.empty()) {
    argv.push_back("--root");
    argv.push_back(root);
  }
  return Run(argv, extraEnv);
}

RunResult CallTcapi(const std::string& api, const std::string& method, const Json::Value& params,
                    const std::string& root, const std::map<std::string, std::string>& extraEnv) {
  return RunTcapi({"call", api, method, ToCompactJson(params)}, root, extraEnv);
}

TempDir MakeDemoRoot() {
  TempDir dir("tc-root-");
  RunResult r = RunTcapi({"init-root", dir.path(), "--demo"});
  if (r.exitCode != 0) {
    throw std::runtime_error("tcapi init-root --demo failed (exit " + std::to_string(r.exitCode) +
                             "): " + r.err);
  }
  return dir;
}

// ---------------------------------------------------------------- background

Background::Background(const std::vector<std::string>& argv,
                       const std::map<std::string, std::string>& extraEnv)
    : logs_("tc-bg-") {
  Fd devnull(open("/dev/null", O_RDONLY | O_CLOEXEC));
  Fd out(open(logs_.Join("out").c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  Fd err(open(logs_.Join("err").c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  if (devnull.get() < 0 || out.get() < 0 || err.get() < 0) throw SysError("Background: open");
  SpawnSetup setup;
  posix_spawn_file_actions_adddup2(&setup.actions, devnull.get(), 0);
  posix_spawn_file_actions_adddup2(&setup.actions, out.get(), 1);
  posix_spawn_file_actions_adddup2(&setup.actions, err.get(), 2);
  pid_ = Spawn(argv, extraEnv, &setup);
}

Background::~Background() {
  if (!reaped_ && pid_ > 0) {
    kill(pid_, SIGKILL);
    WaitPid(pid_, 0, &status_);
  }
}

bool Background::Running() {
  if (reaped_) return false;
  if (WaitPid(pid_, WNOHANG, &status_) == pid_) reaped_ = true;
  return !reaped_;
}

std::string Background::Out() const { return ReadFile(logs_.Join("out")); }

std::string Background::Err() const { return ReadFile(logs_.Join("err")); }

bool Background::WaitForOutput(const std::string& text, std::chrono::milliseconds timeout) {
  const Clock::time_point deadline = Clock::now() + timeout;
  for (;;) {
    if (Out().find(text) != std::string::npos) return true;
    if (!Running() || Clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
}

RunResult Background::Stop(int sig, std::chrono::milliseconds timeout) {
  RunResult result;
  if (!reaped_) {
    kill(pid_, sig);
    const Clock::time_point deadline = Clock::now() + timeout;
    while (Running() && Clock::now() < deadline) {
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    if (!reaped_) {
      kill(pid_, SIGKILL);
      WaitPid(pid_, 0, &status_);
      reaped_ = true;
      result.timedOut = true;
    }
  }
  FillOutcome(status_, &result);
  result.out = Out();
  result.err = Err();
  FillJson(&result);
  return result;
}

}  // namespace tcsupport
