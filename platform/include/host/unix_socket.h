#pragma once
// Unix-domain socket addresses of any length. An address holds at most 107
// bytes of path, and a device root is often a deep temporary or build folder:
// a longer path is reached relative to its folder, through an open descriptor
// of the folder named as /proc/self/fd/N/<name>. Nothing process-wide (such
// as the working folder) changes, so threads may call these at any time.
#include <string>

namespace android {
namespace host {

// Binds the AF_UNIX socket `fd` to `path`. False with the reason, naming the
// path, in *error.
bool bindUnixAt(int fd, const std::string& path, std::string* error);

// Connects the AF_UNIX socket `fd` to `path` (retried on EINTR). False with
// the reason in *error: strerror's text for a socket that is not there or
// refuses, a sentence naming the path when the address cannot be made.
bool connectUnixAt(int fd, const std::string& path, std::string* error);

}  // namespace host
}  // namespace android
