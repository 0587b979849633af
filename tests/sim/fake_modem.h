#pragma once
// The scripted modem as the SIM tests use it: a pty whose slave is linked at
// DIR/dev/appvcomNN for the worker to open, answering with reply texts.
#include <memory>
#include <string>

#include "../atchannel/scripted_modem.h"

namespace sim_test {

using FakeModem = at_test::ScriptedModem;

// Answer forms of the modem.
inline std::string okLine(const std::string& line) { return "\r\n" + line + "\r\n\r\nOK\r\n"; }
inline std::string finalLine(const std::string& text) { return "\r\n" + text + "\r\n"; }

// Until a script is set, every command is answered "ERROR".
inline std::unique_ptr<FakeModem> modemAt(const std::string& linkPath, bool linkNow = true) {
  std::unique_ptr<FakeModem> m = FakeModem::pty(linkPath, linkNow);
  if (m) m->setScript([](FakeModem& fm, const std::string&) { fm.send(finalLine("ERROR")); });
  return m;
}

template <typename Pred>
bool waitUntil(Pred pred) {
  return at_test::eventually(pred);
}

}  // namespace sim_test
