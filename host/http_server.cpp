#include "http_server.h"

#include <malloc.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>

#include <atomic>
#include <cerrno>
#include <exception>
#include <iostream>
#include <thread>

#include <httplib.h>

namespace tcapi {

namespace {

Json::Value HostError(const std::string& message) {
  Json::Value out(Json::objectValue);
  out["success"] = false;
  out["error"]["message"] = message;
  return out;
}

void Reply(httplib::Response& res, int status, const Json::Value& body) {
  res.status = status;
  res.set_content(CompactJson(body) + "\n", "application/json");
}

const char* StatusText(int status) {
  switch (status) {
    case 400:
      return "bad request";
    case 404:
      return "not found";
    case 405:
      return "method not allowed";
    case 413:
      return "request body larger than 1 MiB";
    case 414:
      return "request target too long";
    case 500:
      return "internal error";
    default:
      return "request failed";
  }
}

// A version in a path: decimal digits of an int32_t, nothing else.
bool ParseVersion(const std::string& text, int32_t* version) {
  if (text.empty() || text.size() > 10 || text.find_first_not_of("0123456789") != std::string::npos)
    return false;
  long long value = std::stoll(text);
  if (value > INT32_MAX) return false;
  *version = static_cast<int32_t>(value);
  return true;
}

void LogLine(const std::string& line) {
  // One write per line so that lines of concurrent requests never mix.
  std::string text = "tcapi: " + OneLine(line) + "\n";
  fwrite(text.data(), 1, text.size(), stderr);
}

// Reads the body through the route's content reader: httplib's own reading
// would refuse a form-encoded body over 8 KiB, whatever the limit set here.
// false (with the answer given) when the body is over the limit.
bool ReadBody(const httplib::ContentReader& reader, httplib::Response& res, std::string* body) {
  bool tooBig = false;
  bool complete = reader([&](const char* data, size_t len) {
    if (len > kMaxRequestBody - body->size()) {
      tooBig = true;
      return false;
    }
    body->append(data, len);
    return true;
  });
  if (tooBig || res.status == 413) {
    Reply(res, 413, HostError(StatusText(413)));
    return false;
  }
  if (!complete) {
    Reply(res, 400, HostError("request body could not be read"));
    return false;
  }
  return true;
}

void HandleCall(const Module& module, const httplib::Request& req,
                const httplib::ContentReader& reader, httplib::Response& res) {
  const std::string api = req.matches[1];
  const std::string versionText = req.matches[2];
  const std::string method = req.matches[3];
  int32_t version = 0;
  if (!ParseVersion(versionText, &version)) {
    Reply(res, 404,
          HostError("unknown version " + OneLine(versionText) + " of API " + OneLine(api)));
    return;
  }
  const Route* route = nullptr;
  LookupResult found = module.Find(api, version, method, &route);
  if (found != LookupResult::kFound) {
    Reply(res, 404, HostError(Module::LookupMessage(found, api, version, method)));
    return;
  }
  // A multipart form is not a JSON object; its body is not even read.
  if (req.is_multipart_form_data()) {
    Reply(res, 400, HostError("parameters must be a JSON object"));
    return;
  }
  std::string body;
  if (!ReadBody(reader, res, &body)) return;
  Json::Value params;
  std::string error;
  if (!ParseParams(body, &params, &error)) {
    Reply(res, 400, HostError(error));
    return;
  }
  Outcome outcome = Invoke(*route, params);
  if (outcome.kind == Outcome::kInternalError) {
    LogLine(api + " " + method + ": " + outcome.message);
    Reply(res, 500, HostError(outcome.message));
    return;
  }
  Reply(res, 200, outcome.answer);
}

void HandleList(const Module& module, httplib::Response& res) {
  Json::Value methods(Json::arrayValue);
  for (const Route& route : module.routes()) {
    Json::Value row(Json::objectValue);
    row["api"] = route.api;
    row["version"] = route.version;
    row["method"] = route.method;
    methods.append(row);
  }
  Json::Value out(Json::objectValue);
  out["success"] = true;
  out["data"]["methods"] = methods;
  Reply(res, 200, out);
}

}  // namespace

bool ParseListen(const std::string& text, ListenAddress* address, std::string* error) {
  std::string host;
  std::string port;
  if (!text.empty() && text[0] == '[') {
    size_t close = text.find(']');
    if (close == std::string::npos || close + 1 >= text.size() || text[close + 1] != ':') {
      *error = "--listen: expected [ADDRESS]:PORT, got " + OneLine(text);
      return false;
    }
    host = text.substr(1, close - 1);
    port = text.substr(close + 2);
  } else {
    size_t colon = text.rfind(':');
    if (colon == std::string::npos) {
      *error = "--listen: expected HOST:PORT, got " + OneLine(text);
      return false;
    }
    host = text.substr(0, colon);
    port = text.substr(colon + 1);
    if (host.find(':') != std::string::npos) {
      *error = "--listen: write an IPv6 address in brackets, as [::1]:8080";
      return false;
    }
  }
  if (host.empty()) {
    *error = "--listen: no host in " + OneLine(text);
    return false;
  }
  if (port.empty() || port.size() > 5 ||
      port.find_first_not_of("0123456789") != std::string::npos || std::stoi(port) > 65535) {
    *error = "--listen: port must be a number from 0 to 65535, got " + OneLine(port);
    return false;
  }
  address->host = host;
  address->port = std::stoi(port);
  return true;
}

int Serve(const Module& module, const ListenAddress& address, const std::string& rootShown) {
  // The signals are taken by one thread with sigtimedwait; every other thread
  // (httplib's workers included) inherits them blocked. They stay blocked to
  // the end: a late second signal must not kill a server that is stopping.
  sigset_t stopSignals;
  sigemptyset(&stopSignals);
  sigaddset(&stopSignals, SIGINT);
  sigaddset(&stopSignals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &stopSignals, nullptr);
  // SIGPIPE is ignored from main on: a client that hangs up early costs its
  // connection only, not the server.
  // One malloc arena for all of httplib's workers: with one arena per worker
  // thread the resident size kept growing by megabytes as more workers took
  // their first request, for no gain on a server this lightly loaded.
  mallopt(M_ARENA_MAX, 1);

  httplib::Server server;
  server.set_payload_max_length(kMaxRequestBody);
  server.Get("/api", [&module](const httplib::Request&, httplib::Response& res) {
    HandleList(module, res);
  });
  server.Post(R"(/api/([^/]+)/([^/]+)/([^/]+))",
              [&module](const httplib::Request& req, httplib::Response& res,
                        const httplib::ContentReader& reader) {
                try {
                  HandleCall(module, req, reader, res);
                } catch (const std::exception& e) {
                  LogLine(std::string("internal error: ") + e.what());
                  Reply(res, 500, HostError("internal error"));
                }
              });
  server.set_exception_handler(
      [](const httplib::Request&, httplib::Response& res, std::exception_ptr) {
        Reply(res, 500, HostError("internal error"));
      });
  // httplib's own refusals (unknown path, oversized body, ...) get a JSON body too.
  server.set_error_handler([](const httplib::Request&, httplib::Response& res) {
    if (res.body.empty()) Reply(res, res.status, HostError(StatusText(res.status)));
  });
  server.set_logger([](const httplib::Request& req, const httplib::Response& res) {
    LogLine(req.method + " " + req.path + " " + std::to_string(res.status));
  });

  int port = address.port;
  if (port == 0) {
    port = server.bind_to_any_port(address.host);
  } else if (!server.bind_to_port(address.host, port)) {
    port = -1;
  }
  const std::string shownHost =
      address.host.find(':') != std::string::npos ? "[" + address.host + "]" : address.host;
  if (port <= 0) {
    std::cerr << "tcapi: cannot listen on " << OneLine(shownHost) << ":" << address.port
              << " (address in use or not available)" << std::endl;
    return 2;
  }
  std::cout << "tcapi: listening on http://" << shownHost << ":" << port << " (module "
            << module.path() << ", root " << rootShown << ")" << std::endl;

  std::atomic<bool> done(false);
  std::atomic<bool> stopRequested(false);
  std::thread waiter([&]() {
    const struct timespec tick = {0, 50 * 1000 * 1000};
    bool stopped = false;
    while (!done) {
      if (sigtimedwait(&stopSignals, nullptr, &tick) > 0) stopRequested = true;
      // A signal that arrives before the accept loop runs is acted on as soon
      // as it does; stop() must be called once only.
      if (stopRequested && !stopped && server.is_running()) {
        server.stop();
        stopped = true;
      }
    }
  });
  server.listen_after_bind();
  done = true;
  waiter.join();
  if (!stopRequested) {
    std::cerr << "tcapi: the server stopped unexpectedly" << std::endl;
    return 2;
  }
  std::cerr << "tcapi: stopped" << std::endl;
  return 0;
}

}  // namespace tcapi
