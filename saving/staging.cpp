// Rule files of one adapter, and whole configuration directories removed,
// moved and copied with the system's programs.
#include "staging.h"

#include <string>

#include "olibc.h"
#include "orvi_fw_tc.h"
#include "tclog.h"

namespace {

char* const kNoMoreArgs = nullptr;

enum class Replace { kMove, kCopy };

// Removes dst first so that dst ends up holding src itself rather than src
// nested inside an older dst.
bool RunReplacing(TCHandler& handler, Replace what, const char* src, const char* dst,
                  bool* dstTouched) {
  *dstTouched = false;
  if (src == nullptr || dst == nullptr) return false;
  // A removal that fails may have removed part of dst all the same.
  *dstTouched = true;
  if (!handler.ConfRemove(dst)) return false;
  if (what == Replace::kMove) {
    if (OLIBCExec("/bin/mv", "-f", src, dst, kNoMoreArgs) < 0) {
      TC_LOG("Failed to mv -f (%s) (%s)", src, dst);
      return false;
    }
  } else {
    if (OLIBCExec("/bin/cp", "-rf", src, dst, kNoMoreArgs) < 0) {
      TC_LOG("Failed to cp -rf (%s) (%s)", src, dst);
      return false;
    }
  }
  return true;
}

// One adapter's open rule file and the record reused for each of its rules:
// on every way out the record is released, then the file completed.
struct RuleFileWriter {
  RuleFileWriter(const std::string& dir, const std::string& adapter, TcRuleFile* file)
      : dir(dir), adapter(adapter), file(file) {}
  ~RuleFileWriter() {
    ORVIFwTcBufRulesFree(record);
    ORVIFwTcRuleClose(dir.c_str(), file, adapter.c_str());
  }
  RuleFileWriter(const RuleFileWriter&) = delete;
  RuleFileWriter& operator=(const RuleFileWriter&) = delete;

  const std::string& dir;
  const std::string& adapter;
  TcRuleFile* file;
  TcRule* record = nullptr;
};

}  // namespace

namespace staging {

bool MoveReplacing(TCHandler& handler, const char* src, const char* dst, bool* dstTouched) {
  return RunReplacing(handler, Replace::kMove, src, dst, dstTouched);
}

}  // namespace staging

bool TCHandler::Dump2Conf(std::string dir, std::string adapter, Json::Value rules) {
  TcRuleFile* file = ORVIFwTcRuleOpen(dir.c_str(), adapter.c_str());
  if (file == nullptr) {
    TC_LOG("failed to open rule file of %s", adapter.c_str());
    ORVIFwTcBufRulesFree(nullptr);
    return false;
  }
  RuleFileWriter writer(dir, adapter, file);
  if (ORVIFwTcBufRuleInit(&writer.record) < 0) {
    TC_LOG_ERR("failed to init tc rule structure");
    return false;
  }
  if (!rules.isArray()) return true;
  // Ids are positions in the request: a rule that cannot be built leaves a gap.
  for (Json::ArrayIndex i = 0; i < rules.size(); ++i) {
    if (RuleCreate(static_cast<int>(i) + 1, rules[i], writer.record)) {
      ORVIFwTcRuleWrite(file, writer.record);
    }
  }
  return true;
}

bool TCHandler::ConfRemove(char const* path) {
  if (path == nullptr) return false;
  int ret = OLIBCExec("/bin/rm", "-rf", path, kNoMoreArgs);
  if (ret < 0) {
    TC_LOG("Failed to rm -rf %s. ret=%d", path, ret);
    return false;
  }
  return true;
}

bool TCHandler::ConfMove(char const* src, char const* dst) {
  bool removed = false;
  return RunReplacing(*this, Replace::kMove, src, dst, &removed);
}

bool TCHandler::ConfCopy(char const* src, char const* dst) {
  bool removed = false;
  return RunReplacing(*this, Replace::kCopy, src, dst, &removed);
}
