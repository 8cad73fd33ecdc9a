// Fake platform for the module's unit tests: the utility library, the rule
// store and the network SDK, scripted per test and recorded in call order;
// syslog lines are captured. Not thread-safe except where noted: the module's
// concurrency tests use the real platform.
#ifndef TC_FAKE_PLATFORM_H
#define TC_FAKE_PLATFORM_H

#include <deque>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <vector>

namespace fake {

// One stored rule, as the fake rule store keeps it.
struct StoredRule {
  int id = 0;
  int enabled = 0;
  std::string source;
  bool portsNull = false;
  std::string ports;
  int protocol = 0;
  int minrate = 0;
  int maxrate = 0;
  int ipDirection = 0;
};
using RuleFile = std::vector<StoredRule>;
using Dir = std::map<std::string, RuleFile>;  // adapter name -> its rule file

// A scripted answer of ORVIFwTcRuleGetByAdapter for one adapter.
struct GetScript {
  int result = 0;         // returned as is
  bool nullHead = false;  // hand out a list whose chain head is NULL
};

struct State {
  std::vector<std::string> calls;  // "Name(arg,arg)" in call order
  std::vector<std::string> logs;   // whole syslog lines, as the module wrote them

  // Key file values (OLIBCFileGetKeyValue); a key not here is missing.
  std::map<std::string, std::string> keys;
  // Bridges that OLIBNetEnumBridge appends, in order.
  std::vector<std::string> bridges;
  // Interfaces that SDK::Network::EnumInterfacesStatus lists by "id".
  std::vector<std::string> interfaces;

  // Failure injection: the listed 1-based ordinals of calls to a function
  // fail. Keys are function names, or "OLIBCExec /bin/mv" for one program.
  std::map<std::string, std::set<int>> failAt;
  std::map<std::string, int> callCount;

  // Rule store: in-memory configuration directories, changed by the rule
  // file operations and by OLIBCExec of /bin/rm, /bin/mv and /bin/cp.
  std::map<std::string, Dir> dirs;
  std::map<std::string, GetScript> getScript;               // adapter -> scripted read
  std::deque<int> reloadResults;                            // next reload answers; 0 when empty
  std::vector<std::map<std::string, Dir>> reloadSnapshots;  // dirs at each reload

  // Outstanding allocations handed to the module.
  int ruleListsOut = 0;
  int ruleBufsOut = 0;
  int szListsOut = 0;
  int filesOut = 0;
};

State& S();
// Back to a fresh state: "/etc/tc" exists and is empty, nothing scripted.
void Reset();
// Make the n-th (1-based) call of fn fail.
void FailCall(const std::string& fn, int n = 1);
// Recorded calls whose name starts with prefix.
std::vector<std::string> CallsOf(const std::string& prefix);
// Log lines with the "<file>:<line> " frame removed; every captured line must
// carry that frame (checked by the fake when it captures).
std::vector<std::string> LogBodies();
// Lines whose frame was malformed (should stay empty).
const std::vector<std::string>& BadFrames();

// Convenience: a stored rule with the common fields.
StoredRule Rule(int id, const std::string& ports, int protocol = 1, int minrate = 100,
                int maxrate = 200, const std::string& source = "all", int enabled = 1,
                int ipDirection = 0);

}  // namespace fake

#endif
