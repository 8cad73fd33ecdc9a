// A validated rule object becomes the rule store's record.
#include <stdio.h>
#include <stdlib.h>

#include <string>

#include "ORVI.Core.Network.TrafficControl.h"
#include "olibc.h"
#include "tcalloc.h"
#include "tclog.h"

namespace {

// The rule is normally an object, but nothing here may throw on one that is not.
Json::Value Member(const Json::Value& rule, const char* key) {
  return rule.isObject() ? rule.get(key, Json::Value()) : Json::Value();
}

// Text form of a value; arrays and objects have none and read as empty, so
// that an odd "port_num" of an "ALL" rule cannot end the request.
std::string TextOf(const Json::Value& value) {
  if (value.isString() || value.isNumeric() || value.isBool() || value.isNull()) {
    return value.asString();
  }
  return std::string();
}

bool BoolOf(const Json::Value& value) {
  if (value.isBool() || value.isNumeric() || value.isNull()) return value.asBool();
  return false;
}

int32_t IntOf(const Json::Value& value) {
  return value.isConvertibleTo(Json::intValue) ? value.asInt() : 0;
}

}  // namespace

bool TCHandler::RuleCreate(int id, Json::Value rule, _tag_orvi_firewall_tc_rule_* record) {
  if (record == nullptr) return false;

  std::string spec = TextOf(Member(rule, "port_type"));
  spec += ':';
  spec += TextOf(Member(rule, "port_num"));
  spec += ':';
  spec += TextOf(Member(rule, "port_direction"));

  // The record keeps one block for every rule of a dump: resize it to fit.
  size_t size = spec.size() + 1;
  char* ports = static_cast<char*>(tcalloc::Realloc(record->ports, size));
  if (ports == nullptr) {
    TC_LOG_ERR("Failed to alloc memory");
    return false;
  }
  record->ports = ports;
  snprintf(record->ports, size, "%s", spec.c_str());

  record->id = id;
  record->enabled = BoolOf(Member(rule, "enabled")) ? 1 : 0;
  record->protocol = ProtocolParse(TextOf(Member(rule, "protocol")));
  record->minrate = IntOf(Member(rule, "minrate"));
  record->maxrate = IntOf(Member(rule, "maxrate"));
  snprintf(record->source, sizeof record->source, "%s", TextOf(Member(rule, "source")).c_str());
  // Only the text "src" selects the source direction; the validator's integer
  // default for a missing direction does not.
  Json::Value direction = Member(rule, "ip_direction");
  record->ipDirection = (direction.isString() && direction.asString() == "src") ? 1 : 0;
  return true;
}
