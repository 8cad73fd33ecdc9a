// From the rules of one device to a tc batch: parsing and checking of the
// stored rule fields, expansion into matches, and the HTB tree around them.
#include "tcgen.h"

#include <arpa/inet.h>
#include <syslog.h>

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <cstring>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <map>

#include "olibc.h"
#include "orvi_root.h"
#include "tcgen_detail.h"

namespace tcgen {
namespace detail {
namespace {

bool EqualsNoCase(const std::string& a, const char* b) {
  size_t n = std::strlen(b);
  if (a.size() != n) return false;
  for (size_t i = 0; i < n; ++i) {
    if (std::tolower(static_cast<unsigned char>(a[i])) !=
        std::tolower(static_cast<unsigned char>(b[i])))
      return false;
  }
  return true;
}

bool StartsNoCase(const char* text, const char* prefix) {
  return strncasecmp(text, prefix, std::strlen(prefix)) == 0;
}

std::string Trim(const std::string& s) {
  size_t b = 0, e = s.size();
  while (b < e && std::isspace(static_cast<unsigned char>(s[b]))) ++b;
  while (e > b && std::isspace(static_cast<unsigned char>(s[e - 1]))) --e;
  return s.substr(b, e - b);
}

std::vector<std::string> SplitComma(const std::string& s) {
  std::vector<std::string> items;
  size_t start = 0;
  for (;;) {
    size_t comma = s.find(',', start);
    items.push_back(Trim(s.substr(start, comma == std::string::npos ? comma : comma - start)));
    if (comma == std::string::npos) break;
    start = comma + 1;
  }
  return items;
}

// Decimal digits only (no sign, no blanks), at most `maxDigits` of them.
bool ParseDecimal(const std::string& s, size_t maxDigits, uint32_t maxValue, uint32_t* out) {
  if (s.empty() || s.size() > maxDigits) return false;
  uint32_t v = 0;
  for (char c : s) {
    if (c < '0' || c > '9') return false;
    v = v * 10 + static_cast<uint32_t>(c - '0');
  }
  if (v > maxValue) return false;
  *out = v;
  return true;
}

bool ParsePort(const std::string& s, uint32_t* out) { return ParseDecimal(s, 5, 65535, out); }

int HexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return -1;
}

// "aa:bb:cc:dd:ee:ff" or with "-" between the octets, either case.
bool ParseMac(const std::string& s, uint8_t mac[6]) {
  if (s.size() != 17) return false;
  const char sep = s[2];
  if (sep != ':' && sep != '-') return false;
  for (int i = 0; i < 6; ++i) {
    int hi = HexDigit(s[i * 3]), lo = HexDigit(s[i * 3 + 1]);
    if (hi < 0 || lo < 0) return false;
    if (i < 5 && s[i * 3 + 2] != sep) return false;
    mac[i] = static_cast<uint8_t>(hi * 16 + lo);
  }
  return true;
}

void ClearHostBits(uint8_t* addr, int bytes, int prefixLen) {
  for (int i = 0; i < bytes; ++i) {
    int keep = prefixLen - i * 8;
    if (keep >= 8) continue;
    addr[i] = keep <= 0 ? 0 : static_cast<uint8_t>(addr[i] & (0xff << (8 - keep)));
  }
}

// The built-in table of the appliance's services: name, then (l4, port)
// pairs. Kept small on purpose; names are matched case-insensitively.
const std::map<std::string, std::vector<ServicePort>>& ServiceTable() {
  static const std::map<std::string, std::vector<ServicePort>> table = {
      {"afp", {{kTcp, 548}}},
      {"cifs", {{kTcp, 139}, {kTcp, 445}}},
      {"dhcp", {{kUdp, 67}, {kUdp, 68}}},
      {"dns", {{kTcp, 53}, {kUdp, 53}}},
      {"ftp", {{kTcp, 21}}},
      {"http", {{kTcp, 80}}},
      {"https", {{kTcp, 443}}},
      {"nfs", {{kTcp, 2049}, {kUdp, 2049}}},
      {"ntp", {{kUdp, 123}}},
      {"rsync", {{kTcp, 873}}},
      {"smtp", {{kTcp, 25}}},
      {"ssh", {{kTcp, 22}}},
      {"telnet", {{kTcp, 23}}},
  };
  return table;
}

bool ProtocolAllows(int protocol, uint8_t l4) {
  return protocol == ORVI_FW_PROTO_ALL || (protocol == ORVI_FW_PROTO_TCP && l4 == kTcp) ||
         (protocol == ORVI_FW_PROTO_UDP && l4 == kUdp);
}

// (l4, port block) pairs of a ports field for the rule's protocol.
int PortMatches(const PortField& field, int protocol,
                std::vector<std::pair<uint8_t, PortBlock>>* out, std::string* why) {
  if (field.type == PortField::kAll) {
    out->clear();
    return 0;
  }
  if (field.type == PortField::kSys) {
    for (const std::string& name : SplitComma(field.list)) {
      const std::vector<ServicePort>* ports = LookupService(name);
      if (ports == nullptr) {
        *why = "unknown service name";
        return ORVI_TC_ERR_PORTS;
      }
      for (const ServicePort& sp : *ports) {
        if (!ProtocolAllows(protocol, sp.l4)) continue;
        std::pair<uint8_t, PortBlock> m(sp.l4, PortBlock{sp.port, 0xffff});
        bool seen = std::any_of(out->begin(), out->end(), [&](const auto& o) {
          return o.first == m.first && o.second.value == m.second.value;
        });
        if (!seen) out->push_back(m);
      }
    }
    if (out->empty()) {
      *why = "the services have no port for the rule's protocol";
      return ORVI_TC_ERR_PORTS;
    }
    return 0;
  }
  // SELF: single ports, or one range as the only item.
  std::vector<std::string> items = SplitComma(field.list);
  std::vector<PortBlock> blocks;
  if (items.size() == 1 && items[0].find('-') != std::string::npos) {
    const std::string& item = items[0];
    size_t dash = item.find('-');
    uint32_t lo = 0, hi = 0;
    if (!ParsePort(Trim(item.substr(0, dash)), &lo) ||
        !ParsePort(Trim(item.substr(dash + 1)), &hi) || lo > hi) {
      *why = "malformed port range";
      return ORVI_TC_ERR_PORTS;
    }
    blocks = SplitPortRange(lo, hi);
  } else {
    for (const std::string& item : items) {
      uint32_t port = 0;
      if (!ParsePort(item, &port)) {
        *why = items.size() == 1 && item.empty() ? "empty port list" : "malformed port list";
        return ORVI_TC_ERR_PORTS;
      }
      bool seen = std::any_of(blocks.begin(), blocks.end(),
                              [&](const PortBlock& b) { return b.value == port; });
      if (!seen) blocks.push_back(PortBlock{static_cast<uint16_t>(port), 0xffff});
    }
  }
  const uint8_t l4s[] = {kTcp, kUdp};
  for (uint8_t l4 : l4s) {
    if (!ProtocolAllows(protocol, l4)) continue;
    for (const PortBlock& b : blocks) out->emplace_back(l4, b);
  }
  return 0;
}

// A rule's source for the log: printable bytes only, never more than the field.
std::string Printable(const char* field, size_t size) {
  std::string s;
  for (size_t i = 0; i < size && field[i] != '\0'; ++i) {
    unsigned char c = static_cast<unsigned char>(field[i]);
    s += (c >= 0x20 && c < 0x7f) ? static_cast<char>(c) : '?';
  }
  return s;
}

// Link type of a device (ARPHRD_*), or -1 when the root does not say.
int LinkType(const std::string& dev) {
  std::string text;
  if (!orvi::ReadRegularFile(orvi::RootPath("/sys/class/net/" + dev + "/type"), 64, &text))
    return -1;
  errno = 0;
  char* end = nullptr;
  long type = std::strtol(text.c_str(), &end, 10);
  if (errno != 0 || end == text.c_str() || type < 0 || type > INT_MAX) return -1;
  return static_cast<int>(type);
}

constexpr int kArphrdEther = 1;

// Rates beyond this are clamped: they exceed any link and would overflow
// tc's 32-bit burst sizes.
constexpr long long kMaxKBps = 1000000000LL;

std::string Hex(uint32_t v) {
  char buf[16];
  std::snprintf(buf, sizeof buf, "%x", v);
  return buf;
}

// Explicit HTB parameters, so that the kernel never warns about derived
// quantums and fast classes are not held below their ceiling by too small a
// bucket: burst covers 5 ms at the rate (at least ten full frames); the
// quantum is a tenth of a second's bytes at the rate, kept within the range
// the kernel advises (one frame to 200000 bytes).
long long BurstBytes(long long kbps) {
  long long b = kbps * 1000 / 200;
  return std::min(std::max(b, 15140LL), 1LL << 30);
}
long long QuantumBytes(long long kbps) {
  return std::min(std::max(kbps * 1000 / 10, 1514LL), 200000LL);
}

void AddClass(const std::string& dev, const std::string& parent, const std::string& classid,
              long long rate, long long ceil, std::string* b) {
  *b += "class add dev " + dev + " parent " + parent + " classid " + classid + " htb rate " +
        std::to_string(rate) + "kbps ceil " + std::to_string(ceil) + "kbps quantum " +
        std::to_string(QuantumBytes(rate)) + " burst " + std::to_string(BurstBytes(rate)) +
        " cburst " + std::to_string(BurstBytes(ceil)) + "\n";
}

constexpr uint32_t kDefaultMinor = 0x2;
constexpr uint32_t kFirstRuleMinor = 0x10;

}  // namespace

std::vector<PortBlock> SplitPortRange(uint32_t lo, uint32_t hi) {
  std::vector<PortBlock> blocks;
  if (lo > hi || hi > 0xffff) return blocks;
  while (lo <= hi) {
    // The largest block aligned at lo that does not pass hi.
    uint32_t size = lo == 0 ? 0x10000 : (lo & (~lo + 1));
    while (lo + size - 1 > hi) size >>= 1;
    blocks.push_back(
        PortBlock{static_cast<uint16_t>(lo), static_cast<uint16_t>((0x10000 - size) & 0xffff)});
    lo += size;
  }
  return blocks;
}

bool ParseSource(const char* field, size_t fieldSize, Source* out) {
  size_t len = strnlen(field, fieldSize);
  if (len == fieldSize) return false;  // not terminated inside the field
  std::string s(field, len);
  *out = Source();
  if (EqualsNoCase(s, "all")) return true;
  if (ParseMac(s, out->mac)) {
    out->kind = Source::kMac;
    return true;
  }
  std::string addr = s;
  std::string prefix;
  size_t slash = s.find('/');
  if (slash != std::string::npos) {
    addr = s.substr(0, slash);
    prefix = s.substr(slash + 1);
  }
  int family = addr.find(':') != std::string::npos ? AF_INET6 : AF_INET;
  if (inet_pton(family, addr.c_str(), out->addr) != 1) return false;
  const uint32_t maxLen = family == AF_INET ? 32 : 128;
  uint32_t len32 = maxLen;
  if (slash != std::string::npos && !ParseDecimal(prefix, 3, maxLen, &len32)) return false;
  out->kind = family == AF_INET ? Source::kIPv4 : Source::kIPv6;
  out->prefixLen = static_cast<int>(len32);
  ClearHostBits(out->addr, family == AF_INET ? 4 : 16, out->prefixLen);
  return true;
}

bool ParsePortField(const char* text, PortField* out) {
  if (text == nullptr || *text == '\0') return false;
  *out = PortField();
  const size_t len = std::strlen(text);
  const char* rest = nullptr;
  if (StartsNoCase(text, "ALL")) {
    out->type = PortField::kAll;
    if (len == 3) return true;
    rest = text + 4;  // the separator after "ALL" is not examined
  } else if (StartsNoCase(text, "SELF:")) {
    out->type = PortField::kSelf;
    rest = text + 5;
  } else if (StartsNoCase(text, "SYS:")) {
    out->type = PortField::kSys;
    rest = text + 4;
  } else {
    return false;
  }
  const char* colon = std::strchr(rest, ':');
  if (colon == nullptr) {
    out->list = rest;
    out->srcDir = true;
    return true;
  }
  if (colon[1] == '\0') return false;
  out->list.assign(rest, static_cast<size_t>(colon - rest));
  out->srcDir = strcasecmp(colon + 1, "src") == 0;
  return true;
}

const std::vector<ServicePort>* LookupService(const std::string& name) {
  std::string lower;
  for (char c : name) lower += static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  const auto& table = ServiceTable();
  auto it = table.find(lower);
  return it == table.end() ? nullptr : &it->second;
}

bool ValidDeviceName(const std::string& name) {
  if (name.empty() || name.size() > 15 || name == "." || name == ".." || name[0] == '-')
    return false;
  for (char c : name) {
    bool ok = std::isalnum(static_cast<unsigned char>(c)) || c == '_' || c == '.' || c == '-';
    if (!ok) return false;
  }
  return true;
}

int ExpandRule(const TcRule& rule, std::vector<Match>* out, std::string* why) {
  out->clear();
  Source src;
  if (!ParseSource(rule.source, sizeof rule.source, &src)) {
    *why = "source is not \"all\", an IPv4/IPv6 address or prefix, or a MAC address";
    return ORVI_TC_ERR_SOURCE;
  }
  const int protocol = static_cast<int>(rule.protocol);
  if (protocol < ORVI_FW_PROTO_TCP || protocol > ORVI_FW_PROTO_ALL) {
    *why = "unknown protocol";
    return ORVI_TC_ERR_FORMAT;
  }
  if (rule.minrate < 1 || rule.maxrate < 0 || (rule.maxrate != 0 && rule.maxrate < rule.minrate)) {
    *why = "unusable rates";
    return ORVI_TC_ERR_RATE;
  }
  PortField field;
  if (!ParsePortField(rule.ports, &field)) {
    *why = "unreadable ports field";
    return ORVI_TC_ERR_PORTS;
  }
  std::vector<std::pair<uint8_t, PortBlock>> ports;
  int r = PortMatches(field, protocol, &ports, why);
  if (r != 0) return r;

  std::vector<Family> families;
  if (src.kind != Source::kIPv6) families.push_back(Family::kIPv4);
  if (src.kind != Source::kIPv4) families.push_back(Family::kIPv6);
  for (Family family : families) {
    Match m;
    m.family = family;
    m.source = src;
    m.addrIsSrc = rule.ipDirection == 1;
    m.portIsSrc = field.srcDir;
    if (field.type == PortField::kAll) {
      m.l4 = protocol == ORVI_FW_PROTO_TCP ? kTcp : protocol == ORVI_FW_PROTO_UDP ? kUdp : kAnyL4;
      out->push_back(m);
      continue;
    }
    for (const auto& p : ports) {
      m.l4 = p.first;
      m.hasPort = true;
      m.port = p.second;
      out->push_back(m);
    }
  }
  return 0;
}

std::string RestoreDefaultCommands(const std::string& dev) {
  return "qdisc replace dev " + dev + " root handle fff0: pfifo limit 1000\nqdisc del dev " + dev +
         " root\n";
}

std::string GenerateWith(const DeviceRules& dev, const Classifier& classifier,
                         const LeafQdisc& leaf) {
  if (!ValidDeviceName(dev.device) || dev.upperKBps <= 0) return std::string();
  const std::string& d = dev.device;
  std::string b = RestoreDefaultCommands(d);

  struct Planned {
    const TcRule* rule;
    std::vector<Match> matches;
  };
  std::vector<Planned> planned;
  long long sumMin = 0;
  for (const TcRule* rule : dev.rules) {
    if (rule == nullptr || rule->enabled == 0) continue;
    Planned p{rule, {}};
    std::string why;
    if (ExpandRule(*rule, &p.matches, &why) != 0) continue;  // Check refuses these
    sumMin += rule->minrate;
    planned.push_back(std::move(p));
  }
  if (planned.empty()) return b;
  // Room for every line up front: the batch of a large rule set runs to
  // hundreds of kilobytes, and growing it step by step copied it each time.
  size_t lines = 0;
  for (const Planned& p : planned) lines += 2 + p.matches.size();
  b.reserve(b.size() + 256 * (lines + 4));

  const long long upper = std::min(dev.upperKBps, kMaxKBps);
  b += "qdisc add dev " + d + " root handle 1: htb default " + Hex(kDefaultMinor) + "\n";
  AddClass(d, "1:", "1:1", upper, upper, &b);
  // Unmatched traffic is guaranteed what the rules leave of the bound.
  const std::string defaultClass = "1:" + Hex(kDefaultMinor);
  AddClass(d, "1:1", defaultClass, std::max(1LL, upper - sumMin), upper, &b);
  leaf.AddLeaf(d, defaultClass, kDefaultMinor, upper, &b);
  std::vector<std::string> classids;
  for (size_t k = 0; k < planned.size(); ++k) {
    const TcRule& r = *planned[k].rule;
    const uint32_t minor = kFirstRuleMinor + static_cast<uint32_t>(k);
    const std::string classid = "1:" + Hex(minor);
    const long long ceil = r.maxrate > 0 ? std::min<long long>(r.maxrate, upper) : upper;
    AddClass(d, "1:1", classid, std::min<long long>(r.minrate, ceil), ceil, &b);
    leaf.AddLeaf(d, classid, minor, ceil, &b);
    classids.push_back(classid);
  }
  for (size_t k = 0; k < planned.size(); ++k) {
    classifier.AddFilters(d, k, planned[k].matches, classids[k], &b);
  }
  return b;
}

}  // namespace detail

