#include <fcntl.h>

#include "async_cmd.h"

int asyncCmdOpenPort(const char* path) { return open(path, O_RDWR | O_NOCTTY); }
