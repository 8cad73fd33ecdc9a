#include "rulefile.h"

#include <cstdint>
#include <cstdlib>
#include <cstring>

namespace rulefile {

const char kOutOfMemory[] = "out of memory";

namespace {

constexpr char kMagic[] = "orvi-tc-rules";
constexpr char kVersionLine[] = "orvi-tc-rules 1";
constexpr char kEndWord[] = "end ";
constexpr int kFields = 8;
constexpr size_t kSourceMax = sizeof(TcRule::source) - 1;
constexpr char kHex[] = "0123456789ABCDEF";

static_assert(sizeof(_tag_orvi_firewall_protocol_) == sizeof(int32_t),
              "the protocol is stored as a 32-bit word");

// Bytes written as themselves; everything else becomes %XX. Blanks are
// escaped too, so that no tool that trims or splits on white space can
// change a field.
bool IsRaw(unsigned char c) { return c > 0x20 && c < 0x7f && c != '%' && c != '\\'; }

void Escape(const char* text, size_t n, std::string* out) {
  for (size_t i = 0; i < n; ++i) {
    unsigned char c = static_cast<unsigned char>(text[i]);
    if (IsRaw(c)) {
      out->push_back(static_cast<char>(c));
    } else {
      out->push_back('%');
      out->push_back(kHex[c >> 4]);
      out->push_back(kHex[c & 15]);
    }
  }
}

int HexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return -1;
}

// Only what Escape produces is accepted; a NUL cannot live in a C string.
bool Unescape(const char* b, const char* e, std::string* out) {
  out->clear();
  while (b < e) {
    // Runs of raw bytes go in at once: escapes are rare in real rule files.
    const char* run = b;
    while (run < e && IsRaw(static_cast<unsigned char>(*run))) ++run;
    out->append(b, run);
    b = run;
    if (b == e) break;
    if (*b != '%' || e - b < 3) return false;
    int hi = HexValue(b[1]);
    int lo = HexValue(b[2]);
    if (hi < 0 || lo < 0 || (hi == 0 && lo == 0)) return false;
    out->push_back(static_cast<char>(hi * 16 + lo));
    b += 3;
  }
  return true;
}

// Decimal 32-bit integer: an optional "-" and 1 to 10 digits, nothing else.
bool ParseInt(const char* b, const char* e, int32_t* value) {
  bool negative = b < e && *b == '-';
  if (negative) ++b;
  if (b == e || e - b > 10) return false;
  int64_t v = 0;
  for (; b < e; ++b) {
    if (*b < '0' || *b > '9') return false;
    v = v * 10 + (*b - '0');
  }
  if (negative) v = -v;
  if (v < INT32_MIN || v > INT32_MAX) return false;
  *value = static_cast<int32_t>(v);
  return true;
}

bool LineIs(const char* b, const char* e, const char* text) {
  size_t n = std::strlen(text);
  return static_cast<size_t>(e - b) == n && std::memcmp(b, text, n) == 0;
}

bool LineStartsWith(const char* b, const char* e, const char* text) {
  size_t n = std::strlen(text);
  return static_cast<size_t>(e - b) >= n && std::memcmp(b, text, n) == 0;
}

// One rule line into a fresh record; *why is set on failure.
TcRule* ParseRule(const char* b, const char* e, const char** why) {
  const char* field[kFields + 1];
  const char* fieldEnd[kFields];
  int n = 0;
  field[0] = b;
  for (const char* p = b; p <= e; ++p) {
    if (p == e || *p == '\t') {
      if (n == kFields) {
        *why = "too many fields";
        return nullptr;
      }
      fieldEnd[n++] = p;
      field[n] = p + 1;
    }
  }
  if (n != kFields) {
    *why = "too few fields";
    return nullptr;
  }
  int32_t num[kFields] = {};
  for (int i : {0, 1, 4, 5, 6, 7}) {
    if (!ParseInt(field[i], fieldEnd[i], &num[i])) {
      *why = "a number field is not a 32-bit decimal integer";
      return nullptr;
    }
  }
  std::string source;
  if (!Unescape(field[2], fieldEnd[2], &source)) {
    *why = "bad escape or raw byte in the source";
    return nullptr;
  }
  if (source.size() > kSourceMax) {
    *why = "source longer than 127 bytes";
    return nullptr;
  }
  bool portsNull = LineIs(field[3], fieldEnd[3], "-");
  std::string ports;
  if (!portsNull) {
    if (field[3] == fieldEnd[3] || *field[3] != '=' ||
        !Unescape(field[3] + 1, fieldEnd[3], &ports)) {
      *why = "bad ports field";
      return nullptr;
    }
  }
  TcRule* rule = static_cast<TcRule*>(std::calloc(1, sizeof(TcRule)));
  if (rule == nullptr) {
    *why = kOutOfMemory;
    return nullptr;
  }
  if (!portsNull) {
    rule->ports = static_cast<char*>(std::malloc(ports.size() + 1));
    if (rule->ports == nullptr) {
      std::free(rule);
      *why = kOutOfMemory;
      return nullptr;
    }
    std::memcpy(rule->ports, ports.c_str(), ports.size() + 1);
  }
  rule->id = num[0];
  rule->enabled = num[1];
  std::memcpy(rule->source, source.c_str(), source.size() + 1);
  SetProtocol(rule, num[4]);
  rule->minrate = num[5];
  rule->maxrate = num[6];
  rule->ipDirection = num[7];
  return rule;
}

}  // namespace

