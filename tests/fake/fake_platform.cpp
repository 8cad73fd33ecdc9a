#include "fake_platform.h"

#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <cctype>
#include <regex>

#include "olibc.h"
#include "orvi_fw_tc.h"
#include "sdk_network.h"

namespace fake {
namespace {}  // namespace
State gState;
namespace {
std::vector<std::string> gBadFrames;
thread_local int tErrCode = 0;
thread_local std::string tErrFile;
thread_local int tErrLine = 0;

std::string Join(std::initializer_list<std::string> args) {
  std::string out;
  for (const auto& a : args) {
    if (!out.empty()) out += ",";
    out += a;
  }
  return out;
}

void Record(const std::string& fn, std::initializer_list<std::string> args) {
  gState.calls.push_back(fn + "(" + Join(args) + ")");
}

// Counts the call and answers whether it is scripted to fail; a failure is
// recorded on the error stack as code 0x0201 with the function as "file".
bool Fails(const std::string& fn) {
  int n = ++gState.callCount[fn];
  auto it = gState.failAt.find(fn);
  if (it == gState.failAt.end() || it->second.count(n) == 0) return false;
  tErrCode = 0x0201;
  tErrFile = fn;
  tErrLine = 1;
  return true;
}

std::string Str(const char* s) { return s ? s : "(null)"; }
}  // namespace

State& S() { return gState; }

void Reset() {
  gState = State();
  gState.dirs["/etc/tc"] = Dir();
  gBadFrames.clear();
  tErrCode = 0;
  tErrFile.clear();
  tErrLine = 0;
}

void FailCall(const std::string& fn, int n) { gState.failAt[fn].insert(n); }

std::vector<std::string> CallsOf(const std::string& prefix) {
  std::vector<std::string> out;
  for (const auto& c : gState.calls)
    if (c.compare(0, prefix.size(), prefix) == 0) out.push_back(c);
  return out;
}

std::vector<std::string> LogBodies() {
  static const std::regex frame(R"(^[A-Za-z0-9_.]+\.cpp:[0-9]+ )");
  std::vector<std::string> out;
  for (const auto& line : gState.logs) out.push_back(std::regex_replace(line, frame, ""));
  return out;
}

const std::vector<std::string>& BadFrames() { return gBadFrames; }

StoredRule Rule(int id, const std::string& ports, int protocol, int minrate, int maxrate,
                const std::string& source, int enabled, int ipDirection) {
  StoredRule r;
  r.id = id;
  r.ports = ports;
  r.protocol = protocol;
  r.minrate = minrate;
  r.maxrate = maxrate;
  r.source = source;
  r.enabled = enabled;
  r.ipDirection = ipDirection;
  return r;
}

void CaptureLog(const char* line) {
  static const std::regex frame(R"(^[A-Za-z0-9_.]+\.cpp:[0-9]+ [\s\S]*)");
  std::string text(line);
  if (!std::regex_match(text, frame)) gBadFrames.push_back(text);
  gState.logs.push_back(text);
}

}  // namespace fake

using fake::gState;

// ---- syslog capture -------------------------------------------------------
extern "C" void syslog(int, const char* fmt, ...) {
  char buf[8192];
  va_list ap;
  va_start(ap, fmt);
  vsnprintf(buf, sizeof buf, fmt, ap);
  va_end(ap);
  fake::CaptureLog(buf);
}
extern "C" void __syslog_chk(int, int, const char* fmt, ...) {
  char buf[8192];
  va_list ap;
  va_start(ap, fmt);
  vsnprintf(buf, sizeof buf, fmt, ap);
  va_end(ap);
  fake::CaptureLog(buf);
}

