// Shared by the rule store tests: a temporary appliance root and rules as
// plain values, written and read through the store's C interface.
#ifndef TC_TEST_STORE_FIXTURE_H
#define TC_TEST_STORE_FIXTURE_H

#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

#include "olibc.h"
#include "orvi_fw_tc.h"

namespace storetest {

// One rule as a value; source may be longer than a record holds.
struct Rule {
  int id = 1;
  int enabled = 1;
  std::string source = "all";
  std::optional<std::string> ports = std::string("ALL");
  int protocol = ORVI_FW_PROTO_ALL;
  int minrate = 10;
  int maxrate = 0;
  int ipDirection = 1;
  bool operator==(const Rule& o) const;
};
std::ostream& operator<<(std::ostream& os, const Rule& r);

Rule Enabled(int minrate, int maxrate);
Rule Disabled(int minrate, int maxrate);

// ORVI_ROOT and ORVI_TC_APPLY=plan point at a fresh root with an empty etc/tc.
class StoreRoot : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  std::string Path(const std::string& rel) const { return root_ + rel; }
  // Creates the file (and its parents) under the root with exactly these bytes.
  void Put(const std::string& rel, const std::string& bytes) const;
  std::string Get(const std::string& rel) const;
  // Entries of a directory under the root, sorted.
  std::vector<std::string> List(const std::string& rel) const;

  // Open, one write per rule through one reused record, close.
  int Save(const char* dir, const char* adapter, const std::vector<Rule>& rules) const;
  // Read; the result of ORVIFwTcRuleGetByAdapter goes to *result.
  std::vector<Rule> Load(const char* dir, const char* adapter, int* result) const;

  std::string root_;
};

}  // namespace storetest

#endif
