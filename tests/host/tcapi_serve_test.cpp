// `tcapi serve` on a free loopback port. Every server is stopped with SIGTERM
// on every path (the holder's destructor), SIGKILL only if that fails.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <memory>
#include <regex>
#include <set>
#include <thread>
#include <tuple>

#include <httplib.h>

#include "host_test_util.h"

using hosttest::ErrorAnswer;
using hosttest::ExpectOneLineFailure;
using hosttest::RulesApi;
using tcsupport::RunResult;

namespace {

const size_t kMiB = 1 << 20;

class Server {
 public:
  explicit Server(const std::string& root, const std::string& module = "") {
    std::vector<std::string> argv{tcsupport::TcapiPath(), "serve",  "--listen",
                                  "127.0.0.1:0",          "--root", root};
    if (!module.empty()) argv.insert(argv.end(), {"--module", module});
    process_.reset(new tcsupport::Background(argv));
    const std::regex listening(R"(listening on http://127\.0\.0\.1:(\d+) )");
    if (!process_->WaitForOutput(" (module ", std::chrono::seconds(30))) return;
    std::smatch m;
    const std::string out = process_->Out();
    if (std::regex_search(out, m, listening)) port_ = std::stoi(m[1]);
  }
  ~Server() {
    if (process_->Running()) process_->Stop(SIGTERM);
  }

  int port() const { return port_; }
  std::string Err() const { return process_->Err(); }
  RunResult Stop(int sig) { return process_->Stop(sig); }

  httplib::Result Post(const std::string& path, const std::string& body,
                       const char* type = "application/json") const {
    httplib::Client client("127.0.0.1", port_);
    client.set_read_timeout(60, 0);
    return client.Post(path.c_str(), body, type);
  }

 private:
  std::unique_ptr<tcsupport::Background> process_;
  int port_ = 0;
};

std::string RulesPath(const std::string& method) {
  return std::string("/api/") + RulesApi() + "/1/" + method;
}

// A host refusal: a JSON body {"success":false,"error":{"message":...}}.
void ExpectRefusal(const httplib::Result& res, int status) {
  ASSERT_TRUE(res) << httplib::to_string(res.error());
  EXPECT_EQ(res->status, status);
  EXPECT_EQ(res->get_header_value("Content-Type"), "application/json");
  Json::Value body;
  ASSERT_TRUE(tcsupport::ParseJson(res->body, &body)) << res->body;
  EXPECT_EQ(body["success"], Json::Value(false)) << res->body;
  EXPECT_TRUE(body["error"]["message"].isString()) << res->body;
}

void ExpectAnswer(const httplib::Result& res, const Json::Value& answer) {
  ASSERT_TRUE(res) << httplib::to_string(res.error());
  EXPECT_EQ(res->status, 200);
  Json::Value body;
  ASSERT_TRUE(tcsupport::ParseJson(res->body, &body)) << res->body;
  EXPECT_EQ(body, answer);
}

class TcapiServe : public ::testing::Test {
 protected:
  void SetUp() override {
    server_.reset(new Server(root_.path()));
    ASSERT_GT(server_->port(), 0) << server_->Err();
  }
  void TearDown() override {
    // The normal way out: stopped by SIGTERM, exit status 0.
    if (server_->port() > 0) {
      RunResult r = server_->Stop(SIGTERM);
      EXPECT_EQ(r.exitCode, 0) << r.err;
      EXPECT_FALSE(r.timedOut);
    }
  }

  tcsupport::TempDir root_ = tcsupport::MakeDemoRoot();
  std::unique_ptr<Server> server_;
};

TEST_F(TcapiServe, AnswersLikeCall) {
  struct Case {
    std::string body;
    int code;
  } cases[] = {{R"({"adapter":"nope"})", 4311}, {"", 114}, {"{}", 114}, {R"({"adapter":7})", 114}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.body);
    ExpectAnswer(server_->Post(RulesPath("load"), c.body), ErrorAnswer(c.code));
  }
  // curl -d sends a form type; a body past httplib's 8 KiB form limit is
  // still read as JSON.
  const std::string padded = R"({"adapter":"nope","pad":")" + std::string(20000, 'x') + "\"}";
  ExpectAnswer(server_->Post(RulesPath("load"), padded, "application/x-www-form-urlencoded"),
               ErrorAnswer(4311));
}

