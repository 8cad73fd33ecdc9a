// C utility library of the appliance platform, implemented in C++ behind a C ABI.
#include "olibc.h"

#include <dirent.h>
#include <errno.h>
#include <signal.h>
#include <spawn.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <cctype>
#include <memory>
#include <string>
#include <vector>

#include "orvi_root.h"

extern char** environ;

namespace {

// ---- error stack ------------------------------------------------------------

thread_local int tErrCode = 0;
thread_local char tErrFile[64] = "";
thread_local int tErrLine = 0;

// ---- string lists -----------------------------------------------------------

// Header and item array share one allocation, so growing the list may move it:
// callers that forget to take the new pointer from Push fail fast under ASan.
constexpr int kMinListSize = 8;

size_t ListBytes(int size) { return sizeof(SzList) + static_cast<size_t>(size) * sizeof(char*); }

char** ListSlots(SzList* list) { return reinterpret_cast<char**>(list + 1); }

bool ValidList(const SzList* list) {
  return list != nullptr && list->size >= 0 && list->count >= 0 && list->count <= list->size;
}

// Drops items appended after `count`, so a failed multi-item append leaves
// the list as the caller handed it over.
void TruncateList(SzList* list, int count) {
  while (list->count > count) {
    free(list->items[list->count - 1]);
    list->items[--list->count] = nullptr;
  }
}

// ---- files and directories --------------------------------------------------

struct FileCloser {
  void operator()(FILE* f) const { fclose(f); }
};
using FilePtr = std::unique_ptr<FILE, FileCloser>;

using orvi::DirPtr;

// getline's buffer, reused for every line and released on every return.
struct LineBuf {
  char* data = nullptr;
  size_t cap = 0;
  LineBuf() = default;
  ~LineBuf() { free(data); }
  LineBuf(const LineBuf&) = delete;
  LineBuf& operator=(const LineBuf&) = delete;
};

bool IsDir(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

bool IsBlank(char c) { return c == ' ' || c == '\t'; }

// Trims blanks and line ends from both sides of [begin, end).
void TrimRange(const char*& begin, const char*& end) {
  while (begin < end && isspace(static_cast<unsigned char>(*begin))) ++begin;
  while (end > begin && isspace(static_cast<unsigned char>(end[-1]))) --end;
}

// ---- programs ---------------------------------------------------------------

struct SpawnAttr {
  posix_spawnattr_t attr;
  posix_spawn_file_actions_t actions;
  bool ok;
  bool actionsOk;
  SpawnAttr() {
    ok = posix_spawnattr_init(&attr) == 0;
    actionsOk = posix_spawn_file_actions_init(&actions) == 0;
  }
  ~SpawnAttr() {
    if (ok) posix_spawnattr_destroy(&attr);
    if (actionsOk) posix_spawn_file_actions_destroy(&actions);
  }
  SpawnAttr(const SpawnAttr&) = delete;
  SpawnAttr& operator=(const SpawnAttr&) = delete;
};

// The child starts with default signal dispositions and an empty mask, so a
// host that ignores SIGPIPE or blocks SIGTERM does not hand that on to cp or tc.
bool PrepareSpawnAttr(SpawnAttr& sa) {
  if (!sa.ok || !sa.actionsOk) return false;
#if defined(__GLIBC__) && (__GLIBC__ > 2 || (__GLIBC__ == 2 && __GLIBC_MINOR__ >= 34))
  // The host's sockets and files are none of rm's or cp's business.
  if (posix_spawn_file_actions_addclosefrom_np(&sa.actions, 3) != 0) return false;
#endif
  sigset_t none;
  sigset_t all;
  sigemptyset(&none);
  sigfillset(&all);
  sigdelset(&all, SIGKILL);
  sigdelset(&all, SIGSTOP);
  return posix_spawnattr_setsigmask(&sa.attr, &none) == 0 &&
         posix_spawnattr_setsigdefault(&sa.attr, &all) == 0 &&
         posix_spawnattr_setflags(&sa.attr, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF) == 0;
}

// Appends a copy of item[0, len) to a valid list; the list may move.
int PushRange(SzList** list, const char* item, size_t len) {
  SzList* l = *list;
  char* copy = static_cast<char*>(malloc(len + 1));
  if (copy == nullptr) {
    ORVI_ERR(OLIBC_ERR_NOMEM);
    return -1;
  }
  if (l->count == l->size) {
    if (l->size > INT_MAX / 2) {
      free(copy);
      ORVI_ERR(OLIBC_ERR_NOMEM);
      return -1;
    }
    int grown = l->size > 0 ? l->size * 2 : kMinListSize;
    SzList* moved = static_cast<SzList*>(realloc(l, ListBytes(grown)));
    if (moved == nullptr) {  // the old list is untouched and still the caller's
      free(copy);
      ORVI_ERR(OLIBC_ERR_NOMEM);
      return -1;
    }
    l = moved;
    l->size = grown;
    l->items = ListSlots(l);
    *list = l;
  }
  memcpy(copy, item, len);
  copy[len] = '\0';
  l->items[l->count++] = copy;
  return 0;
}

// Exit status of a child whose exec failed after posix_spawn returned.
constexpr int kExecFailedStatus = 127;

}  // namespace

extern "C" {

// ---- error stack ------------------------------------------------------------

int OLIBCErrGet(void) { return tErrCode; }

const char* OLIBCErrorGetFile(void) { return tErrFile; }

int OLIBCErrorGetLine(void) { return tErrLine; }

void OLIBCErrSetEx(int code, const char* file, int line) {
  tErrCode = code;
  snprintf(tErrFile, sizeof tErrFile, "%s", file != nullptr ? file : "");
  tErrLine = line;
}

// ---- string lists -----------------------------------------------------------

SzList* OLIBCSzListAlloc(int size) {
  if (size < kMinListSize) size = kMinListSize;
  if (static_cast<size_t>(size) > (SIZE_MAX - sizeof(SzList)) / sizeof(char*)) {
    ORVI_ERR(OLIBC_ERR_NOMEM);
    return nullptr;
  }
  // Only the slots below count are ever read, so they are not zeroed: callers
  // ask for 1024 slots and mostly use a handful.
  SzList* list = static_cast<SzList*>(malloc(ListBytes(size)));
  if (list == nullptr) {
    ORVI_ERR(OLIBC_ERR_NOMEM);
    return nullptr;
  }
  list->size = size;
  list->count = 0;
  list->items = ListSlots(list);
  return list;
}

void OLIBCSzListFree(SzList* list) {
  if (list == nullptr) return;
  for (int i = 0; i < list->count; ++i) free(list->items[i]);
  free(list);
}

char* OLIBCSzListGet(SzList* list, int index) {
  if (!ValidList(list) || index < 0 || index >= list->count) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return nullptr;
  }
  return list->items[index];
}

int OLIBCSzListPush(SzList** list, const char* item) {
  if (list == nullptr || !ValidList(*list) || item == nullptr) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  return PushRange(list, item, strlen(item));
}

int OLIBCSzListRemove(SzList* list, int index) {
  if (!ValidList(list) || index < 0 || index >= list->count) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return 0;
  }
  free(list->items[index]);
  memmove(&list->items[index], &list->items[index + 1],
          static_cast<size_t>(list->count - index - 1) * sizeof(char*));
  list->items[--list->count] = nullptr;
  return 1;
}

