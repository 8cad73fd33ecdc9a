// Appliance root shared by the platform libraries: every absolute path the
// platform is given resolves under ORVI_ROOT (unset or "/" = the real root).
#ifndef ORVI_ROOT_H
#define ORVI_ROOT_H

#include <dirent.h>
#include <unistd.h>

#include <cstddef>
#include <memory>
#include <string>

namespace orvi {

// The root without a trailing slash; "" for the real root. Read on every
// call so that tests can point it elsewhere.
std::string RootDir();
// path resolved under the root; a relative path is returned unchanged.
std::string RootPath(const std::string& path);
// Base name of a source file path, for error stack records.
const char* BaseName(const char* file);

// Reads a regular file of at most limit bytes into *data; errno tells why on
// failure (ENOENT missing, EISDIR/EINVAL not a regular file, EFBIG too big).
// The open does not block, so a FIFO planted where a rule file or a sysfs
// attribute belongs is refused instead of hanging the caller.
bool ReadRegularFile(const std::string& path, size_t limit, std::string* data);

// Owners of a descriptor and of a directory stream.
struct FdCloser {
  int fd = -1;
  explicit FdCloser(int f) : fd(f) {}
  FdCloser(const FdCloser&) = delete;
  FdCloser& operator=(const FdCloser&) = delete;
  ~FdCloser() {
    if (fd >= 0) close(fd);
  }
};
struct DirCloser {
  void operator()(DIR* d) const { closedir(d); }
};
using DirPtr = std::unique_ptr<DIR, DirCloser>;

}  // namespace orvi

// Record an error on the olibc error stack with this source file and line.
#define ORVI_ERR(code) OLIBCErrSetEx((code), orvi::BaseName(__FILE__), __LINE__)

#endif
