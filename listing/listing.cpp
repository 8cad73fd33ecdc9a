// Placeholder until the listing lands: answers with the initial code.
#include "ORVI.Core.Network.TrafficControl.h"

void TCHandler::RulesLoad() { _pResponse->SetError(_errCode, Json::Value()); }
void TCHandler::RouterRulesLoad() { _pResponse->SetError(_errCode, Json::Value()); }
int TCHandler::PortsParseGet(char const*, Json::Value&) { return -1; }
