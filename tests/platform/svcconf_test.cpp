#include "orvi_service_conf.h"

#include <string>

#include <gtest/gtest.h>

namespace {

TEST(PortsCheck, Table) {
  struct Case {
    std::string port;
    int want;
  } cases[] = {
      {"0", 1},
      {"1", 1},
      {"80", 1},
      {"65535", 1},
      {"080", 1},
      {"00080", 1},
      {"", 0},
      {"65536", 0},
      {"99999", 0},
      {"000080", 0},
      {"-1", 0},
      {"+1", 0},
      {" 80", 0},
      {"80 ", 0},
      {"8a", 0},
      {"0x10", 0},
      {"８０", 0},
      {"1-2", 0},
      {std::string(20, '9'), 0},
      {"000000000000000000001", 0},
  };
  for (const auto& c : cases) {
    EXPECT_EQ(ORVIServiceConfPortsCheck(c.port.c_str()), c.want) << '"' << c.port << '"';
  }
  EXPECT_EQ(ORVIServiceConfPortsCheck(nullptr), 0);
}

}  // namespace
