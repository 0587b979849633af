// card-vpcd: the project's virtual card in vsmartcard's vpcd reader, so that
// pcscd and every PC/SC application see it as a card in a reader.
#include <arpa/inet.h>
#include <ctype.h>
#include <errno.h>
#include <fcntl.h>
#include <getopt.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "vpcd_card.h"

namespace {

const char kUsage[] =
    "usage: card-vpcd [--port N] [--atr HEX] [--channels N]\n"
    "\n"
    "Serves the virtual card (applets ISD, ECHO, BIG, P2; logical channels;\n"
    "GET RESPONSE) to pcscd through the vpcd reader driver: connects to the\n"
    "driver's TCP port on 127.0.0.1, answers its power, reset and ATR requests\n"
    "and its APDUs. Power off, power on and reset close every logical channel.\n"
    "Prints \"card-vpcd: connected ...\" on standard output once the card is in\n"
    "the reader; the trace (\"< \" APDU received, \"> \" answer, \"# \" events) goes\n"
    "to standard error. When the driver goes away (pcscd stopped) the card waits\n"
    "for it again. SIGTERM or SIGINT pull the card out and end the program.\n"
    "\n"
    "options:\n"
    "  --port N      the driver's port (default 35963, vpcd's first slot)\n"
    "  --atr HEX     the card's ATR (default 3B868001532D53494D + TCK: T=0 and T=1)\n"
    "  --channels N  channels of the card, basic included (1-20, default 4, as\n"
    "                the embedded secure element)\n"
    "  --help        this text\n";

constexpr int kDefaultPort = 35963;
constexpr int kRetryMs = 100;

int g_wakePipe[2] = {-1, -1};
volatile sig_atomic_t g_stop = 0;

void onSignal(int) {
  g_stop = 1;
  const char b = 1;
  ssize_t ignored = write(g_wakePipe[1], &b, 1);
  (void)ignored;
}

bool parseLong(const char* s, long min, long max, long& out) {
  char* end = nullptr;
  errno = 0;
  const long v = strtol(s, &end, 10);
  if (errno != 0 || end == s || *end != '\0' || v < min || v > max) return false;
  out = v;
  return true;
}

bool parseHex(const std::string& text, std::vector<uint8_t>& out) {
  std::string digits;
  for (char c : text) {
    if (c == ' ' || c == ':') continue;
    if (!isxdigit(static_cast<unsigned char>(c))) return false;
    digits.push_back(c);
  }
  if (digits.empty() || digits.size() % 2 != 0 || digits.size() > 2 * 33) return false;
  out.clear();
  for (size_t i = 0; i < digits.size(); i += 2) {
    out.push_back(static_cast<uint8_t>(strtoul(digits.substr(i, 2).c_str(), nullptr, 16)));
  }
  return true;
}

void trace(const std::string& text) {
  fprintf(stderr, "%s\n", text.c_str());
  fflush(stderr);
}

// Waits until `fd` is readable, or the stop signal came, or `ms` passed
// (ms < 0: no limit). True when `fd` is readable.
bool waitReadable(int fd, int ms) {
  pollfd fds[2] = {{g_wakePipe[0], POLLIN, 0}, {fd, POLLIN, 0}};
  const nfds_t n = fd >= 0 ? 2 : 1;
  for (;;) {
    const int r = poll(fds, n, ms);
    if (r < 0 && errno == EINTR) {
      if (g_stop) return false;
      continue;
    }
    return r > 0 && !g_stop && n == 2 && (fds[1].revents & (POLLIN | POLLHUP | POLLERR)) != 0;
  }
}

bool sendAll(int fd, const std::vector<uint8_t>& bytes) {
  size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = send(fd, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

// A connected socket to the driver, or -1 once the stop signal came.
int connectToDriver(int port) {
  bool told = false;
  while (!g_stop) {
    const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
      perror("card-vpcd: socket");
      return -1;
    }
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_port = htons(static_cast<uint16_t>(port));
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0) {
      const int one = 1;
      setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &one, sizeof(one));
      return fd;
    }
    const int err = errno;
    close(fd);
    if (!told) {
      fprintf(stderr, "card-vpcd: waiting for vpcd on 127.0.0.1:%d (%s)\n", port, strerror(err));
      told = true;
    }
    waitReadable(-1, kRetryMs);
  }
  return -1;
}

