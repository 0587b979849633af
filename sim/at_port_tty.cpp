// A modem's AT port that is a terminal: a USB modem's /dev/ttyUSB* or
// /dev/ttyACM*. Until someone configures it, such a port has the kernel's
// default line discipline, which echoes every answer back to the modem (it
// answers ERROR to each, and those stray final lines would be taken as the
// answers of later commands), holds input back until a line end and turns
// CR into LF. The AT channel wants the bytes as the modem sends them.
#include <termios.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "async_cmd.h"
#include "qv_log.h"

int asyncCmdRawTerminal(int fd, const char* path) {
  if (fd < 0 || isatty(fd) == 0) return 0;  // a phone's AT device, a pipe: left as it is
  const char* name = path ? path : "(port)";
  struct termios t;
  if (tcgetattr(fd, &t) != 0) {
    QV_LOGE("%s, %s: cannot read the terminal settings: %s", "asyncCmdRawTerminal", name,
            strerror(errno));
    return -1;
  }
  // No echo, no canonical lines or signals, no CR/NL mapping on either side,
  // no software flow control eating bytes; 8 data bits, no parity, the
  // receiver on and the modem control lines ignored. The speed stays as set.
  t.c_iflag &= ~static_cast<tcflag_t>(IGNBRK | BRKINT | PARMRK | ISTRIP | INLCR | IGNCR | ICRNL |
                                      IXON | IXOFF | IXANY);
  t.c_oflag &= ~static_cast<tcflag_t>(OPOST);
  t.c_lflag &= ~static_cast<tcflag_t>(ECHO | ECHOE | ECHOK | ECHONL | ICANON | ISIG | IEXTEN);
  t.c_cflag &= ~static_cast<tcflag_t>(CSIZE | PARENB);
  t.c_cflag |= CS8 | CREAD | CLOCAL;
  t.c_cc[VMIN] = 1;
  t.c_cc[VTIME] = 0;
  if (tcsetattr(fd, TCSANOW, &t) != 0) {
    QV_LOGE("%s, %s: cannot put the terminal in raw mode: %s", "asyncCmdRawTerminal", name,
            strerror(errno));
    return -1;
  }
  QV_LOGI("%s, %s is a terminal: raw mode set (no echo, no line editing, 8 bits, speed kept)",
          "asyncCmdRawTerminal", name);
  return 1;
}