TEST_F(TcapiServe, RefusesBadBodiesAndUnknownRoutes) {
  struct Case {
    std::string path;
    std::string body;
    int status;
  } cases[] = {
      {RulesPath("load"), "{x", 400},
      {RulesPath("load"), "[]", 400},
      {RulesPath("load"), "5", 400},
      {RulesPath("load"), R"({"adapter":"a","adapter":"b"})", 400},
      {RulesPath("drop"), "{}", 404},
      {"/api/Nope.Api/1/load", "{}", 404},
      {std::string("/api/") + RulesApi() + "/2/load", "{}", 404},
      {std::string("/api/") + RulesApi() + "/x/load", "{}", 404},
      {std::string("/api/") + RulesApi() + "/99999999999/load", "{}", 404},
      {"/elsewhere", "{}", 404},
      {RulesPath("load"), "{}" + std::string(kMiB - 1, ' '), 413},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.path + " " + c.body.substr(0, 40));
    ExpectRefusal(server_->Post(c.path, c.body), c.status);
  }
  // Exactly the limit is still accepted.
  ExpectAnswer(server_->Post(RulesPath("load"), "{}" + std::string(kMiB - 2, ' ')),
               ErrorAnswer(114));
}

TEST_F(TcapiServe, ListsTheMethodTable) {
  httplib::Client client("127.0.0.1", server_->port());
  httplib::Result res = client.Get("/api");
  ASSERT_TRUE(res);
  ASSERT_EQ(res->status, 200);
  Json::Value body;
  ASSERT_TRUE(tcsupport::ParseJson(res->body, &body)) << res->body;
  std::set<std::tuple<std::string, int, std::string>> rows;
  for (const Json::Value& row : body["data"]["methods"]) {
    rows.emplace(row["api"].asString(), row["version"].asInt(), row["method"].asString());
  }
  const std::string router = hosttest::RouterRulesApi();
  EXPECT_EQ(rows, (std::set<std::tuple<std::string, int, std::string>>{{RulesApi(), 1, "load"},
                                                                       {RulesApi(), 1, "save"},
                                                                       {router, 1, "load"},
                                                                       {router, 1, "save"}}));
}

TEST(TcapiServeStop, SigintAndSigtermStopCleanly) {
  tcsupport::TempDir root = tcsupport::MakeDemoRoot();
  for (int sig : {SIGINT, SIGTERM}) {
    SCOPED_TRACE(sig);
    Server server(root.path());
    ASSERT_GT(server.port(), 0) << server.Err();
    ExpectAnswer(server.Post(RulesPath("load"), "{}"), ErrorAnswer(114));
    RunResult r = server.Stop(sig);
    EXPECT_EQ(r.exitCode, 0) << r.err;
    EXPECT_FALSE(r.timedOut);
  }
}

TEST(TcapiServeModule, FaultsAre500AndRequestsRunConcurrently) {
  tcsupport::TempDir root = tcsupport::MakeDemoRoot();
  Server server(root.path(), hosttest::TestModule());
  ASSERT_GT(server.port(), 0) << server.Err();
  for (const char* method : {"silent", "conflict", "throw", "throw-other"}) {
    SCOPED_TRACE(method);
    ExpectRefusal(server.Post(std::string("/api/Test.Host/1/") + method, "{}"), 500);
  }
  // "meet" answers success only while another request is inside it too.
  std::unique_ptr<httplib::Result> first;
  std::thread other(
      [&] { first.reset(new httplib::Result(server.Post("/api/Test.Host/1/meet", "{}"))); });
  httplib::Result second = server.Post("/api/Test.Host/1/meet", "{}");
  other.join();
  ExpectAnswer(*first, hosttest::SuccessAnswer(Json::Value(true)));
  ExpectAnswer(second, hosttest::SuccessAnswer(Json::Value(true)));
  EXPECT_EQ(server.Stop(SIGTERM).exitCode, 0);
}

TEST(TcapiServeListen, BadAddressesAndBusyPortsExitTwo) {
  tcsupport::TempDir root = tcsupport::MakeDemoRoot();
  // A port this test holds open, so that the server cannot have it.
  int holder = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  ASSERT_GE(holder, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof addr;
  ASSERT_EQ(bind(holder, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
  ASSERT_EQ(listen(holder, 1), 0);
  ASSERT_EQ(getsockname(holder, reinterpret_cast<sockaddr*>(&addr), &len), 0);
  const std::string busy = "127.0.0.1:" + std::to_string(ntohs(addr.sin_port));

  struct Case {
    std::string listen;
    const char* fragment;
  } cases[] = {
      {"localhost", "HOST:PORT"},       {":8080", "no host"},     {"127.0.0.1:65536", "0 to 65535"},
      {"127.0.0.1:http", "0 to 65535"}, {"::1:8080", "brackets"}, {"[::1]8080", "[ADDRESS]:PORT"},
      {busy, "cannot listen"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.listen);
    ExpectOneLineFailure(tcsupport::RunTcapi({"serve", "--listen", c.listen}, root.path()),
                         c.fragment);
  }
  close(holder);
}

}  // namespace
