#include "se_uptime.h"

#include <sys/sysinfo.h>

int32_t se_uptime_seconds(long* seconds) {
  struct sysinfo info;
  if (sysinfo(&info) != 0) return -1;
  *seconds = static_cast<long>(info.uptime);
  return 0;
}
