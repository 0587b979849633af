// The NDK binder calls on the RPC host: status objects, AIBinder reference
// counting and weak references, death recipients, the service manager and
// the thread pool. AIDL instances listen in their own socket folder but are
// served by the same I/O loop and pool as the HIDL ones.
#include "aidl_binder.h"

#include <android/binder_manager.h>
#include <android/binder_process.h>
#include <android/log.h>
#include <hidl/HidlTransportSupport.h>
#include <host/aidl_host.h>
#include <host/device_root.h>
#include <host/rpc_hooks.h>

#include <dirent.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <mutex>

struct AStatus {
  binder_exception_t exception = EX_NONE;
  int32_t serviceSpecific = 0;
  binder_status_t status = STATUS_OK;
  std::string message;
};

struct AIBinder_Weak {
  ::android::wp<::android::hidl::base::V1_0::IBase> binder;
};

namespace {

using ::android::sp;
using ::android::wp;
using ::android::hidl::base::V1_0::IBase;
using ::android::host::rpc::ProxyBase;
using ::android::host::rpc::RemotePeer;

AStatus* newStatus(binder_exception_t e, int32_t specific, binder_status_t st, const char* msg) {
  auto s = std::make_unique<AStatus>();
  s->exception = e;
  s->serviceSpecific = e == EX_SERVICE_SPECIFIC ? specific : 0;
  s->status = e == EX_TRANSACTION_FAILED ? st : STATUS_OK;
  if (msg != nullptr) s->message = msg;
  return s.release();
}

}  // namespace

extern "C" {

AStatus* AStatus_newOk() { return newStatus(EX_NONE, 0, STATUS_OK, nullptr); }
AStatus* AStatus_fromExceptionCode(binder_exception_t e) {
  return newStatus(e, 0, STATUS_FAILED_TRANSACTION, nullptr);
}
AStatus* AStatus_fromExceptionCodeWithMessage(binder_exception_t e, const char* message) {
  return newStatus(e, 0, STATUS_FAILED_TRANSACTION, message);
}
AStatus* AStatus_fromServiceSpecificError(int32_t code) {
  return newStatus(EX_SERVICE_SPECIFIC, code, STATUS_OK, nullptr);
}
AStatus* AStatus_fromServiceSpecificErrorWithMessage(int32_t code, const char* message) {
  return newStatus(EX_SERVICE_SPECIFIC, code, STATUS_OK, message);
}
AStatus* AStatus_fromStatus(binder_status_t status) {
  return status == STATUS_OK ? AStatus_newOk()
                             : newStatus(EX_TRANSACTION_FAILED, 0, status, nullptr);
}
bool AStatus_isOk(const AStatus* s) { return s->exception == EX_NONE; }
binder_exception_t AStatus_getExceptionCode(const AStatus* s) { return s->exception; }
int32_t AStatus_getServiceSpecificError(const AStatus* s) { return s->serviceSpecific; }
binder_status_t AStatus_getStatus(const AStatus* s) { return s->status; }
const char* AStatus_getMessage(const AStatus* s) { return s->message.c_str(); }
const char* AStatus_getDescription(const AStatus* s) {
  std::string d;
  if (s->exception == EX_NONE) {
    d = "No error";
  } else if (s->exception == EX_SERVICE_SPECIFIC) {
    d = "Status(-8, EX_SERVICE_SPECIFIC): '" + std::to_string(s->serviceSpecific) + ": " +
        s->message + "'";
  } else if (s->exception == EX_TRANSACTION_FAILED) {
    d = "STATUS(" + std::to_string(s->status) + "): '" + s->message + "'";
  } else {
    d = "Status(" + std::to_string(s->exception) + "): '" + s->message + "'";
  }
  return strdup(d.c_str());
}
void AStatus_deleteDescription(const char* d) { free(const_cast<char*>(d)); }
void AStatus_delete(AStatus* s) { delete s; }

void AIBinder_incStrong(AIBinder* b) {
  if (b != nullptr) b->incStrong(nullptr);
}
void AIBinder_decStrong(AIBinder* b) {
  if (b != nullptr) b->decStrong(nullptr);
}
bool AIBinder_isRemote(const AIBinder* b) { return b != nullptr && b->isRemote(); }

AIBinder_Weak* AIBinder_Weak_new(AIBinder* b) {
  auto w = std::make_unique<AIBinder_Weak>();
  w->binder = wp<IBase>(static_cast<IBase*>(b));
  return w.release();
}
void AIBinder_Weak_delete(AIBinder_Weak* w) { delete w; }
AIBinder* AIBinder_Weak_promote(AIBinder_Weak* w) {
  if (w == nullptr) return nullptr;
  sp<IBase> strong = w->binder.promote();
  auto* b = dynamic_cast<AIBinder*>(strong.get());
  AIBinder_incStrong(b);
  return b;
}

}  // extern "C"

