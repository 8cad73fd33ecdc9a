// Rule store: one rule file per adapter inside a configuration directory, and
// the reload that checks a directory's rules and hands them to tcgen.
//
// Files. Adapter A's rules live in <dir>/A.rules. A write goes to
// <dir>/A.rules.tmp-XXXXXX (mkstemp) and is renamed over A.rules on close
// after an fsync, then the directory is fsynced, so readers see the old or the
// new file and never a torn one. The reload reads only names ending in
// ".rules" whose stem is a valid adapter name, so temporary files of an
// unfinished write (and anything else in the directory) are ignored.
//
// Format (version 1), text, every line ending in "\n":
//   orvi-tc-rules 1
//   id TAB enabled TAB source TAB ports TAB protocol TAB minrate TAB maxrate TAB ipDirection
//   ...                                    (one line per rule, in chain order)
//   end COUNT                              (the number of rule lines)
// Numbers are 32-bit decimal integers. source and ports are escaped: bytes
// 0x21..0x7e other than "%" and "\" stand for themselves, every other byte is
// written %XX (upper-case hex; %00 is refused, a C string cannot hold it).
// ports is "-" for a NULL pointer and "=" followed by the escaped text
// otherwise, so NULL and "" stay distinct. A file without its end line, with
// a count that does not match, with anything after the end line or without
// the final newline is refused as truncated or malformed.
//
// Reading a missing rule file gives count 0 and an empty, non-NULL list
// (free it like any other). Error codes: see orvi_fw_tc.h.
#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "olibc.h"
#include "orvi_fw_tc.h"
#include "orvi_root.h"
#include "rulefile.h"
#include "tcgen.h"

namespace {

constexpr char kSuffix[] = ".rules";
constexpr char kTmpInfix[] = ".tmp-XXXXXX";
constexpr char kKeyFile[] = "/etc/orviinfo.conf";
constexpr char kNetDir[] = "/sys/class/net/";
constexpr char kUpload[] = "upload";
// An unknown link is never throttled: it counts as 10 Gbit/s.
constexpr long long kDefaultSpeedMbps = 10000;
constexpr long long kKBpsPerMbps = 125;
// Longest directory path accepted, leaving room for the file names.
constexpr size_t kMaxDirPath = PATH_MAX - 64;

using orvi::FdCloser;

struct ListFree {
  void operator()(TcRuleList* list) const { ORVIFwTcRulesFreeByAdapter(list); }
};

// The kernel's rule for interface names (dev_valid_name): 1 to 15 bytes, not
// "." or "..", no "/", ":" or white space. It also keeps names inside the
// directory they are joined to.
bool ValidAdapter(const char* name) {
  if (name == nullptr || *name == '\0') return false;
  if (strnlen(name, 16) > 15) return false;
  if (std::strcmp(name, ".") == 0 || std::strcmp(name, "..") == 0) return false;
  for (const char* p = name; *p != '\0'; ++p) {
    if (*p == '/' || *p == ':' || std::strchr(" \t\n\v\f\r", *p) != nullptr) return false;
  }
  return true;
}

// The directory resolved under the appliance root, with "." components,
// repeated and trailing slashes dropped, so that the paths given to open and
// close compare equal. ".." is refused: it could leave the appliance root.
bool ResolveDir(const char* dir, std::string* out) {
  if (dir == nullptr || *dir == '\0' || strnlen(dir, kMaxDirPath + 1) > kMaxDirPath) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return false;
  }
  std::string norm = dir[0] == '/' ? "/" : "";
  const char* p = dir;
  while (*p != '\0') {
    const char* slash = std::strchr(p, '/');
    size_t n = slash ? static_cast<size_t>(slash - p) : std::strlen(p);
    std::string part(p, n);
    if (part == "..") {
      ORVI_ERR(OLIBC_ERR_INVAL);
      return false;
    }
    if (!part.empty() && part != ".") {
      if (!norm.empty() && norm.back() != '/') norm += '/';
      norm += part;
    }
    p += n;
    if (*p == '/') ++p;
  }
  if (norm.empty()) norm = ".";
  *out = orvi::RootPath(norm);
  if (out->empty()) *out = "/";
  return true;
}

std::string RulePath(const std::string& dir, const std::string& adapter) {
  return dir + (dir.back() == '/' ? "" : "/") + adapter + kSuffix;
}

