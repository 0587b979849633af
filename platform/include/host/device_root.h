#pragma once
// The device root: every absolute path the daemon opens is resolved under
// $SE_DEVICE_ROOT (default "/"), so a test or demo can lay out its own /dev,
// /sys and properties in a temporary folder.
#include <string>

namespace android {
namespace host {

// The current root, without a trailing slash ("" for "/").
std::string deviceRoot();
// `path` under the root when it is absolute; relative paths are unchanged.
std::string mapDevicePath(const std::string& path);

}  // namespace host
}  // namespace android