// A recipient's links and notices live in its shared state, so that
// deleting the recipient stops its notices even while a host thread is
// about to run one. A link is keyed by the proxy's serial, not its address:
// a freed proxy's address may come back as another proxy's.
struct AIBinder_DeathRecipient {
  struct Link {
    uint64_t binder;  // the proxy's serial
    void* cookie;
    sp<::android::hardware::hidl_death_recipient> notice;
    std::weak_ptr<RemotePeer> peer;
  };
  struct State {
    std::mutex lock;  // held while a notice runs
    AIBinder_DeathRecipient_onBinderDied onDied = nullptr;
    std::mutex linksLock;  // never held while taking `lock`
    std::vector<Link> links;
  };
  std::shared_ptr<State> state = std::make_shared<State>();
};

namespace {

class DeathNotice : public ::android::hardware::hidl_death_recipient {
 public:
  explicit DeathNotice(std::shared_ptr<AIBinder_DeathRecipient::State> state, void* cookie)
      : mState(std::move(state)), mCookie(cookie) {}
  void serviceDied(uint64_t, const wp<IBase>&) override {
    // The link goes with the death; one unlinked meanwhile tells nothing.
    sp<::android::hardware::hidl_death_recipient> self;  // the table's, dropped after the notice
    {
      std::lock_guard<std::mutex> g(mState->linksLock);
      auto& links = mState->links;
      auto it = std::find_if(links.begin(), links.end(), [&](const AIBinder_DeathRecipient::Link& l) {
        return l.notice.get() == this;
      });
      if (it == links.end()) return;
      self = it->notice;
      links.erase(it);
    }
    // Held while the notice runs: a recipient deleted meanwhile waits for it.
    std::lock_guard<std::mutex> g(mState->lock);
    if (mState->onDied != nullptr) mState->onDied(mCookie);
  }

 private:
  const std::shared_ptr<AIBinder_DeathRecipient::State> mState;
  void* const mCookie;
};

ProxyBase* proxyOf(const AIBinder* b) {
  return b != nullptr ? dynamic_cast<ProxyBase*>(const_cast<AIBinder*>(b)) : nullptr;
}

// Takes `link` out of its connection's table.
void unlinkFromPeer(const AIBinder_DeathRecipient::Link& link) {
  if (std::shared_ptr<RemotePeer> peer = link.peer.lock()) {
    peer->unlinkToDeath(link.notice, link.binder);
  }
}

}  // namespace

