#include "se_modem_id.h"

std::atomic<int32_t> g_ulModemId{0};
