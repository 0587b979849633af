#pragma once
#include <cstdint>

// The modem the SIM front is currently working for. Written only by the SIM
// front; the request handlers and the AT channel read it to print it in log
// lines. It never selects a port.
extern int32_t g_ulModemId;
