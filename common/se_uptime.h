#pragma once
// The system's uptime, as the SIM front's start-up settling delay reads it.
// Its own unit in se_common, so that a test can link its own definition in
// its place and take both branches of the delay, and the failure, on any
// machine.
#include <cstdint>

// Seconds since boot into *seconds: 0, or -1 when the system cannot tell.
int32_t se_uptime_seconds(long* seconds);
