#include "status_words.h"

#include <cstdio>

namespace se_card {

namespace {
struct Entry {
  uint16_t sw;
  const char* name;
};

// One catalogue for every word the card gives and the ones a log reader
// commonly meets from other cards.
const Entry kCatalogue[] = {
    {SW_OK, "success"},
    {0x6281, "part of returned data may be corrupted"},
    {0x6282, "end of data reached before Le bytes"},
    {0x6283, "selected file deactivated"},
    {0x6400, "execution error"},
    {0x6581, "memory failure"},
    {SW_WRONG_LENGTH, "wrong length"},
    {SW_CHANNEL_NOT_SUPPORTED, "logical channel not supported or not open"},
    {SW_SM_NOT_SUPPORTED, "secure messaging not supported"},
    {0x6982, "security status not satisfied"},
    {SW_CONDITIONS_NOT_SATISFIED, "conditions of use not satisfied"},
    {0x6999, "applet selection failed"},
    {0x6A80, "incorrect data field"},
    {SW_FUNCTION_NOT_SUPPORTED, "function not supported"},
    {SW_NOT_FOUND, "file or application not found"},
    {SW_INCORRECT_P1P2, "incorrect parameters P1-P2"},
    {SW_REFERENCED_DATA_NOT_FOUND, "referenced data not found"},
    {0x6B00, "wrong parameters P1-P2"},
    {SW_INS_NOT_SUPPORTED, "instruction not supported"},
    {SW_CLA_NOT_SUPPORTED, "class not supported"},
    {SW_NO_PRECISE_DIAGNOSIS, "no precise diagnosis"},
};
}  // namespace

std::string statusWordName(uint16_t sw) {
  char buf[48];
  const unsigned low = sw & 0xFFu;
  switch (sw & 0xFF00u) {
    case SW_BYTES_AVAILABLE:
      snprintf(buf, sizeof(buf), "%u bytes available", low == 0 ? 256u : low);
      return buf;
    case SW_WRONG_LE:
      snprintf(buf, sizeof(buf), "wrong Le (exact 0x%02X)", low);
      return buf;
    default:
      break;
  }
  for (const Entry& e : kCatalogue) {
    if (e.sw == sw) return e.name;
  }
  return "unknown status";
}

}  // namespace se_card
