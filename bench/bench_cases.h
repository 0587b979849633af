#pragma once
// se-bench's cases: the APDUs timed, the frames and texts of the transport
// floors, and the three ways of running the cases: the daemon over its
// sockets, the vendor library in this process, a modem-sim port written to
// directly.
#include <dlfcn.h>
#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

#include <android/hardware/secure_element/1.0/ISecureElement.h>

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "bench_setup.h"
#include "card_applets.h"
#include "ese_qv_hal.h"
#include "floors.h"

namespace se_bench {

using ::android::sp;
using ::android::hardware::hidl_vec;
using ::android::hardware::Return;
using ::android::hardware::Void;
using ::android::hardware::secure_element::V1_0::ISecureElement;
using ::android::hardware::secure_element::V1_0::ISecureElementHalCallback;
using ::android::hardware::secure_element::V1_0::LogicalChannelResponse;
using ::android::hardware::secure_element::V1_0::SecureElementStatus;
using Bytes = std::vector<uint8_t>;

uint8_t claFor(uint8_t channel);

struct Case {
  const char* name;
  Bytes command;
  Bytes response;
};

// Case 2: INS 01 of the echo applet without data, Le 00; answer 90 00.
// Case 4: 255 bytes echoed back, Le 00; answer the same bytes and 90 00.
std::vector<Case> casesFor(uint8_t channel);

std::string hexOf(const Bytes& b);

// The frames of one call on the wire: the call with `args`, the reply
// with `result` (the RPC host's encoding, so the floor moves the same bytes).
se_bench::Exchange frameExchange(uint32_t code, const Bytes* args, const Bytes* result, uint8_t flag);

se_bench::Exchange textExchange(const std::string& request, const std::string& answer);

// ---------------------------------------------------------------------------
// The daemon over its sockets

sp<ISecureElement> connectInstance(const std::string& name);

uint8_t openEcho(const sp<ISecureElement>& se, const std::string& name);

// ---------------------------------------------------------------------------
// The vendor library in this process

class Library {
 public:
  Library(const std::string& path, const std::string& logPath) {
    // The library logs every exchange; into a file, as the daemon's log goes.
    mSavedErr = dup(STDERR_FILENO);
    int log = ::open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_APPEND, 0644);
    if (log >= 0) {
      dup2(log, STDERR_FILENO);
      close(log);
    }
    mHandle = dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (mHandle == nullptr) fail(std::string("dlopen: ") + dlerror());
    auto* exist = static_cast<int32_t*>(dlsym(mHandle, "g_korva_exist"));
    auto* typeFn = reinterpret_cast<int32_t (*)()>(dlsym(mHandle, "get_korva_exist_flag"));
    auto* openFn = reinterpret_cast<int32_t (*)()>(dlsym(mHandle, "phQvEse_init_open"));
    mTransmit = reinterpret_cast<int32_t (*)(phQvEse_data*, phQvEse_data*)>(
        dlsym(mHandle, "phQVNciHal_Transmit_APDU_by_IPC"));
    if (!exist || !typeFn || !openFn || !mTransmit) fail("symbols missing in " + path);
    *exist = typeFn();
    if (openFn() != 0) fail("phQvEse_init_open failed");
  }
  ~Library() {
    if (mSavedErr >= 0) {
      dup2(mSavedErr, STDERR_FILENO);
      close(mSavedErr);
    }
    // Left loaded: its objects live to the end of the process by design.
  }
  Library(const Library&) = delete;
  Library& operator=(const Library&) = delete;

  Bytes transmit(const Bytes& cmd) {
    phQvEse_data c{static_cast<uint32_t>(cmd.size()), const_cast<uint8_t*>(cmd.data())};
    phQvEse_data r{0, mRsp};
    if (mTransmit(&c, &r) != 0 || r.len > sizeof(mRsp)) return {};
    return Bytes(mRsp, mRsp + r.len);
  }

  // Opens a channel with MANAGE CHANNEL and selects the echo applet there.
  uint8_t openEcho() {
    Bytes r = transmit({0x00, 0x70, 0x00, 0x00, 0x01});
    if (r.size() != 3 || r[1] != 0x90 || r[0] == 0) fail("MANAGE CHANNEL in the library failed");
    uint8_t channel = r[0];
    Bytes select = {claFor(channel), 0xA4, 0x04, 0x00, static_cast<uint8_t>(se_card::aid::kEcho.size())};
    select.insert(select.end(), se_card::aid::kEcho.begin(), se_card::aid::kEcho.end());
    select.push_back(0x00);
    r = transmit(select);
    if (r.size() < 2 || r[r.size() - 2] != 0x90) fail("SELECT of the echo applet in the library failed");
    return channel;
  }

 private:
  void* mHandle = nullptr;
  int mSavedErr = -1;
  int32_t (*mTransmit)(phQvEse_data*, phQvEse_data*) = nullptr;
  uint8_t mRsp[4096];
};

// ---------------------------------------------------------------------------
// A modem-sim port, written to directly

class ModemPort {
 public:
  explicit ModemPort(const std::string& path) {
    mFd = ::open(path.c_str(), O_RDWR | O_NOCTTY | O_CLOEXEC);
    if (mFd < 0) fail("cannot open " + path + ": " + strerror(errno));
  }
  ~ModemPort() {
    if (mFd >= 0) close(mFd);
  }
  ModemPort(const ModemPort&) = delete;
  ModemPort& operator=(const ModemPort&) = delete;

  // Sends one command and CR; the lines before the final one in *lines.
  // False on ERROR, a time-out or a broken port.
  bool command(const std::string& cmd, std::vector<std::string>* lines) {
    std::string out = cmd + "\r";
    const char* p = out.data();
    size_t left = out.size();
    while (left > 0) {
      ssize_t w = write(mFd, p, left);
      if (w < 0 && errno == EINTR) continue;
      if (w <= 0) return false;
      p += w;
      left -= static_cast<size_t>(w);
    }
    lines->clear();
    for (;;) {
      std::string line;
      if (!nextLine(&line)) return false;
      if (line == "OK") return true;
      if (line.rfind("ERROR", 0) == 0 || line.rfind("+CME ERROR", 0) == 0) return false;
      lines->push_back(line);
    }
  }

 private:
  bool nextLine(std::string* line) {
    for (;;) {
      size_t end = mBuf.find_first_of("\r\n");
      if (end != std::string::npos) {
        *line = mBuf.substr(0, end);
        mBuf.erase(0, end + 1);
        if (line->empty()) continue;
        return true;
      }
      pollfd p{mFd, POLLIN, 0};
      int r = poll(&p, 1, 10000);
      if (r < 0 && errno == EINTR) continue;
      if (r <= 0) return false;
      char chunk[4096];
      ssize_t n = read(mFd, chunk, sizeof(chunk));
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return false;
      mBuf.append(chunk, static_cast<size_t>(n));
    }
  }
  int mFd = -1;
  std::string mBuf;
};

}  // namespace se_bench
