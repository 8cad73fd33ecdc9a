// Fuzz entry point for the rule file parser. Beyond "no crash", a file that
// parses must survive a write and a second read unchanged: that catches an
// escape the writer produces but the reader refuses, or bytes lost between
// the two.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "rulefile.h"

namespace {

std::string Write(const rulefile::Parsed& parsed) {
  std::string text = rulefile::Header();
  for (const TcRule* r = parsed.head.get(); r != nullptr; r = r->next) {
    text += rulefile::RuleLine(*r);
  }
  return text + rulefile::EndLine(parsed.count);
}

bool SameText(const char* a, const char* b) {
  if (a == nullptr || b == nullptr) return a == b;
  return std::strcmp(a, b) == 0;
}

bool SameRule(const TcRule& a, const TcRule& b) {
  return a.id == b.id && a.enabled == b.enabled && SameText(a.source, b.source) &&
         SameText(a.ports, b.ports) && rulefile::ProtocolOf(a) == rulefile::ProtocolOf(b) &&
         a.minrate == b.minrate && a.maxrate == b.maxrate && a.ipDirection == b.ipDirection;
}

void Require(bool ok) {
  if (!ok) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  rulefile::Parsed first;
  int line = 0;
  const char* why = nullptr;
  if (!rulefile::Parse(reinterpret_cast<const char*>(data), size, &first, &line, &why)) {
    Require(why != nullptr && line >= 0);
    return 0;
  }
  int n = 0;
  for (const TcRule* r = first.head.get(); r != nullptr; r = r->next) {
    Require(std::memchr(r->source, '\0', sizeof(r->source)) != nullptr);
    ++n;
  }
  Require(n == first.count);

  const std::string text = Write(first);
  rulefile::Parsed second;
  Require(rulefile::Parse(text.data(), text.size(), &second, &line, &why));
  Require(second.count == first.count);
  const TcRule* a = first.head.get();
  const TcRule* b = second.head.get();
  for (; a != nullptr && b != nullptr; a = a->next, b = b->next) Require(SameRule(*a, *b));
  Require(a == nullptr && b == nullptr);
  Require(Write(second) == text);
  return 0;
}
