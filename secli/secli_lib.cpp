// The secli program: the list command, and commands or a script run on one
// instance over either interface.
#include "secli_internal.h"

#include <host/aidl_host.h>
#include <host/rpc_host.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <thread>

namespace secli {

using ::android::sp;

namespace {

int runList(const Options& o, FILE* out, FILE* err) {
  auto deadline =
      std::chrono::steady_clock::now() + std::chrono::milliseconds(o.listWaitMs < 0 ? 0 : o.listWaitMs);
  auto both = [] {
    std::vector<std::string> names = ::android::host::listServices();
    for (auto& n : ::android::host::listAidlServices()) names.push_back(n);
    return names;
  };
  std::vector<std::string> names = both();
  while (o.listWaitMs >= 0 && names.empty() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    names = both();
  }
  if (o.json) {
    std::string s = "{\"cmd\":\"list\",\"instances\":[";
    for (size_t k = 0; k < names.size(); ++k) s += (k ? "," : "") + jsonString(names[k]);
    fprintf(out, "%s]}\n", s.c_str());
  } else {
    for (const auto& n : names) fprintf(out, "%s\n", n.c_str());
  }
  fflush(out);
  if (o.listWaitMs >= 0 && names.empty()) {
    fprintf(err, "secli: no instance registered within %s s\n",
            secondsText(o.listWaitMs / 1000.0).c_str());
    return 1;
  }
  return 0;
}

}  // namespace

int runMain(const std::vector<std::string>& args, FILE* out, FILE* err, FILE* in) {
  Options o;
  std::string message;
  switch (parseArgs(args, &o, &message)) {
    case ArgsOutcome::Help:
      fputs(message.c_str(), out);
      return 0;
    case ArgsOutcome::Usage:
      fprintf(err, "secli: %s (see secli --help)\n", message.c_str());
      return 2;
    case ArgsOutcome::Run:
      break;
  }
  if (!o.root.empty()) setenv("SE_DEVICE_ROOT", o.root.c_str(), 1);
  if (o.list) return runList(o, out, err);

  // A script file is checked whole before anything runs.
  std::vector<Command> commands;
  bool streaming = o.script == "-";
  if (!o.command.empty()) {
    commands.emplace_back();
    parseCommand(o.command, &commands.back(), &message);
  } else if (!streaming) {
    std::ifstream file(o.script);
    if (!file) {
      fprintf(err, "secli: cannot read %s: %s\n", o.script.c_str(), strerror(errno));
      return 2;
    }
    std::string line;
    for (int n = 1; std::getline(file, line); ++n) {
      std::vector<std::string> words;
      Command c;
      if (!splitLine(line, &words, &message) ||
          (!words.empty() && !parseCommand(words, &c, &message))) {
        fprintf(err, "secli: %s:%d: %s\n", o.script.c_str(), n, message.c_str());
        return 2;
      }
      if (!words.empty()) commands.push_back(std::move(c));
    }
  }

  if (!o.aidl) {
    for (const Command& c : commands) {
      if (c.kind == CommandKind::Reset) {
        fprintf(err, "secli: reset is an AIDL call; add --aidl\n");
        return 2;
      }
    }
  }
  std::function<Result(const Command&)> runCommand;
  std::unique_ptr<Session> session;
  std::unique_ptr<AidlSession> aidlSession;
  // With --wait, an instance not there yet is looked for again until it is
  // or the time is up, as list --wait does.
  const auto waitEnd = std::chrono::steady_clock::now() + std::chrono::milliseconds(o.waitMs);
  auto keepLooking = [&] {
    if (std::chrono::steady_clock::now() >= waitEnd) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    return true;
  };
  if (o.aidl) {
    aidlSession = AidlSession::connect(o.instance, o.timeoutMs);
    while (aidlSession == nullptr && keepLooking()) aidlSession = AidlSession::connect(o.instance, o.timeoutMs);
    if (aidlSession == nullptr) {
      fprintf(err, "secli: no AIDL instance %s (%s)\n", o.instance.c_str(),
              ::android::host::aidlSocketPath(aidlInstanceName(o.instance)).c_str());
      return 1;
    }
    aidlSession->setChain(o.chain);
    if (o.trace) aidlSession->setTrace(err);
    runCommand = [&](const Command& c) { return aidlSession->run(c); };
  } else {
    sp<ISecureElement> se = ISecureElement::getService(o.instance);
    while (se == nullptr && keepLooking()) se = ISecureElement::getService(o.instance);
    if (se == nullptr) {
      fprintf(err, "secli: no instance %s (%s)\n", o.instance.c_str(),
              ::android::host::serviceSocketPath(o.instance).c_str());
      return 1;
    }
    ::android::host::setCallTimeout(se, o.timeoutMs);
    session = std::make_unique<Session>(se, o.timeoutMs);
    session->setChain(o.chain);
    if (o.trace) session->setTrace(err);
    runCommand = [&](const Command& c) { return session->run(c); };
  }
  auto runOne = [&](const Command& c) {
    Result r = runCommand(c);
    std::string text = o.json ? formatJson(r) : formatHuman(r);
    if (!text.empty()) fprintf(out, "%s\n", text.c_str());
    fflush(out);
    if (r.error.empty()) return true;
    fprintf(err, "secli: %s: %s\n", r.cmd.c_str(), r.error.c_str());
    return false;
  };
  if (!streaming) {
    for (const Command& c : commands) {
      if (!runOne(c)) return 1;
    }
    return 0;
  }
  char* raw = nullptr;
  size_t cap = 0;
  int status = 0;
  for (int n = 1; getline(&raw, &cap, in) >= 0; ++n) {
    std::vector<std::string> words;
    Command c;
    if (!splitLine(raw, &words, &message) ||
        (!words.empty() && !parseCommand(words, &c, &message))) {
      fprintf(err, "secli: line %d: %s\n", n, message.c_str());
      status = 2;
      break;
    }
    if (words.empty()) continue;
    if (c.kind == CommandKind::Reset && !o.aidl) {
      fprintf(err, "secli: line %d: reset is an AIDL call; add --aidl\n", n);
      status = 2;
      break;
    }
    if (!runOne(c)) {
      status = 1;
      break;
    }
  }
  free(raw);
  return status;
}

}  // namespace secli
