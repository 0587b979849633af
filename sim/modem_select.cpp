#include "modem_select.h"

#include <cutils/properties.h>
#include <fcntl.h>
#include <securec.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "qv_log.h"

int32_t getNFCNodeInfo(const char* path) {
  if (path == nullptr) {
    QV_LOGE("%s input param error.\n", "getNFCNodeInfo");
    return -1;
  }
  int fd = open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    QV_LOGE("%s: open %s fail, %s.\n", "getNFCNodeInfo", path, strerror(errno));
    return -1;
  }
  char buf[3];
  (void)memset_s(buf, sizeof(buf), 0, sizeof(buf));
  ssize_t got = read(fd, buf, 1);
  int readErrno = errno;
  close(fd);
  if (got < 0) {
    QV_LOGE("%s: read %s fail, %s.\n", "getNFCNodeInfo", path, strerror(readErrno));
    return -1;
  }
  return static_cast<int32_t>(buf[0]) - '0';
}

namespace {

bool isDualCardsValue(const char* value) {
  return strcmp(value, "2") == 0 || strcmp(value, "3") == 0;
}

// The SIM the NFC side is switched to: 1 or 2.
int32_t judge_nfc_switch(int32_t simSwitch, int32_t cardNum, int32_t wiredEseType) {
  int32_t selectNfcSim;
  if (simSwitch < 0 || cardNum < 0 || wiredEseType < 0) {
    QV_LOGE("%s get param error=%d,%d,%d\n", "judge_nfc_switch", simSwitch, cardNum,
            wiredEseType);
    QV_LOGD("%s, select_nfc_sim=%d", "communication_which_modem", -1);
    QV_LOGE("%s, judge_nfc_switch error SET SIM1", "communication_which_modem");
    return 1;
  }
  if (simSwitch == 2 && (cardNum == 3 || (cardNum == 2 && wiredEseType == 0))) {
    selectNfcSim = 2;
  } else {
    selectNfcSim = 1;
  }
  QV_LOGD("%s, select_nfc_sim=%d", "communication_which_modem", selectNfcSim);
  return selectNfcSim;
}

}  // namespace

int32_t judge_dual_sim(void) {
  char dualcardsProp[PROPERTY_VALUE_MAX];
  (void)memset_s(dualcardsProp, sizeof(dualcardsProp), 0, sizeof(dualcardsProp));
  if (property_get(PROP_MODEM_NUMBER, dualcardsProp, "1") < 0) {
    QV_LOGE("%s, get persist.sys.dualcards error", "judge_dual_sim");
  }
  QV_LOGD("%s, dualcards_prop=%s", "judge_dual_sim", dualcardsProp);
  return isDualCardsValue(dualcardsProp) ? 2 : 1;
}

int32_t communication_which_modem(void) {
  static const char* const kFn = "communication_which_modem";
  int32_t simSwitch = getNFCNodeInfo(NFC_SIM_SWITCH_NODE);
  int32_t cardNum = getNFCNodeInfo(NFC_CARD_NUM_NODE);
  int32_t wiredEseType = getNFCNodeInfo(NFC_WIRED_ESE_TYPE_NODE);
  int32_t selectNfcSim = judge_nfc_switch(simSwitch, cardNum, wiredEseType);

  char dualcardsProp[PROPERTY_VALUE_MAX];
  char simSlot[PROPERTY_VALUE_MAX];
  (void)memset_s(dualcardsProp, sizeof(dualcardsProp), 0, sizeof(dualcardsProp));
  (void)memset_s(simSlot, sizeof(simSlot), 0, sizeof(simSlot));
  if (property_get(PROP_MODEM_NUMBER, dualcardsProp, "2") < 0) {
    QV_LOGE("%s, get persist.sys.dualcards error", kFn);
  }
  if (property_get(PROP_SIM_SLOT_CFG, simSlot, "0,1") < 0) {
    QV_LOGE("%s, get persist.odm.radio.sim_slot_cfg error", kFn);
  }
  QV_LOGD("%s, dualcards_prop=%s", kFn, dualcardsProp);
  QV_LOGD("%s, sim_slot=%s", kFn, simSlot);

  // With velk the value reads "2,a,b" and the slot order is in a and b.
  bool velk = simSlot[0] == '2';
  QV_LOGD(velk ? "%s, open through velk" : "%s, close through velk", kFn);
  bool dualSupport = isDualCardsValue(dualcardsProp);
  QV_LOGD(dualSupport ? "%s, support dual sim" : "%s, not support dual sim", kFn);

  // Characters past the end of a short value are the buffer's zeros, so the
  // slot text ends early there.
  char simSlotStr[3] = {0, 0, 0};
  simSlotStr[0] = velk ? simSlot[2] : simSlot[0];
  simSlotStr[1] = velk ? simSlot[4] : simSlot[2];
  QV_LOGD("%s, sim_slot_str=%s", kFn, simSlotStr);
  int32_t simSlotInt = static_cast<int32_t>(strtol(simSlotStr, nullptr, 10));
  QV_LOGD("%s, sim_slot_int=%d", kFn, simSlotInt);

  if (!dualSupport) {
    QV_LOGD(selectNfcSim == 1 ? "%s, selectmodem=%d" : "%s, else3 selectmodem=%d", kFn, 0);
    return 0;
  }
  int32_t selected = -1;
  if (simSlotInt == 1 || simSlotInt == 10) {
    bool normalOrder = simSlotInt == 1;
    if (!velk) {
      // Without velk the modems follow the slot order.
      selected = ((selectNfcSim == 1) == normalOrder) ? 0 : 1;
    } else if (selectNfcSim == 2 && normalOrder) {
      QV_LOGD("%s, else2 selectmodem=%d", kFn, 1);
      return 1;
    } else if (!(selectNfcSim == 1 && !normalOrder)) {
      selected = 1;
    }
  }
  if (selected < 0) {
    QV_LOGE("%s, else4 error=%d,%d,%d,%d", kFn, selectNfcSim, velk ? 1 : 0, 2, simSlotInt);
    return -1;
  }
  QV_LOGD("%s, selectmodem=%d", kFn, selected);
  return selected;
}
