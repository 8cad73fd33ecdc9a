#include "orvi_api.h"

#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace {

Json::Value Parse(const char* text) {
  Json::Value v;
  Json::CharReaderBuilder b;
  std::string errs;
  std::unique_ptr<Json::CharReader> r(b.newCharReader());
  std::string s(text);
  EXPECT_TRUE(r->parse(s.data(), s.data() + s.size(), &v, &errs)) << errs;
  return v;
}

TEST(APIRequest, ParamsAndDefaults) {
  ORVI::APIRequest req(Parse(R"({"adapter":"eth0","rules":[],"zero":null})"));
  EXPECT_TRUE(req.HasParam("adapter"));
  EXPECT_TRUE(req.HasParam("zero"));  // present, even when null
  EXPECT_FALSE(req.HasParam("direction"));
  EXPECT_EQ(req.GetParam("adapter", "none"), Json::Value("eth0"));
  EXPECT_TRUE(req.GetParam("rules", Json::Value()).isArray());
  EXPECT_EQ(req.GetParam("direction", "upload"), Json::Value("upload"));
  EXPECT_TRUE(req.GetParam("zero", "default").isNull());
}

TEST(APIRequest, NonObjectParamsCountAsNone) {
  for (const char* text : {"null", "[1,2]", "\"adapter\"", "7"}) {
    ORVI::APIRequest req(Parse(text));
    EXPECT_FALSE(req.HasParam("adapter")) << text;
    EXPECT_FALSE(req.HasParam("0")) << text;
    EXPECT_EQ(req.GetParam("adapter", 5), Json::Value(5)) << text;
  }
  ORVI::APIRequest none;
  EXPECT_FALSE(none.HasParam("adapter"));
}

TEST(APIResponse, CountsAnswersAndFlagsConflicts) {
  struct Answer {
    bool success;
    int code;
  };
  struct Case {
    const char* what;
    std::vector<Answer> answers;
    bool conflicting;
  } cases[] = {
      {"none", {}, false},
      {"one success", {{true, 0}}, false},
      {"one error", {{false, 101}}, false},
      {"same code twice", {{false, 1201}, {false, 1201}}, false},
      {"two codes", {{false, 1201}, {false, 1202}}, true},
      {"success after error", {{false, 101}, {true, 0}}, true},
      {"error after success", {{true, 0}, {false, 101}}, true},
      {"two successes", {{true, 0}, {true, 0}}, true},
  };
  for (const auto& c : cases) {
    ORVI::APIResponse resp;
    for (const auto& a : c.answers) {
      if (a.success) {
        resp.SetSuccess(Json::Value());
      } else {
        resp.SetError(a.code, Json::Value());
      }
    }
    EXPECT_EQ(resp.AnswerCount(), static_cast<int>(c.answers.size())) << c.what;
    EXPECT_EQ(resp.Answered(), !c.answers.empty()) << c.what;
    EXPECT_EQ(resp.Conflicting(), c.conflicting) << c.what;
  }
}

TEST(APIResponse, ToJsonShapes) {
  ORVI::APIResponse ok;
  ok.SetSuccess(Parse(R"({"rules":[],"total":0})"));
  EXPECT_EQ(ok.ToJson(), Parse(R"({"success":true,"data":{"rules":[],"total":0}})"));

  ORVI::APIResponse saved;
  saved.SetSuccess(Json::Value());
  EXPECT_EQ(saved.ToJson(), Parse(R"({"success":true,"data":null})"));

  ORVI::APIResponse failed;
  failed.SetError(4311, Json::Value());
  EXPECT_FALSE(failed.Success());
  EXPECT_EQ(failed.ErrorCode(), 4311);
  EXPECT_EQ(failed.ToJson(), Parse(R"({"success":false,"error":{"code":4311}})"));
}

}  // namespace
