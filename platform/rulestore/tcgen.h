// Rule store internals: from the rules of one device to a tc batch, and the
// application of that batch. The reload (rulestore.cpp) reads the rule files,
// maps adapters to devices and checks the bounds; everything that knows tc
// lives behind this interface.
#ifndef ORVI_TCGEN_H
#define ORVI_TCGEN_H

#include <string>
#include <vector>

#include "orvi_fw_tc.h"

namespace tcgen {

// Everything the generator needs to know about one device.
struct DeviceRules {
  std::string device;                // kernel device name (e.g. "br0", "wan0")
  long long upperKBps = 0;           // the device's upper bound in KB/s (1 KB = 1000 bytes)
  std::vector<const TcRule*> rules;  // the file's rules in file order (disabled ones included)
};

enum class ApplyMode { kPlan, kKernel };

// Checks what the generator would refuse (device name, sources, services,
// filter count). 0, or a negative value with an error on the error stack.
int Check(const DeviceRules& dev);

// The whole batch for tc -batch: replaces the device's tree; an empty rule
// set restores the default qdisc. Call only after Check passed.
std::string Generate(const DeviceRules& dev);

// Plan: writes the batch to <root>/run/tc/<dev>.tc. Kernel: runs it with one
// `tc -batch -` under a per-device lock; on failure re-applies the device's
// last good batch and returns a negative value.
int Apply(const std::string& device, const std::string& batch, ApplyMode mode);

}  // namespace tcgen

#endif
