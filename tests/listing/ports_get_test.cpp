// Reading stored ports fields back into rule object members.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "ORVI.Core.Network.TrafficControl.h"
#include "fake_platform.h"
#include "olibc.h"

namespace {

const char kHint[] =
    "port format should be one of ALL/SELF/SYS, ex: ALL::src, SELF:777:src, SYS:cifs[0x0016 "
    "prev:7]";

struct PortCase {
  const char* input;  // nullptr: a null pointer
  int result;
  // Expected members; nullptr: absent.
  const char* type;
  const char* num;
  const char* direction;
  const char* log;  // nullptr: nothing logged
};

const PortCase kCases[] = {
    {"ALL::src", 0, "ALL", "", "src", nullptr},
    {"ALL", 0, "ALL", nullptr, "src", nullptr},
    {"all:", 0, "ALL", "", "src", nullptr},
    {"ALL:80:dest", 0, "ALL", "80", "dest", nullptr},
    {"all:80:DEST", 0, "ALL", "80", "dest", nullptr},
    {"ALL/80:src", 0, "ALL", "80", "src", nullptr},
    {"SELF:777:src", 0, "SELF", "777", "src", nullptr},
    {"self:1000-2000:DEST", 0, "SELF", "1000-2000", "dest", nullptr},
    {"SELF:777", 0, "SELF", "777", "src", nullptr},
    {"SELF:", 0, "SELF", "", "src", nullptr},
    {"SELF::src", 0, "SELF", "", "src", nullptr},
    {"SELF:777:xyz", 0, "SELF", "777", "dest", nullptr},
    {"SELF:777:src:x", 0, "SELF", "777", "dest", nullptr},
    {"SYS:cifs", 0, "SYS", "cifs", "src", nullptr},
    {"sys:cifs,afp:SrC", 0, "SYS", "cifs,afp", "src", nullptr},
    {"SELF:777:", -1, "SELF", nullptr, nullptr, kHint},
    {"ALL::", -1, "ALL", nullptr, nullptr, kHint},
    {"SELF", -1, nullptr, nullptr, nullptr, kHint},
    {"SYS", -1, nullptr, nullptr, nullptr, kHint},
    {"TCP:80:src", -1, nullptr, nullptr, nullptr, kHint},
    {"", -1, nullptr, nullptr, nullptr, "Ports format error[0x0016 prev:7]"},
    {nullptr, -1, nullptr, nullptr, nullptr, "Ports format error[0x0016 prev:7]"},
};

TEST(PortsParseGet, StoredForms) {
  for (const PortCase& c : kCases) {
    SCOPED_TRACE(c.input ? std::string("\"") + c.input + "\"" : std::string("NULL"));
    fake::Reset();
    // A recorded error, so that the suffix of a failure line shows the stack.
    OLIBCErrSetEx(0x0016, "prev", 7);
    ORVI::APIRequest req;
    ORVI::APIResponse resp;
    TCHandler h(&req, &resp);

    Json::Value out;
    EXPECT_EQ(h.PortsParseGet(c.input, out), c.result);

    Json::Value expected;  // stays null when nothing may be written
    if (c.type) expected["port_type"] = c.type;
    if (c.num) expected["port_num"] = c.num;
    if (c.direction) expected["port_direction"] = c.direction;
    EXPECT_EQ(out, expected) << out.toStyledString();

    std::vector<std::string> logs;
    if (c.log) logs.push_back(c.log);
    EXPECT_EQ(fake::LogBodies(), logs);
    EXPECT_TRUE(fake::BadFrames().empty());
    EXPECT_FALSE(resp.Answered());
  }
}

}  // namespace