extern "C" {

AIBinder_DeathRecipient* AIBinder_DeathRecipient_new(AIBinder_DeathRecipient_onBinderDied fn) {
  if (fn == nullptr) return nullptr;
  auto r = std::make_unique<AIBinder_DeathRecipient>();
  r->state->onDied = fn;
  return r.release();
}

void AIBinder_DeathRecipient_delete(AIBinder_DeathRecipient* r) {
  if (r == nullptr) return;
  {
    std::lock_guard<std::mutex> g(r->state->lock);
    r->state->onDied = nullptr;
  }
  // As on the platform, its links go with it.
  std::vector<AIBinder_DeathRecipient::Link> links;
  {
    std::lock_guard<std::mutex> g(r->state->linksLock);
    links.swap(r->state->links);
  }
  for (const auto& l : links) unlinkFromPeer(l);
  delete r;
}

binder_status_t AIBinder_linkToDeath(AIBinder* binder, AIBinder_DeathRecipient* r, void* cookie) {
  if (binder == nullptr || r == nullptr) return STATUS_UNEXPECTED_NULL;
  ProxyBase* proxy = proxyOf(binder);
  if (proxy == nullptr) return STATUS_INVALID_OPERATION;  // a local object never dies alone
  sp<::android::hardware::hidl_death_recipient> notice = new DeathNotice(r->state, cookie);
  // In the recipient's table first: a death right after the link finds it.
  {
    std::lock_guard<std::mutex> g(r->state->linksLock);
    r->state->links.push_back({proxy->serial(), cookie, notice, proxy->peer()});
  }
  if (!proxy->peer()->linkToDeath(notice, 0, wp<IBase>(static_cast<IBase*>(binder)),
                                  proxy->serial())) {
    std::lock_guard<std::mutex> g(r->state->linksLock);
    auto& links = r->state->links;
    links.erase(std::remove_if(links.begin(), links.end(),
                               [&](const AIBinder_DeathRecipient::Link& l) {
                                 return l.notice == notice;
                               }),
                links.end());
    return STATUS_DEAD_OBJECT;
  }
  return STATUS_OK;
}

binder_status_t AIBinder_unlinkToDeath(AIBinder* binder, AIBinder_DeathRecipient* r, void* cookie) {
  if (binder == nullptr || r == nullptr) return STATUS_UNEXPECTED_NULL;
  ProxyBase* proxy = proxyOf(binder);
  if (proxy == nullptr) return STATUS_INVALID_OPERATION;
  AIBinder_DeathRecipient::Link link;
  {
    std::lock_guard<std::mutex> g(r->state->linksLock);
    auto& links = r->state->links;
    auto it = std::find_if(links.begin(), links.end(), [&](const auto& l) {
      return l.binder == proxy->serial() && l.cookie == cookie;
    });
    if (it == links.end()) return STATUS_BAD_VALUE;
    link = std::move(*it);
    links.erase(it);
  }
  unlinkFromPeer(link);
  return STATUS_OK;
}

}  // extern "C"

namespace android {
namespace host {

size_t liveDeathLinksForTest(const AIBinder_DeathRecipient* r) {
  // Every link holds one notice, in the recipient's table and in its
  // connection's; each notice holds the state once.
  return r == nullptr ? 0 : static_cast<size_t>(r->state.use_count() - 1);
}

}  // namespace host
}  // namespace android

namespace android {
namespace host {
namespace aidl_rpc {

namespace {

constexpr size_t kMaxMessage = 256;

class LocalBinder : public AIBinder {
 public:
  LocalBinder(std::shared_ptr<ndk::ICInterface> object, const char* descriptor,
              TransactFn transact)
      : AIBinder(descriptor), mObject(std::move(object)), mTransact(transact) {}
  const std::shared_ptr<ndk::ICInterface>& object() const { return mObject; }
  TransactFn transact() const { return mTransact; }

