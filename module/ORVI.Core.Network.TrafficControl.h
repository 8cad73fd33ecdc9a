// Traffic-control web API module: the per-request handler.
#ifndef ORVI_CORE_NETWORK_TRAFFICCONTROL_H
#define ORVI_CORE_NETWORK_TRAFFICCONTROL_H

#include <stdint.h>

#include <string>

#include <json/json.h>

#include "orvi_api.h"
#include "orvi_fw_tc.h"

// Web API error codes the module answers with.
enum TCErrorCode : int32_t {
  TC_ERR_VALIDATION = 101,
  TC_ERR_PARAM = 114,
  TC_ERR_INITIAL = 1200,
  TC_ERR_FAILED = 1201,
  TC_ERR_CEIL_BOUND = 1202,
  TC_ERR_CEIL_MAX = 1203,
  TC_ERR_REAPPLY = 1204,
  TC_ERR_NO_INTERFACE = 4311,
};

// One request's handler: built by an entry function, runs one operation.
class TCHandler {
 public:
  struct ProtoWord {
    const char* name;
    int value;
  };

  TCHandler(ORVI::APIRequest* request, ORVI::APIResponse* response);
  ~TCHandler();
  TCHandler(const TCHandler&) = delete;
  TCHandler& operator=(const TCHandler&) = delete;

  // Operations, one per table row.
  void RulesLoad();
  void RulesSave();
  void RouterRulesLoad();
  void RouterRulesSave();

  // Request preconditions.
  int InterfaceCheck();
  int RulesCheck();

  // Validation.
  int RuleValidator(Json::Value& rules);
  int EnableCheck(Json::Value rule);
  int ProtocolCheck(Json::Value rule);
  int RateCheck(Json::Value rule);
  int SrcCheck(Json::Value& rule);
  int IpDirectCheck(Json::Value& rule);
  int PortsParseSet(Json::Value& rule);
  int ParseSYS(Json::Value& rule);
  int ParseSELF(Json::Value& rule);
  int PortsFormatNormalize(char const* ports, char** out, int* size);
  int PortsSELFCheck(char const* szPorts);

  // Listing.
  int PortsParseGet(char const* ports, Json::Value& out);

  // Rule data model.
  std::string ProtocolParse(_tag_orvi_firewall_protocol_ value);
  _tag_orvi_firewall_protocol_ ProtocolParse(std::string name);

  // Saving.
  bool RuleCreate(int id, Json::Value rule, _tag_orvi_firewall_tc_rule_* record);
  bool Dump2Conf(std::string dir, std::string adapter, Json::Value rules);
  bool ConfRemove(char const* path);
  bool ConfMove(char const* src, char const* dst);
  bool ConfCopy(char const* src, char const* dst);

  // Data members, in this order.
  ORVI::APIRequest* _pRequest;
  ORVI::APIResponse* _pResponse;
  int32_t _errCode;
  Json::Value _respData;
  std::string _adapter;

  static const ProtoWord _wordProto[];
};

#endif
