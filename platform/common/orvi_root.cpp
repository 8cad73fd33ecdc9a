#include "orvi_root.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace orvi {

std::string RootDir() {
  const char* env = std::getenv("ORVI_ROOT");
  if (env == nullptr || *env == '\0') return "";
  std::string root(env);
  while (!root.empty() && root.back() == '/') root.pop_back();
  return root;  // "/" becomes "": the real root
}

std::string RootPath(const std::string& path) {
  if (path.empty() || path[0] != '/') return path;
  return RootDir() + path;
}

const char* BaseName(const char* file) {
  if (file == nullptr) return "";
  const char* slash = std::strrchr(file, '/');
  return slash ? slash + 1 : file;
}

bool ReadRegularFile(const std::string& path, size_t limit, std::string* data) {
  FdCloser fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (fd.fd < 0) return false;
  struct stat st;
  if (fstat(fd.fd, &st) != 0) return false;
  if (!S_ISREG(st.st_mode)) {
    errno = S_ISDIR(st.st_mode) ? EISDIR : EINVAL;
    return false;
  }
  data->clear();
  char buf[8192];
  for (;;) {
    ssize_t n = read(fd.fd, buf, sizeof(buf));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    if (n == 0) return true;
    data->append(buf, static_cast<size_t>(n));
    if (data->size() > limit) {
      errno = EFBIG;
      return false;
    }
  }
}

}  // namespace orvi