bool IsDirectory(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

bool WriteAll(int fd, const std::string& data) {
  const char* p = data.data();
  size_t left = data.size();
  while (left > 0) {
    ssize_t n = write(fd, p, left);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    p += n;
    left -= static_cast<size_t>(n);
  }
  return true;
}

enum class Load { kOk, kMissing, kFailed };

// Reads and parses one rule file; every failure is logged and recorded.
Load LoadRuleFile(const std::string& path, rulefile::Parsed* parsed) {
  std::string data;
  if (!orvi::ReadRegularFile(path, rulefile::kMaxFileBytes, &data)) {
    if (errno == ENOENT) return Load::kMissing;
    int err = errno;
    syslog(LOG_ERR, "rulestore: cannot read rule file %s: %s", path.c_str(), std::strerror(err));
    ORVI_ERR(err == EFBIG ? ORVI_TC_ERR_FORMAT : OLIBC_ERR_IO);
    return Load::kFailed;
  }
  int line = 0;
  const char* why = "";
  if (!rulefile::Parse(data.data(), data.size(), parsed, &line, &why)) {
    syslog(LOG_ERR, "rulestore: malformed rule file %s, line %d: %s", path.c_str(), line, why);
    ORVI_ERR(why == rulefile::kOutOfMemory ? OLIBC_ERR_NOMEM : ORVI_TC_ERR_FORMAT);
    return Load::kFailed;
  }
  return Load::kOk;
}

// Strict decimal in [1, INT32_MAX], surrounding white space allowed.
long long PositiveNumber(const char* text) {
  while (*text == ' ' || *text == '\t') ++text;
  if (*text < '0' || *text > '9') return -1;
  errno = 0;
  char* end = nullptr;
  long long v = std::strtoll(text, &end, 10);
  while (*end == ' ' || *end == '\t' || *end == '\n' || *end == '\r') ++end;
  if (errno != 0 || *end != '\0' || v < 1 || v > INT32_MAX) return -1;
  return v;
}

// A key of the platform key file, or "" when it is missing or empty.
std::string KeyValue(const std::string& key) {
  char buf[1024];
  if (OLIBCFileGetKeyValue(kKeyFile, key.c_str(), buf, sizeof(buf), 0) < 1) return "";
  return buf;
}

// The device's upper bound in KB/s: the key file's override, else the link
// speed, else the default speed.
long long UpperBound(const std::string& dev) {
  std::string override = KeyValue("tc_bandwidth_" + dev);
  if (!override.empty()) {
    long long kbps = PositiveNumber(override.c_str());
    if (kbps > 0) return kbps;
    syslog(LOG_WARNING, "rulestore: ignoring tc_bandwidth_%s: not a positive number of KB/s",
           dev.c_str());
  }
  std::string text;
  long long mbps = -1;
  if (orvi::ReadRegularFile(orvi::RootPath(kNetDir + dev + "/speed"), 64, &text)) {
    mbps = PositiveNumber(text.c_str());
  }
  if (mbps < 1) mbps = kDefaultSpeedMbps;
  return mbps * kKBpsPerMbps;
}

// What the default class for unmatched traffic keeps for itself: 1% of the
// bound, at least 1 KB/s, so that unmatched traffic is never starved.
long long DefaultReserve(long long bound) { return std::max(1LL, bound / 100); }

// The device an adapter's rules go to, or "" when there is none (logged).
std::string DeviceOf(const std::string& adapter) {
  std::string dev = adapter;
  if (adapter == kUpload) {
    dev = KeyValue("wan_interface");
    if (dev.empty()) {
      syslog(LOG_WARNING, "rulestore: no wan_interface set, upload rules skipped");
      return "";
    }
    if (!ValidAdapter(dev.c_str())) {
      syslog(LOG_WARNING, "rulestore: wan_interface is not a device name, upload rules skipped");
      return "";
    }
  }
  if (!IsDirectory(orvi::RootPath(kNetDir + dev))) {
    syslog(LOG_WARNING, "rulestore: device %s of adapter %s does not exist, its rules skipped",
           dev.c_str(), adapter.c_str());
    return "";
  }
  return dev;
}

// Rates that no batch could express, refused before the bounds are looked at.
bool RatesUsable(const TcRule& r) {
  return r.minrate >= 1 && r.maxrate >= 0 && (r.maxrate == 0 || r.maxrate >= r.minrate);
}

// 0, -2 or -3 for one device's enabled rules against its bound, or -1 for
// rates that make no sense; the error is recorded and logged.
int CheckBounds(const tcgen::DeviceRules& dev) {
  long long sum = 0;
  for (const TcRule* r : dev.rules) {
    if (r->enabled == 0) continue;
    if (!RatesUsable(*r)) {
      syslog(LOG_ERR, "rulestore: %s: rule %d has unusable rates (min %d, max %d)",
             dev.device.c_str(), r->id, r->minrate, r->maxrate);
      ORVI_ERR(ORVI_TC_ERR_RATE);
      return -1;
    }
    long long ceiling = r->maxrate != 0 ? r->maxrate : r->minrate;
    if (ceiling > dev.upperKBps) {
      syslog(LOG_ERR, "rulestore: %s: rule %d ceiling %lld KB/s above the bound %lld KB/s",
             dev.device.c_str(), r->id, ceiling, dev.upperKBps);
      ORVI_ERR(ORVI_TC_ERR_CEIL);
      return -2;
    }
    sum += r->minrate;
  }
  long long reserve = DefaultReserve(dev.upperKBps);
  if (sum + reserve > dev.upperKBps) {
    syslog(LOG_ERR,
           "rulestore: %s: guaranteed rates %lld KB/s plus reserve %lld KB/s above the bound "
           "%lld KB/s",
           dev.device.c_str(), sum, reserve, dev.upperKBps);
    ORVI_ERR(ORVI_TC_ERR_RATESUM);
    return -3;
  }
  return 0;
}

bool ApplyModeFromEnv(tcgen::ApplyMode* mode) {
  const char* env = std::getenv("ORVI_TC_APPLY");
  if (env == nullptr || *env == '\0') {
    *mode = orvi::RootDir().empty() ? tcgen::ApplyMode::kKernel : tcgen::ApplyMode::kPlan;
  } else if (std::strcmp(env, "kernel") == 0) {
    *mode = tcgen::ApplyMode::kKernel;
  } else if (std::strcmp(env, "plan") == 0) {
    *mode = tcgen::ApplyMode::kPlan;
  } else {
    syslog(LOG_ERR, "rulestore: ORVI_TC_APPLY must be \"kernel\" or \"plan\"");
    ORVI_ERR(OLIBC_ERR_INVAL);
    return false;
  }
  return true;
}

// Adapter names of the directory's rule files, sorted; false when the
// directory cannot be listed (recorded).
bool ListAdapters(const std::string& dir, std::vector<std::string>* adapters) {
  orvi::DirPtr d(opendir(dir.c_str()));
  if (!d) {
    ORVI_ERR(OLIBC_ERR_IO);
    return false;
  }
  const size_t suffix = std::strlen(kSuffix);
  while (struct dirent* e = readdir(d.get())) {
    std::string name = e->d_name;
    if (name.size() <= suffix || name.compare(name.size() - suffix, suffix, kSuffix) != 0) continue;
    name.resize(name.size() - suffix);
    if (ValidAdapter(name.c_str())) adapters->push_back(name);
  }
  std::sort(adapters->begin(), adapters->end());
  return true;
}

// No exception may cross the C interface: out of memory is the only one the
// store's own code can raise.
int Unexpected() {
  try {
    throw;
  } catch (const std::bad_alloc&) {
    ORVI_ERR(OLIBC_ERR_NOMEM);
  } catch (...) {
    ORVI_ERR(OLIBC_ERR_IO);
  }
  return -1;
}

// tcgen's failures must not read as the bound checks' -2 and -3.
int GeneratorFailure(int r) { return r == -2 || r == -3 ? -1 : r; }

// The rules of a directory grouped by device, every file read and every
// device's bounds checked; files owns the records that devices point into.
struct Collected {
  std::vector<rulefile::Parsed> files;
  std::map<std::string, tcgen::DeviceRules> devices;
};

int Collect(const std::string& dir, Collected* out) {
  std::vector<std::string> adapters;
  if (!ListAdapters(dir, &adapters)) return -1;

  // Every file is read before any device is looked at: one bad file stops
  // the whole reload.
  out->files.resize(adapters.size());
  for (size_t i = 0; i < adapters.size(); ++i) {
    Load load = LoadRuleFile(RulePath(dir, adapters[i]), &out->files[i]);
    if (load == Load::kMissing) ORVI_ERR(OLIBC_ERR_IO);  // vanished since the listing
    if (load != Load::kOk) return -1;
  }

  // Rules of several adapters on one device (a file named after the WAN
  // device and "upload") are merged in adapter name order.
  for (size_t i = 0; i < adapters.size(); ++i) {
    std::string dev = DeviceOf(adapters[i]);
    if (dev.empty()) continue;
    tcgen::DeviceRules& d = out->devices[dev];
    d.device = dev;
    for (const TcRule* r = out->files[i].head.get(); r != nullptr; r = r->next)
      d.rules.push_back(r);
  }
  for (auto& entry : out->devices) {
    entry.second.upperKBps = UpperBound(entry.first);
    int r = CheckBounds(entry.second);
    if (r < 0) return r;
  }
  for (const auto& entry : out->devices) {
    int r = tcgen::Check(entry.second);
    if (r < 0) return GeneratorFailure(r);
  }
  return 0;
}

int Reload(const char* dirArg) {
  std::string dir;
  if (!ResolveDir(dirArg, &dir)) return -1;
  tcgen::ApplyMode mode;
  if (!ApplyModeFromEnv(&mode)) return -1;
  Collected all;
  int r = Collect(dir, &all);
  if (r < 0) return r;
  for (const auto& entry : all.devices) {
    r = tcgen::Apply(entry.first, tcgen::Generate(entry.second), mode);
    if (r < 0) {
      syslog(LOG_ERR, "rulestore: applying the rules of %s failed", entry.first.c_str());
      return GeneratorFailure(r);
    }
  }
  return 0;
}

int Plan(const char* dirArg, const char* adapter, char** batch) {
  if (batch == nullptr) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  *batch = nullptr;
  if (adapter == nullptr || !ValidAdapter(adapter)) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  std::string dir;
  if (!ResolveDir(dirArg, &dir)) return -1;
  // The whole directory is checked, as a reload would, so a plan never shows
  // a batch that the reload would refuse.
  Collected all;
  int r = Collect(dir, &all);
  if (r < 0) return r;
  std::string dev = DeviceOf(adapter);
  if (dev.empty()) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  auto it = all.devices.find(dev);
  tcgen::DeviceRules none;
  none.device = dev;
  none.upperKBps = UpperBound(dev);
  *batch = strdup(tcgen::Generate(it != all.devices.end() ? it->second : none).c_str());
  if (*batch == nullptr) {
    ORVI_ERR(OLIBC_ERR_NOMEM);
    return -1;
  }
  return 0;
}

}  // namespace

