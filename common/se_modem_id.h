#pragma once
#include <atomic>
#include <cstdint>

// The modem the SIM front is currently working for. Written only by the SIM
// front; the request handlers and the AT channel read it to print it in log
// lines. It never selects a port. Atomic because those readers run on the
// worker and reader threads while a caller writes it.
extern std::atomic<int32_t> g_ulModemId;
