#include "se_modem_id.h"

int32_t g_ulModemId = 0;
