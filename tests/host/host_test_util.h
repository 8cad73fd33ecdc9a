// Shared expectations of the tcapi integration tests.
#ifndef HOST_TEST_UTIL_H
#define HOST_TEST_UTIL_H

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <string>

#include "tc_support.h"

namespace hosttest {

inline const char* RulesApi() { return "ORVI.Core.Network.TrafficControl.Rules"; }
inline const char* RouterRulesApi() { return "ORVI.Core.Network.TrafficControl.RouterRules"; }
inline std::string TestModule() { return tcsupport::LibDir() + "/tcapi_test_module.so"; }

inline long Lines(const std::string& text) { return std::count(text.begin(), text.end(), '\n'); }

// What a web API error looks like on the wire.
inline Json::Value ErrorAnswer(int code) {
  Json::Value answer(Json::objectValue);
  answer["success"] = false;
  answer["error"]["code"] = code;
  return answer;
}

inline Json::Value SuccessAnswer(const Json::Value& data) {
  Json::Value answer(Json::objectValue);
  answer["success"] = true;
  answer["data"] = data;
  return answer;
}

// Usage and loading errors: status 2, nothing on standard output and one
// line on standard error that names the problem.
inline void ExpectOneLineFailure(const tcsupport::RunResult& r, const std::string& fragment) {
  EXPECT_EQ(r.exitCode, 2) << r.err;
  EXPECT_EQ(r.out, "");
  EXPECT_EQ(Lines(r.err), 1) << r.err;
  EXPECT_THAT(r.err, ::testing::StartsWith("tcapi: "));
  EXPECT_THAT(r.err, ::testing::HasSubstr(fragment));
}

// An answered request: exactly one JSON line on standard output.
inline void ExpectAnswer(const tcsupport::RunResult& r, int exitCode, const Json::Value& answer) {
  EXPECT_EQ(r.exitCode, exitCode) << r.err;
  ASSERT_TRUE(r.jsonValid) << r.out;
  EXPECT_EQ(r.json, answer) << r.out;
  EXPECT_EQ(Lines(r.out), 1) << r.out;
  EXPECT_EQ(r.out.back(), '\n');
}

}  // namespace hosttest

#endif