// Serves one connection until the driver closes it or the stop signal came.
void serve(int fd, se_vpcd::CardSession& session) {
  se_vpcd::FrameReader reader;
  uint8_t buf[4096];
  std::vector<uint8_t> body;
  std::vector<uint8_t> out;
  while (waitReadable(fd, -1)) {
    // The driver writes a message's length and body apart; acknowledging at
    // once keeps the second write from waiting for a delayed ACK (40 ms).
    const int one = 1;
    setsockopt(fd, IPPROTO_TCP, TCP_QUICKACK, &one, sizeof(one));
    const ssize_t n = recv(fd, buf, sizeof(buf), 0);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      trace(n == 0 ? "# vpcd closed the connection" : std::string("# connection lost: ") + strerror(errno));
      return;
    }
    reader.feed(buf, static_cast<size_t>(n));
    while (reader.next(&body)) {
      se_vpcd::CardSession::Result r = session.handle(body);
      if (!r.event.empty()) trace(r.event);
      if (r.reply && (!se_vpcd::frame(*r.reply, &out) || !sendAll(fd, out))) {
        trace(std::string("# could not answer: ") + strerror(errno));
        return;
      }
    }
  }
}

}  // namespace

int main(int argc, char** argv) {
  long port = kDefaultPort;
  long channels = 4;
  std::vector<uint8_t> atr;
  static const option kLong[] = {{"port", required_argument, nullptr, 'p'},
                                  {"atr", required_argument, nullptr, 'a'},
                                  {"channels", required_argument, nullptr, 'c'},
                                  {"help", no_argument, nullptr, 'h'},
                                  {nullptr, 0, nullptr, 0}};
  for (;;) {
    const int c = getopt_long(argc, argv, "h", kLong, nullptr);
    if (c == -1) break;
    switch (c) {
      case 'p':
        if (!parseLong(optarg, 1, 65535, port)) {
          fprintf(stderr, "card-vpcd: --port takes 1 to 65535, not '%s'\n", optarg);
          return 2;
        }
        break;
      case 'a':
        if (!parseHex(optarg, atr)) {
          fprintf(stderr, "card-vpcd: --atr takes 1 to 33 bytes in hex, not '%s'\n", optarg);
          return 2;
        }
        break;
      case 'c':
        if (!parseLong(optarg, 1, se_card::kMaxChannels, channels)) {
          fprintf(stderr, "card-vpcd: --channels takes 1 to %d, not '%s'\n", se_card::kMaxChannels, optarg);
          return 2;
        }
        break;
      case 'h':
        fputs(kUsage, stdout);
        return 0;
      default:
        fputs(kUsage, stderr);
        return 2;
    }
  }
  if (optind < argc) {
    fprintf(stderr, "card-vpcd: unexpected argument '%s'\n", argv[optind]);
    fputs(kUsage, stderr);
    return 2;
  }

  if (pipe2(g_wakePipe, O_CLOEXEC | O_NONBLOCK) != 0) {
    perror("card-vpcd: pipe");
    return 1;
  }
  struct sigaction sa {};
  sa.sa_handler = onSignal;
  sigemptyset(&sa.sa_mask);
  sigaction(SIGTERM, &sa, nullptr);
  sigaction(SIGINT, &sa, nullptr);
  signal(SIGPIPE, SIG_IGN);

  se_vpcd::CardSession session(se_card::CardOptions{static_cast<int>(channels), atr});
  while (!g_stop) {
    const int fd = connectToDriver(static_cast<int>(port));
    if (fd < 0) break;
    printf("card-vpcd: connected to vpcd on 127.0.0.1:%ld, ATR %s\n", port,
           se_vpcd::hexSpaced(session.card().atr()).c_str());
    fflush(stdout);
    serve(fd, session);
    close(fd);
    // Out of the reader: whatever was open on the card is gone.
    session.remove();
  }
  trace("# stopped");
  return 0;
}
