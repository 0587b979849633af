#include "at_tok.h"

#include <cctype>
#include <cstdlib>
#include <cstring>

namespace {

// Cuts the next field off the cursor in place; see at_tok.h for the rules.
char* nextTok(char** p_cur) {
  char* cur = *p_cur;
  while (*cur != '\0' && isspace(static_cast<unsigned char>(*cur))) ++cur;

  char* tok;
  if (*cur == '"') {
    ++cur;
    tok = cur;
    char* close = strchr(cur, '"');
    if (close == nullptr) {
      *p_cur = nullptr;
      return tok;
    }
    *close = '\0';
    cur = close + 1;
    // Whatever stands between the closing quote and the comma is skipped.
    while (*cur != '\0' && *cur != ',') ++cur;
    if (*cur == ',') ++cur;
    *p_cur = cur;
    return tok;
  }

  tok = cur;
  char* comma = strchr(cur, ',');
  if (comma == nullptr) {
    *p_cur = nullptr;
  } else {
    *comma = '\0';
    *p_cur = comma + 1;
  }
  return tok;
}

}  // namespace

int32_t at_tok_start(char** p_cur) {
  if (p_cur == nullptr || *p_cur == nullptr) return -1;
  char* colon = strchr(*p_cur, ':');
  if (colon == nullptr) {
    *p_cur = nullptr;
    return -1;
  }
  *p_cur = colon + 1;
  return 0;
}

int32_t at_tok_nextint(char** p_cur, int32_t* p_out) {
  if (p_cur == nullptr || *p_cur == nullptr || p_out == nullptr) return -1;
  char* tok = nextTok(p_cur);
  char* end = nullptr;
  long value = strtol(tok, &end, 10);
  // Kept to the low 32 bits, as the field is a 32-bit value on the wire.
  *p_out = static_cast<int32_t>(static_cast<uint32_t>(static_cast<unsigned long>(value)));
  return end == tok ? -1 : 0;
}

int32_t at_tok_nextstr(char** p_cur, char** p_out) {
  if (p_cur == nullptr || *p_cur == nullptr || p_out == nullptr) return -1;
  *p_out = nextTok(p_cur);
  return 0;
}