int OLIBCSzListJoin(SzList* list, const char* sep, char** buf, int* size) {
  if (!ValidList(list) || sep == nullptr || buf == nullptr || size == nullptr ||
      (*buf != nullptr && *size < 0)) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  const size_t sepLen = strlen(sep);
  size_t need = 1;  // the terminating NUL
  for (int i = 0; i < list->count; ++i) {
    need += (list->items[i] != nullptr ? strlen(list->items[i]) : 0) + (i > 0 ? sepLen : 0);
    if (need > static_cast<size_t>(INT_MAX)) {
      ORVI_ERR(OLIBC_ERR_NOMEM);
      return -1;
    }
  }
  if (*buf == nullptr || static_cast<size_t>(*size) < need) {
    char* grown = static_cast<char*>(realloc(*buf, need));
    if (grown == nullptr) {  // the caller's buffer stays as it was
      ORVI_ERR(OLIBC_ERR_NOMEM);
      return -1;
    }
    *buf = grown;
    *size = static_cast<int>(need);
  }
  char* out = *buf;
  for (int i = 0; i < list->count; ++i) {
    if (i > 0) {
      memcpy(out, sep, sepLen);
      out += sepLen;
    }
    if (list->items[i] != nullptr) {
      size_t len = strlen(list->items[i]);
      memcpy(out, list->items[i], len);
      out += len;
    }
  }
  *out = '\0';
  return 0;
}

// ---- string helpers ---------------------------------------------------------

int OLIBCStrTok(const char* text, const char* seps, SzList** list) {
  if (text == nullptr || seps == nullptr || list == nullptr || !ValidList(*list)) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  if (*text == '\0') return 0;
  const int before = (*list)->count;
  for (const char* p = text;; ++p) {
    const size_t len = strcspn(p, seps);
    if (PushRange(list, p, len) < 0) {  // error already recorded
      TruncateList(*list, before);
      return -1;
    }
    p += len;
    if (*p == '\0') break;
  }
  return 0;
}

int OLIBCStrTrimSpace(char* text, int /*flags*/) {
  if (text == nullptr) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  const char* begin = text;
  const char* end = text + strlen(text);
  TrimRange(begin, end);
  size_t len = static_cast<size_t>(end - begin);
  memmove(text, begin, len);
  text[len] = '\0';
  return 0;
}

// ---- key file ---------------------------------------------------------------

