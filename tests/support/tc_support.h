// Helpers for integration tests that drive the real tcapi binary: temporary
// directories, demo appliance roots and running programs with captured output.
#ifndef TC_SUPPORT_H
#define TC_SUPPORT_H

#include <sys/types.h>

#include <chrono>
#include <map>
#include <string>
#include <vector>

#include <json/json.h>

namespace tcsupport {

// A fresh directory under /tmp (mkdtemp), removed with everything in it when
// the object is destroyed. Movable, not copyable.
class TempDir {
 public:
  explicit TempDir(const std::string& prefix = "tc-test-");
  ~TempDir();
  TempDir(TempDir&& other) noexcept;
  TempDir& operator=(TempDir&& other) noexcept;
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  // Absolute path of the directory ("" after being moved from).
  const std::string& path() const { return path_; }
  // path() + "/" + relative.
  std::string Join(const std::string& relative) const;

 private:
  std::string path_;
};

// Removes a file or a directory tree; missing paths are fine.
void RemoveTree(const std::string& path);
// Whole file as text; throws std::runtime_error when it cannot be read.
std::string ReadFile(const std::string& path);
// Creates or replaces a file; throws std::runtime_error on failure.
void WriteFile(const std::string& path, const std::string& text);
bool PathExists(const std::string& path);
bool IsDirectory(const std::string& path);

// The outcome of a finished program.
struct RunResult {
  int exitCode = -1;       // exit status, or -1 when it did not exit normally
  int termSignal = 0;      // the signal that ended it, 0 when it exited
  bool timedOut = false;   // killed by Run because it took too long
  std::string out;         // everything written to standard output
  std::string err;         // everything written to standard error
  bool jsonValid = false;  // standard output held exactly one JSON value
  Json::Value json;        // that value (null otherwise)
};

// Runs argv[0] (a path, not searched in PATH) with argv, the current
// environment plus extraEnv (which overrides), and stdinText on standard
// input; captures both outputs. A program still running after `timeout` is
// killed. Throws std::runtime_error when the program cannot be started.
RunResult Run(const std::vector<std::string>& argv,
              const std::map<std::string, std::string>& extraEnv = {},
              const std::string& stdinText = "",
              std::chrono::milliseconds timeout = std::chrono::seconds(120));

// The tcapi binary of this build tree.
std::string TcapiPath();
// Directory of this build tree's libraries (the module and the platform).
std::string LibDir();

// `tcapi <args...> [--root root]`; json/jsonValid filled from standard output.
RunResult RunTcapi(const std::vector<std::string>& args, const std::string& root = "",
                   const std::map<std::string, std::string>& extraEnv = {});
// `tcapi call API METHOD '<params as compact JSON>' --root root`.
RunResult CallTcapi(const std::string& api, const std::string& method, const Json::Value& params,
                    const std::string& root,
                    const std::map<std::string, std::string>& extraEnv = {});

// A temporary directory made into a simulated router appliance by
// `tcapi init-root <dir> --demo`. Throws std::runtime_error when that fails.
TempDir MakeDemoRoot();

// Compact one-line JSON text of a value.
std::string ToCompactJson(const Json::Value& value);
// Parses text that must hold exactly one JSON value; false when it does not.
bool ParseJson(const std::string& text, Json::Value* value);

// A program left running in the background (a server), its standard output
// and error going to files so that it can never block on a full pipe.
// Destroying it sends SIGKILL if it is still running and reaps it.
class Background {
 public:
  Background(const std::vector<std::string>& argv,
             const std::map<std::string, std::string>& extraEnv = {});
  ~Background();
  Background(const Background&) = delete;
  Background& operator=(const Background&) = delete;

  pid_t pid() const { return pid_; }
  bool Running();
  // What it has written so far.
  std::string Out() const;
  std::string Err() const;
  // Waits up to `timeout` for standard output to contain `text`; false when
  // the time runs out or the program ends first.
  bool WaitForOutput(const std::string& text, std::chrono::milliseconds timeout);
  // Sends `sig`, waits up to `timeout` for the program to end (SIGKILL after
  // that, reported as timedOut) and returns how it ended with its output.
  RunResult Stop(int sig, std::chrono::milliseconds timeout = std::chrono::seconds(20));

 private:
  TempDir logs_;
  pid_t pid_ = -1;
  bool reaped_ = false;
  int status_ = 0;
};

}  // namespace tcsupport

#endif
