#pragma once
// Which modem carries the SIM that the NFC side is switched to, and whether
// the device has a second modem. Inputs are read afresh on every call.
#include <cstdint>

#define NFC_SIM_SWITCH_NODE "/sys/nfc/nfc_sim_switch"
#define NFC_CARD_NUM_NODE "/sys/nfc/nfc_card_num"
#define NFC_WIRED_ESE_TYPE_NODE "/sys/nfc/nfc_wired_ese_type"
#define PROP_MODEM_NUMBER "ro.odm.config.modem_number"
#define PROP_SIM_SLOT_CFG "persist.odm.radio.sim_slot_cfg"

// First character of the file minus '0' (no range check), -1 on error.
int32_t getNFCNodeInfo(const char* path);
// 2 when the device has two modems, else 1.
int32_t judge_dual_sim(void);
// 0 or 1: the modem to use; -1 when the inputs give no answer.
int32_t communication_which_modem(void);
