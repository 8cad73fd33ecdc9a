// Placeholder until the saving lands: answers with the initial code.
#include "ORVI.Core.Network.TrafficControl.h"

void TCHandler::RulesSave() { _pResponse->SetError(_errCode, Json::Value()); }
void TCHandler::RouterRulesSave() { _pResponse->SetError(_errCode, Json::Value()); }
bool TCHandler::RuleCreate(int, Json::Value, _tag_orvi_firewall_tc_rule_*) { return false; }
bool TCHandler::Dump2Conf(std::string, std::string, Json::Value) { return false; }
bool TCHandler::ConfRemove(char const*) { return false; }
bool TCHandler::ConfMove(char const*, char const*) { return false; }
bool TCHandler::ConfCopy(char const*, char const*) { return false; }
