// Host capi-system-info over the sysroot's files: the device tree or DMI for the model and
// os-release for the build string.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <system_info.h>

#include <string>

#include "platform/fixed_path.h"

namespace {

// Whole file as text; false when it cannot be opened.
bool ReadFile(const char* fixedPath, std::string* out) {
  char buf[4096];
  FILE* f = fopen(logmgr_fixed_path(fixedPath, buf, sizeof(buf)), "re");
  if (f == nullptr) return false;
  out->clear();
  char chunk[512];
  size_t n;
  while ((n = fread(chunk, 1, sizeof(chunk), f)) > 0) out->append(chunk, n);
  fclose(f);
  return true;
}

// Device-tree strings end in NUL, sysfs files in a newline; neither belongs to the value.
std::string TrimEnd(std::string text) {
  while (!text.empty() && (text.back() == '\n' || text.back() == '\r' || text.back() == '\0' ||
                           text.back() == ' ' || text.back() == '\t')) {
    text.pop_back();
  }
  return text;
}

// One os-release value: unquoted, or in single quotes (literal) or double quotes (with
// backslash escapes), as the file format allows.
std::string UnquoteOsRelease(const std::string& raw) {
  std::string v = TrimEnd(raw);
  if (v.size() >= 2 && v.front() == '\'' && v.back() == '\'') return v.substr(1, v.size() - 2);
  if (v.size() >= 2 && v.front() == '"' && v.back() == '"') {
    std::string out;
    for (size_t i = 1; i + 1 < v.size(); ++i) {
      if (v[i] == '\\' && i + 2 < v.size()) ++i;
      out.push_back(v[i]);
    }
    return out;
  }
  return v;
}

bool OsReleaseValue(const char* key, std::string* out) {
  std::string text;
  if (!ReadFile("/etc/os-release", &text)) return false;
  std::string prefix = std::string(key) + "=";
  size_t pos = 0;
  while (pos < text.size()) {
    size_t end = text.find('\n', pos);
    if (end == std::string::npos) end = text.size();
    std::string line = text.substr(pos, end - pos);
    pos = end + 1;
    if (line.compare(0, prefix.size(), prefix) == 0) {
      *out = UnquoteOsRelease(line.substr(prefix.size()));
      return !out->empty();
    }
  }
  return false;
}

bool ModelValue(std::string* out) {
  static const char* const kSources[] = {"/sys/firmware/devicetree/base/model",
                                         "/sys/class/dmi/id/product_name"};
  for (const char* path : kSources) {
    std::string text;
    if (ReadFile(path, &text)) {
      *out = TrimEnd(text);
      if (!out->empty()) return true;
    }
  }
  return false;
}

}  // namespace

extern "C" int system_info_get_value_string(system_info_key_e key, char** value) {
  if (value == nullptr) return SYSTEM_INFO_ERROR_INVALID_PARAMETER;
  std::string text;
  bool found;
  switch (key) {
    case SYSTEM_INFO_KEY_MODEL:
      found = ModelValue(&text);
      break;
    case SYSTEM_INFO_KEY_BUILD_STRING:
      found = OsReleaseValue("BUILD_ID", &text) || OsReleaseValue("VERSION_ID", &text);
      break;
    default:
      return SYSTEM_INFO_ERROR_INVALID_PARAMETER;
  }
  if (!found) return SYSTEM_INFO_ERROR_IO_ERROR;
  *value = strdup(text.c_str());
  return *value == nullptr ? SYSTEM_INFO_ERROR_OUT_OF_MEMORY : SYSTEM_INFO_ERROR_NONE;
}
