// `tcapi call` through the real binary, the real module in a demo root and a
// deliberately faulty module.
#include <memory>
#include <regex>

#include "host_test_util.h"

using hosttest::ErrorAnswer;
using hosttest::ExpectAnswer;
using hosttest::ExpectOneLineFailure;
using hosttest::RulesApi;
using hosttest::SuccessAnswer;
using tcsupport::RunResult;
using tcsupport::RunTcapi;

namespace {

class TcapiCall : public ::testing::Test {
 protected:
  static void SetUpTestSuite() { root_.reset(new tcsupport::TempDir(tcsupport::MakeDemoRoot())); }
  static void TearDownTestSuite() { root_.reset(); }
  static std::string Root() { return root_->path(); }

  static std::unique_ptr<tcsupport::TempDir> root_;
};
std::unique_ptr<tcsupport::TempDir> TcapiCall::root_;

// "@ROOT" and "@LIB" in arguments stand for the demo root and the library dir.
std::vector<std::string> Expand(std::vector<std::string> args, const std::string& root) {
  for (std::string& arg : args) {
    if (arg.compare(0, 5, "@ROOT") == 0) arg = root + arg.substr(5);
    if (arg.compare(0, 4, "@LIB") == 0) arg = tcsupport::LibDir() + arg.substr(4);
  }
  return args;
}

TEST_F(TcapiCall, UsageAndLoadingErrorsExitTwoWithOneLine) {
  const std::string deep = "{\"a\":" + std::string(400, '[') + std::string(400, ']') + "}";
  struct Case {
    const char* name;
    std::vector<std::string> args;
    const char* fragment;
  } cases[] = {
      {"unknown API", {"call", "Nope.Api", "load", "{}"}, "unknown API Nope.Api"},
      {"unknown method", {"call", RulesApi(), "drop", "{}"}, "unknown method drop"},
      {"unknown version", {"call", RulesApi(), "load", "--api-version", "2"}, "unknown version 2"},
      {"missing module",
       {"call", RulesApi(), "load", "--module", "/nonexistent/mod.so"},
       "cannot load module /nonexistent/mod.so"},
      {"library without GetAPITable",
       {"call", RulesApi(), "load", "--module", "@LIB/libwebapi.so"},
       "does not export GetAPITable"},
      {"null method table",
       {"call", RulesApi(), "load", "--module", "@LIB/tcapi_test_module_null.so"},
       "returned no method table"},
      {"params []", {"call", RulesApi(), "load", "[]"}, "must be a JSON object"},
      {"params 5", {"call", RulesApi(), "load", "5"}, "must be a JSON object"},
      {"params string", {"call", RulesApi(), "load", "\"eth0\""}, "must be a JSON object"},
      {"params null", {"call", RulesApi(), "load", "null"}, "must be a JSON object"},
      {"params cut short", {"call", RulesApi(), "load", "{\"adapter\":"}, "not valid JSON"},
      {"params two values", {"call", RulesApi(), "load", "{} {}"}, "not valid JSON"},
      {"params multi-line error",
       {"call", RulesApi(), "load", "{\n\"adapter\"\n"},
       "not valid JSON"},
      {"params duplicate key",
       {"call", RulesApi(), "load", R"({"adapter":"eth0","adapter":"nope"})"},
       "not valid JSON"},
      {"params nested too deep", {"call", RulesApi(), "load", deep}, "not valid JSON"},
      {"missing root",
       {"call", RulesApi(), "load", "{}", "--root", "/nonexistent/root"},
       "cannot use appliance root"},
      {"empty root", {"call", RulesApi(), "load", "{}", "--root", ""}, "appliance root"},
      {"empty module", {"call", RulesApi(), "load", "--module", ""}, "no module path"},
      {"root is a file",
       {"call", RulesApi(), "load", "{}", "--root", "@ROOT/etc/orviinfo.conf"},
       "is not a directory"},
      {"api version not a number",
       {"call", RulesApi(), "load", "--api-version", "x"},
       "--api-version"},
      {"extra argument", {"call", RulesApi(), "load", "{}", "extra"}, "extra"},
      {"no subcommand", {}, "subcommand"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::vector<std::string> args = Expand(c.args, Root());
    bool hasRoot = std::find(args.begin(), args.end(), "--root") != args.end();
    ExpectOneLineFailure(RunTcapi(args, hasRoot || args.empty() ? "" : Root()), c.fragment);
  }
}

TEST_F(TcapiCall, RulesPreconditionFailuresPrintTheErrorAndExitOne) {
  struct Case {
    const char* params;  // nullptr: no parameters at all
    int code;
  } cases[] = {
      {R"({"adapter":"nope"})", 4311},
      {R"({"adapter":"ETH0"})", 4311},
      {"{}", 114},
      {nullptr, 114},
      {"  ", 114},
      {R"({"adapter":5})", 114},
      {R"({"adapter":true})", 114},
      {R"({"adapter":""})", 114},
  };
  for (const char* method : {"load", "save"}) {
    for (const Case& c : cases) {
      SCOPED_TRACE(std::string(method) + " " + (c.params ? c.params : "(none)"));
      std::vector<std::string> args{"call", RulesApi(), method};
      if (c.params != nullptr) args.push_back(c.params);
      RunResult r = RunTcapi(args, Root());
      ExpectAnswer(r, 1, ErrorAnswer(c.code));
      // Without --log-stderr the module's lines go to the system log only.
      EXPECT_EQ(r.err, "");
    }
  }
}

TEST_F(TcapiCall, DemoInterfacesAreVisibleThroughRoot) {
  for (const char* adapter : {"eth0", "eth1", "wan0", "br0", "br1", "gbr"}) {
    SCOPED_TRACE(adapter);
    Json::Value params(Json::objectValue);
    params["adapter"] = adapter;
    RunResult r = tcsupport::CallTcapi(RulesApi(), "load", params, Root());
    ASSERT_TRUE(r.jsonValid) << r.out << r.err;
    EXPECT_NE(r.json, ErrorAnswer(4311));
    EXPECT_NE(r.json, ErrorAnswer(114));
  }
}

TEST_F(TcapiCall, LogStderrShowsTheModuleLines) {
  RunResult r =
      RunTcapi({"call", RulesApi(), "load", R"({"adapter":"nope"})", "--log-stderr"}, Root());
  ExpectAnswer(r, 1, ErrorAnswer(4311));
  // The module's own line, after the log ident: "<file>:<line> <body>".
  EXPECT_TRUE(
      std::regex_search(r.err, std::regex(R"((^|\n)tcapi: \S+:\d+ No such interface \[nope\])")))
      << r.err;
}

TEST_F(TcapiCall, AnswersOfAModuleArePrintedOrRefused) {
  const Json::Value nested = [] {
    Json::Value v(Json::objectValue);
    v["list"].append(1);
    v["list"].append("two\nlines \xC3\xA9");
    v["list"].append(Json::Value());
    v["flag"] = false;
    return v;
  }();
  auto echoed = [](int version, const Json::Value& value) {
    Json::Value data(Json::objectValue);
    data["version"] = version;
    data["value"] = value;
    return SuccessAnswer(data);
  };
  Json::Value withNested(Json::objectValue);
  withNested["value"] = nested;
  const std::string nestedParams = tcsupport::ToCompactJson(withNested);

  struct Answered {
    const char* method;
    std::vector<std::string> extra;
    int exitCode;
    Json::Value answer;
  } answered[] = {
      {"echo", {nestedParams}, 0, echoed(1, nested)},
      {"echo", {nestedParams, "--api-version", "2"}, 0, echoed(2, nested)},
      {"after-gaps", {}, 0, echoed(1, Json::Value())},
      {"fail", {}, 1, ErrorAnswer(4242)},
      {"fail-twice", {}, 1, ErrorAnswer(1201)},
  };
  for (const Answered& c : answered) {
    SCOPED_TRACE(c.method);
    std::vector<std::string> args{"call", "Test.Host", c.method};
    args.insert(args.end(), c.extra.begin(), c.extra.end());
    args.insert(args.end(), {"--module", hosttest::TestModule()});
    ExpectAnswer(RunTcapi(args), c.exitCode, c.answer);
  }

  // Module faults are never passed on as an answer.
  struct Fault {
    const char* method;
    const char* fragment;
  } faults[] = {
      {"silent", "no answer"},       {"conflict", "conflicting answers"},
      {"throw", "boom second line"}, {"throw-other", "unknown type"},
      {"throw-json", "exception"},   {"no-handler", "unknown method no-handler"},
  };
  for (const Fault& c : faults) {
    SCOPED_TRACE(c.method);
    ExpectOneLineFailure(
        RunTcapi({"call", "Test.Host", c.method, "{}", "--module", hosttest::TestModule()}),
        c.fragment);
  }
}

TEST(TcapiCli, HelpAndVersionSucceed) {
  for (const char* flag : {"--help", "--version"}) {
    SCOPED_TRACE(flag);
    RunResult r = RunTcapi({flag});
    EXPECT_EQ(r.exitCode, 0) << r.err;
    EXPECT_THAT(r.out, ::testing::HasSubstr("tcapi"));
  }
}

}  // namespace
