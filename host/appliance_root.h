// Simulated appliance roots: a directory that the platform libraries treat
// as "/" when ORVI_ROOT points at it.
#ifndef TCAPI_APPLIANCE_ROOT_H
#define TCAPI_APPLIANCE_ROOT_H

#include <string>

namespace tcapi {

// Creates the layout of an appliance root in dir (and dir itself, with its
// parents, when missing). With demo, adds a router with interfaces eth0, eth1,
// wan0 and bridges br0, br1, gbr. A directory that already holds an appliance
// root is completed, its existing files left alone; any other non-empty
// directory is refused. False with a one-line reason in *error on failure.
bool InitRoot(const std::string& dir, bool demo, std::string* error);

// Absolute form of an existing directory for ORVI_ROOT; false with a reason
// when it is missing or not a directory.
bool ResolveRoot(const std::string& dir, std::string* absolute, std::string* error);

}  // namespace tcapi

#endif
