// Host battery level: the kernel's power-supply class beneath the sysroot.
#include "device/battery.h"

#include <dirent.h>
#include <errno.h>
#include <limits.h>
#include <stdlib.h>

#include <fstream>
#include <sstream>
#include <string>

#include "platform/fixed_path.h"

namespace {

const char kSupplyDir[] = "/sys/class/power_supply";

// A sysfs attribute without its trailing whitespace; false when unreadable.
bool ReadAttribute(const std::string& path, std::string* out) {
  std::ifstream in(path);
  if (!in) return false;
  std::stringstream ss;
  ss << in.rdbuf();
  *out = ss.str();
  while (!out->empty() && (out->back() == '\n' || out->back() == ' ' || out->back() == '\t'))
    out->pop_back();
  return true;
}

bool ParsePercent(const std::string& text, int* out) {
  if (text.empty()) return false;
  errno = 0;
  char* end = nullptr;
  long v = strtol(text.c_str(), &end, 10);
  if (errno != 0 || *end != '\0' || v < 0 || v > 100) return false;
  *out = static_cast<int>(v);
  return true;
}

}  // namespace

extern "C" int device_battery_get_percent(int* percent) {
  if (percent == nullptr) return DEVICE_ERROR_INVALID_PARAMETER;
  char buf[PATH_MAX];
  std::string dir = logmgr_fixed_path(kSupplyDir, buf, sizeof(buf));
  struct dirent** entries = nullptr;
  int n = scandir(dir.c_str(), &entries, nullptr, alphasort);
  if (n < 0) return DEVICE_ERROR_OPERATION_FAILED;
  int result = DEVICE_ERROR_OPERATION_FAILED;
  bool found = false;
  for (int i = 0; i < n; ++i) {
    std::string name = entries[i]->d_name;
    if (!found && name != "." && name != "..") {
      std::string type;
      if (ReadAttribute(dir + "/" + name + "/type", &type) && type == "Battery") {
        // The first battery decides, readable or not: the device has only one.
        found = true;
        std::string capacity;
        int value = 0;
        if (ReadAttribute(dir + "/" + name + "/capacity", &capacity) &&
            ParsePercent(capacity, &value)) {
          *percent = value;
          result = DEVICE_ERROR_NONE;
        }
      }
    }
    free(entries[i]);
  }
  free(entries);
  return result;
}
