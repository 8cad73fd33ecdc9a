#include "json_util.h"

#include <string.h>

namespace tcjson {

const Json::Value* Member(const Json::Value& value, const char* key) {
  if (!value.isObject()) return nullptr;
  return value.find(key, key + strlen(key));
}

std::string Shown(const Json::Value& value) {
  switch (value.type()) {
    case Json::stringValue:
    case Json::booleanValue:
    case Json::intValue:
    case Json::uintValue:
    case Json::realValue:
      return value.asString();
    default: {
      Json::StreamWriterBuilder builder;
      builder["indentation"] = "";
      return Json::writeString(builder, value);
    }
  }
}

}  // namespace tcjson
