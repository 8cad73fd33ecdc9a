#include <stdlib.h>

#include <functional>

#include "validation_fixture.h"

namespace {

struct NormCase {
  const char* in;
  const char* out;
};

class Normalize : public ValidationTest {
 protected:
  // Runs the normaliser and hands back its text; the buffer is the caller's.
  int Run(const char* in, std::string* text) {
    char* buf = nullptr;
    int size = 0;
    int rc = h.PortsFormatNormalize(in, &buf, &size);
    if (buf) {
      if (text) *text = buf;
      EXPECT_GE(size, 1024);
      free(buf);
    }
    return rc;
  }
};

TEST_F(Normalize, TrimsOnlyTheEndsOfItems) {
  const NormCase cases[] = {
      {"80 , 443 ,777", "80,443,777"},
      {"1000 - 2000", "1000 - 2000"},
      {"\t80\t,\n443 ", "80,443"},
      {" cifs ", "cifs"},
      {"", ""},
      {",,,", ",,,"},
      {"80, ,443", "80,,443"},
      {"80,443", "80,443"},
  };
  for (const auto& c : cases) {
    std::string out = "(none)";
    EXPECT_EQ(Run(c.in, &out), 0) << c.in;
    EXPECT_EQ(out, c.out) << c.in;
  }
  EXPECT_TRUE(fake::LogBodies().empty());
}

TEST_F(Normalize, NullInputIsRefused) {
  EXPECT_EQ(Run(nullptr, nullptr), -1);
  EXPECT_EQ(fake::LogBodies(), Lines{"szPorts should not be NULL" + kNoErr});
}

TEST_F(Normalize, PlatformFailuresAreLoggedAndReleased) {
  struct Case {
    const char* name;
    std::function<void()> inject;
    Lines lines;
  };
  const Case cases[] = {
      {"alloc",
       [] { fake::FailCall("OLIBCSzListAlloc"); },
       {"Failed to allocate list[0x0201 OLIBCSzListAlloc:1]"}},
      {"strtok",
       [] { fake::FailCall("OLIBCStrTok"); },
       {"Failed to strtok ports (80, 443)[0x0201 OLIBCStrTok:1]"}},
      {"trim",
       [] { fake::FailCall("OLIBCStrTrimSpace", 2); },
       {"Failed to OLIBCStrTrimSpace ( 443)[0x0201 OLIBCStrTrimSpace:1]"}},
      {"join",
       [] { fake::FailCall("OLIBCSzListJoin"); },
       {"Failed to OLIBCSzListJoin()[0x0201 OLIBCSzListJoin:1]"}},
      {"malloc", [] { tcalloc::FailAfter(0); }, {"Failed to alloc memory" + kNoErr}},
  };
  for (const auto& c : cases) {
    fake::Reset();
    c.inject();
    EXPECT_EQ(Run("80, 443", nullptr), -1) << c.name;
    EXPECT_EQ(fake::LogBodies(), c.lines) << c.name;
    EXPECT_EQ(fake::S().szListsOut, 0) << c.name;
    tcalloc::FailAfter(-1);
  }
  // The failed allocation leaves the out-of-memory error for the callers' lines.
  EXPECT_EQ(OLIBCErrGet(), 0x0200);
  EXPECT_STREQ(OLIBCErrorGetFile(), "port_list.cpp");
  EXPECT_EQ(fake::CallsOf("OLIBCErrSetEx"), Lines{"OLIBCErrSetEx(512)"});
}

TEST_F(ValidationTest, SelfCheckAcceptsPortsAndOneOrderedRange) {
  const char* good[] = {"80,443", "65535", "0", "", "1000-2000", "1000-1000", "80,80,22"};
  for (const char* list : good) EXPECT_EQ(h.PortsSELFCheck(list), 0) << list;
  EXPECT_TRUE(fake::LogBodies().empty());
}

TEST_F(ValidationTest, SelfCheckRefusals) {
  const std::string num = " 0 <= port number < 65536 " + kNoErr;
  const std::string single =
      " You can input just one port range setting without other ports" + kNoErr;
  const struct {
    const char* list;
    std::string line;
  } cases[] = {
      {"65536", "Format error! (65536)" + num},
      {"2000-1000", "Format error! (2000) must <= (1000)" + kNoErr},
      {"80,1000-2000", "Format error! (1000-2000)" + single},
      {"1000-2000,80", "Format error! (1000-2000)" + single},
      {"99999,1000-2000", "Format error! (99999)" + num},
      {"-1", "Format error! ()" + num},                // empty low end
      {"abc-70000", "Format error! (70000)" + num},    // high end is looked at first
      {"1000-", "Format error! ()" + num},             // empty high end, before the low one
      {"1000 - 2000", "Format error! ( 2000)" + num},  // blanks inside stay
      {"1-2-3", "Format error! (2-3)" + num},
      {"+80", "Format error! (+80)" + num},
      {"8 0", "Format error! (8 0)" + num},
      {",,,", "Format error! ()" + num},
      {"80,http", "Format error! (http)" + num},
  };
  for (const auto& c : cases) {
    fake::Reset();
    EXPECT_EQ(h.PortsSELFCheck(c.list), -1) << c.list;
    EXPECT_EQ(fake::LogBodies(), Lines{c.line}) << c.list;
  }
  fake::Reset();
  EXPECT_EQ(h.PortsSELFCheck(nullptr), -1);
  EXPECT_EQ(fake::LogBodies(), Lines{"szPorts should not be NULL" + kNoErr});
}

TEST_F(ValidationTest, SelfCheckPlatformFailures) {
  fake::FailCall("OLIBCSzListAlloc");
  EXPECT_EQ(h.PortsSELFCheck("80"), -1);
  fake::FailCall("OLIBCStrTok");
  EXPECT_EQ(h.PortsSELFCheck("80"), -1);
  EXPECT_EQ(fake::LogBodies(), (Lines{"Failed to allocate list[0x0201 OLIBCSzListAlloc:1]",
                                      "Failed to strtok ports (80)[0x0201 OLIBCStrTok:1]"}));
}

}  // namespace
