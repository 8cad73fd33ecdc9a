// Shared frame of the validation tests: a handler on a fresh fake platform,
// and checks that every call released its scratch lists and logged framed lines.
#ifndef TC_TESTS_VALIDATION_FIXTURE_H
#define TC_TESTS_VALIDATION_FIXTURE_H

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include <json/json.h>

#include "ORVI.Core.Network.TrafficControl.h"
#include "fake_platform.h"
#include "test_json.h"
#include "olibc.h"
#include "tcalloc.h"

using Lines = std::vector<std::string>;

// Error suffix while nothing is on the error stack.
const std::string kNoErr = "[0x0000 :0]";

// The suffix the module prints for the error currently on the stack.
inline std::string CurrentErr() {
  char buf[128];
  snprintf(buf, sizeof buf, "[0x%04X %s:%d]", OLIBCErrGet(), OLIBCErrorGetFile(),
           OLIBCErrorGetLine());
  return buf;
}

class ValidationTest : public ::testing::Test {
 protected:
  void SetUp() override {
    fake::Reset();
    tcalloc::FailAfter(-1);
  }
  void TearDown() override {
    tcalloc::FailAfter(-1);
    EXPECT_EQ(fake::S().szListsOut, 0) << "scratch list leaked";
    EXPECT_TRUE(fake::BadFrames().empty());
  }

  ORVI::APIRequest req;
  ORVI::APIResponse resp;
  TCHandler h{&req, &resp};
};

#endif