 private:
  const std::shared_ptr<ndk::ICInterface> mObject;
  const TransactFn mTransact;
};

class RemoteBinder : public AIBinder, public ProxyBase {
 public:
  RemoteBinder(std::shared_ptr<RemotePeer> peer, uint32_t object)
      : AIBinder(nullptr), ProxyBase(std::move(peer), object) {}
  bool isRemote() const override { return true; }
};

ndk::SpAIBinder adopt(AIBinder* b) {
  AIBinder_incStrong(b);
  return ndk::SpAIBinder(b);
}

sp<IBase> makeRemote(const std::shared_ptr<RemotePeer>& peer, uint32_t id) {
  return sp<IBase>(new RemoteBinder(peer, id));
}

// Runs a peer's call on a local binder served by the host.
StubResult binderStub(const sp<IBase>& target, uint32_t method, BodyReader& in, BodyWriter& out,
                      const std::shared_ptr<RemotePeer>& peer, std::string* error) {
  auto* b = dynamic_cast<LocalBinder*>(target.get());
  if (b == nullptr) {
    *error = "not an AIDL object";
    return StubResult::BadCall;
  }
  std::shared_ptr<ndk::ICInterface> object = b->object();
  return b->transact()(object.get(), method, in, out, peer, error);
}

std::string instanceFolder(const std::string& instance, std::string* name) {
  const size_t slash = instance.rfind('/');
  if (slash == std::string::npos) {
    *name = instance;
    return aidlSocketDir();
  }
  *name = instance.substr(slash + 1);
  return aidlSocketDir() + "/" + instance.substr(0, slash);
}

}  // namespace

ndk::SpAIBinder newLocalBinder(std::shared_ptr<ndk::ICInterface> object, const char* descriptor,
                               TransactFn transact) {
  return adopt(new LocalBinder(std::move(object), descriptor, transact));
}

std::shared_ptr<ndk::ICInterface> localObject(const ndk::SpAIBinder& binder,
                                              const char* descriptor) {
  auto* b = dynamic_cast<LocalBinder*>(binder.get());
  if (b == nullptr || strcmp(b->interfaceDescriptor(), descriptor) != 0) return nullptr;
  return b->object();
}

void writeStatus(BodyWriter& out, const ndk::ScopedAStatus& st) {
  out.u32(static_cast<uint32_t>(st.getExceptionCode()));
  out.u32(static_cast<uint32_t>(st.getServiceSpecificError()));
  out.u32(static_cast<uint32_t>(st.getStatus()));
  std::string message = st.getMessage();
  if (message.size() > kMaxMessage) message.resize(kMaxMessage);
  out.text(message);
}

ndk::ScopedAStatus callRemote(AIBinder* binder, uint32_t code, const BodyWriter& args,
                              std::vector<uint8_t>* results) {
  ProxyBase* proxy = proxyOf(binder);
  if (proxy == nullptr) return ndk::ScopedAStatus::fromStatus(STATUS_INVALID_OPERATION);
  std::vector<uint8_t> reply;
  hardware::Status st = proxy->peer()->call(proxy->object(), code, args, &reply);
  if (!st.isOk()) {
    return ndk::ScopedAStatus(newStatus(EX_TRANSACTION_FAILED, 0, STATUS_DEAD_OBJECT,
                                        st.exceptionMessage().c_str()));
  }
  BodyReader r(reply);
  uint32_t exception, specific, status;
  std::string message;
  if (!r.u32(&exception) || !r.u32(&specific) || !r.u32(&status) ||
      !r.text(&message, kMaxMessage)) {
    return ndk::ScopedAStatus(newStatus(EX_TRANSACTION_FAILED, 0, STATUS_BAD_VALUE,
                                        "malformed reply"));
  }
  const auto e = static_cast<binder_exception_t>(exception);
  if (e != EX_NONE) {
    return ndk::ScopedAStatus(newStatus(e, static_cast<int32_t>(specific),
                                        static_cast<binder_status_t>(status), message.c_str()));
  }
  // What follows the status block: three words and the counted message.
  const size_t head = 3 * 4 + 4 + message.size();
  results->assign(reply.begin() + static_cast<std::ptrdiff_t>(head), reply.end());
  return ndk::ScopedAStatus::ok();
}

bool writeBinder(AIBinder* via, const ndk::SpAIBinder& binder, BodyWriter& out,
                 std::string* error) {
  uint32_t id = 0;
  if (binder.get() != nullptr) {
    ProxyBase* proxy = proxyOf(via);
    if (proxy == nullptr || binder.get()->isRemote()) {
      *error = "only a local object can be passed";
      return false;
    }
    if (!proxy->peer()->exportObject(sp<IBase>(static_cast<IBase*>(binder.get())), binderStub,
                                     &id)) {
      *error = "cannot export the object";
      return false;
    }
  }
  out.u32(id);
  return true;
}

ndk::SpAIBinder readBinder(uint32_t id, const std::shared_ptr<RemotePeer>& peer) {
  if (id == 0) return ndk::SpAIBinder();
  sp<IBase> proxy = peer->importObject(id, makeRemote);
  return adopt(dynamic_cast<AIBinder*>(proxy.get()));
}

}  // namespace aidl_rpc

std::string aidlSocketDir() { return mapDevicePath("/dev/socket/aidl"); }

std::string aidlSocketPath(const std::string& instance) { return aidlSocketDir() + "/" + instance; }

std::vector<std::string> listAidlServices() {
  std::vector<std::string> names;
  const std::string root = aidlSocketDir();
  auto accepting = [](const std::string& path) {
    std::string ignored;
    return rpc::connectPath(path, &ignored) != nullptr;
  };
  DIR* d = opendir(root.c_str());
  if (d == nullptr) return names;
  while (dirent* e = readdir(d)) {
    const std::string iface = e->d_name;
    if (iface == "." || iface == "..") continue;
    const std::string dir = root + "/" + iface;
    DIR* inner = opendir(dir.c_str());
    if (inner == nullptr) continue;
    while (dirent* f = readdir(inner)) {
      const std::string name = f->d_name;
      struct stat st;
      if (name == "." || name == ".." || lstat((dir + "/" + name).c_str(), &st) != 0 ||
          !S_ISSOCK(st.st_mode)) {
        continue;
      }
      if (accepting(dir + "/" + name)) names.push_back(iface + "/" + name);
    }
    closedir(inner);
  }
  closedir(d);
  std::sort(names.begin(), names.end());
  return names;
}

int pollIncomingCalls(AIBinder* binder, int timeoutMs) {
  ProxyBase* proxy = proxyOf(binder);
  return proxy ? proxy->peer()->pollIncoming(timeoutMs) : -1;
}

bool setCallTimeout(AIBinder* binder, int timeoutMs) {
  ProxyBase* proxy = proxyOf(binder);
  if (proxy == nullptr) return false;
  proxy->peer()->setCallTimeout(timeoutMs);
  return true;
}

}  // namespace host
}  // namespace android

