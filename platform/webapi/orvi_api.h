// Web API framework of the appliance: the request and response objects that
// the host hands to a module's entry functions, and the method table.
#ifndef ORVI_API_H
#define ORVI_API_H

#include <stdint.h>

#include <string>

#include <json/json.h>

namespace ORVI {

class APIRequest {  // owned by the host
 public:
  // params must be a JSON object (a null value counts as no parameters).
  explicit APIRequest(const Json::Value& params = Json::Value(Json::objectValue));

  bool HasParam(const std::string& name) const;
  Json::Value GetParam(const std::string& name, const Json::Value& defaultValue) const;

 private:
  Json::Value params_;
};

class APIResponse {  // owned by the host
 public:
  void SetSuccess(const Json::Value& data);
  void SetError(int code, const Json::Value& data);

  // What the host and tests read back.
  bool Answered() const { return answers_ > 0; }
  int AnswerCount() const { return answers_; }
  // True when more than one answer was given and they differ (success after
  // error, or two different codes): a module fault.
  bool Conflicting() const { return conflicting_; }
  bool Success() const { return success_; }
  int ErrorCode() const { return code_; }
  const Json::Value& Data() const { return data_; }
  // {"success":true,"data":...} or {"success":false,"error":{"code":N}}
  Json::Value ToJson() const;

 private:
  int answers_ = 0;
  bool conflicting_ = false;
  bool success_ = false;
  int code_ = 0;
  Json::Value data_;
};

}  // namespace ORVI

extern "C" {
typedef void (*APIHandler)(ORVI::APIRequest*, ORVI::APIResponse*);
typedef struct {
  const char* api;
  int32_t version;
  const char* method;
  APIHandler handler;
} APITableEntry;
const APITableEntry* GetAPITable(void);
}

#endif
