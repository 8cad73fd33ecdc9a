/* Network SDK of the appliance platform. */
#ifndef ORVI_SDK_NETWORK_H
#define ORVI_SDK_NETWORK_H

#include <json/json.h>

namespace SDK {
namespace Network {

/* Fills interfaces (made an array) with one object per network interface of
 * the appliance root's sys/class/net (its directories; plain files such as
 * bonding_masters are skipped), in name order:
 *   "id"          string   the interface name
 *   "bridge"      bool     true when the interface is a bridge
 *   "speed_mbps"  int      link speed in Mbit/s, -1 when unknown
 *   "up"          bool     true when operstate reads "up" (or "unknown")
 * Returns false, with an error on the error stack, when the interfaces
 * cannot be listed. */
bool EnumInterfacesStatus(Json::Value& interfaces);

}  // namespace Network
}  // namespace SDK

#endif
