// Saves through tcapi, the real module and the real platform in a demo
// appliance root, read back with the load methods and from the rule files.
#include <dirent.h>
#include <signal.h>

#include <map>
#include <memory>
#include <regex>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <httplib.h>

#include "tc_support.h"

namespace {

const char kRules[] = "ORVI.Core.Network.TrafficControl.Rules";
const char kRouterRules[] = "ORVI.Core.Network.TrafficControl.RouterRules";

// Every field in every form: port types, directions, protocols, sources,
// enabled and disabled, and a rule without "ip_direction".
const char kSaved[] = R"([
  {"enabled":true,"port_type":"SELF","port_num":" 80 , 443","port_direction":"src",
   "protocol":"tcp","minrate":1000,"maxrate":5000,"source":"192.168.1.20","ip_direction":"src"},
  {"enabled":false,"port_type":"SYS","port_num":"cifs,afp","port_direction":"dest",
   "protocol":"all","minrate":200,"maxrate":0,"source":"all","ip_direction":"dest"},
  {"enabled":true,"port_type":"ALL","protocol":"udp","minrate":50,"maxrate":100,
   "source":"10.0.0.0/8","ip_direction":"src"},
  {"enabled":true,"port_type":"SELF","port_num":"1000-2000","port_direction":"dest",
   "protocol":"tcp","minrate":7,"maxrate":9,"source":"aa:bb:cc:dd:ee:ff"}])";
// What a load gives back for them.
const char kLoaded[] = R"([
  {"enabled":true,"port_type":"SELF","port_num":"80,443","port_direction":"src",
   "protocol":"tcp","minrate":1000,"maxrate":5000,"source":"192.168.1.20","ip_direction":"src"},
  {"enabled":false,"port_type":"SYS","port_num":"cifs,afp","port_direction":"dest",
   "protocol":"all","minrate":200,"maxrate":0,"source":"all","ip_direction":"dest"},
  {"enabled":true,"port_type":"ALL","port_num":"","port_direction":"src","protocol":"udp",
   "minrate":50,"maxrate":100,"source":"10.0.0.0/8","ip_direction":"src"},
  {"enabled":true,"port_type":"SELF","port_num":"1000-2000","port_direction":"dest",
   "protocol":"tcp","minrate":7,"maxrate":9,"source":"aa:bb:cc:dd:ee:ff","ip_direction":"dest"}])";

const char kOther[] = R"([{"enabled":true,"port_type":"SYS","port_num":"ssh","protocol":"tcp",
  "minrate":10,"maxrate":20,"source":"all","ip_direction":"dest"}])";

Json::Value J(const std::string& text) {
  Json::Value v;
  EXPECT_TRUE(tcsupport::ParseJson(text, &v)) << text;
  return v;
}

Json::Value Params(const char* key, const char* value, const char* rules = nullptr) {
  Json::Value p(Json::objectValue);
  p[key] = value;
  if (rules != nullptr) p["rules"] = J(rules);
  return p;
}

Json::Value Answer(int code) {
  Json::Value a(Json::objectValue);
  a["success"] = code == 0;
  if (code == 0) {
    a["data"] = Json::Value();
  } else {
    a["error"]["code"] = code;
  }
  return a;
}

Json::Value LoadAnswer(const Json::Value& rules, int total) {
  Json::Value a(Json::objectValue);
  a["success"] = true;
  a["data"]["rules"] = rules;
  a["data"]["total"] = total;
  return a;
}

class SaveThroughTcapi : public ::testing::Test {
 protected:
  tcsupport::RunResult Call(const char* api, const char* method, const Json::Value& params) {
    return tcsupport::CallTcapi(api, method, params, root_.path());
  }
  void ExpectAnswer(const char* api, const char* method, const Json::Value& params,
                    const Json::Value& answer) {
    tcsupport::RunResult r = Call(api, method, params);
    EXPECT_EQ(r.exitCode, answer["success"].asBool() ? 0 : 1) << r.err;
    ASSERT_TRUE(r.jsonValid) << r.out << r.err;
    EXPECT_EQ(r.json, answer) << tcsupport::ToCompactJson(params);
  }
  // Every rule file of the live directory with its bytes.
  std::map<std::string, std::string> LiveFiles() {
    std::map<std::string, std::string> files;
    const std::string dir = root_.Join("etc/tc");
    std::unique_ptr<DIR, int (*)(DIR*)> d(opendir(dir.c_str()), closedir);
    EXPECT_NE(d, nullptr) << dir;
    if (d == nullptr) return files;
    while (dirent* e = readdir(d.get())) {
      std::string name = e->d_name;
      if (name != "." && name != "..") files[name] = tcsupport::ReadFile(dir + "/" + name);
    }
    return files;
  }
  bool StagingGone() { return !tcsupport::PathExists(root_.Join("etc/tc_tmp")); }

