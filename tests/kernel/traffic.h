// Test traffic between the namespaces of a Topology, bounded in time and
// bytes, and only ever to the topology's own addresses.
#ifndef TC_TESTS_KERNEL_TRAFFIC_H
#define TC_TESTS_KERNEL_TRAFFIC_H

#include <cstdint>
#include <string>

#include "netns_env.h"

namespace kerneltest {

struct TcpLimits {
  double seconds = 3.5;          // the sender stops after this long...
  long long maxBytes = 8 << 20;  // ...or after this many bytes
  double skipSeconds = 0.5;      // arrivals before this are not measured
};

// One TCP stream from W to L's IPv4 address and port. Returns the receive
// rate in KB/s (1000 bytes) over the measured part, or a negative value with
// *error set when the stream could not be run.
double TcpRateKBps(const Topology& t, uint16_t port, const TcpLimits& limits, std::string* error);

// `count` UDP datagrams of 100 bytes from W to L (IPv4 or IPv6 address),
// from source port `srcPort` (0: any). false with *error on failure.
bool SendUdp(const Topology& t, const std::string& dstAddr, uint16_t dstPort, uint16_t srcPort,
             int count, std::string* error);

}  // namespace kerneltest

#endif
