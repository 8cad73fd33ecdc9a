#include "appliance_root.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <memory>

namespace tcapi {

namespace {

const char kKeyFile[] = "etc/orviinfo.conf";
const char* const kDirs[] = {"etc", "etc/tc", "sys", "sys/class", "sys/class/net", "run", "run/tc"};
const char kDemoKeys[] =
    "support_net_topology=yes\n"
    "net_topology=router\n"
    "wan_interface=wan0\n";

struct DemoInterface {
  const char* name;
  bool bridge;
  bool hasSpeed;
};
const DemoInterface kDemoInterfaces[] = {
    {"eth0", false, true}, {"eth1", false, true}, {"wan0", false, true},
    {"br0", true, false},  {"br1", true, false},  {"gbr", true, false},
};

struct DirCloser {
  void operator()(DIR* d) const { closedir(d); }
};

std::string Reason(const std::string& what, const std::string& path) {
  return what + " " + path + ": " + strerror(errno);
}

bool MakeDir(const std::string& path, std::string* error) {
  if (mkdir(path.c_str(), 0755) == 0) return true;
  struct stat st;
  if (errno == EEXIST && stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) return true;
  if (errno == EEXIST) errno = ENOTDIR;
  *error = Reason("cannot create directory", path);
  return false;
}

// mkdir -p
bool MakeDirs(const std::string& path, std::string* error) {
  for (size_t pos = path.find('/', 1); pos != std::string::npos; pos = path.find('/', pos + 1)) {
    if (!MakeDir(path.substr(0, pos), error)) return false;
  }
  return MakeDir(path, error);
}

// Creates the file with `text` unless it exists already, which is left alone.
bool MakeFile(const std::string& path, const std::string& text, std::string* error) {
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
  if (fd < 0) {
    if (errno == EEXIST) return true;
    *error = Reason("cannot create", path);
    return false;
  }
  size_t done = 0;
  while (done < text.size()) {
    ssize_t n = write(fd, text.data() + done, text.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      *error = Reason("cannot write", path);
      close(fd);
      return false;
    }
    done += static_cast<size_t>(n);
  }
  if (close(fd) != 0) {
    *error = Reason("cannot write", path);
    return false;
  }
  return true;
}

// 1 when dir has entries, 0 when empty, -1 when it cannot be read.
int HasEntries(const std::string& dir) {
  std::unique_ptr<DIR, DirCloser> d(opendir(dir.c_str()));
  if (!d) return -1;
  while (struct dirent* entry = readdir(d.get())) {
    if (strcmp(entry->d_name, ".") != 0 && strcmp(entry->d_name, "..") != 0) return 1;
  }
  return 0;
}

}  // namespace

bool InitRoot(const std::string& dirArg, bool demo, std::string* error) {
  if (dirArg.empty()) {
    *error = "no directory given";
    return false;
  }
  std::string dir = dirArg;
  while (dir.size() > 1 && dir.back() == '/') dir.pop_back();
  struct stat st;
  if (stat(dir.c_str(), &st) == 0) {
    if (!S_ISDIR(st.st_mode)) {
      *error = dir + " exists and is not a directory";
      return false;
    }
    int entries = HasEntries(dir);
    if (entries < 0) {
      *error = Reason("cannot read directory", dir);
      return false;
    }
    if (entries > 0 && access((dir + "/" + kKeyFile).c_str(), F_OK) != 0) {
      *error = dir + " is not empty and is not an appliance root (no " + kKeyFile + ")";
      return false;
    }
  } else if (!MakeDirs(dir, error)) {
    return false;
  }

  for (const char* sub : kDirs) {
    if (!MakeDir(dir + "/" + sub, error)) return false;
  }
  if (!MakeFile(dir + "/" + kKeyFile, demo ? kDemoKeys : "", error)) return false;
  if (!demo) return true;

  const std::string net = dir + "/sys/class/net/";
  for (const DemoInterface& itf : kDemoInterfaces) {
    const std::string dev = net + itf.name;
    if (!MakeDir(dev, error)) return false;
    if (!MakeFile(dev + "/operstate", "up\n", error)) return false;
    if (itf.hasSpeed && !MakeFile(dev + "/speed", "1000\n", error)) return false;
    if (itf.bridge && !MakeDir(dev + "/bridge", error)) return false;
  }
  return true;
}

bool ResolveRoot(const std::string& dir, std::string* absolute, std::string* error) {
  std::unique_ptr<char, decltype(&free)> real(realpath(dir.c_str(), nullptr), &free);
  struct stat st;
  if (!real || stat(real.get(), &st) != 0) {
    *error = Reason("cannot use appliance root", dir);
    return false;
  }
  if (!S_ISDIR(st.st_mode)) {
    *error = "appliance root " + dir + " is not a directory";
    return false;
  }
  *absolute = real.get();
  return true;
}

}  // namespace tcapi