int Check(const DeviceRules& dev) {
  if (!detail::ValidDeviceName(dev.device)) {
    syslog(LOG_ERR, "tcgen: device name is not usable with tc");
    ORVI_ERR(0x0016);
    return -1;
  }
  if (dev.upperKBps <= 0) {
    syslog(LOG_ERR, "tcgen: %s: upper bound %lld KB/s is not positive", dev.device.c_str(),
           dev.upperKBps);
    ORVI_ERR(0x0016);
    return -1;
  }
  const int linkType = detail::LinkType(dev.device);
  const bool ethernet = linkType < 0 || linkType == detail::kArphrdEther;
  size_t filters = 0;
  std::vector<detail::Match> matches;
  for (const TcRule* rule : dev.rules) {
    if (rule == nullptr) {
      ORVI_ERR(0x0016);
      return -1;
    }
    if (rule->enabled == 0) continue;  // stored, but nothing of it reaches tc
    std::string why;
    int code = detail::ExpandRule(*rule, &matches, &why);
    if (code == 0 && !ethernet && !matches.empty() &&
        matches[0].source.kind == detail::Source::kMac) {
      why = "MAC sources need an Ethernet device";
      code = ORVI_TC_ERR_SOURCE;
    }
    if (code != 0) {
      syslog(LOG_ERR, "tcgen: %s: rule %d (source \"%s\"): %s", dev.device.c_str(), rule->id,
             detail::Printable(rule->source, sizeof rule->source).c_str(), why.c_str());
      ORVI_ERR(code);
      return -1;
    }
    filters += matches.size();
  }
  if (filters > detail::kMaxFilters) {
    syslog(LOG_ERR, "tcgen: %s: the rules need %zu filters, at most %zu are allowed",
           dev.device.c_str(), filters, detail::kMaxFilters);
    ORVI_ERR(ORVI_TC_ERR_TOOMANY);
    return -1;
  }
  return 0;
}

std::string Generate(const DeviceRules& dev) {
  return detail::GenerateWith(dev, detail::U32Classifier(), detail::PfifoLeaf());
}

}  // namespace tcgen