int OLIBCFileGetKeyValue(const char* path, const char* key, char* buf, int size, int /*flags*/) {
  // Whatever fails below, the caller never reads stale text as a value.
  if (buf != nullptr && size >= 1) *buf = '\0';
  if (path == nullptr || *path == '\0' || key == nullptr || *key == '\0' || buf == nullptr ||
      size < 1) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  FilePtr file(fopen(orvi::RootPath(path).c_str(), "re"));
  if (!file) {
    ORVI_ERR(OLIBC_ERR_IO);
    return -1;
  }
  const size_t keyLen = strlen(key);
  LineBuf line;
  ssize_t n;
  while ((n = getline(&line.data, &line.cap, file.get())) >= 0) {
    const char* begin = line.data;
    const char* end = begin + n;
    while (begin < end && IsBlank(*begin)) ++begin;
    if (begin == end || *begin == '#') continue;
    const char* eq = static_cast<const char*>(memchr(begin, '=', static_cast<size_t>(end - begin)));
    if (eq == nullptr) continue;
    const char* keyEnd = eq;
    while (keyEnd > begin && IsBlank(keyEnd[-1])) --keyEnd;
    if (static_cast<size_t>(keyEnd - begin) != keyLen || memcmp(begin, key, keyLen) != 0) continue;

    const char* value = eq + 1;
    TrimRange(value, end);
    if (end - value >= 2 && (*value == '"' || *value == '\'') && end[-1] == *value) {
      ++value;
      --end;
    }
    const size_t len = static_cast<size_t>(end - value);
    // A cut value would be taken for the whole one: refuse it instead.
    if (len >= static_cast<size_t>(size)) {
      ORVI_ERR(OLIBC_ERR_RANGE);
      return -1;
    }
    // The length snprintf reports stops at a stray NUL byte, like the copy does.
    return snprintf(buf, static_cast<size_t>(size), "%.*s", static_cast<int>(len), value);
  }
  ORVI_ERR(ferror(file.get()) ? OLIBC_ERR_IO : OLIBC_ERR_NOKEY);
  return -1;
}

// ---- programs ---------------------------------------------------------------

int OLIBCExec(const char* program, ...) {
  if (program == nullptr || *program == '\0') {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  std::vector<std::string> args{program};
  va_list ap;
  va_start(ap, program);
  // Reading one past the third argument is safe: a conforming caller passes NULL there.
  for (int i = 0; i < 4; ++i) {
    const char* arg = va_arg(ap, const char*);
    if (arg == nullptr) break;
    if (i == 3) {
      va_end(ap);
      ORVI_ERR(OLIBC_ERR_INVAL);
      return -1;
    }
    args.push_back(arg[0] == '/' ? orvi::RootPath(arg) : std::string(arg));
  }
  va_end(ap);

  std::vector<char*> argv;
  for (auto& a : args) argv.push_back(&a[0]);
  argv.push_back(nullptr);

  SpawnAttr sa;
  if (!PrepareSpawnAttr(sa)) {
    ORVI_ERR(OLIBC_ERR_SPAWN);
    return -1;
  }
  pid_t pid = -1;
  if (posix_spawn(&pid, program, &sa.actions, &sa.attr, argv.data(), environ) != 0) {
    ORVI_ERR(OLIBC_ERR_SPAWN);
    return -1;
  }
  int status = 0;
  pid_t waited;
  do {
    waited = waitpid(pid, &status, 0);
  } while (waited < 0 && errno == EINTR);
  if (waited < 0) {  // e.g. the host reaps children itself (SIGCHLD ignored)
    ORVI_ERR(OLIBC_ERR_EXIT);
    return -2;
  }
  if (WIFSIGNALED(status)) {
    ORVI_ERR(OLIBC_ERR_EXIT);
    return -3;
  }
  if (WIFEXITED(status) && WEXITSTATUS(status) == 0) return 0;
  if (WIFEXITED(status) && WEXITSTATUS(status) == kExecFailedStatus) {
    ORVI_ERR(OLIBC_ERR_SPAWN);
    return -1;
  }
  ORVI_ERR(OLIBC_ERR_EXIT);
  return -2;
}

// ---- network ----------------------------------------------------------------

int OLIBNetEnumBridge(SzList** list, int /*option*/) {
  if (list == nullptr || !ValidList(*list)) {
    ORVI_ERR(OLIBC_ERR_INVAL);
    return -1;
  }
  const std::string base = orvi::RootPath("/sys/class/net");
  std::vector<std::string> bridges;
  {
    DirPtr dir(opendir(base.c_str()));
    if (!dir) {
      ORVI_ERR(OLIBC_ERR_IO);
      return -1;
    }
    errno = 0;
    while (struct dirent* entry = readdir(dir.get())) {
      std::string name = entry->d_name;
      if (name != "." && name != ".." && IsDir(base + "/" + name + "/bridge"))
        bridges.push_back(name);
      errno = 0;
    }
    if (errno != 0) {
      ORVI_ERR(OLIBC_ERR_IO);
      return -1;
    }
  }
  std::sort(bridges.begin(), bridges.end());
  const int before = (*list)->count;
  for (const auto& name : bridges) {
    if (OLIBCSzListPush(list, name.c_str()) < 0) {
      TruncateList(*list, before);
      return -1;
    }
  }
  return 0;
}

}  // extern "C"
