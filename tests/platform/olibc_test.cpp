#include "olibc.h"

#include <fcntl.h>
#include <stdlib.h>
#include <string.h>

#include <fstream>
#include <functional>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "tmp_root.h"

namespace {

using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;

struct ListFree {
  void operator()(SzList* l) const { OLIBCSzListFree(l); }
};
using ListPtr = std::unique_ptr<SzList, ListFree>;

std::vector<std::string> Items(const SzList* list) {
  std::vector<std::string> out;
  for (int i = 0; i < list->count; ++i) out.emplace_back(list->items[i]);
  return out;
}

// Pushes through a raw pointer, as the module does, and hands the (possibly
// moved) list back to the holder.
int Push(ListPtr& holder, const char* item) {
  SzList* raw = holder.release();
  int rc = OLIBCSzListPush(&raw, item);
  holder.reset(raw);
  return rc;
}

void ClearError() { OLIBCErrSetEx(0, "", 0); }

// ---- error stack ------------------------------------------------------------

TEST(ErrorStack, IsPerThreadAndNeverNull) {
  OLIBCErrSetEx(0x1234, "main.cpp", 42);
  int otherCode = -1;
  std::string otherFile = "unset";
  int otherLine = -1;
  std::thread([&] {
    otherCode = OLIBCErrGet();
    otherFile = OLIBCErrorGetFile();  // never NULL, even before any record
    otherLine = OLIBCErrorGetLine();
    OLIBCErrSetEx(0x9999, "thread.cpp", 7);
  }).join();
  EXPECT_EQ(otherCode, 0);
  EXPECT_EQ(otherFile, "");
  EXPECT_EQ(otherLine, 0);
  EXPECT_EQ(OLIBCErrGet(), 0x1234);
  EXPECT_STREQ(OLIBCErrorGetFile(), "main.cpp");
  EXPECT_EQ(OLIBCErrorGetLine(), 42);
}

TEST(ErrorStack, FileNameIsCopiedAndBounded) {
  std::string name(300, 'f');
  OLIBCErrSetEx(1, name.c_str(), 1);
  name.assign(300, 'x');  // the record must not point into the caller's text
  std::string stored = OLIBCErrorGetFile();
  EXPECT_EQ(stored, std::string(63, 'f'));
  OLIBCErrSetEx(1, nullptr, 1);
  EXPECT_STREQ(OLIBCErrorGetFile(), "");
}

// ---- SzList -----------------------------------------------------------------

TEST(SzList, GrowsBeyondItsInitialSizeAndCopiesItems) {
  ListPtr list(OLIBCSzListAlloc(2));
  ASSERT_TRUE(list);
  char item[32];
  for (int i = 0; i < 100; ++i) {
    snprintf(item, sizeof item, "item%d", i);
    ASSERT_EQ(Push(list, item), 0) << i;
  }
  strcpy(item, "changed");
  // The module reads the count as the second 32-bit word of the header.
  EXPECT_EQ(reinterpret_cast<const int32_t*>(list.get())[1], 100);
  EXPECT_STREQ(OLIBCSzListGet(list.get(), 0), "item0");
  EXPECT_STREQ(OLIBCSzListGet(list.get(), 99), "item99");
  EXPECT_EQ(OLIBCSzListGet(list.get(), 100), nullptr);
  EXPECT_EQ(OLIBCSzListGet(list.get(), -1), nullptr);
}

TEST(SzList, NonPositiveSizeStillGivesAUsableList) {
  for (int size : {0, -5}) {
    ListPtr list(OLIBCSzListAlloc(size));
    ASSERT_TRUE(list) << size;
    EXPECT_EQ(list->count, 0) << size;
    EXPECT_EQ(Push(list, "a"), 0) << size;
    EXPECT_THAT(Items(list.get()), ElementsAre("a")) << size;
  }
}

TEST(SzList, RemoveKeepsOrderAndRefusesBadIndexes) {
  ListPtr list(OLIBCSzListAlloc(4));
  for (const char* s : {"a", "b", "c", "d"}) ASSERT_EQ(Push(list, s), 0);
  EXPECT_NE(OLIBCSzListRemove(list.get(), 1), 0);
  EXPECT_THAT(Items(list.get()), ElementsAre("a", "c", "d"));
  EXPECT_NE(OLIBCSzListRemove(list.get(), 2), 0);
  EXPECT_THAT(Items(list.get()), ElementsAre("a", "c"));
  ClearError();
  EXPECT_EQ(OLIBCSzListRemove(list.get(), 2), 0);
  EXPECT_EQ(OLIBCErrGet(), OLIBC_ERR_INVAL);
  EXPECT_THAT(Items(list.get()), ElementsAre("a", "c"));
}

TEST(SzList, JoinTable) {
  struct Case {
    std::vector<const char*> items;
    const char* sep;
    const char* want;
  } cases[] = {
      {{}, ",", ""},
      {{"80"}, ",", "80"},
      {{"80", "", "443"}, ",", "80,,443"},
      {{"a", "b"}, ", ", "a, b"},
      {{"a", "b"}, "", "ab"},
  };
  for (const auto& c : cases) {
    ListPtr list(OLIBCSzListAlloc(1));
    for (const char* s : c.items) ASSERT_EQ(Push(list, s), 0);
    int size = 64;
    char* buf = static_cast<char*>(malloc(size));
    EXPECT_EQ(OLIBCSzListJoin(list.get(), c.sep, &buf, &size), 0) << c.want;
    EXPECT_STREQ(buf, c.want);
    EXPECT_EQ(size, 64) << c.want << ": a buffer that fits is kept";
    free(buf);
  }
}

TEST(SzList, JoinEnlargesTheBufferAndUpdatesItsSize) {
  ListPtr list(OLIBCSzListAlloc(4));
  std::string want;
  for (int i = 0; i < 50; ++i) {
    std::string item = std::to_string(1000 + i);
    ASSERT_EQ(Push(list, item.c_str()), 0);
    want += (i ? "," : "") + item;
  }
  int size = 4;
  char* buf = static_cast<char*>(malloc(size));
  ASSERT_EQ(OLIBCSzListJoin(list.get(), ",", &buf, &size), 0);
  EXPECT_EQ(buf, want);
  EXPECT_GE(size, static_cast<int>(want.size()) + 1);
  free(buf);

  char* none = nullptr;
  int noSize = 0;
  ASSERT_EQ(OLIBCSzListJoin(list.get(), ",", &none, &noSize), 0);
  EXPECT_EQ(none, want);
  EXPECT_GE(noSize, static_cast<int>(want.size()) + 1);
  free(none);
}

// ---- string helpers ---------------------------------------------------------

TEST(StrTok, Table) {
  struct Case {
    const char* text;
    const char* seps;
    std::vector<std::string> want;
  } cases[] = {
      {"", ",", {}},
      {"80", ",", {"80"}},
      {"80,443", ",", {"80", "443"}},
      {"80,,443", ",", {"80", "", "443"}},
      {"80,", ",", {"80", ""}},
      {",80", ",", {"", "80"}},
      {",", ",", {"", ""}},
      {"1-2,3", ",-", {"1", "2", "3"}},
      {"a b", "", {"a b"}},
  };
  for (const auto& c : cases) {
    ListPtr list(OLIBCSzListAlloc(1));
    ASSERT_EQ(Push(list, "before"), 0);
    SzList* raw = list.release();
    EXPECT_EQ(OLIBCStrTok(c.text, c.seps, &raw), 0) << '"' << c.text << '"';
    list.reset(raw);
    std::vector<std::string> want{"before"};
    want.insert(want.end(), c.want.begin(), c.want.end());
    EXPECT_THAT(Items(list.get()), ElementsAreArray(want)) << '"' << c.text << '"';
  }
}

TEST(StrTrimSpace, Table) {
  struct Case {
    const char* text;
    const char* want;
  } cases[] = {
      {"", ""},           {"   ", ""},  {"a", "a"},   {"  a b  ", "a b"},
      {"\t\na\r\n", "a"}, {"a  ", "a"}, {"  a", "a"},
  };
  for (const auto& c : cases) {
    std::string text = c.text;
    EXPECT_EQ(OLIBCStrTrimSpace(&text[0], 0), 0) << '"' << c.text << '"';
    EXPECT_STREQ(text.c_str(), c.want) << '"' << c.text << '"';
  }
}

// ---- key file ---------------------------------------------------------------

TEST(FileGetKeyValue, Table) {
  TmpRoot root;
  root.Write("etc/orviinfo.conf",
             "# wan_interface=commented\n"
             "   #net_topology=commented\n"
             "\n"
             "no equals sign here\n"
             "wan_interface = wan0\n"
             "dq=\"router mode\"\n"
             "sq='x'\n"
             "mixed=\"a'\n"
             "lone=\"\n"
             "empty=\n"
             "empty_quotes=\"\"\n"
             "blank =   \n"
             "crlf=v\r\n"
             "inner=a=b\n"
             "net_topology=router\n"
             "net_topology=bridge\n"
             "wan_interface_2=wrong\n"
             "last=no newline");
  struct Case {
    const char* key;
    int ret;
    const char* value;
  } cases[] = {
      {"wan_interface", 4, "wan0"},
      {"dq", 11, "router mode"},
      {"sq", 1, "x"},
      {"mixed", 3, "\"a'"},
      {"lone", 1, "\""},
      {"empty", 0, ""},
      {"empty_quotes", 0, ""},
      {"blank", 0, ""},
      {"crlf", 1, "v"},
      {"inner", 3, "a=b"},
      {"net_topology", 6, "router"},
      {"last", 10, "no newline"},
  };
  for (const auto& c : cases) {
    char buf[1024] = "stale";
    EXPECT_EQ(OLIBCFileGetKeyValue("/etc/orviinfo.conf", c.key, buf, sizeof buf, 0), c.ret)
        << c.key;
    EXPECT_STREQ(buf, c.value) << c.key;
  }
}

TEST(FileGetKeyValue, FailuresAreNegativeWithAnError) {
  TmpRoot root;
  root.Write("etc/k.conf", "key=router\n#gone=1\n");
  const std::string longPath = "/etc/" + std::string(5000, 'x');
  struct Case {
    const char* what;
    const char* path;
    const char* key;
    int size;
    int code;
  } cases[] = {
      {"missing key", "/etc/k.conf", "absent", 1024, OLIBC_ERR_NOKEY},
      {"commented key", "/etc/k.conf", "gone", 1024, OLIBC_ERR_NOKEY},
      {"key prefix", "/etc/k.conf", "ke", 1024, OLIBC_ERR_NOKEY},
      {"missing file", "/etc/none.conf", "key", 1024, OLIBC_ERR_IO},
      {"a directory", "/etc", "key", 1024, OLIBC_ERR_IO},
      {"over-long path", longPath.c_str(), "key", 1024, OLIBC_ERR_IO},
      {"value cut", "/etc/k.conf", "key", 6, OLIBC_ERR_RANGE},
      {"zero size", "/etc/k.conf", "key", 0, OLIBC_ERR_INVAL},
      {"empty key", "/etc/k.conf", "", 1024, OLIBC_ERR_INVAL},
      {"NULL key", "/etc/k.conf", nullptr, 1024, OLIBC_ERR_INVAL},
      {"NULL path", nullptr, "key", 1024, OLIBC_ERR_INVAL},
  };
  for (const auto& c : cases) {
    char buf[1024] = "stale";
    ClearError();
    EXPECT_LT(OLIBCFileGetKeyValue(c.path, c.key, buf, c.size, 0), 0) << c.what;
    EXPECT_EQ(OLIBCErrGet(), c.code) << c.what;
    if (c.size > 0) {
      EXPECT_STREQ(buf, "") << c.what << ": no partial value";
    }
  }
}

// ---- programs ---------------------------------------------------------------

TEST(Exec, ResultsTable) {
  struct Case {
    const char* what;
    const char* program;
    const char* a1;
    const char* a2;
    bool ok;
    int code;
  } cases[] = {
      {"exit 0", EXEC_HELPER, "exit", "0", true, 0},
      {"exit 3", EXEC_HELPER, "exit", "3", false, OLIBC_ERR_EXIT},
      {"killed by a signal", EXEC_HELPER, "kill", nullptr, false, OLIBC_ERR_EXIT},
      {"missing program", "/nonexistent/program", nullptr, nullptr, false, OLIBC_ERR_SPAWN},
      {"a directory", "/", nullptr, nullptr, false, OLIBC_ERR_SPAWN},
      {"empty program", "", nullptr, nullptr, false, OLIBC_ERR_INVAL},
      {"NULL program", nullptr, nullptr, nullptr, false, OLIBC_ERR_INVAL},
  };
  for (const auto& c : cases) {
    ClearError();
    int rc = OLIBCExec(c.program, c.a1, c.a2, nullptr);
    if (c.ok) {
      EXPECT_EQ(rc, 0) << c.what;
    } else {
      EXPECT_LT(rc, 0) << c.what;
    }
    EXPECT_EQ(OLIBCErrGet(), c.code) << c.what;
  }
}

// Arguments reach the program unchanged, one per argv slot (no shell: blanks
// and "$" stay), absolute ones under the root; the environment is inherited.
TEST(Exec, PassesArgumentsResolvedUnderTheRoot) {
  TmpRoot root;
  const std::string out = root.Path("argv.txt");
  setenv("EXEC_HELPER_OUT", out.c_str(), 1);
  int rc = OLIBCExec(EXEC_HELPER, "args", "/etc/tc", "a b;$HOME", nullptr);
  unsetenv("EXEC_HELPER_OUT");
  ASSERT_EQ(rc, 0);
  std::ifstream in(out);
  std::stringstream text;
  text << in.rdbuf();
  EXPECT_EQ(text.str(), root.Dir() + "/etc/tc\na b;$HOME\n");
}

// A descriptor the host left inheritable does not reach the program.
TEST(Exec, HostDescriptorsStayWithTheHost) {
  int fd = open("/dev/null", O_RDONLY);  // no O_CLOEXEC on purpose
  ASSERT_GE(fd, 3);
  const std::string text = std::to_string(fd);
  EXPECT_EQ(OLIBCExec(EXEC_HELPER, "closed", text.c_str(), nullptr), 0);
  close(fd);
}

TEST(Exec, CopiesADirectoryInsideTheRoot) {
  TmpRoot root;
  root.Write("etc/tc/eth0", "rules");
  ASSERT_EQ(OLIBCExec("/bin/cp", "-r", "/etc/tc", "/etc/tc_tmp", nullptr), 0);
  EXPECT_TRUE(root.Exists("etc/tc_tmp/eth0"));
}

// ---- bridges ----------------------------------------------------------------

TEST(EnumBridge, ListsBridgesInNameOrder) {
  TmpRoot root;
  for (const char* dir : {"sys/class/net/eth0", "sys/class/net/br1/bridge",
                          "sys/class/net/gbr/bridge", "sys/class/net/br0/bridge"})
    root.MkDir(dir);
  root.Write("sys/class/net/eth1/bridge", "a file, not a bridge directory");
  root.Write("sys/class/net/bonding_masters", "");
  ListPtr list(OLIBCSzListAlloc(1));
  ASSERT_EQ(Push(list, "before"), 0);
  SzList* raw = list.release();
  EXPECT_EQ(OLIBNetEnumBridge(&raw, 3), 0);
  list.reset(raw);
  EXPECT_THAT(Items(list.get()), ElementsAre("before", "br0", "br1", "gbr"));
}

TEST(EnumBridge, MissingDirectoryFailsAndAppendsNothing) {
  TmpRoot root;
  ListPtr list(OLIBCSzListAlloc(1));
  SzList* raw = list.get();
  ClearError();
  EXPECT_LT(OLIBNetEnumBridge(&raw, 3), 0);
  EXPECT_EQ(OLIBCErrGet(), OLIBC_ERR_IO);
  EXPECT_THAT(Items(list.get()), IsEmpty());
}

// ---- bad arguments ----------------------------------------------------------

// Every entry point refuses NULL and out-of-range arguments with a negative
// result (0 for Remove, NULL for Get), an EINVAL record naming this library,
// and leaves the caller's list and buffer as they were.
TEST(BadArguments, AreRefusedWithAnError) {
  ListPtr list(OLIBCSzListAlloc(4));
  ASSERT_EQ(Push(list, "a"), 0);
  SzList* l = list.get();
  SzList* none = nullptr;
  int size = 8;
  char* buf = static_cast<char*>(malloc(size));
  strcpy(buf, "keep");
  struct Case {
    const char* what;
    std::function<bool()> refused;
  } cases[] = {
      {"Get NULL list", [&] { return OLIBCSzListGet(nullptr, 0) == nullptr; }},
      {"Get index -1", [&] { return OLIBCSzListGet(l, -1) == nullptr; }},
      {"Push NULL item", [&] { return OLIBCSzListPush(&l, nullptr) < 0; }},
      {"Push NULL list address", [&] { return OLIBCSzListPush(nullptr, "a") < 0; }},
      {"Push NULL list", [&] { return OLIBCSzListPush(&none, "a") < 0; }},
      {"Remove NULL list", [&] { return OLIBCSzListRemove(nullptr, 0) == 0; }},
      {"Remove index -1", [&] { return OLIBCSzListRemove(l, -1) == 0; }},
      {"Join NULL list", [&] { return OLIBCSzListJoin(nullptr, ",", &buf, &size) < 0; }},
      {"Join NULL sep", [&] { return OLIBCSzListJoin(l, nullptr, &buf, &size) < 0; }},
      {"Join NULL buf address", [&] { return OLIBCSzListJoin(l, ",", nullptr, &size) < 0; }},
      {"Join NULL size", [&] { return OLIBCSzListJoin(l, ",", &buf, nullptr) < 0; }},
      {"StrTok NULL text", [&] { return OLIBCStrTok(nullptr, ",", &l) < 0; }},
      {"StrTok NULL seps", [&] { return OLIBCStrTok("a", nullptr, &l) < 0; }},
      {"StrTok NULL list address", [&] { return OLIBCStrTok("a", ",", nullptr) < 0; }},
      {"StrTok NULL list", [&] { return OLIBCStrTok("a", ",", &none) < 0; }},
      {"Trim NULL", [&] { return OLIBCStrTrimSpace(nullptr, 0) < 0; }},
      {"Key NULL buf", [&] { return OLIBCFileGetKeyValue("/etc/k", "key", nullptr, 16, 0) < 0; }},
      {"Exec four arguments",
       [&] { return OLIBCExec(EXEC_HELPER, "exit", "0", "x", "y", nullptr) < 0; }},
      {"EnumBridge NULL list address", [&] { return OLIBNetEnumBridge(nullptr, 3) < 0; }},
      {"EnumBridge NULL list", [&] { return OLIBNetEnumBridge(&none, 3) < 0; }},
  };
  for (const auto& c : cases) {
    ClearError();
    EXPECT_TRUE(c.refused()) << c.what;
    EXPECT_EQ(OLIBCErrGet(), OLIBC_ERR_INVAL) << c.what;
    EXPECT_STREQ(OLIBCErrorGetFile(), "olibc.cpp") << c.what;
  }
  EXPECT_EQ(l, list.get());
  EXPECT_THAT(Items(l), ElementsAre("a"));
  EXPECT_STREQ(buf, "keep");
  EXPECT_EQ(size, 8);
  free(buf);
  OLIBCSzListFree(nullptr);  // accepted
}

}  // namespace
