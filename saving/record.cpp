// A validated rule object becomes the rule store's record.
#include <stdio.h>
#include <stdlib.h>

#include <string>

#include "ORVI.Core.Network.TrafficControl.h"
#include "json_util.h"
#include "olibc.h"
#include "tcalloc.h"
#include "tclog.h"

namespace {

using tcjson::Member;

// Text form of a member; a missing one, an array or an object has none and
// reads as empty, so that an odd "port_num" of an "ALL" rule cannot end the
// request.
std::string TextOf(const Json::Value* value) {
  if (value == nullptr) return std::string();
  if (value->isString() || value->isNumeric() || value->isBool() || value->isNull()) {
    return value->asString();
  }
  return std::string();
}

bool BoolOf(const Json::Value* value) {
  if (value == nullptr) return false;
  if (value->isBool() || value->isNumeric() || value->isNull()) return value->asBool();
  return false;
}

int32_t IntOf(const Json::Value* value) {
  return value != nullptr && value->isConvertibleTo(Json::intValue) ? value->asInt() : 0;
}

}  // namespace

bool TCHandler::RuleCreate(int id, Json::Value rule, _tag_orvi_firewall_tc_rule_* record) {
  if (record == nullptr) return false;

  std::string portsText = TextOf(Member(rule, "port_type"));
  portsText += ':';
  portsText += TextOf(Member(rule, "port_num"));
  portsText += ':';
  portsText += TextOf(Member(rule, "port_direction"));

  // The record keeps one block for every rule of a dump: resize it to fit.
  size_t size = portsText.size() + 1;
  char* ports = static_cast<char*>(tcalloc::Realloc(record->ports, size));
  if (ports == nullptr) {
    TC_LOG_ERR("Failed to alloc memory");
    return false;
  }
  record->ports = ports;
  snprintf(record->ports, size, "%s", portsText.c_str());

  record->id = id;
  record->enabled = BoolOf(Member(rule, "enabled")) ? 1 : 0;
  record->protocol = ProtocolParse(TextOf(Member(rule, "protocol")));
  record->minrate = IntOf(Member(rule, "minrate"));
  record->maxrate = IntOf(Member(rule, "maxrate"));
  snprintf(record->source, sizeof record->source, "%s", TextOf(Member(rule, "source")).c_str());
  // Only the text "src" selects the source direction; the validator's integer
  // default for a missing direction does not.
  const Json::Value* direction = Member(rule, "ip_direction");
  record->ipDirection =
      (direction != nullptr && direction->isString() && direction->asString() == "src") ? 1 : 0;
  return true;
}
