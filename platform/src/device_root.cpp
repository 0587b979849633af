#include <host/device_root.h>

#include <cstdlib>

namespace android {
namespace host {

std::string deviceRoot() {
  const char* env = getenv("SE_DEVICE_ROOT");
  std::string root = env ? env : "";
  while (!root.empty() && root.back() == '/') root.pop_back();
  return root;
}

std::string mapDevicePath(const std::string& path) {
  if (path.empty() || path[0] != '/') return path;
  return deviceRoot() + path;
}

}  // namespace host
}  // namespace android
