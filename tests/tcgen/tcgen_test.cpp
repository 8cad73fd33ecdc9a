// The tc batch generator: whole batches against golden files, the refusals
// of Check with their error codes, port range blocks, and plan-mode writes.
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include <gtest/gtest.h>

#include "golden_cases.h"
#include "olibc.h"
#include "tcgen.h"
#include "tcgen_detail.h"

namespace {

using tctest::kAll;
using tctest::kTcp;
using tctest::kUdp;
using tctest::RuleDef;
using tctest::RuleSet;

std::string ReadText(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

// A temporary appliance root that ORVI_ROOT points at while the object lives.
class TempRoot {
 public:
  TempRoot() {
    std::string tmpl = (std::filesystem::temp_directory_path() / "tcgen-XXXXXX").string();
    if (mkdtemp(&tmpl[0]) != nullptr) dir_ = tmpl;
    setenv("ORVI_ROOT", dir_.c_str(), 1);
  }
  ~TempRoot() {
    unsetenv("ORVI_ROOT");
    std::error_code ec;
    if (!dir_.empty()) std::filesystem::remove_all(dir_, ec);
  }
  std::string Path(const std::string& rel) const { return dir_ + "/" + rel; }
  void Write(const std::string& rel, const std::string& text) const {
    std::filesystem::create_directories(std::filesystem::path(Path(rel)).parent_path());
    std::ofstream(Path(rel)) << text;
  }

 private:
  std::string dir_;
};

class Golden : public ::testing::TestWithParam<tctest::GoldenCase> {};

TEST_P(Golden, BatchMatchesFile) {
  const tctest::GoldenCase& c = GetParam();
  RuleSet set("br0", 125000, c.rules);
  ASSERT_EQ(tcgen::Check(set.dev()), 0) << c.name;
  const std::string expected = ReadText(tctest::GoldenPath(TC_SOURCE_DIR, c.name));
  ASSERT_FALSE(expected.empty()) << "missing golden file for " << c.name;
  EXPECT_EQ(tcgen::Generate(set.dev()), expected) << c.name;
}

INSTANTIATE_TEST_SUITE_P(RuleShapes, Golden, ::testing::ValuesIn(tctest::GoldenCases()),
                         [](const auto& info) { return std::string(info.param.name); });

TEST(Generate, RefusesToEmitForUnusableDevice) {
  RuleSet set("-x", 125000, {{1, "all", "ALL", kTcp, 1, 0, 1}});
  EXPECT_EQ(tcgen::Generate(set.dev()), "");
}

TEST(Generate, HugeBoundsStayWithinTcLimits) {
  // A bogus bandwidth override must not produce numbers tc cannot parse.
  RuleSet set("eth0", 5000000000000LL, {{1, "all", "ALL", kTcp, 1, 0, 1}});
  ASSERT_EQ(tcgen::Check(set.dev()), 0);
  std::istringstream lines(tcgen::Generate(set.dev()));
  std::string line;
  int classes = 0;
  while (std::getline(lines, line)) {
    if (line.rfind("class add", 0) != 0) continue;
    ++classes;
    EXPECT_NE(line.find("ceil 1000000000kbps"), std::string::npos) << line;
    std::istringstream words(line);
    std::string w;
    while (words >> w) {
      if (w == "burst" || w == "cburst") {
        long long v = 0;
        words >> v;
        EXPECT_LE(v, 0xffffffffLL) << line;
      }
    }
  }
  EXPECT_EQ(classes, 3);
}

struct Refusal {
  const char* tag;
  std::string device;
  long long upper;
  RuleDef rule;
  int code;
};

void PrintTo(const Refusal& r, std::ostream* os) { *os << r.tag; }

class CheckRefuses : public ::testing::TestWithParam<Refusal> {};

TEST_P(CheckRefuses, WithItsCode) {
  const Refusal& r = GetParam();
  RuleSet set(r.device, r.upper, {r.rule});
  OLIBCErrSetEx(0, "", 0);
  EXPECT_LT(tcgen::Check(set.dev()), 0) << r.tag;
  EXPECT_EQ(OLIBCErrGet(), r.code) << r.tag;
  EXPECT_STRNE(OLIBCErrorGetFile(), "") << r.tag;
}

const int kSrc = ORVI_TC_ERR_SOURCE;
const int kPorts = ORVI_TC_ERR_PORTS;
const int kInval = 0x0016;

INSTANTIATE_TEST_SUITE_P(
    BadInput, CheckRefuses,
    ::testing::Values(
        Refusal{"ipv4_octet_300", "br0", 125000, {1, "10.0.0.300", "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{"ipv6_bad_digit", "br0", 125000, {1, "::g", "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{"ipv4_prefix_33", "br0", 125000, {1, "10.0.0.0/33", "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{
            "ipv6_prefix_129", "br0", 125000, {1, "2001:db8::/129", "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{"prefix_empty", "br0", 125000, {1, "10.0.0.0/", "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{"prefix_signed", "br0", 125000, {1, "10.0.0.0/+8", "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{"all_with_blank", "br0", 125000, {1, "all ", "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{"newline", "br0", 125000, {1, "10.0.0.1\n", "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{"127_chars", "br0", 125000, {1, std::string(127, 'a'), "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{"empty_source", "br0", 125000, {1, "", "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{
            "mac_five_octets", "br0", 125000, {1, "aa:bb:cc:dd:ee", "ALL", kTcp, 1, 0, 1}, kSrc},
        Refusal{"mac_mixed_separators",
                "br0",
                125000,
                {1, "aa:bb-cc:dd:ee:ff", "ALL", kTcp, 1, 0, 1},
                kSrc},
        Refusal{
            "unknown_service", "br0", 125000, {1, "all", "SYS:nosuch:src", kTcp, 1, 0, 1}, kPorts},
        Refusal{"service_without_udp", "br0", 125000, {1, "all", "SYS:ssh", kUdp, 1, 0, 1}, kPorts},
        Refusal{"service_list_empty_item",
                "br0",
                125000,
                {1, "all", "SYS:ssh,,http", kTcp, 1, 0, 1},
                kPorts},
        Refusal{"list_empty_item",
                "br0",
                125000,
                {1, "all", "SELF:80,,443:dest", kTcp, 1, 0, 1},
                kPorts},
        Refusal{"port_65536", "br0", 125000, {1, "all", "SELF:65536:dest", kTcp, 1, 0, 1}, kPorts},
        Refusal{"port_letters", "br0", 125000, {1, "all", "SELF:80a:dest", kTcp, 1, 0, 1}, kPorts},
        Refusal{"range_reversed",
                "br0",
                125000,
                {1, "all", "SELF:2000-1000:dest", kTcp, 1, 0, 1},
                kPorts},
        Refusal{"range_with_port",
                "br0",
                125000,
                {1, "all", "SELF:80,1000-2000", kTcp, 1, 0, 1},
                kPorts},
        Refusal{"range_open_end", "br0", 125000, {1, "all", "SELF:1000-", kTcp, 1, 0, 1}, kPorts},
        Refusal{"self_empty", "br0", 125000, {1, "all", "SELF::dest", kTcp, 1, 0, 1}, kPorts},
        Refusal{"direction_missing", "br0", 125000, {1, "all", "SELF:80:", kTcp, 1, 0, 1}, kPorts},
        Refusal{"type_unknown", "br0", 125000, {1, "all", "TCP:80:src", kTcp, 1, 0, 1}, kPorts},
        Refusal{"ports_null", "br0", 125000, {1, "all", nullptr, kTcp, 1, 0, 1}, kPorts},
        Refusal{"protocol_4", "br0", 125000, {1, "all", "ALL", 4, 1, 0, 1}, ORVI_TC_ERR_FORMAT},
        Refusal{"minrate_0", "br0", 125000, {1, "all", "ALL", kTcp, 0, 0, 1}, ORVI_TC_ERR_RATE},
        Refusal{
            "max_below_min", "br0", 125000, {1, "all", "ALL", kTcp, 500, 400, 1}, ORVI_TC_ERR_RATE},
        Refusal{"device_option", "-help", 125000, {1, "all", "ALL", kTcp, 1, 0, 1}, kInval},
        Refusal{"device_empty", "", 125000, {1, "all", "ALL", kTcp, 1, 0, 1}, kInval},
        Refusal{"device_16_chars",
                "abcdefghijklmnop",
                125000,
                {1, "all", "ALL", kTcp, 1, 0, 1},
                kInval},
        Refusal{"device_blank", "br 0", 125000, {1, "all", "ALL", kTcp, 1, 0, 1}, kInval},
        Refusal{"device_slash", "eth0/1", 125000, {1, "all", "ALL", kTcp, 1, 0, 1}, kInval},
        Refusal{"device_dotdot", "..", 125000, {1, "all", "ALL", kTcp, 1, 0, 1}, kInval},
        Refusal{"device_comment", "eth#0", 125000, {1, "all", "ALL", kTcp, 1, 0, 1}, kInval},
        Refusal{"bound_zero", "br0", 0, {1, "all", "ALL", kTcp, 1, 0, 1}, kInval}),
    [](const auto& info) { return std::string(info.param.tag); });

TEST(Check, SourceFieldWithoutTerminatorIsRefused) {
  RuleSet set("br0", 125000, {{1, "all", "ALL", kTcp, 1, 0, 1}});
  std::memset(set.Last().source, '1', sizeof set.Last().source);
  EXPECT_LT(tcgen::Check(set.dev()), 0);
  EXPECT_EQ(OLIBCErrGet(), ORVI_TC_ERR_SOURCE);
}

TEST(Check, DisabledRulesAreNotExamined) {
  // They generate nothing, so they cannot spoil a batch.
  RuleSet set("br0", 125000, {{0, "10.0.0.300", "SYS:nosuch", kTcp, 0, 0, 1}});
  EXPECT_EQ(tcgen::Check(set.dev()), 0);
}

TEST(Check, FilterCapCountsEveryFamilyAndProtocol) {
  // "all" source and protocol: each port costs four filters (tcp/udp x v4/v6).
  auto list = [](int n) {
    std::string s = "SELF:";
    for (int i = 0; i < n; ++i) s += (i ? "," : "") + std::to_string(1000 + i);
    return s + ":dest";
  };
  const std::string atCap = list(250), overCap = list(251);
  RuleSet ok("br0", 125000, {{1, "all", atCap.c_str(), kAll, 1, 0, 1}});
  EXPECT_EQ(tcgen::Check(ok.dev()), 0);
  RuleSet over("br0", 125000, {{1, "all", overCap.c_str(), kAll, 1, 0, 1}});
  EXPECT_LT(tcgen::Check(over.dev()), 0);
  EXPECT_EQ(OLIBCErrGet(), ORVI_TC_ERR_TOOMANY);
  // The cap is per device, summed over rules.
  RuleSet summed(
      "br0", 125000,
      {{1, "all", atCap.c_str(), kAll, 1, 0, 1}, {1, "10.0.0.1", "SELF:1:dest", kTcp, 1, 0, 1}});
  EXPECT_LT(tcgen::Check(summed.dev()), 0);
  EXPECT_EQ(OLIBCErrGet(), ORVI_TC_ERR_TOOMANY);
}

TEST(Check, MacSourcesNeedAnEthernetDevice) {
  TempRoot root;
  root.Write("sys/class/net/ppp0/type", "512\n");
  root.Write("sys/class/net/eth0/type", "1\n");
  RuleSet ppp("ppp0", 125000, {{1, "aa:bb:cc:dd:ee:ff", "ALL", kTcp, 1, 0, 1}});
  EXPECT_LT(tcgen::Check(ppp.dev()), 0);
  EXPECT_EQ(OLIBCErrGet(), ORVI_TC_ERR_SOURCE);
  RuleSet eth("eth0", 125000, {{1, "aa:bb:cc:dd:ee:ff", "ALL", kTcp, 1, 0, 1}});
  EXPECT_EQ(tcgen::Check(eth.dev()), 0);
  RuleSet pppIp("ppp0", 125000, {{1, "10.0.0.1", "ALL", kTcp, 1, 0, 1}});
  EXPECT_EQ(tcgen::Check(pppIp.dev()), 0);
}

// Every port of 0..limit is inside exactly the blocks it should be: one when
// lo <= p <= hi, none otherwise; blocks are aligned.
void ExpectExactCover(uint32_t lo, uint32_t hi, uint32_t from, uint32_t to) {
  const auto blocks = tcgen::detail::SplitPortRange(lo, hi);
  for (const auto& b : blocks) {
    ASSERT_EQ(b.value & static_cast<uint16_t>(~b.mask), 0) << lo << "-" << hi;
  }
  for (uint32_t p = from; p <= to; ++p) {
    int hits = 0;
    for (const auto& b : blocks) hits += (p & b.mask) == b.value;
    ASSERT_EQ(hits, (p >= lo && p <= hi) ? 1 : 0) << "port " << p << " in " << lo << "-" << hi;
  }
}

TEST(SplitPortRange, CoversSmallRangesExactly) {
  for (uint32_t lo = 0; lo <= 70; ++lo) {
    for (uint32_t hi = lo; hi <= 70; ++hi) ExpectExactCover(lo, hi, 0, 140);
  }
}

TEST(SplitPortRange, CoversRangesAtTheTopExactly) {
  for (uint32_t lo = 65470; lo <= 65535; ++lo) {
    for (uint32_t hi = lo; hi <= 65535; ++hi) ExpectExactCover(lo, hi, 65400, 65535);
  }
}

TEST(SplitPortRange, UsesFewestBlocks) {
  struct {
    uint32_t lo, hi;
    size_t blocks;
  } cases[] = {{0, 65535, 1}, {1, 65534, 30}, {1024, 2047, 1}, {1000, 2000, 8}, {80, 80, 1}};
  for (const auto& c : cases) {
    EXPECT_EQ(tcgen::detail::SplitPortRange(c.lo, c.hi).size(), c.blocks) << c.lo << "-" << c.hi;
  }
  EXPECT_TRUE(tcgen::detail::SplitPortRange(5, 4).empty());
  EXPECT_TRUE(tcgen::detail::SplitPortRange(0, 65536).empty());
}

struct FieldCase {
  const char* text;
  bool ok;
  tcgen::detail::PortField::Type type;
  const char* list;
  bool src;
};

TEST(ParsePortField, StoredForms) {
  using T = tcgen::detail::PortField;
  const FieldCase cases[] = {
      {"ALL::src", true, T::kAll, "", true},
      {"ALL", true, T::kAll, "", true},
      {"all:80:DEST", true, T::kAll, "80", false},
      {"SELF:777:src", true, T::kSelf, "777", true},
      {"self:1000-2000:DEST", true, T::kSelf, "1000-2000", false},
      {"SELF:777", true, T::kSelf, "777", true},
      {"SELF:777:xyz", true, T::kSelf, "777", false},
      {"SELF:777:src:x", true, T::kSelf, "777", false},
      {"SYS:cifs,afp:src", true, T::kSys, "cifs,afp", true},
      {"SELF:777:", false, T::kAll, "", true},
      {"SELF", false, T::kAll, "", true},
      {"SYS", false, T::kAll, "", true},
      {"TCP:80:src", false, T::kAll, "", true},
      {"", false, T::kAll, "", true},
  };
  for (const FieldCase& c : cases) {
    T field;
    ASSERT_EQ(tcgen::detail::ParsePortField(c.text, &field), c.ok) << c.text;
    if (!c.ok) continue;
    EXPECT_EQ(field.type, c.type) << c.text;
    EXPECT_EQ(field.list, c.list) << c.text;
    EXPECT_EQ(field.srcDir, c.src) << c.text;
  }
  tcgen::detail::PortField field;
  EXPECT_FALSE(tcgen::detail::ParsePortField(nullptr, &field));
}

TEST(ParseSource, AcceptedForms) {
  using S = tcgen::detail::Source;
  struct {
    const char* text;
    S::Kind kind;
    int prefix;
  } cases[] = {{"all", S::kAll, 0},
               {"ALL", S::kAll, 0},
               {"10.1.2.3", S::kIPv4, 32},
               {"10.1.2.3/8", S::kIPv4, 8},
               {"0.0.0.0/0", S::kIPv4, 0},
               {"2001:db8::1", S::kIPv6, 128},
               {"::ffff:1.2.3.4", S::kIPv6, 128},
               {"aa:BB:cc:dd:ee:ff", S::kMac, 0}};
  for (const auto& c : cases) {
    char field[128] = {};
    std::strncpy(field, c.text, sizeof field - 1);
    S s;
    ASSERT_TRUE(tcgen::detail::ParseSource(field, sizeof field, &s)) << c.text;
    EXPECT_EQ(s.kind, c.kind) << c.text;
    EXPECT_EQ(s.prefixLen, c.prefix) << c.text;
  }
  char field[128] = "10.1.2.3/12";
  S s;
  ASSERT_TRUE(tcgen::detail::ParseSource(field, sizeof field, &s));
  EXPECT_EQ(s.addr[1], 0);  // 10.1.2.3/12: the host bits of the second byte are cleared
  EXPECT_EQ(s.addr[2], 0);
}

TEST(ApplyPlan, WritesTheBatchAndNothingElse) {
  TempRoot root;
  ASSERT_EQ(tcgen::Apply("br0", "first\n", tcgen::ApplyMode::kPlan), 0);
  ASSERT_EQ(tcgen::Apply("br0", "second\n", tcgen::ApplyMode::kPlan), 0);
  EXPECT_EQ(ReadText(root.Path("run/tc/br0.tc")), "second\n");
  std::vector<std::string> names;
  for (const auto& e : std::filesystem::directory_iterator(root.Path("run/tc"))) {
    names.push_back(e.path().filename().string());
  }
  EXPECT_EQ(names, std::vector<std::string>{"br0.tc"});  // no temporary or lock files left
}

TEST(ApplyPlan, RefusesBadDeviceNamesAndEmptyBatchesBeforeTouchingFiles) {
  TempRoot root;
  for (const char* dev : {"../x", "", "-f", "a b"}) {
    OLIBCErrSetEx(0, "", 0);
    EXPECT_LT(tcgen::Apply(dev, "x\n", tcgen::ApplyMode::kPlan), 0) << dev;
    EXPECT_EQ(OLIBCErrGet(), kInval) << dev;
  }
  EXPECT_FALSE(std::filesystem::exists(root.Path("run")));
  EXPECT_LT(tcgen::Apply("br0", "", tcgen::ApplyMode::kPlan), 0);
  EXPECT_FALSE(std::filesystem::exists(root.Path("run")));
}

TEST(ApplyPlan, ReportsAnUnwritableRoot) {
  TempRoot root;
  root.Write("run", "a file where the directory should be");
  OLIBCErrSetEx(0, "", 0);
  EXPECT_LT(tcgen::Apply("br0", "x\n", tcgen::ApplyMode::kPlan), 0);
  EXPECT_EQ(OLIBCErrGet(), OLIBC_ERR_IO);
}

}  // namespace
