// The rules of a save request: count limit, field checks and defaults, run
// rule by rule in place on the caller's array.
#include <string>

#include "ORVI.Core.Network.TrafficControl.h"
#include "json_util.h"
#include "tclog.h"

namespace {

const Json::ArrayIndex kMaxRules = 100;
const int kMaxRate = 200000;

}  // namespace

int TCHandler::RuleValidator(Json::Value& rules) {
  bool passed = false;
  // A null array is an empty one. Anything else that is not an array cannot be
  // walked by index (JsonCpp would throw) and is refused like a bad rule.
  if (!rules.isNull() && !rules.isArray()) {
    TC_LOG_ERR("The rules should be an array !!");
  } else if (rules.size() > kMaxRules) {
    TC_LOG_ERR("The count of rules should be between: 0 ~ 100 !!");
  } else {
    passed = true;
    for (Json::ArrayIndex i = 0; passed && i < rules.size(); ++i) {
      Json::Value& rule = rules[i];
      passed = false;
      if (EnableCheck(rule) < 0) {
        TC_LOG_ERR("Fail to EnableCheck()!!");
      } else if (ProtocolCheck(rule) < 0) {
        TC_LOG_ERR("Fail to ProtocolCheck()!!");
      } else if (RateCheck(rule) < 0) {
        TC_LOG_ERR("Fail to RateCheck()!!");
      } else if (SrcCheck(rule) < 0) {
        TC_LOG_ERR("Fail to SrcSet()!!");
      } else if (IpDirectCheck(rule) < 0) {
        TC_LOG_ERR("Fail to IpDirectSet()!!");
      } else if (PortsParseSet(rule) < 0) {
        TC_LOG_ERR("Fail to PortsParseSet()!!");
      } else {
        passed = true;
      }
    }
  }
  if (passed) return 0;
  _errCode = TC_ERR_VALIDATION;
  _pResponse->SetError(_errCode, Json::Value());
  return -1;
}

int TCHandler::EnableCheck(Json::Value rule) {
  const Json::Value* enabled = tcjson::Member(rule, "enabled");
  return enabled != nullptr && enabled->isBool() ? 0 : -1;
}

int TCHandler::ProtocolCheck(Json::Value rule) {
  const Json::Value* protocol = tcjson::Member(rule, "protocol");
  if (protocol == nullptr || !protocol->isString()) return -1;
  const std::string name = protocol->asString();
  if (name == "tcp" || name == "udp" || name == "all") return 0;
  TC_LOG_ERR("protocol must be one of tcp/udp/all");
  return -1;
}

// isInt() also takes a real with an integral value inside the 32-bit range
// (100.0 reads as 100); fractions and anything beyond int32 are refused here
// rather than cut into range by asInt().
int TCHandler::RateCheck(Json::Value rule) {
  const Json::Value* minRate = tcjson::Member(rule, "minrate");
  const Json::Value* maxRate = tcjson::Member(rule, "maxrate");
  if (minRate == nullptr || !minRate->isInt() || maxRate == nullptr || !maxRate->isInt()) {
    return -1;
  }
  const int min = minRate->asInt();
  const int max = maxRate->asInt();
  if (min < 1 || min > kMaxRate) {
    TC_LOG_ERR("minrate should between: 0 < minrate <= %d", kMaxRate);
    return -1;
  }
  if (max < 0 || max > kMaxRate) {
    TC_LOG_ERR("maxrate should between: 0 <= maxrate <= %d", kMaxRate);
    return -1;
  }
  // A zero ceiling means "no ceiling", so any minrate fits under it.
  if (max != 0 && min > max) {
    TC_LOG_ERR("mixrate must <= maxrate (min: %d, max: %d)", min, max);
    return -1;
  }
  return 0;
}

int TCHandler::SrcCheck(Json::Value& rule) {
  if (!rule.isObject()) return -1;
  const Json::Value* source = tcjson::Member(rule, "source");
  if (source == nullptr || source->isNull() || (source->isString() && source->asString().empty())) {
    rule["source"] = "all";
    return 0;
  }
  if (source->isString()) return 0;
  TC_LOG("Bad src value %s", tcjson::Shown(*source).c_str());
  return -1;
}

int TCHandler::IpDirectCheck(Json::Value& rule) {
  if (!rule.isObject()) return -1;
  const Json::Value* direction = tcjson::Member(rule, "ip_direction");
  if (direction == nullptr) {
    // The absent default is the integer 1, not the text "src": saving stores
    // it as the destination direction.
    rule["ip_direction"] = 1;
    return 0;
  }
  return direction->isString() ? 0 : -1;
}
