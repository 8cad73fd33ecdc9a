// Small helpers for reading JSON values that come straight from a client:
// JsonCpp throws when a keyed lookup hits a value that is not an object, so
// every lookup here checks the type first.
#ifndef TC_JSON_UTIL_H
#define TC_JSON_UTIL_H

#include <stdlib.h>

#include <memory>
#include <string>

#include <json/json.h>

namespace tcjson {

// The member `key` of `value`, or nullptr when value is not an object or has
// no such member. Never creates the member.
const Json::Value* Member(const Json::Value& value, const char* key);

// Text for log lines: a string's own text, a number's or boolean's asString()
// form, and compact JSON (no newline) for null, arrays and objects.
std::string Shown(const Json::Value& value);

// Owner of a C heap buffer that the platform may have reallocated.
struct CFree {
  void operator()(void* p) const { free(p); }
};
using CBuffer = std::unique_ptr<char, CFree>;

}  // namespace tcjson

#endif
