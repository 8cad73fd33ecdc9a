// The default classifier (u32) and leaf queue (pfifo) of the tc generator.
#include <arpa/inet.h>

#include <algorithm>
#include <cstdio>

#include "tcgen_detail.h"

namespace tcgen {
namespace detail {
namespace {

std::string MacText(const uint8_t mac[6]) {
  char buf[18];
  std::snprintf(buf, sizeof buf, "%02x:%02x:%02x:%02x:%02x:%02x", mac[0], mac[1], mac[2], mac[3],
                mac[4], mac[5]);
  return buf;
}

std::string AddrText(const Source& src) {
  char buf[INET6_ADDRSTRLEN];
  int af = src.kind == Source::kIPv4 ? AF_INET : AF_INET6;
  if (inet_ntop(af, src.addr, buf, sizeof buf) == nullptr) return std::string();
  return std::string(buf) + "/" + std::to_string(src.prefixLen);
}

std::string MaskText(uint16_t mask) {
  char buf[8];
  std::snprintf(buf, sizeof buf, "0x%04x", mask);
  return buf;
}

// u32 keys are offsets from the network header. Ports are read at fixed
// offsets, so a filter with ports also requires the header layout that puts
// them there: for IPv4 a 20-byte header (IHL 5) and a packet that is not a
// later fragment; for IPv6 the transport header right after the fixed header
// (the next-header check does that). Other packets fall to later rules or to
// the default class rather than being matched on unrelated bytes.
std::string Keys(const Match& m) {
  const bool v4 = m.family == Family::kIPv4;
  const char* ip = v4 ? "ip" : "ip6";
  std::string k;
  if (m.source.kind == Source::kMac) {
    k += std::string(" match ether ") + (m.addrIsSrc ? "src " : "dst ") + MacText(m.source.mac);
  } else if (m.source.kind != Source::kAll && m.source.prefixLen > 0) {
    k += std::string(" match ") + ip + (m.addrIsSrc ? " src " : " dst ") + AddrText(m.source);
  }
  if (m.l4 != kAnyL4) {
    k += std::string(" match ") + ip + " protocol " + std::to_string(m.l4) + " 0xff";
  }
  if (m.hasPort) {
    if (v4) k += " match u8 0x05 0x0f at 0 match u16 0x0000 0x1fff at 6";
    k += std::string(" match ") + ip + (m.portIsSrc ? " sport " : " dport ") +
         std::to_string(m.port.value) + " " + MaskText(m.port.mask);
  }
  if (k.empty()) k = " match u32 0 0";  // everything of this protocol
  return k;
}

class U32 : public Classifier {
 public:
  // One u32 instance per rule and family: tc keys filter instances by
  // (prio, protocol), so IPv4 and IPv6 filters of a rule need two prios.
  // Rule k gets 2k+1 (IPv4) and 2k+2 (IPv6): an earlier rule always wins.
  void AddFilters(const std::string& dev, size_t ordinal, const std::vector<Match>& matches,
                  const std::string& flowid, std::string* batch) const override {
    const Family families[] = {Family::kIPv4, Family::kIPv6};
    for (Family f : families) {
      const std::string prio = std::to_string(2 * ordinal + (f == Family::kIPv4 ? 1 : 2));
      const char* proto = f == Family::kIPv4 ? "ip" : "ipv6";
      for (const Match& m : matches) {
        if (m.family != f) continue;
        *batch += "filter add dev " + dev + " parent 1: protocol " + proto + " prio " + prio +
                  " u32" + Keys(m) + " flowid " + flowid + "\n";
      }
    }
  }
};

class Pfifo : public LeafQdisc {
 public:
  // About 100 ms of full frames at the ceiling, between 64 and 1000 packets:
  // a slow class should not queue for minutes.
  void AddLeaf(const std::string& dev, const std::string& parent, uint32_t handleMajor,
               long long ceilKBps, std::string* batch) const override {
    long long limit = std::min(std::max(ceilKBps * 100 / 1500, 64LL), 1000LL);
    char handle[16];
    std::snprintf(handle, sizeof handle, "%x:", handleMajor);
    *batch += "qdisc add dev " + dev + " parent " + parent + " handle " + handle + " pfifo limit " +
              std::to_string(limit) + "\n";
  }
};

}  // namespace

const Classifier& U32Classifier() {
  static const U32 instance;
  return instance;
}

const LeafQdisc& PfifoLeaf() {
  static const Pfifo instance;
  return instance;
}

}  // namespace detail
}  // namespace tcgen
