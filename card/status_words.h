#pragma once
// The status words the virtual card answers with, and their names for logs.
#include <cstdint>
#include <string>

namespace se_card {

enum StatusWord : uint16_t {
  SW_OK = 0x9000,
  SW_BYTES_AVAILABLE = 0x6100,  // low byte: bytes left for GET RESPONSE (00 = 256 or more)
  SW_WRONG_LENGTH = 0x6700,
  SW_CHANNEL_NOT_SUPPORTED = 0x6881,  // also: the logical channel is not open
  SW_SM_NOT_SUPPORTED = 0x6882,
  SW_CONDITIONS_NOT_SATISFIED = 0x6985,
  SW_FUNCTION_NOT_SUPPORTED = 0x6A81,  // also: no logical channel left
  SW_NOT_FOUND = 0x6A82,
  SW_INCORRECT_P1P2 = 0x6A86,
  SW_REFERENCED_DATA_NOT_FOUND = 0x6A88,
  SW_WRONG_LE = 0x6C00,  // low byte: the exact Le to use
  SW_INS_NOT_SUPPORTED = 0x6D00,
  SW_CLA_NOT_SUPPORTED = 0x6E00,
  SW_NO_PRECISE_DIAGNOSIS = 0x6F00,
};

// A short name for any status word ("success", "wrong Le (exact 0x10)", ...);
// words outside the catalogue get "unknown status".
std::string statusWordName(uint16_t sw);

}  // namespace se_card
