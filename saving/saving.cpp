// The save operations: stage a copy of the live rules, rewrite the affected
// adapters' rule files in it, have the rule store apply it, and only then
// move it into place.
#include <mutex>
#include <shared_mutex>
#include <string>

#include "ORVI.Core.Network.TrafficControl.h"
#include "conflock.h"
#include "olibc.h"
#include "orvi_fw_tc.h"
#include "preconditions.h"
#include "staging.h"
#include "tclog.h"

namespace {

// Where the staging copy goes when it is the only copy of the rules left; the
// next save's staging copy does not touch it.
const char kRescueDir[] = "/etc/tc_rescue";
char* const kNoMoreArgs = nullptr;
const int kAdapterListSize = 32;

// One save's progress from the staging copy to its answer.
struct SaveRun {
  std::unique_lock<std::mutex> staging{conflock::Staging(), std::defer_lock};
  std::unique_lock<conflock::WriterFirstLock> live{conflock::Live(), std::defer_lock};
  bool applied = false;    // the rule store applied the staging directory
  bool succeeded = false;  // the staging directory is the live one now
  bool keptInStaging = false;
};

// The live directory is gone or incomplete and the staging directory holds
// the only sure copy of the rules. Returns true when they could not be moved away and so must stay
// in the staging directory.
bool KeepStagingCopy() {
  bool moved = OLIBCExec("/bin/rm", "-rf", kRescueDir, kNoMoreArgs) >= 0 &&
               OLIBCExec("/bin/mv", "-f", kStagingDir, kRescueDir, kNoMoreArgs) >= 0;
  TC_LOG("%s may be gone or incomplete: the applied rules are kept in %s", kLiveDir,
         moved ? kRescueDir : kStagingDir);
  return !moved;
}

void ApplyAndMove(TCHandler& h, SaveRun& run) {
  int r = ORVIFwTcRuleReload(kStagingDir);
  if (r >= 0) {
    run.applied = true;
    // Loads must not see the moment between removing the live directory and
    // moving the staging one in.
    run.live.lock();
    bool liveTouched = false;
    if (staging::MoveReplacing(h, kStagingDir, kLiveDir, &liveTouched)) {
      run.succeeded = true;
      run.live.unlock();
    } else {
      h._errCode = TC_ERR_FAILED;
      if (liveTouched) run.keptInStaging = KeepStagingCopy();
    }
  } else if (r == -2) {
    TC_LOG_ERR("ceil exceed system upper bound!");
    h._errCode = TC_ERR_CEIL_BOUND;
  } else if (r == -3) {
    TC_LOG_ERR("max ceil too large");
    h._errCode = TC_ERR_CEIL_MAX;
  } else {
    TC_LOG_ERR("operation fail");
    h._errCode = TC_ERR_FAILED;
  }
}

// Removes the staging directory and answers; the locks are released last.
void Finish(TCHandler& h, SaveRun& run) {
  if (!run.staging.owns_lock()) run.staging.lock();
  if (!run.keptInStaging) h.ConfRemove(kStagingDir);
  if (run.succeeded) {
    h._pResponse->SetSuccess(Json::Value());
    return;
  }
  // The staging rules are running but are not the live ones: bring the
  // running rules back in line with the live directory.
  if (run.applied && ORVIFwTcRuleReload(kLiveDir) != 0) h._errCode = TC_ERR_REAPPLY;
  h._pResponse->SetError(h._errCode, Json::Value());
}

}  // namespace

void TCHandler::RulesSave() {
  if (InterfaceCheck() < 0) return;
  if (RulesCheck() < 0) return;
  Json::Value rules = _pRequest->GetParam("rules", Json::Value());
  if (RuleValidator(rules) < 0) return;

  SaveRun run;
  run.staging.lock();
  if (!ConfCopy(kLiveDir, kStagingDir)) {
    _errCode = TC_ERR_FAILED;
  } else if (!Dump2Conf(kStagingDir, _adapter, rules)) {
    _errCode = TC_ERR_FAILED;
  } else {
    ApplyAndMove(*this, run);
  }
  Finish(*this, run);
}

void TCHandler::RouterRulesSave() {
  SaveRun run;
  SzListHolder adapters;
  // Every failure below ends in Finish, which answers again after a check
  // that answered itself; the code is the same, so the answer stands.
  if (IsRouterMode() && RouterAdaptersSelect(*this, kAdapterListSize, adapters) &&
      RulesCheck() >= 0) {
    Json::Value rules = _pRequest->GetParam("rules", Json::Value());
    if (RuleValidator(rules) >= 0) {
      run.staging.lock();
      if (!ConfCopy(kLiveDir, kStagingDir)) {
        _errCode = TC_ERR_FAILED;
      } else {
        bool dumped = true;
        SzList* list = adapters.Get();
        for (int i = 0; dumped && i < list->count; ++i) {
          const char* name = OLIBCSzListGet(list, i);
          dumped = Dump2Conf(kStagingDir, name != nullptr ? name : "", rules);
        }
        if (dumped) {
          ApplyAndMove(*this, run);
        } else {
          _errCode = TC_ERR_FAILED;
        }
      }
    }
  }
  adapters.Release();
  Finish(*this, run);
}