// ---- utility library ------------------------------------------------------
extern "C" {

int OLIBCErrGet(void) { return fake::tErrCode; }
const char* OLIBCErrorGetFile(void) { return fake::tErrFile.c_str(); }
int OLIBCErrorGetLine(void) { return fake::tErrLine; }
void OLIBCErrSetEx(int code, const char* file, int line) {
  fake::Record("OLIBCErrSetEx", {std::to_string(code)});
  fake::tErrCode = code;
  fake::tErrFile = file ? file : "";
  fake::tErrLine = line;
}

SzList* OLIBCSzListAlloc(int size) {
  fake::Record("OLIBCSzListAlloc", {std::to_string(size)});
  if (fake::Fails("OLIBCSzListAlloc")) return nullptr;
  SzList* list = static_cast<SzList*>(calloc(1, sizeof(SzList)));
  list->size = size > 0 ? size : 1;
  list->items = static_cast<char**>(calloc(list->size, sizeof(char*)));
  ++gState.szListsOut;
  return list;
}

void OLIBCSzListFree(SzList* list) {
  fake::Record("OLIBCSzListFree", {list ? "list" : "NULL"});
  if (list == nullptr) return;
  for (int i = 0; i < list->count; ++i) free(list->items[i]);
  free(list->items);
  free(list);
  --gState.szListsOut;
}

char* OLIBCSzListGet(SzList* list, int index) {
  if (list == nullptr || index < 0 || index >= list->count) return nullptr;
  return list->items[index];
}

int OLIBCSzListPush(SzList** list, const char* item) {
  fake::Record("OLIBCSzListPush", {fake::Str(item)});
  if (fake::Fails("OLIBCSzListPush") || list == nullptr || *list == nullptr || !item) return -1;
  SzList* l = *list;
  if (l->count == l->size) {
    l->size *= 2;
    l->items = static_cast<char**>(realloc(l->items, l->size * sizeof(char*)));
  }
  l->items[l->count++] = strdup(item);
  return 0;
}

int OLIBCSzListRemove(SzList* list, int index) {
  fake::Record("OLIBCSzListRemove", {std::to_string(index)});
  if (fake::Fails("OLIBCSzListRemove") || list == nullptr || index < 0 || index >= list->count)
    return 0;
  free(list->items[index]);
  memmove(&list->items[index], &list->items[index + 1], (list->count - index - 1) * sizeof(char*));
  --list->count;
  return 1;
}

int OLIBCSzListJoin(SzList* list, const char* sep, char** buf, int* size) {
  fake::Record("OLIBCSzListJoin", {sep ? sep : "(null)"});
  if (fake::Fails("OLIBCSzListJoin") || !list || !sep || !buf || !size) return -1;
  std::string out;
  for (int i = 0; i < list->count; ++i) {
    if (i) out += sep;
    out += list->items[i] ? list->items[i] : "";
  }
  if (*buf == nullptr || *size < static_cast<int>(out.size()) + 1) {
    int want = static_cast<int>(out.size()) + 1;
    char* grown = static_cast<char*>(realloc(*buf, want));
    if (!grown) return -1;
    *buf = grown;
    *size = want;
  }
  memcpy(*buf, out.c_str(), out.size() + 1);
  return 0;
}

int OLIBCStrTok(const char* text, const char* seps, SzList** list) {
  fake::Record("OLIBCStrTok", {fake::Str(text), fake::Str(seps)});
  if (fake::Fails("OLIBCStrTok") || !text || !seps || !list || !*list) return -1;
  if (*text == '\0') return 0;
  std::string item;
  for (const char* p = text;; ++p) {
    if (*p == '\0' || strchr(seps, *p) != nullptr) {
      OLIBCSzListPush(list, item.c_str());
      gState.calls.pop_back();  // internal push, not the module's
      item.clear();
      if (*p == '\0') break;
    } else {
      item += *p;
    }
  }
  return 0;
}

int OLIBCStrTrimSpace(char* text, int) {
  if (fake::Fails("OLIBCStrTrimSpace") || text == nullptr) return -1;
  size_t len = strlen(text);
  size_t start = 0;
  while (start < len && isspace(static_cast<unsigned char>(text[start]))) ++start;
  while (len > start && isspace(static_cast<unsigned char>(text[len - 1]))) --len;
  memmove(text, text + start, len - start);
  text[len - start] = '\0';
  return 0;
}

int OLIBCFileGetKeyValue(const char* path, const char* key, char* buf, int size, int) {
  fake::Record("OLIBCFileGetKeyValue", {fake::Str(path), fake::Str(key)});
  if (fake::Fails("OLIBCFileGetKeyValue") || !key || !buf || size < 1) return -1;
  auto it = gState.keys.find(key);
  if (it == gState.keys.end()) return -1;
  snprintf(buf, size, "%s", it->second.c_str());
  return static_cast<int>(strlen(buf));
}

namespace {
void CopyDir(const std::string& src, const std::string& dst) {
  gState.dirs[dst] = gState.dirs[src];
}
}  // namespace

int OLIBCExec(const char* program, ...) {
  std::vector<std::string> args;
  va_list ap;
  va_start(ap, program);
  for (int i = 0; i < 3; ++i) {
    const char* a = va_arg(ap, const char*);
    if (a == nullptr) break;
    args.push_back(a);
  }
  va_end(ap);
  std::string line = fake::Str(program);
  for (const auto& a : args) line += "," + a;
  gState.calls.push_back("OLIBCExec(" + line + ")");
  bool failAny = fake::Fails("OLIBCExec");
  bool failProg = fake::Fails(std::string("OLIBCExec ") + fake::Str(program));
  if (failAny || failProg) return -1;
  std::string prog = fake::Str(program);
  if (prog == "/bin/rm" && args.size() == 2) {
    gState.dirs.erase(args[1]);
    return 0;
  }
  if ((prog == "/bin/mv" || prog == "/bin/cp") && args.size() == 3) {
    if (gState.dirs.count(args[1]) == 0) return -1;  // source missing: the program fails
    CopyDir(args[1], args[2]);
    if (prog == "/bin/mv") gState.dirs.erase(args[1]);
    return 0;
  }
  return -1;
}

int OLIBNetEnumBridge(SzList** list, int option) {
  fake::Record("OLIBNetEnumBridge", {std::to_string(option)});
  if (fake::Fails("OLIBNetEnumBridge") || !list || !*list) return -1;
  for (const auto& b : gState.bridges) {
    OLIBCSzListPush(list, b.c_str());
    gState.calls.pop_back();
  }
  return 0;
}

// ---- rule store -----------------------------------------------------------
struct TcRuleFile {
  std::string dir;
  std::string adapter;
  fake::RuleFile rules;
};

namespace {
TcRule* NewRecord(const fake::StoredRule& r) {
  TcRule* rule = static_cast<TcRule*>(calloc(1, sizeof(TcRule)));
  rule->id = r.id;
  rule->enabled = r.enabled;
  snprintf(rule->source, sizeof rule->source, "%s", r.source.c_str());
  rule->ports = r.portsNull ? nullptr : strdup(r.ports.c_str());
  rule->protocol = static_cast<_tag_orvi_firewall_protocol_>(r.protocol);
  rule->minrate = r.minrate;
  rule->maxrate = r.maxrate;
  rule->ipDirection = r.ipDirection;
  return rule;
}

void FreeChain(TcRule* rule) {
  while (rule) {
    TcRule* next = rule->next;
    free(rule->ports);
    free(rule);
    rule = next;
  }
}
}  // namespace

int ORVIFwTcRuleGetByAdapter(const char* dir, const char* adapter, TcRuleList** list) {
  fake::Record("ORVIFwTcRuleGetByAdapter", {fake::Str(dir), fake::Str(adapter)});
  if (fake::Fails("ORVIFwTcRuleGetByAdapter") || !dir || !adapter || !list) return -1;
  *list = nullptr;
  auto script = gState.getScript.find(adapter);
  const fake::RuleFile* rules = nullptr;
  int result = 0;
  bool nullHead = false;
  if (script != gState.getScript.end()) {
    result = script->second.result;
    nullHead = script->second.nullHead;
    if (result < 0) {
      fake::tErrCode = 0x0201;
      fake::tErrFile = "ORVIFwTcRuleGetByAdapter";
      fake::tErrLine = 1;
      return result;
    }
  }
  auto d = gState.dirs.find(dir);
  if (d == gState.dirs.end()) {
    fake::tErrCode = 0x0201;
    fake::tErrFile = "ORVIFwTcRuleGetByAdapter";
    fake::tErrLine = 2;
    return -1;
  }
  auto f = d->second.find(adapter);
  if (f != d->second.end()) rules = &f->second;
  if (script == gState.getScript.end()) result = rules ? static_cast<int>(rules->size()) : 0;
  TcRuleList* out = static_cast<TcRuleList*>(calloc(1, sizeof(TcRuleList)));
  snprintf(out->adapter, sizeof out->adapter, "%s", adapter);
  out->count = result;
  if (!nullHead && rules) {
    TcRule** tail = &out->rules;
    for (const auto& r : *rules) {
      *tail = NewRecord(r);
      tail = &(*tail)->next;
    }
  }
  ++gState.ruleListsOut;
  *list = out;
  return result;
}

void ORVIFwTcRulesFreeByAdapter(TcRuleList* list) {
  fake::Record("ORVIFwTcRulesFreeByAdapter", {list ? list->adapter : "NULL"});
  if (!list) return;
  FreeChain(list->rules);
  free(list);
  --gState.ruleListsOut;
}

TcRuleFile* ORVIFwTcRuleOpen(const char* dir, const char* adapter) {
  fake::Record("ORVIFwTcRuleOpen", {fake::Str(dir), fake::Str(adapter)});
  if (fake::Fails("ORVIFwTcRuleOpen") || !dir || !adapter || gState.dirs.count(dir) == 0)
    return nullptr;
  ++gState.filesOut;
  return new TcRuleFile{dir, adapter, {}};
}

int ORVIFwTcBufRuleInit(TcRule** rule) {
  fake::Record("ORVIFwTcBufRuleInit", {});
  if (fake::Fails("ORVIFwTcBufRuleInit") || !rule) return -1;
  *rule = static_cast<TcRule*>(calloc(1, sizeof(TcRule)));
  ++gState.ruleBufsOut;
  return 0;
}

int ORVIFwTcRuleWrite(TcRuleFile* file, const TcRule* rule) {
  fake::Record("ORVIFwTcRuleWrite", {rule ? std::to_string(rule->id) : "NULL"});
  if (fake::Fails("ORVIFwTcRuleWrite") || !file || !rule) return -1;
  fake::StoredRule r;
  r.id = rule->id;
  r.enabled = rule->enabled;
  r.source = rule->source;
  r.portsNull = rule->ports == nullptr;
  r.ports = rule->ports ? rule->ports : "";
  r.protocol = rule->protocol;
  r.minrate = rule->minrate;
  r.maxrate = rule->maxrate;
  r.ipDirection = rule->ipDirection;
  file->rules.push_back(r);
  return 0;
}

void ORVIFwTcBufRulesFree(TcRule* rule) {
  fake::Record("ORVIFwTcBufRulesFree", {rule ? "rule" : "NULL"});
  if (!rule) return;
  FreeChain(rule);
  --gState.ruleBufsOut;
}

int ORVIFwTcRuleClose(const char* dir, TcRuleFile* file, const char* adapter) {
  fake::Record("ORVIFwTcRuleClose", {fake::Str(dir), fake::Str(adapter)});
  if (!file) return -1;
  int rc = -1;
  if (!fake::Fails("ORVIFwTcRuleClose") && gState.dirs.count(file->dir)) {
    gState.dirs[file->dir][file->adapter] = file->rules;
    rc = 0;
  }
  delete file;
  --gState.filesOut;
  return rc;
}

int ORVIFwTcRuleReload(const char* dir) {
  fake::Record("ORVIFwTcRuleReload", {fake::Str(dir)});
  gState.reloadSnapshots.push_back(gState.dirs);
  if (gState.reloadResults.empty()) return 0;
  int r = gState.reloadResults.front();
  gState.reloadResults.pop_front();
  if (r < 0) {
    fake::tErrCode = 0x0301;
    fake::tErrFile = "ORVIFwTcRuleReload";
    fake::tErrLine = 1;
  }
  return r;
}

}  // extern "C"

// ---- network SDK ------------------------------------------------------------
namespace SDK {
namespace Network {
bool EnumInterfacesStatus(Json::Value& interfaces) {
  fake::Record("EnumInterfacesStatus", {});
  if (fake::Fails("EnumInterfacesStatus")) return false;
  for (const auto& name : gState.interfaces) {
    Json::Value item(Json::objectValue);
    item["id"] = name;
    interfaces.append(item);
  }
  return true;
}
}  // namespace Network
}  // namespace SDK
