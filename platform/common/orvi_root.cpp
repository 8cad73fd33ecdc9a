#include "orvi_root.h"

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

}  // namespace orvi