void FreeChain(TcRule* head) {
  while (head != nullptr) {
    TcRule* next = head->next;
    std::free(head->ports);
    std::free(head);
    head = next;
  }
}

int ProtocolOf(const TcRule& rule) {
  int32_t value;
  std::memcpy(&value, &rule.protocol, sizeof(value));
  return value;
}

void SetProtocol(TcRule* rule, int value) {
  int32_t v = value;
  std::memcpy(&rule->protocol, &v, sizeof(v));
}

std::string Header() { return std::string(kVersionLine) + "\n"; }

std::string RuleLine(const TcRule& rule) {
  std::string line;
  line.reserve(64 + 3 * kSourceMax);
  line += std::to_string(rule.id) + '\t' + std::to_string(rule.enabled) + '\t';
  // The source is cut to 127 bytes even when the record lacks its NUL.
  Escape(rule.source, strnlen(rule.source, kSourceMax), &line);
  line += '\t';
  if (rule.ports == nullptr) {
    line += '-';
  } else {
    line += '=';
    Escape(rule.ports, std::strlen(rule.ports), &line);
  }
  line += '\t' + std::to_string(ProtocolOf(rule)) + '\t' + std::to_string(rule.minrate) + '\t' +
          std::to_string(rule.maxrate) + '\t' + std::to_string(rule.ipDirection) + '\n';
  return line;
}

std::string EndLine(int count) { return kEndWord + std::to_string(count) + "\n"; }

bool Parse(const char* data, size_t size, Parsed* out, int* badLine, const char** why) {
  *badLine = 0;
  out->head.reset();
  out->count = 0;
  if (size == 0) {
    *why = "empty file";
    return false;
  }
  if (size > kMaxFileBytes) {
    *why = "file too large";
    return false;
  }
  if (data[size - 1] != '\n') {
    *why = "truncated: no final newline";
    return false;
  }
  const char* p = data;
  const char* end = data + size;
  TcRule* tail = nullptr;
  int lineNo = 0;
  bool sawEnd = false;
  while (p < end) {
    const char* eol = static_cast<const char*>(std::memchr(p, '\n', end - p));
    ++lineNo;
    *badLine = lineNo;
    if (sawEnd) {
      *why = "data after the end line";
      return false;
    }
    if (lineNo == 1) {
      if (!LineIs(p, eol, kVersionLine)) {
        *why = LineStartsWith(p, eol, kMagic) ? "unsupported format version" : "not a rule file";
        return false;
      }
    } else if (LineStartsWith(p, eol, kEndWord)) {
      int32_t count;
      if (!ParseInt(p + std::strlen(kEndWord), eol, &count) || count != out->count) {
        *why = "end line does not match the rule count";
        return false;
      }
      sawEnd = true;
    } else {
      TcRule* rule = ParseRule(p, eol, why);
      if (rule == nullptr) return false;
      if (tail == nullptr) {
        out->head.reset(rule);
      } else {
        tail->next = rule;
      }
      tail = rule;
      ++out->count;
    }
    p = eol + 1;
  }
  if (!sawEnd) {
    *badLine = 0;
    *why = "truncated: no end line";
    return false;
  }
  *badLine = 0;
  return true;
}

}  // namespace rulefile
