// Network SDK of the appliance platform: interfaces read from sysfs under the
// appliance root.
#include "sdk_network.h"

#include <dirent.h>
#include <errno.h>
#include <sys/stat.h>

#include <algorithm>
#include <cctype>
#include <climits>
#include <cstdlib>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "olibc.h"
#include "orvi_root.h"

namespace {

using orvi::DirPtr;

// sysfs attributes are one short line; anything longer is not one.
const size_t kAttrMax = 4096;

bool IsDir(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// First line of a small sysfs attribute without surrounding blanks; false
// when it cannot be read (missing, or EINVAL as "speed" gives on a link down).
bool ReadAttr(const std::string& path, std::string& out) {
  if (!orvi::ReadRegularFile(path, kAttrMax, &out)) return false;
  size_t begin = 0;
  size_t end = out.find('\n');
  if (end == std::string::npos) end = out.size();
  while (begin < end && isspace(static_cast<unsigned char>(out[begin]))) ++begin;
  while (end > begin && isspace(static_cast<unsigned char>(out[end - 1]))) --end;
  out = out.substr(begin, end - begin);
  return true;
}

// Link speed in Mbit/s; -1 for anything that is not a positive number
// (virtual devices report -1 or nothing at all).
int SpeedMbps(const std::string& dev) {
  std::string text;
  if (!ReadAttr(dev + "/speed", text) || text.empty()) return -1;
  errno = 0;
  char* end = nullptr;
  long value = strtol(text.c_str(), &end, 10);
  if (errno != 0 || *end != '\0' || value <= 0 || value > INT_MAX) return -1;
  return static_cast<int>(value);
}

// "unknown" is what drivers without carrier reporting (lo, tun) show while up.
bool IsUp(const std::string& dev) {
  std::string state;
  return ReadAttr(dev + "/operstate", state) && (state == "up" || state == "unknown");
}

}  // namespace

namespace SDK {
namespace Network {

bool EnumInterfacesStatus(Json::Value& interfaces) {
  interfaces = Json::Value(Json::arrayValue);
  const std::string base = orvi::RootPath("/sys/class/net");
  std::vector<std::string> names;
  {
    DirPtr dir(opendir(base.c_str()));
    if (!dir) {
      ORVI_ERR(OLIBC_ERR_IO);
      return false;
    }
    errno = 0;
    while (struct dirent* entry = readdir(dir.get())) {
      std::string name = entry->d_name;
      // Entries are symlinks to device directories; plain files such as
      // bonding_masters are not interfaces.
      if (name != "." && name != ".." && IsDir(base + "/" + name)) names.push_back(name);
      errno = 0;
    }
    if (errno != 0) {
      ORVI_ERR(OLIBC_ERR_IO);
      return false;
    }
  }
  std::sort(names.begin(), names.end());
  for (const auto& name : names) {
    const std::string dev = base + "/" + name;
    Json::Value item(Json::objectValue);
    item["id"] = name;
    item["bridge"] = IsDir(dev + "/bridge");
    item["speed_mbps"] = SpeedMbps(dev);
    item["up"] = IsUp(dev);
    interfaces.append(std::move(item));
  }
  return true;
}

}  // namespace Network
}  // namespace SDK
