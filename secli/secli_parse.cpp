// secli's parsing: hex and byte arguments, script lines, command words, the
// command line's options and the help texts.
#include "secli_lib.h"

#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>

namespace secli {

namespace {

constexpr uint32_t kMaxSleepMs = 3600 * 1000;
constexpr double kMaxSeconds = 24 * 3600;

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// Whole seconds or fractions, 0 up to a day; milliseconds in *ms.
bool parseSeconds(const std::string& text, bool allowZero, int* ms) {
  if (text.empty()) return false;
  char* end = nullptr;
  errno = 0;
  double s = strtod(text.c_str(), &end);
  if (errno != 0 || end == text.c_str() || *end != '\0' || !std::isfinite(s)) return false;
  if (s < 0 || s > kMaxSeconds || (!allowZero && s <= 0)) return false;
  *ms = static_cast<int>(std::lround(s * 1000));
  if (!allowZero && *ms == 0) *ms = 1;
  return true;
}

struct CommandInfo {
  const char* name;
  CommandKind kind;
  const char* usage;
  const char* help;
};

const CommandInfo kCommands[] = {
    {"init", CommandKind::Init, "init",
     "Calls init with a callback and waits up to the time-out for onStateChange."},
    {"present", CommandKind::Present, "present", "Asks whether a card is present."},
    {"atr", CommandKind::Atr, "atr", "Reads the ATR."},
    {"open", CommandKind::Open, "open AID [P2]",
     "Opens a logical channel to the applet AID (hex). P2 defaults to 0."},
    {"basic", CommandKind::Basic, "basic AID [P2]",
     "Opens the basic channel to the applet AID (hex; \"\" for the default applet).\n"
     "P2 defaults to 0."},
    {"transmit", CommandKind::Transmit, "transmit APDU",
     "Sends a command APDU (hex; the rest of the line, spaces allowed) and prints\n"
     "the response with its status word."},
    {"close", CommandKind::Close, "close CHANNEL", "Closes a channel."},
    {"sleep", CommandKind::Sleep, "sleep MS", "Waits MS milliseconds (for scripts)."},
    {"reset", CommandKind::Reset, "reset",
     "Resets the element (AIDL only): every channel closed, then onStateChange\n"
     "false and true again; prints the states received."},
};

std::vector<std::string> wordsOf(const std::string& text) {
  std::vector<std::string> words;
  std::string cur;
  for (char c : text + " ") {
    if (c == ' ' || c == '\n') {
      if (!cur.empty()) words.push_back(cur);
      cur.clear();
    } else {
      cur += c;
    }
  }
  return words;
}

const CommandInfo* findCommand(const std::string& name) {
  for (const auto& c : kCommands) {
    if (name == c.name) return &c;
  }
  return nullptr;
}

}  // namespace

bool parseHex(const std::string& text, std::vector<uint8_t>* out, std::string* error) {
  std::vector<uint8_t> bytes;
  int high = -1;
  for (char c : text) {
    if (c == ' ' || c == '\t') continue;
    int d = hexDigit(c);
    if (d < 0) {
      if (error) *error = "'" + text + "' is not hex";
      return false;
    }
    if (high < 0) {
      high = d;
    } else {
      bytes.push_back(static_cast<uint8_t>(high << 4 | d));
      high = -1;
    }
  }
  if (high >= 0) {
    if (error) *error = "'" + text + "' has an odd number of hex digits";
    return false;
  }
  *out = std::move(bytes);
  return true;
}

bool parseByte(const std::string& text, uint8_t* out) {
  std::string digits = text;
  int base = 10;
  if (digits.size() > 2 && digits[0] == '0' && (digits[1] == 'x' || digits[1] == 'X')) {
    digits = digits.substr(2);
    base = 16;
  }
  if (digits.empty() || digits.size() > 3) return false;
  unsigned v = 0;
  for (char c : digits) {
    int d = hexDigit(c);
    if (d < 0 || d >= base) return false;
    v = v * base + static_cast<unsigned>(d);
  }
  if (v > 255) return false;
  *out = static_cast<uint8_t>(v);
  return true;
}

bool splitLine(const std::string& line, std::vector<std::string>* words, std::string* error) {
  words->clear();
  std::string cur;
  bool inWord = false, quoted = false;
  for (char c : line) {
    if (quoted) {
      if (c == '"') {
        quoted = false;
      } else {
        cur += c;
      }
      continue;
    }
    if (c == '#') break;
    if (c == '"') {
      quoted = true;
      inWord = true;
    } else if (c == ' ' || c == '\t' || c == '\r' || c == '\n') {
      if (inWord) words->push_back(cur);
      cur.clear();
      inWord = false;
    } else {
      cur += c;
      inWord = true;
    }
  }
  if (quoted) {
    if (error) *error = "unclosed quote";
    return false;
  }
  if (inWord) words->push_back(cur);
  return true;
}

bool parseCommand(const std::vector<std::string>& words, Command* out, std::string* error) {
  if (words.empty()) {
    *error = "no command given";
    return false;
  }
  const CommandInfo* info = findCommand(words[0]);
  if (info == nullptr) {
    *error = "unknown command '" + words[0] + "'";
    return false;
  }
  Command c;
  c.kind = info->kind;
  c.name = info->name;
  size_t nargs = words.size() - 1;
  auto usage = [&](const std::string& why) {
    *error = why + "; usage: " + info->usage;
    return false;
  };
  switch (c.kind) {
    case CommandKind::Init:
    case CommandKind::Present:
    case CommandKind::Atr:
    case CommandKind::Reset:
      if (nargs != 0) return usage(std::string(info->name) + " takes no argument");
      break;
    case CommandKind::Open:
    case CommandKind::Basic:
      if (nargs < 1 || nargs > 2) {
        return usage(std::string(info->name) + " needs AID [P2] (quote an AID written with spaces)");
      }
      if (!parseHex(words[1], &c.bytes, error)) return false;
      if (nargs == 2 && !parseByte(words[2], &c.p2)) {
        return usage("P2 '" + words[2] + "' is not 0..255 (decimal or 0x hex)");
      }
      break;
    case CommandKind::Transmit: {
      std::string hex;
      for (size_t i = 1; i < words.size(); ++i) hex += words[i];
      if (!parseHex(hex, &c.bytes, error)) return false;
      if (c.bytes.empty()) return usage("transmit needs an APDU");
      break;
    }
    case CommandKind::Close:
      if (nargs != 1) return usage("close needs a channel number");
      if (!parseByte(words[1], &c.channel)) {
        return usage("channel '" + words[1] + "' is not 0..255 (decimal or 0x hex)");
      }
      break;
    case CommandKind::Sleep: {
      if (nargs != 1) return usage("sleep needs milliseconds");
      const std::string& w = words[1];
      char* end = nullptr;
      errno = 0;
      unsigned long v = strtoul(w.c_str(), &end, 10);
      if (w.empty() || w[0] == '-' || *end != '\0' || errno != 0 || v > kMaxSleepMs) {
        return usage("'" + w + "' is not 0.." + std::to_string(kMaxSleepMs) + " milliseconds");
      }
      c.ms = static_cast<uint32_t>(v);
      break;
    }
  }
  *out = std::move(c);
  return true;
}

std::string mainHelp() {
  std::string s =
      "secli: talk to the secure element service.\n"
      "\n"
      "Usage:\n"
      "  secli [--root DIR] [--json] list [--wait SECONDS]\n"
      "  secli [--root DIR] [OPTIONS] -i NAME COMMAND [ARG...]\n"
      "  secli [--root DIR] [OPTIONS] -i NAME -f FILE|-\n"
      "\n"
      "Options:\n"
      "  --root DIR         device root (default: $SE_DEVICE_ROOT, else /)\n"
      "  --json             one JSON object per command per line\n"
      "  --timeout SECONDS  limit for each call, and how long init waits for\n"
      "                     onStateChange (default 10)\n"
      "  -i NAME            the instance, e.g. SIM1 or eSE1 (see 'list')\n"
      "  --aidl             speak the AIDL interface to the instance (the same\n"
      "                     name): errors come back as statuses by name\n"
      "  --wait SECONDS     wait up to SECONDS for the instance to be registered\n"
      "                     (a daemon just started registers HIDL, then AIDL)\n"
      "  -f FILE            run the commands of FILE (- for standard input), one a\n"
      "                     line, '#' starts a comment; all on one connection\n"
      "  --chain            transmit follows 61xx with GET RESPONSE on the same\n"
      "                     channel and resends on 6Cxx with the Le asked for,\n"
      "                     printing the joined answer\n"
      "  --trace            writes every APDU sent (>) and received (<) to\n"
      "                     standard error, marked 'secli: trace'\n"
      "  -h, --help         this text; 'secli COMMAND --help' for one command\n"
      "\n"
      "Commands:\n";
  // The first sentence of each command's help; its continuation lines
  // indented under the first.
  const std::string indent(21, ' ');
  for (const auto& c : kCommands) {
    char head[32];
    snprintf(head, sizeof(head), "  %-18s ", c.usage);
    const std::string help(c.help);
    std::string line = head;
    size_t width = line.size();
    for (const std::string& word : wordsOf(help.substr(0, help.find('.') + 1))) {
      if (width > indent.size() && width + 1 + word.size() > 79) {
        line += "\n" + indent;
        width = indent.size();
      } else if (width > indent.size()) {
        line += ' ';
        ++width;
      }
      line += word;
      width += word.size();
    }
    s += line + "\n";
  }
  s += "  list [--wait SECONDS]\n" + indent + "Lists the registered instances.\n"
       "\n"
       "Hex accepts upper or lower case and spaces; P2 and CHANNEL accept decimal or\n"
       "0x hex. Exit status: 0 when every call went through (whatever the status it\n"
       "returned), 1 when a call failed in transport or the instance is missing,\n"
       "2 for usage errors.\n"
       "\n"
       "Example:\n"
       "  secli -i SIM1 init\n"
       "  secli -i SIM1 open A0000001510000 0x00\n"
       "  secli -i SIM1 transmit 81 CA 9F 7F 00\n"
       "  secli -i eSE1 --chain --trace -f session.txt\n"
       "  secli --aidl -i eSE1 -f session.txt   # init, open, transmit, reset\n";
  return s;
}

std::string commandHelp(const std::string& command) {
  if (command == "list") {
    return "Usage: secli [--root DIR] [--json] list [--wait SECONDS]\n"
           "Lists the registered instances, one a line: HIDL ones by their name\n"
           "(eSE1), AIDL ones by their full name\n"
           "(android.hardware.secure_element.ISecureElement/eSE1). With --wait, waits\n"
           "up to SECONDS until at least one is registered (exit 1 if none came).\n";
  }
  const CommandInfo* info = findCommand(command);
  if (info == nullptr) return mainHelp();
  return std::string("Usage: secli [OPTIONS] -i NAME ") + info->usage + "\n" + info->help + "\n";
}

ArgsOutcome parseArgs(const std::vector<std::string>& args, Options* out, std::string* message) {
  Options o;
  bool haveScript = false;
  size_t i = 0;
  auto value = [&](const std::string& opt, std::string* v) {
    if (i + 1 >= args.size()) {
      *message = opt + " needs a value";
      return false;
    }
    *v = args[++i];
    return true;
  };
  for (; i < args.size(); ++i) {
    const std::string& a = args[i];
    std::string v;
    if (a == "-h" || a == "--help") {
      *message = mainHelp();
      return ArgsOutcome::Help;
    } else if (a == "--json") {
      o.json = true;
    } else if (a == "--chain") {
      o.chain = true;
    } else if (a == "--trace") {
      o.trace = true;
    } else if (a == "--aidl") {
      o.aidl = true;
    } else if (a == "--root" || a.rfind("--root=", 0) == 0) {
      if (a == "--root") {
        if (!value(a, &v)) return ArgsOutcome::Usage;
      } else {
        v = a.substr(7);
      }
      if (v.empty()) {
        *message = "--root needs a folder";
        return ArgsOutcome::Usage;
      }
      o.root = v;
    } else if (a == "--wait") {
      if (!value(a, &v)) return ArgsOutcome::Usage;
      if (!parseSeconds(v, true, &o.waitMs)) {
        *message = "--wait '" + v + "' is not a number of seconds";
        return ArgsOutcome::Usage;
      }
    } else if (a == "--timeout") {
      if (!value(a, &v)) return ArgsOutcome::Usage;
      if (!parseSeconds(v, false, &o.timeoutMs)) {
        *message = "--timeout '" + v + "' is not a number of seconds above 0";
        return ArgsOutcome::Usage;
      }
    } else if (a == "-i" || a == "--instance") {
      if (!value(a, &o.instance)) return ArgsOutcome::Usage;
    } else if (a == "-f" || a == "--file") {
      if (!value(a, &o.script)) return ArgsOutcome::Usage;
      haveScript = true;
    } else if (a.size() > 1 && a[0] == '-') {
      *message = "unknown option '" + a + "'";
      return ArgsOutcome::Usage;
    } else {
      break;
    }
  }
  o.command.assign(args.begin() + static_cast<std::ptrdiff_t>(i), args.end());
  for (const std::string& w : o.command) {
    if (w == "--help" || w == "-h") {
      *message = commandHelp(o.command[0]);
      return ArgsOutcome::Help;
    }
  }
  if (!o.command.empty() && o.command[0] == "help") {
    *message = o.command.size() > 1 ? commandHelp(o.command[1]) : mainHelp();
    return ArgsOutcome::Help;
  }
  if (!o.command.empty() && o.command[0] == "list") {
    if (haveScript) {
      *message = "list does not take -f";
      return ArgsOutcome::Usage;
    }
    o.list = true;
    for (size_t k = 1; k < o.command.size(); ++k) {
      if (o.command[k] == "--wait" && k + 1 < o.command.size() &&
          parseSeconds(o.command[k + 1], true, &o.listWaitMs)) {
        ++k;
      } else {
        *message = "usage: list [--wait SECONDS]";
        return ArgsOutcome::Usage;
      }
    }
    *out = std::move(o);
    return ArgsOutcome::Run;
  }
  if (haveScript && !o.command.empty()) {
    *message = "give either a command or -f, not both";
    return ArgsOutcome::Usage;
  }
  if (!haveScript && o.command.empty()) {
    *message = "no command given";
    return ArgsOutcome::Usage;
  }
  if (haveScript && o.script.empty()) {
    *message = "-f needs a file name or -";
    return ArgsOutcome::Usage;
  }
  if (o.instance.empty()) {
    *message = "-i NAME is required (see 'secli list')";
    return ArgsOutcome::Usage;
  }
  if (!o.command.empty()) {
    Command c;
    if (!parseCommand(o.command, &c, message)) return ArgsOutcome::Usage;
    if (c.kind == CommandKind::Reset && !o.aidl) {
      *message = "reset is an AIDL call; add --aidl";
      return ArgsOutcome::Usage;
    }
  }
  *out = std::move(o);
  return ArgsOutcome::Run;
}

}  // namespace secli
