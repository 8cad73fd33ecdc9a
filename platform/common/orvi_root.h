// Appliance root shared by the platform libraries: every absolute path the
// platform is given resolves under ORVI_ROOT (unset or "/" = the real root).
#ifndef ORVI_ROOT_H
#define ORVI_ROOT_H

#include <string>

namespace orvi {

// The root without a trailing slash; "" for the real root. Read on every
// call so that tests can point it elsewhere.
std::string RootDir();
// path resolved under the root; a relative path is returned unchanged.
std::string RootPath(const std::string& path);
// Base name of a source file path, for error stack records.
const char* BaseName(const char* file);

}  // namespace orvi

// Record an error on the olibc error stack with this source file and line.
#define ORVI_ERR(code) OLIBCErrSetEx((code), orvi::BaseName(__FILE__), __LINE__)

#endif
