// Internals of the tc batch generator, shared by its sources and its tests.
// A rule is first expanded into Matches (one per filter, independent of the
// classifier); a Classifier turns Matches into filter commands and a
// LeafQdisc gives each class its queue. u32 and pfifo are the defaults
// because the target kernels have neither flower nor fq_codel/sfq.
#ifndef ORVI_TCGEN_DETAIL_H
#define ORVI_TCGEN_DETAIL_H

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "tcgen.h"

namespace tcgen {
namespace detail {

// Limits of one device's batch: beyond them Check refuses, so that tc never
// fails halfway through a huge batch.
constexpr size_t kMaxFilters = 1000;

// One aligned block of ports: a port p is inside when (p & mask) == value.
struct PortBlock {
  uint16_t value;
  uint16_t mask;
};
// The fewest aligned blocks that cover lo..hi exactly (lo <= hi <= 65535).
std::vector<PortBlock> SplitPortRange(uint32_t lo, uint32_t hi);

enum class Family { kIPv4, kIPv6 };
enum L4 : uint8_t { kAnyL4 = 0, kTcp = 6, kUdp = 17 };

struct Source {
  enum Kind { kAll, kIPv4, kIPv6, kMac } kind = kAll;
  uint8_t addr[16] = {};  // network address (host bits cleared); IPv4 uses 4 bytes
  int prefixLen = 0;
  uint8_t mac[6] = {};
};
// Parses a rule's fixed-size source field; false for anything but "all", an
// IPv4/IPv6 address or prefix, or a MAC address (also when unterminated).
bool ParseSource(const char* field, size_t fieldSize, Source* out);

struct PortField {
  enum Type { kAll, kSelf, kSys } type = kAll;
  std::string list;    // port list or service names, as stored
  bool srcDir = true;  // ports are source ports ("src"), else destination
};
// Reads the stored "TYPE:LIST:DIR" text (shorter forms such as "ALL" and
// "SYS:cifs" included); false for anything unreadable.
bool ParsePortField(const char* text, PortField* out);

struct ServicePort {
  uint8_t l4;
  uint16_t port;
};
// The built-in service table; nullptr for an unknown name (case-insensitive).
const std::vector<ServicePort>* LookupService(const std::string& name);

// What one filter matches. The address (or MAC) applies as source when
// addrIsSrc, the port block as source port when portIsSrc.
struct Match {
  Family family = Family::kIPv4;
  uint8_t l4 = kAnyL4;
  Source source;
  bool addrIsSrc = true;
  bool hasPort = false;
  PortBlock port = {0, 0};
  bool portIsSrc = false;
};

// The matches of one enabled rule, in filter order. 0, or an error code of
// orvi_fw_tc.h with a reason for the log.
int ExpandRule(const TcRule& rule, std::vector<Match>* out, std::string* why);

// Device names that are valid for the kernel and harmless on a tc command
// line: 1 to 15 of [A-Za-z0-9_.-], not starting with "-", not "." or "..".
bool ValidDeviceName(const std::string& name);

class Classifier {
 public:
  virtual ~Classifier() = default;
  // Appends the filter commands of one rule (the rule's position among the
  // enabled rules is `ordinal`; lower ordinals must win) to `batch`.
  virtual void AddFilters(const std::string& dev, size_t ordinal, const std::vector<Match>& matches,
                          const std::string& flowid, std::string* batch) const = 0;
};

class LeafQdisc {
 public:
  virtual ~LeafQdisc() = default;
  // Appends the command that attaches the leaf queue under class `parent`.
  virtual void AddLeaf(const std::string& dev, const std::string& parent, uint32_t handleMajor,
                       long long ceilKBps, std::string* batch) const = 0;
};

const Classifier& U32Classifier();
const LeafQdisc& PfifoLeaf();

// Generate with an explicit classifier and leaf queue.
std::string GenerateWith(const DeviceRules& dev, const Classifier& classifier,
                         const LeafQdisc& leaf);

// The two commands that put any device back on its default qdisc and never
// fail while the device exists: first a known root, then its deletion (a bare
// "qdisc del root" fails on a device that has no qdisc of its own).
std::string RestoreDefaultCommands(const std::string& dev);

}  // namespace detail
}  // namespace tcgen

#endif
