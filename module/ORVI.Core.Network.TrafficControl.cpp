// Traffic-control web API module: entry table, handler construction, request
// preconditions and the protocol names.
#include "ORVI.Core.Network.TrafficControl.h"

#include <stdio.h>
#include <string.h>
#include <strings.h>

#include "json_util.h"
#include "olibc.h"
#include "preconditions.h"
#include "sdk_network.h"
#include "tclog.h"

#define TC_EXPORT __attribute__((visibility("default")))

const char* const kKeyFile = "/etc/orviinfo.conf";
const char* const kLiveDir = "/etc/tc";
const char* const kStagingDir = "/etc/tc_tmp";

namespace {
const char kApiRules[] = "ORVI.Core.Network.TrafficControl.Rules";
const char kApiRouterRules[] = "ORVI.Core.Network.TrafficControl.RouterRules";
const size_t kValueBufSize = 1024;
const size_t kAdapterBufSize = 16;
}  // namespace

extern "C" {
TC_EXPORT void APIRulesLoad(ORVI::APIRequest* request, ORVI::APIResponse* response);
TC_EXPORT void APIRulesSave(ORVI::APIRequest* request, ORVI::APIResponse* response);
TC_EXPORT void APIRouterRulesLoad(ORVI::APIRequest* request, ORVI::APIResponse* response);
TC_EXPORT void APIRouterRulesSave(ORVI::APIRequest* request, ORVI::APIResponse* response);

TC_EXPORT extern const APITableEntry gTable[5];
const APITableEntry gTable[5] = {
    {kApiRules, 1, "load", APIRulesLoad},
    {kApiRules, 1, "save", APIRulesSave},
    {kApiRouterRules, 1, "load", APIRouterRulesLoad},
    {kApiRouterRules, 1, "save", APIRouterRulesSave},
    {nullptr, 0, nullptr, nullptr},
};

TC_EXPORT const APITableEntry* GetAPITable(void) { return gTable; }

// The handler lives on the stack: whatever happens, it is destroyed before
// the entry function returns, and exceptions reach the host untouched.
void APIRulesLoad(ORVI::APIRequest* request, ORVI::APIResponse* response) {
  TCHandler handler(request, response);
  handler.RulesLoad();
}

void APIRulesSave(ORVI::APIRequest* request, ORVI::APIResponse* response) {
  TCHandler handler(request, response);
  handler.RulesSave();
}

void APIRouterRulesLoad(ORVI::APIRequest* request, ORVI::APIResponse* response) {
  TCHandler handler(request, response);
  handler.RouterRulesLoad();
}

void APIRouterRulesSave(ORVI::APIRequest* request, ORVI::APIResponse* response) {
  TCHandler handler(request, response);
  handler.RouterRulesSave();
}
}  // extern "C"

const TCHandler::ProtoWord TCHandler::_wordProto[] = {
    {"tcp", ORVI_FW_PROTO_TCP},
    {"udp", ORVI_FW_PROTO_UDP},
    {"all", ORVI_FW_PROTO_ALL},
    {nullptr, -1},
};

TCHandler::TCHandler(ORVI::APIRequest* request, ORVI::APIResponse* response)
    : _pRequest(request),
      _pResponse(response),
      _errCode(TC_ERR_INITIAL),
      _respData(Json::objectValue),
      _adapter("") {
  if (_pRequest->HasParam("adapter")) {
    Json::Value adapter = _pRequest->GetParam("adapter", Json::Value());
    if (adapter.isString() && !adapter.asString().empty()) _adapter = adapter.asString();
  }
}

TCHandler::~TCHandler() = default;

bool IsRouterMode() {
  char support[kValueBufSize] = {0};
  char topology[kValueBufSize] = {0};
  if (OLIBCFileGetKeyValue(kKeyFile, "support_net_topology", support, sizeof support, 0) < 1) {
    TC_LOG("Failed to get [net_topology] info from [%s], or key not found", kKeyFile);
    return false;
  }
  if (OLIBCFileGetKeyValue(kKeyFile, "net_topology", topology, sizeof topology, 0) < 1) {
    TC_LOG("Failed to get [net_topology] info from [%s], or key not found", kKeyFile);
    return false;
  }
  if (strcasecmp(topology, "router") == 0 && strcasecmp(support, "yes") == 0) return true;
  TC_LOG("QS is not in router mode");
  TC_ERR_SET(0xD900);
  return false;
}