  tcsupport::TempDir root_ = tcsupport::MakeDemoRoot();
};

TEST_F(SaveThroughTcapi, AdapterRoundTrip) {
  ExpectAnswer(kRules, "save", Params("adapter", "eth0", kSaved), Answer(0));
  ExpectAnswer(kRules, "load", Params("adapter", "eth0"), LoadAnswer(J(kLoaded), 4));
  EXPECT_TRUE(StagingGone());
  // Saving again replaces rather than appends.
  ExpectAnswer(kRules, "save", Params("adapter", "eth0", kOther), Answer(0));
  Json::Value other = J(kOther);
  other[0]["port_direction"] = "src";
  ExpectAnswer(kRules, "load", Params("adapter", "eth0"), LoadAnswer(other, 1));
}

TEST_F(SaveThroughTcapi, UploadRoundTrip) {
  ExpectAnswer(kRouterRules, "save", Params("direction", "upload", kSaved), Answer(0));
  ExpectAnswer(kRouterRules, "load", Params("direction", "upload"), LoadAnswer(J(kLoaded), 4));
  EXPECT_EQ(LiveFiles().size(), 1u);
  EXPECT_TRUE(StagingGone());
}

TEST_F(SaveThroughTcapi, DownloadWritesBothLanBridgesButNotGbr) {
  ExpectAnswer(kRules, "save", Params("adapter", "gbr", kOther), Answer(0));
  const std::string gbr = LiveFiles().at("gbr.rules");
  ExpectAnswer(kRouterRules, "save", Params("direction", "download", kSaved), Answer(0));
  ExpectAnswer(kRules, "load", Params("adapter", "br0"), LoadAnswer(J(kLoaded), 4));
  ExpectAnswer(kRules, "load", Params("adapter", "br1"), LoadAnswer(J(kLoaded), 4));
  EXPECT_EQ(LiveFiles().at("gbr.rules"), gbr);
  Json::Value both(Json::arrayValue);
  for (int i = 0; i < 2; ++i) {
    for (const Json::Value& rule : J(kLoaded)) both.append(rule);
  }
  ExpectAnswer(kRouterRules, "load", Params("direction", "download"), LoadAnswer(both, 4));
  EXPECT_TRUE(StagingGone());
}

TEST_F(SaveThroughTcapi, SaveWithoutRulesEmptiesTheAdapter) {
  ExpectAnswer(kRules, "save", Params("adapter", "eth1", kSaved), Answer(0));
  ExpectAnswer(kRules, "save", Params("adapter", "eth1"), Answer(0));
  ExpectAnswer(kRules, "load", Params("adapter", "eth1"),
               LoadAnswer(Json::Value(Json::arrayValue), 0));
  ExpectAnswer(kRouterRules, "save", Params("direction", "download", kSaved), Answer(0));
  ExpectAnswer(kRouterRules, "save", Params("direction", "download"), Answer(0));
  ExpectAnswer(kRules, "load", Params("adapter", "br1"),
               LoadAnswer(Json::Value(Json::arrayValue), 0));
}

TEST_F(SaveThroughTcapi, OtherAdaptersSurviveByteForByte) {
  ExpectAnswer(kRules, "save", Params("adapter", "eth1", kOther), Answer(0));
  ExpectAnswer(kRouterRules, "save", Params("direction", "upload", kSaved), Answer(0));
  std::map<std::string, std::string> before = LiveFiles();
  ExpectAnswer(kRules, "save", Params("adapter", "eth0", kSaved), Answer(0));
  std::map<std::string, std::string> after = LiveFiles();
  ASSERT_EQ(after.count("eth0.rules"), 1u);
  after.erase("eth0.rules");
  EXPECT_EQ(after, before);
}

// Requests that fail leave the live rules as they were and no staging
// directory behind.
struct FailureCase {
  const char* name;
  const char* api;
  const char* key;  // "adapter" or "direction"
  const char* value;
  const char* rules;  // JSON text
  int code;
};

