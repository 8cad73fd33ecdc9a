// The default classifier (u32) and leaf queue (pfifo) of the tc generator.
#include <arpa/inet.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <string>

#include "tcgen_detail.h"

namespace tcgen {
namespace detail {
namespace {

void AppendUnsigned(std::string* out, unsigned long v) {
  char buf[24];
  char* end = buf + sizeof buf;
  char* p = end;
  do {
    *--p = static_cast<char>('0' + v % 10);
    v /= 10;
  } while (v != 0);
  out->append(p, static_cast<size_t>(end - p));
}

// Text of a rule's address or MAC match. A rule's matches all share one
// source, so the text is made once per rule rather than once per filter.
class SourceText {
 public:
  const std::string& Of(const Match& m) {
    if (!valid_ || !Same(last_, m.source) || lastIsSrc_ != m.addrIsSrc || lastFamily_ != m.family) {
      last_ = m.source;
      lastIsSrc_ = m.addrIsSrc;
      lastFamily_ = m.family;
      valid_ = true;
      Make(m);
    }
    return text_;
  }

 private:
  static bool Same(const Source& a, const Source& b) {
    return a.kind == b.kind && a.prefixLen == b.prefixLen &&
           std::memcmp(a.addr, b.addr, sizeof a.addr) == 0 &&
           std::memcmp(a.mac, b.mac, sizeof a.mac) == 0;
  }

  void Make(const Match& m) {
    text_.clear();
    const char* ip = m.family == Family::kIPv4 ? "ip" : "ip6";
    char buf[INET6_ADDRSTRLEN];
    if (m.source.kind == Source::kMac) {
      const uint8_t* mac = m.source.mac;
      std::snprintf(buf, sizeof buf, "%02x:%02x:%02x:%02x:%02x:%02x", mac[0], mac[1], mac[2],
                    mac[3], mac[4], mac[5]);
      text_ = std::string(" match ether ") + (m.addrIsSrc ? "src " : "dst ") + buf;
    } else if (m.source.kind != Source::kAll && m.source.prefixLen > 0) {
      int af = m.source.kind == Source::kIPv4 ? AF_INET : AF_INET6;
      if (inet_ntop(af, m.source.addr, buf, sizeof buf) == nullptr) buf[0] = '\0';
      text_ = std::string(" match ") + ip + (m.addrIsSrc ? " src " : " dst ") + buf + "/";
      AppendUnsigned(&text_, static_cast<unsigned long>(m.source.prefixLen));
    }
  }

  Source last_;
  bool lastIsSrc_ = false;
  Family lastFamily_ = Family::kIPv4;
  bool valid_ = false;
  std::string text_;
};

// u32 keys are offsets from the network header. Ports are read at fixed
// offsets, so a filter with ports also requires the header layout that puts
// them there: for IPv4 a 20-byte header (IHL 5) and a packet that is not a
// later fragment; for IPv6 the transport header right after the fixed header
// (the next-header check does that). Other packets fall to later rules or to
// the default class rather than being matched on unrelated bytes.
void AppendKeys(const Match& m, SourceText& sources, std::string* k) {
  const bool v4 = m.family == Family::kIPv4;
  const char* ip = v4 ? " match ip" : " match ip6";
  const size_t start = k->size();
  k->append(sources.Of(m));
  if (m.l4 != kAnyL4) {
    k->append(ip);
    k->append(" protocol ");
    AppendUnsigned(k, m.l4);
    k->append(" 0xff");
  }
  if (m.hasPort) {
    if (v4) k->append(" match u8 0x05 0x0f at 0 match u16 0x0000 0x1fff at 6");
    k->append(ip);
    k->append(m.portIsSrc ? " sport " : " dport ");
    AppendUnsigned(k, m.port.value);
    static const char kHex[] = "0123456789abcdef";
    const char mask[] = {' ',
                         '0',
                         'x',
                         kHex[(m.port.mask >> 12) & 0xf],
                         kHex[(m.port.mask >> 8) & 0xf],
                         kHex[(m.port.mask >> 4) & 0xf],
                         kHex[m.port.mask & 0xf]};
    k->append(mask, sizeof mask);
  }
  if (k->size() == start) k->append(" match u32 0 0");  // everything of this protocol
}

class U32 : public Classifier {
 public:
  // One u32 instance per rule and family: tc keys filter instances by
  // (prio, protocol), so IPv4 and IPv6 filters of a rule need two prios.
  // Rule k gets 2k+1 (IPv4) and 2k+2 (IPv6): an earlier rule always wins.
  void AddFilters(const std::string& dev, size_t ordinal, const std::vector<Match>& matches,
                  const std::string& flowid, std::string* batch) const override {
    const Family families[] = {Family::kIPv4, Family::kIPv6};
    SourceText sources;
    for (Family f : families) {
      // Everything up to the keys is the same for every filter of the family.
      std::string head = "filter add dev " + dev + " parent 1: protocol " +
                         (f == Family::kIPv4 ? "ip" : "ipv6") + " prio ";
      AppendUnsigned(&head, 2 * ordinal + (f == Family::kIPv4 ? 1 : 2));
      head += " u32";
      for (const Match& m : matches) {
        if (m.family != f) continue;
        batch->append(head);
        AppendKeys(m, sources, batch);
        batch->append(" flowid ");
        batch->append(flowid);
        batch->push_back('\n');
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