int BridgeListGet(SzList** list) {
  if (OLIBNetEnumBridge(list, 3) < 0) {
    TC_LOG_ERR("Failed to OLIBNetEnumBridge ");
    return -1;
  }
  for (int i = 0; i < (*list)->count; ++i) {
    const char* name = OLIBCSzListGet(*list, i);
    if (name != nullptr && strcasecmp(name, "gbr") == 0) {
      return OLIBCSzListRemove(*list, i) == 0 ? -1 : 0;
    }
  }
  return 0;
}

bool RouterAdaptersSelect(TCHandler& h, int listSize, SzListHolder& names) {
  const Json::Value direction = h._pRequest->GetParam("direction", Json::Value());
  // Only a warning: the text decides below. A value that is present but not
  // a string never matches; the log shows it as compact JSON.
  if (!direction.isString()) TC_LOG("Bad parameters");
  const std::string text = direction.isNull() ? std::string() : tcjson::Shown(direction);

  names.Release();
  *names.Out() = OLIBCSzListAlloc(listSize);
  if (names.Get() == nullptr) {
    TC_LOG_ERR("Failed to OLIBCSzListAlloc ");
    h._errCode = TC_ERR_FAILED;
    return false;
  }
  if (text == "upload") {
    // Without the name the request would touch nothing and still succeed.
    if (OLIBCSzListPush(names.Out(), "upload") < 0) {
      TC_LOG_ERR("Failed to OLIBCSzListPush ");
      h._errCode = TC_ERR_FAILED;
      return false;
    }
    return true;
  }
  if (text == "download") {
    if (BridgeListGet(names.Out()) < 0) {
      TC_LOG("Bad parameters");
      h._errCode = TC_ERR_INITIAL;
      return false;
    }
    return true;
  }
  TC_LOG("Unknown direction %s", text.c_str());
  h._errCode = TC_ERR_INITIAL;
  return false;
}

int TCHandler::InterfaceCheck() {
  if (_adapter.empty()) {
    TC_LOG_ERR("Required parameter error!");
    _errCode = TC_ERR_PARAM;
  } else {
    char shown[kAdapterBufSize] = {0};
    snprintf(shown, sizeof shown, "%s", _adapter.c_str());
    Json::Value interfaces(Json::arrayValue);
    if (!SDK::Network::EnumInterfacesStatus(interfaces)) {
      TC_LOG("enum interface failed");
      _errCode = TC_ERR_FAILED;
    } else {
      // Read-only lookups: the SDK's objects are trusted, but a stray element
      // that is not an object must not throw.
      const Json::Value& list = interfaces;
      for (Json::ArrayIndex i = 0; list.isArray() && i < list.size(); ++i) {
        const Json::Value* id = tcjson::Member(list[i], "id");
        if (id != nullptr && (id->isString() || id->isNumeric()) && id->asString() == _adapter)
          return 0;
      }
      TC_LOG_ERR("No such interface [%s]", shown);
      _errCode = TC_ERR_NO_INTERFACE;
    }
  }
  _pResponse->SetError(_errCode, Json::Value());
  return -1;
}

int TCHandler::RulesCheck() {
  if (!_pRequest->HasParam("rules")) return 0;
  if (_pRequest->GetParam("rules", Json::Value()).isArray()) return 0;
  TC_LOG_ERR("Required parameter error!");
  _errCode = TC_ERR_PARAM;
  _pResponse->SetError(_errCode, Json::Value());
  return -1;
}

std::string TCHandler::ProtocolParse(_tag_orvi_firewall_protocol_ value) {
  for (const ProtoWord* w = _wordProto; w->name != nullptr; ++w) {
    if (w->value == static_cast<int>(value)) return w->name;
  }
  TC_LOG("bad parameters of protocol: %d", static_cast<int>(value));
  return "tcp";
}

_tag_orvi_firewall_protocol_ TCHandler::ProtocolParse(std::string name) {
  if (name.empty()) return ORVI_FW_PROTO_ALL;
  for (const ProtoWord* w = _wordProto; w->name != nullptr; ++w) {
    if (name == w->name) return static_cast<_tag_orvi_firewall_protocol_>(w->value);
  }
  TC_LOG("bad parameters of protocol: %s", name.c_str());
  return ORVI_FW_PROTO_ALL;
}