const FailureCase kFailures[] = {
    {"CeilingAboveLink", kRules, "adapter", "eth0",
     R"([{"enabled":true,"protocol":"tcp","minrate":10,"maxrate":200000,"port_type":"ALL"}])",
     1202},
    {"GuaranteesAboveLink", kRules, "adapter", "eth0",
     R"([{"enabled":true,"protocol":"tcp","minrate":100000,"maxrate":0,"port_type":"ALL"},
         {"enabled":true,"protocol":"udp","minrate":100000,"maxrate":0,"port_type":"ALL"}])",
     1203},
    {"SourceNotAnAddress", kRules, "adapter", "eth0",
     R"([{"enabled":true,"protocol":"tcp","minrate":1,"maxrate":2,"port_type":"ALL",
          "source":"somewhere"}])",
     1201},
    {"UnknownService", kRules, "adapter", "eth0",
     R"([{"enabled":true,"protocol":"tcp","minrate":1,"maxrate":2,"port_type":"SYS",
          "port_num":"nosuchservice"}])",
     1201},
    {"BadRule", kRules, "adapter", "eth0", R"([{"enabled":true,"protocol":"tcp","minrate":0}])",
     101},
    {"RulesNotArray", kRules, "adapter", "eth0", R"("all")", 114},
    {"NoSuchAdapter", kRules, "adapter", "eth7", "[]", 4311},
    {"UploadCeilingAboveWan", kRouterRules, "direction", "upload",
     R"([{"enabled":true,"protocol":"tcp","minrate":10,"maxrate":130000,"port_type":"ALL"}])",
     1202},
    {"UnknownDirection", kRouterRules, "direction", "both", "[]", 1200},
};

class SaveFailures : public SaveThroughTcapi, public ::testing::WithParamInterface<FailureCase> {};

TEST_P(SaveFailures, LeaveLiveRulesAlone) {
  const FailureCase& c = GetParam();
  ExpectAnswer(kRules, "save", Params("adapter", "eth0", kOther), Answer(0));
  ExpectAnswer(kRouterRules, "save", Params("direction", "upload", kOther), Answer(0));
  const std::map<std::string, std::string> before = LiveFiles();
  ExpectAnswer(c.api, "save", Params(c.key, c.value, c.rules), Answer(c.code));
  EXPECT_EQ(LiveFiles(), before);
  EXPECT_TRUE(StagingGone());
}

INSTANTIATE_TEST_SUITE_P(Cases, SaveFailures, ::testing::ValuesIn(kFailures),
                         [](const ::testing::TestParamInfo<FailureCase>& info) {
                           return std::string(info.param.name);
                         });

// Both saves through the HTTP front of tcapi.
TEST_F(SaveThroughTcapi, Serve) {
  tcsupport::Background server(
      {tcsupport::TcapiPath(), "serve", "--listen", "127.0.0.1:0", "--root", root_.path()});
  ASSERT_TRUE(server.WaitForOutput(" (module ", std::chrono::seconds(30))) << server.Err();
  std::smatch m;
  const std::string out = server.Out();
  ASSERT_TRUE(std::regex_search(out, m, std::regex(R"(http://127\.0\.0\.1:(\d+) )"))) << out;
  httplib::Client client("127.0.0.1", std::stoi(m[1]));
  client.set_read_timeout(60, 0);
  auto post = [&](const char* api, const char* method, const Json::Value& params) {
    httplib::Result res = client.Post(std::string("/api/") + api + "/1/" + method,
                                      tcsupport::ToCompactJson(params), "application/json");
    Json::Value body;
    EXPECT_TRUE(res) << httplib::to_string(res.error());
    if (res) {
      EXPECT_TRUE(tcsupport::ParseJson(res->body, &body)) << res->body;
    }
    return body;
  };
  EXPECT_EQ(post(kRules, "save", Params("adapter", "eth0", kSaved)), Answer(0));
  EXPECT_EQ(post(kRouterRules, "save", Params("direction", "download", kSaved)), Answer(0));
  EXPECT_EQ(post(kRules, "load", Params("adapter", "eth0")), LoadAnswer(J(kLoaded), 4));
  EXPECT_EQ(post(kRules, "load", Params("adapter", "br1")), LoadAnswer(J(kLoaded), 4));
  EXPECT_EQ(post(kRouterRules, "save", Params("direction", "upload", "[{}]")), Answer(101));
  EXPECT_TRUE(StagingGone());
  server.Stop(SIGTERM);
}

}  // namespace
