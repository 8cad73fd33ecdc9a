// Rule file codec of the rule store: the text form of one adapter's rules.
// Pure functions without I/O or error stack, so that the fuzzer can drive the
// parser on its own. The format is described at the top of rulestore.cpp.
#ifndef ORVI_RULEFILE_H
#define ORVI_RULEFILE_H

#include <cstddef>
#include <memory>
#include <string>

#include "orvi_fw_tc.h"

namespace rulefile {

// Files above this size are refused unread: a rule file is a few KB.
constexpr size_t kMaxFileBytes = 16u << 20;

// Frees a record chain allocated by the parser or ORVIFwTcBufRuleInit.
void FreeChain(TcRule* head);

struct ChainDeleter {
  void operator()(TcRule* head) const { FreeChain(head); }
};
using Chain = std::unique_ptr<TcRule, ChainDeleter>;

// The protocol is read and written as a plain int: a stored record may hold
// any number there, and loading an enum outside its range is undefined.
int ProtocolOf(const TcRule& rule);
void SetProtocol(TcRule* rule, int value);

std::string Header();
std::string RuleLine(const TcRule& rule);
std::string EndLine(int count);

struct Parsed {
  Chain head;
  int count = 0;
};

// The reason Parse gives when an allocation failed (compare the pointer).
extern const char kOutOfMemory[];

// Parses a whole file. On failure returns false with the 1-based line number
// (0 for the file as a whole) and a constant reason.
bool Parse(const char* data, size_t size, Parsed* out, int* badLine, const char** why);

}  // namespace rulefile

#endif
