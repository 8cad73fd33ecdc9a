// Placeholder until the generator lands: accepts everything, applies nothing.
#include "tcgen.h"

namespace tcgen {
int Check(const DeviceRules&) { return 0; }
std::string Generate(const DeviceRules&) { return std::string(); }
int Apply(const std::string&, const std::string&, ApplyMode) { return 0; }
}  // namespace tcgen