// An open rule file: a temporary file in the target directory that becomes
// the adapter's rule file on a successful close, and is removed otherwise.
struct TcRuleFile {
  std::string dir;
  std::string adapter;
  std::string tmpPath;
  // Rule lines wait here and go out in large writes: one write per rule
  // made the writes cost more than building the lines.
  std::string pending;
  int fd = -1;
  int count = 0;
  bool failed = false;
  bool committed = false;

  ~TcRuleFile() {
    if (fd >= 0) close(fd);
    if (!committed && !tmpPath.empty()) unlink(tmpPath.c_str());
  }
};

namespace {

constexpr size_t kWriteChunk = 64 * 1024;

bool Flush(TcRuleFile* file) {
  bool ok = WriteAll(file->fd, file->pending);
  file->pending.clear();
  return ok;
}

}  // namespace

extern "C" {

int ORVIFwTcRuleGetByAdapter(const char* dir, const char* adapter, TcRuleList** list) {
  try {
    if (list != nullptr) *list = nullptr;
    std::string path;
    if (list == nullptr || !ValidAdapter(adapter)) {
      ORVI_ERR(OLIBC_ERR_INVAL);
      return -1;
    }
    if (!ResolveDir(dir, &path)) return -1;
    rulefile::Parsed parsed;
    Load load = LoadRuleFile(RulePath(path, adapter), &parsed);
    if (load == Load::kFailed) return -1;
    if (load == Load::kMissing && !IsDirectory(path)) {
      ORVI_ERR(OLIBC_ERR_IO);
      return -1;
    }
    std::unique_ptr<TcRuleList, ListFree> out(
        static_cast<TcRuleList*>(std::calloc(1, sizeof(TcRuleList))));
    if (!out) {
      ORVI_ERR(OLIBC_ERR_NOMEM);
      return -1;
    }
    std::snprintf(out->adapter, sizeof(out->adapter), "%s", adapter);
    out->count = parsed.count;
    out->rules = parsed.head.release();
    *list = out.release();
    return (*list)->count;
  } catch (...) {
    return Unexpected();
  }
}

void ORVIFwTcRulesFreeByAdapter(TcRuleList* list) {
  if (list == nullptr) return;
  rulefile::FreeChain(list->rules);
  std::free(list);
}

TcRuleFile* ORVIFwTcRuleOpen(const char* dir, const char* adapter) {
  try {
    std::string path;
    if (!ValidAdapter(adapter)) {
      ORVI_ERR(OLIBC_ERR_INVAL);
      return nullptr;
    }
    if (!ResolveDir(dir, &path)) return nullptr;
    if (!IsDirectory(path)) {
      ORVI_ERR(OLIBC_ERR_IO);
      return nullptr;
    }
    std::unique_ptr<TcRuleFile> file(new TcRuleFile);
    file->dir = path;
    file->adapter = adapter;
    std::string tmpl = RulePath(path, adapter) + kTmpInfix;
    std::vector<char> name(tmpl.begin(), tmpl.end());
    name.push_back('\0');
    file->fd = mkostemp(name.data(), O_CLOEXEC);
    if (file->fd < 0) {
      ORVI_ERR(OLIBC_ERR_IO);
      return nullptr;
    }
    file->tmpPath = name.data();
    file->pending = rulefile::Header();
    if (fchmod(file->fd, 0644) != 0) {
      ORVI_ERR(OLIBC_ERR_IO);
      return nullptr;
    }
    return file.release();
  } catch (...) {
    Unexpected();
    return nullptr;
  }
}

int ORVIFwTcBufRuleInit(TcRule** rule) {
  if (rule == nullptr) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  *rule = static_cast<TcRule*>(std::calloc(1, sizeof(TcRule)));
  if (*rule == nullptr) {
    ORVI_ERR(OLIBC_ERR_NOMEM);
    return -1;
  }
  return 0;
}

int ORVIFwTcRuleWrite(TcRuleFile* file, const TcRule* rule) {
  if (file == nullptr) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  // A refused or failed write poisons the handle: its close must not replace
  // the live file with a list that lacks a rule.
  if (rule == nullptr) {
    file->failed = true;
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  if (file->failed) {
    ORVI_ERR(OLIBC_ERR_IO);
    return -1;
  }
  try {
    file->pending += rulefile::RuleLine(*rule);
    if (file->pending.size() >= kWriteChunk && !Flush(file)) {
      file->failed = true;
      ORVI_ERR(OLIBC_ERR_IO);
      return -1;
    }
  } catch (...) {
    file->failed = true;
    return Unexpected();
  }
  ++file->count;
  return 0;
}

void ORVIFwTcBufRulesFree(TcRule* rule) { rulefile::FreeChain(rule); }

int ORVIFwTcRuleClose(const char* dir, TcRuleFile* file, const char* adapter) {
  if (file == nullptr) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  std::unique_ptr<TcRuleFile> owner(file);
  try {
    std::string path;
    if (!ResolveDir(dir, &path)) return -1;
    // Closing under another name would put one adapter's rules in another's file.
    if (path != file->dir || !ValidAdapter(adapter) || file->adapter != adapter) {
      ORVI_ERR(OLIBC_ERR_INVAL);
      return -1;
    }
    if (file->failed) {
      ORVI_ERR(OLIBC_ERR_IO);
      return -1;
    }
    int fd = file->fd;
    file->fd = -1;
    file->pending += rulefile::EndLine(file->count);
    bool ok = WriteAll(fd, file->pending) && fsync(fd) == 0;
    ok = close(fd) == 0 && ok;
    std::string live = RulePath(file->dir, file->adapter);
    if (!ok || rename(file->tmpPath.c_str(), live.c_str()) != 0) {
      ORVI_ERR(OLIBC_ERR_IO);
      return -1;
    }
    file->committed = true;
    // The rename itself is durable only once the directory is synced.
    FdCloser d(open(file->dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (d.fd < 0 || fsync(d.fd) != 0) {
      syslog(LOG_ERR, "rulestore: cannot sync directory %s", file->dir.c_str());
      ORVI_ERR(OLIBC_ERR_IO);
      return -1;
    }
    return 0;
  } catch (...) {
    return Unexpected();
  }
}

int ORVIFwTcRuleReload(const char* dir) {
  try {
    return Reload(dir);
  } catch (...) {
    return Unexpected();
  }
}

int ORVIFwTcRulePlan(const char* dir, const char* adapter, char** batch) {
  try {
    return Plan(dir, adapter, batch);
  } catch (...) {
    return Unexpected();
  }
}

}  // extern "C"