extern "C" {

binder_exception_t AServiceManager_addService(AIBinder* binder, const char* instance) {
  using namespace ::android::host;
  if (binder == nullptr || instance == nullptr || binder->isRemote()) return EX_ILLEGAL_ARGUMENT;
  sp<IBase> service(static_cast<IBase*>(binder));
  RpcHooks* hooks = rpc::currentHooks();
  if (hooks && hooks->registerService) {
    return hooks->registerService(binder->interfaceDescriptor(), instance, service) ==
                   ::android::OK
               ? EX_NONE
               : EX_ILLEGAL_STATE;
  }
  std::string name;
  const std::string dir = aidl_rpc::instanceFolder(instance, &name);
  return rpc::registerServiceIn(dir, name, service, aidl_rpc::binderStub) == ::android::OK
             ? EX_NONE
             : EX_ILLEGAL_STATE;
}

AIBinder* AServiceManager_checkService(const char* instance) {
  using namespace ::android::host;
  if (instance == nullptr || *instance == '\0') return nullptr;
  std::string error;
  std::shared_ptr<RemotePeer> peer = rpc::connectPath(aidlSocketPath(instance), &error);
  if (peer == nullptr) return nullptr;
  return aidl_rpc::adopt(new aidl_rpc::RemoteBinder(std::move(peer), 0)).release();
}

bool ABinderProcess_setThreadPoolMaxThreadCount(uint32_t) { return true; }

void ABinderProcess_startThreadPool() {}

void ABinderProcess_joinThreadPool() { ::android::hardware::joinRpcThreadpool(); }

}  // extern "C"
