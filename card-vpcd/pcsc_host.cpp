#include "pcsc_host.h"

#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <vector>

namespace pcsc_host {

const char* const kPcscdSocket = "/run/pcscd/pcscd.comm";

namespace {

std::string firstOf(const std::vector<std::string>& paths) {
  for (const std::string& p : paths) {
    if (access(p.c_str(), R_OK) == 0) return p;
  }
  return "";
}

// `port` bound on the loopback (0: any); the port taken, or 0.
int bindPort(int port) {
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(static_cast<uint16_t>(port));
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof(a);
  const bool ok = fd >= 0 && bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof(a)) == 0 &&
                  getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len) == 0;
  if (fd >= 0) close(fd);
  return ok ? ntohs(a.sin_port) : 0;
}

}  // namespace

std::string pcscdPath() { return firstOf({"/usr/sbin/pcscd", "/sbin/pcscd", "/usr/local/sbin/pcscd"}); }

std::string vpcdDriver() {
  return firstOf({"/usr/lib/pcsc/drivers/serial/libifdvpcd.so", "/usr/local/lib/pcsc/drivers/serial/libifdvpcd.so"});
}

std::string unavailable() {
  if (pcscdPath().empty()) return "pcscd is not installed (Debian: pcscd; scripts/deps.sh installs it)";
  if (vpcdDriver().empty()) return "the vpcd reader driver is not installed (Debian: vsmartcard-vpcd)";
  return "";
}

bool pcscdRunning() {
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  strncpy(addr.sun_path, kPcscdSocket, sizeof(addr.sun_path) - 1);
  const bool up = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0;
  close(fd);
  return up;
}

int freePortPair() {
  for (int attempt = 0; attempt < 50; ++attempt) {
    const int port = bindPort(0);
    if (port > 0 && port < 65535 && bindPort(port + 1)) return port;
  }
  return 0;
}

std::string readerConf(int port) {
  return "FRIENDLYNAME \"Virtual PCD\"\nDEVICENAME /dev/null:" + std::to_string(port) + "\nLIBPATH " +
         vpcdDriver() + "\nCHANNELID " + std::to_string(port) + "\n";
}

}  // namespace pcsc_host
