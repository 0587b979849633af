// Serves the fake secure element under a name, for trying secli by hand:
//   se_test_server --root DIR [--name SIM1] [--threads 2] [--defer]
// Prints "ready PATH" once listening and "serviceDied cookie=N" whenever a
// client that passed a callback goes away.
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include <hidl/HidlTransportSupport.h>
#include <host/rpc_host.h>

#include "fake_secure_element.h"

namespace {
class PrintingWatcher : public fake::DeathWatcher {
 public:
  void serviceDied(uint64_t cookie, const android::wp<fake::IBase>& who) override {
    printf("serviceDied cookie=%llu\n", static_cast<unsigned long long>(cookie));
    fflush(stdout);
    fake::DeathWatcher::serviceDied(cookie, who);
  }
};
}  // namespace

int main(int argc, char** argv) {
  std::string name = "SIM1";
  size_t threads = 2;
  android::sp<fake::FakeSecureElement> se = new fake::FakeSecureElement();
  for (int i = 1; i < argc; ++i) {
    std::string a = argv[i];
    if (a == "--root" && i + 1 < argc) {
      setenv("SE_DEVICE_ROOT", argv[++i], 1);
    } else if (a == "--name" && i + 1 < argc) {
      name = argv[++i];
    } else if (a == "--threads" && i + 1 < argc) {
      threads = strtoul(argv[++i], nullptr, 10);
    } else if (a == "--defer") {
      se->deferStateChange = true;
    } else {
      fprintf(stderr, "usage: se_test_server --root DIR [--name NAME] [--threads N] [--defer]\n");
      return 2;
    }
  }
  se->watcher = new PrintingWatcher();
  android::hardware::configureRpcThreadpool(threads, true);
  if (se->registerAsService(name) != android::OK) return 1;
  printf("ready %s\n", android::host::serviceSocketPath(name).c_str());
  fflush(stdout);
  android::hardware::joinRpcThreadpool();
  return 1;
}
