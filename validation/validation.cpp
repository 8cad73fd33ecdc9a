// Placeholder until the validation lands: refuses every rule set.
#include "ORVI.Core.Network.TrafficControl.h"

int TCHandler::RuleValidator(Json::Value&) { return -1; }
int TCHandler::EnableCheck(Json::Value) { return -1; }
int TCHandler::ProtocolCheck(Json::Value) { return -1; }
int TCHandler::RateCheck(Json::Value) { return -1; }
int TCHandler::SrcCheck(Json::Value&) { return -1; }
int TCHandler::IpDirectCheck(Json::Value&) { return -1; }
int TCHandler::PortsParseSet(Json::Value&) { return -1; }
int TCHandler::ParseSYS(Json::Value&) { return -1; }
int TCHandler::ParseSELF(Json::Value&) { return -1; }
int TCHandler::PortsFormatNormalize(char const*, char**, int*) { return -1; }
int TCHandler::PortsSELFCheck(char const*) { return -1; }
