#include <fcntl.h>

#include "async_cmd.h"

int asyncCmdOpenPort(const char* path) {
  int fd = open(path, O_RDWR | O_NOCTTY);
  if (fd >= 0) (void)asyncCmdRawTerminal(fd, path);
  return fd;
}
