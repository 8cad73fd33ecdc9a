#include "module_host.h"

#include <dlfcn.h>

#include <exception>

namespace tcapi {

namespace {

// A module's table ends with an all-zero row; one that runs on this long
// has lost its terminator, and reading further would leave the array.
const size_t kMaxTableRows = 4096;

typedef const APITableEntry* (*GetAPITableFn)(void);

bool IsTerminator(const APITableEntry& row) {
  return row.api == nullptr && row.version == 0 && row.method == nullptr && row.handler == nullptr;
}

std::string DlError(const char* fallback) {
  const char* text = dlerror();
  return OneLine(text != nullptr ? text : fallback);
}

}  // namespace

std::unique_ptr<Module> Module::Load(const std::string& path, std::string* error) {
  // A bare file name would make dlopen search the library path instead of
  // opening the file the user named.
  if (path.empty()) {
    *error = "no module path given";
    return nullptr;
  }
  std::string file = path.find('/') == std::string::npos ? "./" + path : path;
  dlerror();
  void* handle = dlopen(file.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (handle == nullptr) {
    *error = "cannot load module " + path + ": " + DlError("unknown error");
    return nullptr;
  }
  std::unique_ptr<Module> module(new Module(handle, path));
  dlerror();
  void* symbol = dlsym(handle, "GetAPITable");
  if (symbol == nullptr) {
    *error = "module " + path + " does not export GetAPITable";
    return nullptr;
  }
  GetAPITableFn getTable = reinterpret_cast<GetAPITableFn>(symbol);
  const APITableEntry* table = getTable();
  if (table == nullptr) {
    *error = "module " + path + " returned no method table";
    return nullptr;
  }
  for (size_t i = 0;; ++i) {
    if (i == kMaxTableRows) {
      *error = "method table of module " + path + " has no terminating row";
      return nullptr;
    }
    const APITableEntry& row = table[i];
    if (IsTerminator(row)) break;
    // A row missing a name or a handler can never be dispatched to.
    if (row.api == nullptr || row.method == nullptr || row.handler == nullptr) continue;
    module->routes_.push_back(Route{row.api, row.version, row.method, row.handler});
  }
  return module;
}

Module::~Module() {
  if (handle_ != nullptr) dlclose(handle_);
}

LookupResult Module::Find(const std::string& api, int32_t version, const std::string& method,
                          const Route** route) const {
  bool apiSeen = false;
  bool versionSeen = false;
  for (const Route& r : routes_) {
    if (r.api != api) continue;
    apiSeen = true;
    if (r.version != version) continue;
    versionSeen = true;
    if (r.method == method) {
      *route = &r;
      return LookupResult::kFound;
    }
  }
  if (!apiSeen) return LookupResult::kUnknownApi;
  return versionSeen ? LookupResult::kUnknownMethod : LookupResult::kUnknownVersion;
}

std::string Module::LookupMessage(LookupResult result, const std::string& api, int32_t version,
                                  const std::string& method) {
  const std::string shownApi = OneLine(api);
  switch (result) {
    case LookupResult::kUnknownApi:
      return "unknown API " + shownApi;
    case LookupResult::kUnknownVersion:
      return "unknown version " + std::to_string(version) + " of API " + shownApi;
    case LookupResult::kUnknownMethod:
      return "unknown method " + OneLine(method) + " of API " + shownApi + " version " +
             std::to_string(version);
    case LookupResult::kFound:
      break;
  }
  return "";
}

Outcome Invoke(const Route& route, const Json::Value& params) {
  Outcome outcome;
  ORVI::APIRequest request(params);
  ORVI::APIResponse response;
  try {
    route.handler(&request, &response);
  } catch (const std::exception& e) {
    outcome.message = "the module raised an exception: " + OneLine(e.what());
    return outcome;
  } catch (...) {
    outcome.message = "the module raised an exception of an unknown type";
    return outcome;
  }
  if (!response.Answered()) {
    outcome.message = "the module gave no answer";
  } else if (response.Conflicting()) {
    outcome.message = "the module gave conflicting answers";
  } else {
    outcome.kind = response.Success() ? Outcome::kSuccess : Outcome::kApiError;
    outcome.answer = response.ToJson();
  }
  return outcome;
}

bool ParseParams(const std::string& text, Json::Value* params, std::string* error) {
  if (text.find_first_not_of(" \t\r\n") == std::string::npos) {
    *params = Json::Value(Json::objectValue);
    return true;
  }
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  builder["allowComments"] = false;
  builder["failIfExtra"] = true;
  // With two values for one key, which one the module would see is a guess.
  builder["rejectDupKeys"] = true;
  builder["stackLimit"] = 256;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value parsed;
  std::string errors;
  bool ok = false;
  try {
    ok = reader->parse(text.data(), text.data() + text.size(), &parsed, &errors);
  } catch (const std::exception& e) {  // nesting deeper than stackLimit
    errors = e.what();
  }
  if (!ok) {
    *error = "parameters are not valid JSON: " + OneLine(errors);
    return false;
  }
  if (!parsed.isObject()) {
    *error = "parameters must be a JSON object";
    return false;
  }
  *params = std::move(parsed);
  return true;
}

std::string CompactJson(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  return Json::writeString(builder, value);
}

std::string OneLine(const std::string& text) {
  std::string out;
  out.reserve(text.size());
  for (char c : text) {
    unsigned char u = static_cast<unsigned char>(c);
    out += (u < 0x20 || u == 0x7f) ? ' ' : c;
  }
  while (!out.empty() && out.back() == ' ') out.pop_back();
  return out;
}

}  // namespace tcapi
