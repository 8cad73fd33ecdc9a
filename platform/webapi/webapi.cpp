#include "orvi_api.h"

namespace ORVI {

APIRequest::APIRequest(const Json::Value& params)
    : params_(params.isObject() ? params : Json::Value(Json::objectValue)) {}

bool APIRequest::HasParam(const std::string& name) const { return params_.isMember(name); }

Json::Value APIRequest::GetParam(const std::string& name, const Json::Value& defaultValue) const {
  return params_.isMember(name) ? params_[name] : defaultValue;
}

void APIResponse::SetSuccess(const Json::Value& data) {
  if (answers_ > 0) conflicting_ = true;
  ++answers_;
  success_ = true;
  code_ = 0;
  data_ = data;
}

void APIResponse::SetError(int code, const Json::Value& data) {
  // A second answer is legitimate only when it repeats the same error code.
  if (answers_ > 0 && (success_ || code_ != code)) conflicting_ = true;
  ++answers_;
  success_ = false;
  code_ = code;
  data_ = data;
}

Json::Value APIResponse::ToJson() const {
  Json::Value out(Json::objectValue);
  out["success"] = success_;
  if (success_) {
    out["data"] = data_;
  } else {
    out["error"]["code"] = code_;
  }
  return out;
}

}  // namespace ORVI
