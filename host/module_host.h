// Loading a web API module and running its methods, shared by `call` and
// `serve`.
#ifndef TCAPI_MODULE_HOST_H
#define TCAPI_MODULE_HOST_H

#include <memory>
#include <string>
#include <vector>

#include <json/json.h>

#include "orvi_api.h"

namespace tcapi {

// One method of a module's table.
struct Route {
  std::string api;
  int32_t version = 0;
  std::string method;
  APIHandler handler = nullptr;
};

enum class LookupResult { kFound, kUnknownApi, kUnknownVersion, kUnknownMethod };

// A loaded module and a copy of its method table. The library stays loaded
// for the life of the object.
class Module {
 public:
  // nullptr with a one-line reason in *error when the library cannot be
  // loaded, has no GetAPITable, or its table cannot be read.
  static std::unique_ptr<Module> Load(const std::string& path, std::string* error);
  ~Module();
  Module(const Module&) = delete;
  Module& operator=(const Module&) = delete;

  const std::string& path() const { return path_; }
  const std::vector<Route>& routes() const { return routes_; }

  // Finds the row of (api, version, method); *route is set when found.
  LookupResult Find(const std::string& api, int32_t version, const std::string& method,
                    const Route** route) const;
  // The one-line message for a failed lookup.
  static std::string LookupMessage(LookupResult result, const std::string& api, int32_t version,
                                   const std::string& method);

 private:
  Module(void* handle, std::string path) : handle_(handle), path_(std::move(path)) {}

  void* handle_;
  std::string path_;
  std::vector<Route> routes_;
};

// What became of one request.
struct Outcome {
  enum Kind { kSuccess, kApiError, kInternalError };
  Kind kind = kInternalError;
  Json::Value answer;   // the response's JSON form (success and API error)
  std::string message;  // one line (internal error)
};

// Runs one request through a handler. A handler that gives no answer, gives
// two conflicting answers or throws is a fault of the module: an internal
// error, never passed on as an answer.
Outcome Invoke(const Route& route, const Json::Value& params);

// Request parameters from text: empty (or blank) text means no parameters;
// anything else must be exactly one JSON object.
bool ParseParams(const std::string& text, Json::Value* params, std::string* error);

// Compact one-line JSON text.
std::string CompactJson(const Json::Value& value);

// `text` on one line: control characters (newlines included) become spaces.
std::string OneLine(const std::string& text);

}  // namespace tcapi

#endif
