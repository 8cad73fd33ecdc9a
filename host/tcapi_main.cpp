// tcapi: loads a web API module and runs its methods from the command line
// or over HTTP, in the real appliance root or a simulated one.
#include <limits.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <stdio.h>

#include <iostream>
#include <memory>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>

#include "appliance_root.h"
#include "http_server.h"
#include "module_host.h"
#include "olibc.h"
#include "orvi_fw_tc.h"

#ifndef TCAPI_VERSION
#define TCAPI_VERSION "0.0.0"
#endif

namespace {

const char kModuleFile[] = "ORVI.Core.Network.TrafficControl.so";

// Exit statuses.
const int kExitOk = 0;
const int kExitApiError = 1;
const int kExitUsage = 2;

int Fail(const std::string& message) {
  std::cerr << "tcapi: " << tcapi::OneLine(message) << std::endl;
  return kExitUsage;
}

bool IsFile(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

// The module built beside this program: <bindir>/../lib/<module>, else
// <bindir>/<module>.
bool DefaultModule(std::string* path, std::string* error) {
  char self[PATH_MAX];
  ssize_t n = readlink("/proc/self/exe", self, sizeof self - 1);
  if (n <= 0) {
    *error = "cannot find the module beside tcapi (/proc/self/exe unreadable); give --module PATH";
    return false;
  }
  self[n] = '\0';
  std::string binDir(self);
  binDir.erase(binDir.rfind('/'));
  const std::vector<std::string> candidates = {binDir + "/../lib/" + kModuleFile,
                                               binDir + "/" + kModuleFile};
  for (const std::string& candidate : candidates) {
    if (IsFile(candidate)) {
      *path = candidate;
      return true;
    }
  }
  *error = "no module found at " + candidates[0] + " or " + candidates[1] + "; give --module PATH";
  return false;
}

// Options shared by `call` and `serve`.
struct HostOptions {
  std::string root;
  std::string module;
  bool logStderr = false;
  // Given on the command line (even as ""), rather than left to the default.
  bool rootGiven = false;
  bool moduleGiven = false;
};

void AddHostOptions(CLI::App* cmd, HostOptions* options) {
  cmd->add_option_function<std::string>(
      "--root",
      [options](const std::string& value) {
        options->root = value;
        options->rootGiven = true;
      },
      "appliance root directory (sets ORVI_ROOT; default: the environment's, or /)");
  cmd->add_option_function<std::string>(
      "--module",
      [options](const std::string& value) {
        options->module = value;
        options->moduleGiven = true;
      },
      "module to load (default: the one built beside tcapi)");
  cmd->add_flag("--log-stderr", options->logStderr, "copy the system log lines to standard error");
}

// Sets up the root and the log and loads the module; nullptr after printing
// the reason.
std::unique_ptr<tcapi::Module> Prepare(const HostOptions& options, std::string* rootShown) {
  if (options.rootGiven) {
    std::string absolute;
    std::string error;
    if (!tcapi::ResolveRoot(options.root, &absolute, &error)) {
      Fail(error);
      return nullptr;
    }
    // Before the module loads: the platform reads it on every call.
    setenv("ORVI_ROOT", absolute.c_str(), 1);
  }
  const char* env = getenv("ORVI_ROOT");
  *rootShown = (env != nullptr && *env != '\0') ? env : "/";
  // With LOG_PERROR the module's lines reach standard error as they are,
  // after the ident.
  openlog("tcapi", options.logStderr ? LOG_PERROR : 0, LOG_USER);

  std::string path = options.module;
  std::string error;
  if (!options.moduleGiven && !DefaultModule(&path, &error)) {
    Fail(error);
    return nullptr;
  }
  std::unique_ptr<tcapi::Module> module = tcapi::Module::Load(path, &error);
  if (!module) Fail(error);
  return module;
}

int RunCall(const HostOptions& options, const std::string& api, const std::string& method,
            int32_t version, const std::string& paramsText) {
  // Bad parameters are reported before anything is loaded.
  Json::Value params;
  std::string error;
  if (!tcapi::ParseParams(paramsText, &params, &error)) return Fail(error);
  std::string rootShown;
  std::unique_ptr<tcapi::Module> module = Prepare(options, &rootShown);
  if (!module) return kExitUsage;
  const tcapi::Route* route = nullptr;
  tcapi::LookupResult found = module->Find(api, version, method, &route);
  if (found != tcapi::LookupResult::kFound) {
    return Fail(tcapi::Module::LookupMessage(found, api, version, method));
  }
  tcapi::Outcome outcome = tcapi::Invoke(*route, params);
  if (outcome.kind == tcapi::Outcome::kInternalError) {
    return Fail(api + " " + method + ": " + outcome.message);
  }
  std::cout << tcapi::CompactJson(outcome.answer) << std::endl;
  if (!std::cout) return Fail("cannot write the answer to standard output");
  return outcome.kind == tcapi::Outcome::kSuccess ? kExitOk : kExitApiError;
}

int RunServe(const HostOptions& options, const std::string& listen) {
  tcapi::ListenAddress address;
  std::string error;
  if (!tcapi::ParseListen(listen, &address, &error)) return Fail(error);
  std::string rootShown;
  std::unique_ptr<tcapi::Module> module = Prepare(options, &rootShown);
  if (!module) return kExitUsage;
  return tcapi::Serve(*module, address, rootShown);
}

int RunInitRoot(const std::string& dir, bool demo) {
  std::string error;
  if (!tcapi::InitRoot(dir, demo, &error)) return Fail(error);
  std::cout << "tcapi: appliance root " << dir << (demo ? " (demo router)" : "") << " ready"
            << std::endl;
  return kExitOk;
}

// Prints the tc batch that the live rules of one adapter give, through the
// same checks as a reload, without applying anything.
int RunPlan(const std::string& root, bool rootGiven, const std::string& adapter) {
  if (rootGiven) {
    std::string absolute;
    std::string error;
    if (!tcapi::ResolveRoot(root, &absolute, &error)) return Fail(error);
    setenv("ORVI_ROOT", absolute.c_str(), 1);
  }
  char* batch = nullptr;
  int r = ORVIFwTcRulePlan("/etc/tc", adapter.c_str(), &batch);
  std::unique_ptr<char, decltype(&free)> owned(batch, &free);
  if (r < 0) {
    char detail[128];
    snprintf(detail, sizeof detail, "error 0x%04X at %s:%d", OLIBCErrGet(), OLIBCErrorGetFile(),
             OLIBCErrorGetLine());
    std::cerr << "tcapi: no plan for " << tcapi::OneLine(adapter) << " (result " << r << ", "
              << detail << ")" << std::endl;
    return kExitApiError;
  }
  std::cout << owned.get();
  return std::cout ? kExitOk : Fail("cannot write the batch to standard output");
}

}  // namespace

int main(int argc, char** argv) {
  // A reader that goes away early (tcapi call ... | head) must give a write
  // error and exit status 2, not a silent death by signal.
  signal(SIGPIPE, SIG_IGN);
  CLI::App app{"tcapi: runs the methods of a web API module from the command line or over HTTP"};
  app.set_version_flag("--version", std::string("tcapi ") + TCAPI_VERSION);
  app.require_subcommand(1);

  HostOptions callOptions;
  std::string api;
  std::string method;
  std::string paramsText;
  int32_t version = 1;
  CLI::App* call = app.add_subcommand("call", "run one method and print its JSON answer");
  call->add_option("API", api, "API name")->required();
  call->add_option("METHOD", method, "method name")->required();
  call->add_option("PARAMS_JSON", paramsText, "parameters, a JSON object (default: {})");
  call->add_option("--api-version", version, "API version")->capture_default_str();
  AddHostOptions(call, &callOptions);

  HostOptions serveOptions;
  std::string listen = "127.0.0.1:8080";
  CLI::App* serve = app.add_subcommand("serve", "serve POST /api/<API>/<version>/<method>");
  serve->add_option("--listen", listen, "HOST:PORT to listen on (port 0: any free port)")
      ->capture_default_str();
  AddHostOptions(serve, &serveOptions);

  std::string rootDir;
  bool demo = false;
  CLI::App* init = app.add_subcommand("init-root", "create a simulated appliance root");
  init->add_option("DIR", rootDir, "directory to create or complete")->required();
  init->add_flag("--demo", demo, "a router with interfaces eth0, eth1, wan0, br0, br1, gbr");

  std::string planAdapter;
  std::string planRoot;
  bool planRootGiven = false;
  CLI::App* plan = app.add_subcommand("plan", "print the tc batch of one adapter's live rules");
  plan->add_option("ADAPTER", planAdapter, "adapter name (\"upload\": the WAN device)")->required();
  plan->add_option_function<std::string>(
      "--root",
      [&](const std::string& value) {
        planRoot = value;
        planRootGiven = true;
      },
      "appliance root directory (sets ORVI_ROOT)");

  try {
    app.parse(argc, argv);
  } catch (const CLI::Success& e) {
    return app.exit(e);  // --help, --version
  } catch (const CLI::ParseError& e) {
    return Fail(std::string(e.what()) + " (see tcapi --help)");
  }

  try {
    if (call->parsed()) return RunCall(callOptions, api, method, version, paramsText);
    if (serve->parsed()) return RunServe(serveOptions, listen);
    if (plan->parsed()) return RunPlan(planRoot, planRootGiven, planAdapter);
    return RunInitRoot(rootDir, demo);
  } catch (const std::exception& e) {
    return Fail(std::string("internal error: ") + e.what());
  } catch (...) {
    // A module may throw anything from its loading code or its table.
    return Fail("internal error: an exception that is not a std::exception");
  }
}
