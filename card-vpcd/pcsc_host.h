#pragma once
// What a host offers for reaching the virtual card through PC/SC: where
// pcscd and vsmartcard's vpcd driver are installed, whether a pcscd answers,
// and ports for a vpcd reader of one's own. For the tools and tests that
// start their own pcscd when none runs.
#include <string>

namespace pcsc_host {

// The port the vpcd package's reader configuration listens on.
constexpr int kDefaultVpcdPort = 35963;
// pcscd's machine-wide socket.
extern const char* const kPcscdSocket;

// Paths, or "" when not installed.
std::string pcscdPath();
std::string vpcdDriver();
// Why a pcscd with the vpcd reader cannot be started here ("" when it can).
std::string unavailable();

// A pcscd answers on the machine-wide socket.
bool pcscdRunning();
// Two free loopback ports in a row (the first, or 0): vpcd listens on the
// configured port for its first slot and on the next one for its second.
int freePortPair();
// A reader configuration for vpcd on `port`.
std::string readerConf(int port);

}  // namespace pcsc_host
