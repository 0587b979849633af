// Property stand-in: `name=value` lines in $SE_DEVICE_ROOT/properties, read
// afresh on every call; the last line for a name wins.
#include <cutils/properties.h>
#include <host/device_root.h>

#include <cstring>
#include <fstream>
#include <string>

namespace {
std::string trim(const std::string& s) {
  size_t b = s.find_first_not_of(" \t\r");
  if (b == std::string::npos) return "";
  size_t e = s.find_last_not_of(" \t\r");
  return s.substr(b, e - b + 1);
}
}  // namespace

extern "C" int property_get(const char* key, char* value, const char* default_value) {
  if (value == nullptr) return -1;
  std::string result;
  bool found = false;
  if (key != nullptr) {
    std::ifstream in(android::host::mapDevicePath("/properties"));
    std::string line;
    while (std::getline(in, line)) {
      std::string t = trim(line);
      if (t.empty() || t[0] == '#') continue;
      size_t eq = t.find('=');
      if (eq == std::string::npos) continue;
      if (trim(t.substr(0, eq)) != key) continue;
      result = t.substr(eq + 1);
      // Values keep inner and trailing text as written, minus a CR.
      if (!result.empty() && result.back() == '\r') result.pop_back();
      found = true;
    }
  }
  // As on the device, an empty value counts as unset, so appending "name="
  // returns a property to its default.
  if (!found || result.empty()) result = default_value ? default_value : "";
  if (result.size() > PROPERTY_VALUE_MAX - 1) result.resize(PROPERTY_VALUE_MAX - 1);
  memcpy(value, result.c_str(), result.size() + 1);
  return static_cast<int>(result.size());
}
