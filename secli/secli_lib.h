#pragma once
// secli's parsing, execution and output, apart from main() so tests can drive
// them without processes.
#include <cstdint>
#include <cstdio>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <android/hardware/secure_element/1.0/ISecureElement.h>

namespace secli {

using ::android::hardware::secure_element::V1_0::ISecureElement;
using ::android::hardware::secure_element::V1_0::SecureElementStatus;

enum class CommandKind { Init, Present, Atr, Open, Basic, Transmit, Close, Sleep, Reset };

struct Command {
  CommandKind kind = CommandKind::Present;
  std::string name;            // the command word: "open", "transmit", ...
  std::vector<uint8_t> bytes;  // AID for open/basic, APDU for transmit
  uint8_t p2 = 0;              // open/basic
  uint8_t channel = 0;         // close
  uint32_t ms = 0;             // sleep
};

// Hex in either case, blanks allowed between digits; an even number of digits.
bool parseHex(const std::string& text, std::vector<uint8_t>* out, std::string* error);
// 0..255, decimal or 0x hex.
bool parseByte(const std::string& text, uint8_t* out);
// Parses COMMAND [ARG...]; a usage message in *error on failure.
bool parseCommand(const std::vector<std::string>& words, Command* out, std::string* error);
// Splits a script line into words: blanks separate, double quotes group (""
// is an empty word), '#' outside quotes starts a comment.
bool splitLine(const std::string& line, std::vector<std::string>* words, std::string* error);

std::string hexCompact(const std::vector<uint8_t>& bytes);  // "6F0A9000"
std::string hexGrouped(const std::vector<uint8_t>& bytes);  // "6F 0A 90 00"
// Meaning of a status word, "" when not in the catalogue.
std::string describeStatusWord(uint8_t sw1, uint8_t sw2);
// "(9000: OK)", "(6A88)" for an unknown word, "" for fewer than two bytes.
std::string statusWordNote(const std::vector<uint8_t>& response);

struct Result {
  CommandKind kind = CommandKind::Present;
  std::string cmd;
  std::string error;               // non-empty: the call failed in transport
  std::optional<bool> state;       // init: the onStateChange value, if one came
  bool present = false;            // present
  std::vector<uint8_t> data;       // atr, transmit response, select response
  SecureElementStatus status = SecureElementStatus::SUCCESS;  // open, basic, close
  uint8_t channel = 0;             // open
  uint32_t ms = 0;                 // sleep
  double waitedSeconds = 0;        // init: the time-out that ran out
  int exchanges = 1;               // transmit: APDUs sent (more with --chain)
  // AIDL calls: the call's status ("SUCCESS" or the error's name) with its
  // message; results are meaningful only on SUCCESS.
  bool aidl = false;
  std::string aidlStatus;
  std::string aidlMessage;
  std::optional<std::string> reason;  // init: the onStateChange reason
  std::vector<bool> states;           // reset: the connected values received, in order
};

// The channel a command's CLA names: 0-3 in a first interindustry class,
// 4-19 in a further one.
uint8_t channelOfCla(uint8_t cla);
// The CLA of a GET RESPONSE for a command sent with `cla`: same channel.
uint8_t getResponseCla(uint8_t cla);
// The command sent again with Le set to `le`, as a card's 6C xx asks; empty
// when the command is not a short APDU whose Le can be set.
std::vector<uint8_t> withLe(const std::vector<uint8_t>& apdu, uint8_t le);

// One exchange on the wire; an empty answer means it failed.
using TransmitFn = std::function<std::vector<uint8_t>(const std::vector<uint8_t>&)>;
// Sends `apdu` and, like a phone framework for its clients, answers 6C xx by
// sending it once more with Le xx, and follows 61 xx with GET RESPONSE on the
// same channel until the card stops asking. Returns all data parts joined
// with the last status word; empty when any exchange came back empty or
// without a status word. *exchanges counts what was sent.
std::vector<uint8_t> transmitChained(const std::vector<uint8_t>& apdu, const TransmitFn& send,
                                     int* exchanges = nullptr);

// `s` as a quoted JSON string.
std::string jsonText(const std::string& s);
// One JSON object, no newline.
std::string formatJson(const Result& r);
// One human line, no newline; "" when there is nothing to say (sleep).
std::string formatHuman(const Result& r);

// Runs commands on one connection; the callback passed by init stays with
// the connection, so a later init may reuse it.
class Session {
 public:
  Session(::android::sp<ISecureElement> se, int timeoutMs);
  Result run(const Command& c);
  // transmit follows 61xx and 6Cxx itself.
  void setChain(bool on) { mChain = on; }
  // Every APDU sent and received is written to `trace` ("> " and "< " lines).
  void setTrace(FILE* trace) { mTrace = trace; }

 private:
  std::vector<uint8_t> exchange(const std::vector<uint8_t>& apdu, std::string* error);

  ::android::sp<ISecureElement> mSe;
  int mTimeoutMs;
  bool mChain = false;
  FILE* mTrace = nullptr;
};

// The same commands over the AIDL interface (secli_aidl.cpp). One callback
// per session, passed by init and kept for reset's state changes.
class AidlSession {
 public:
  // `instance` is the short name (eSE1); the full AIDL name is made here.
  static std::unique_ptr<AidlSession> connect(const std::string& instance, int timeoutMs);
  virtual ~AidlSession() = default;
  virtual Result run(const Command& c) = 0;
  virtual void setChain(bool on) = 0;
  virtual void setTrace(FILE* trace) = 0;
};
// The full AIDL instance name of a short one.
std::string aidlInstanceName(const std::string& instance);

// Command line.
struct Options {
  std::string root;          // --root; empty: $SE_DEVICE_ROOT
  bool json = false;         // --json
  int timeoutMs = 10000;     // --timeout SECONDS
  bool chain = false;        // --chain
  bool trace = false;        // --trace
  bool aidl = false;         // --aidl
  std::string instance;      // -i NAME
  std::string script;        // -f FILE ("-": standard input)
  bool list = false;         // the list command
  int listWaitMs = -1;       // list --wait SECONDS
  int waitMs = 0;            // --wait SECONDS: for the instance to be registered
  std::vector<std::string> command;  // COMMAND [ARG...]
};

enum class ArgsOutcome { Run, Help, Usage };
// Help text or the usage error in *message.
ArgsOutcome parseArgs(const std::vector<std::string>& args, Options* out, std::string* message);

// Text of `secli --help`, of `secli list --help` and of `secli COMMAND --help`.
std::string mainHelp();
std::string commandHelp(const std::string& command);

// Runs the whole program; output and errors go to the given streams.
int runMain(const std::vector<std::string>& args, FILE* out, FILE* err, FILE* in);

}  // namespace secli
