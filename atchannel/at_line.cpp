#include "at_line.h"

#include <android/log.h>
#include <securec.h>

#include <cstddef>
#include <cstdint>
#include <cstring>

#include "atchannel.h"

namespace {

const char* const kTag = "atchannel";

const char* const kFinalSuccess[] = {"OK", "CONNECT"};

const char* const kSmsUnsolicited[] = {"+CMT:", "^BST:", "+CDS:", "+CBM:"};

bool startsWith(const char* line, const char* prefix) {
  return strncmp(line, prefix, strlen(prefix)) == 0;
}

template <size_t N>
bool startsWithAny(const char* line, const char* const (&table)[N]) {
  for (const char* p : table) {
    if (startsWith(line, p)) return true;
  }
  return false;
}

// A line that is nothing but a decimal number.
bool isBareNumber(const char* line) {
  if (*line == '\0') return false;
  for (; *line != '\0'; ++line) {
    if (*line < '0' || *line > '9') return false;
  }
  return true;
}

char* skipLineEnds(char* p) {
  while (*p == '\r' || *p == '\n') ++p;
  return p;
}

// The end of the line starting at `p`, or null when the data there is
// still a partial line. The prompt "> " is complete without a line end.
char* findLineEnd(char* p) {
  if (p[0] == '>' && p[1] == ' ' && p[2] == '\0') return p + 1;
  return strpbrk(p, "\r\n");
}

// Moves the unconsumed bytes to the front, so that a partial line always
// starts at the buffer's start and the over-long rule counts only its own
// bytes, however the stream was cut into reads.
void compact(char* line_buf, char** line_cur, char** read_end) {
  size_t len = static_cast<size_t>(*read_end - *line_cur);
  if (*line_cur != line_buf) {
    memmove_s(line_buf, AT_LINE_BUF_SIZE, *line_cur, len + 1);
  }
  *line_cur = line_buf;
  *read_end = line_buf + len;
}

// A NUL from the port would end the buffered text early and hide the line
// ends behind it; such bytes carry nothing for a text protocol.
int32_t dropNuls(char* p, int32_t n) {
  int32_t out = 0;
  for (int32_t i = 0; i < n; ++i) {
    if (p[i] != '\0') p[out++] = p[i];
  }
  return out;
}

// Case folding as tolower() does it in the C locale the daemon runs in.
inline unsigned char foldAscii(unsigned char c) {
  return (c >= 'A' && c <= 'Z') ? static_cast<unsigned char>(c - 'A' + 'a') : c;
}

// The mask words grouped by their folded first character, each group in
// table order, so that one pass over a text finds the earliest word in the
// table. Every sent and received AT line goes through the search, and an
// APDU line is over 500 characters: trying the 70 words one by one over the
// whole line cost more than the modem exchange itself.
struct MaskIndex {
  uint8_t first[256][AT_MASK_WORD_COUNT];
  uint8_t count[256];
  uint8_t length[AT_MASK_WORD_COUNT];
};

const MaskIndex& maskIndex() {
  static const MaskIndex index = [] {
    MaskIndex m{};
    for (size_t w = 0; w < static_cast<size_t>(AT_MASK_WORD_COUNT); ++w) {
      const unsigned char c = foldAscii(static_cast<unsigned char>(at_mask_words[w][0]));
      m.first[c][m.count[c]++] = static_cast<uint8_t>(w);
      m.length[w] = static_cast<uint8_t>(strlen(at_mask_words[w]));
    }
    return m;
  }();
  return index;
}

// Whether `word` (of length `wl`) starts at `t`, compared without regard to case.
bool matchesAt(const char* t, const char* word, size_t wl) {
  for (size_t i = 1; i < wl; ++i) {
    if (t[i] == '\0' ||
        foldAscii(static_cast<unsigned char>(t[i])) != foldAscii(static_cast<unsigned char>(word[i]))) {
      return false;
    }
  }
  return true;
}

}  // namespace

const char* const final_error_prefixes[9] = {
    "ERROR", "+CMS ERROR:", "+CME ERROR:", "COMMAND NOT SUPPORT", "NO CARRIER",
    "NO DIALTONE", "BUSY", "NO ANSWER", "ABORT",
};

const char* const at_mask_words[AT_MASK_WORD_COUNT] = {
    "CRSM", "CRLA", "CLCC", "ATD", "CCWA", "CCFC", "CLIP", "APDS", "VOLTEIMPU", "IMSMTRPT",
    "CACMIMS", "CLCCECONF", "ECONFDIAL", "ECONFERR", "CFSH", "CDISP", "CCONNNUM", "CCALLEDNUM",
    "CCALLINGNUM", "CREDIRNUM", "CCWAC", "CSSI", "ECCALL", "ECKMC", "ECRANDOM", "PHYNUM",
    "MEID:", "HPLMN:", "CECELLID", "CCMGS", "CCMT", "DHCP", "USIMICCID:", "ICCID:", "UICCAUTH",
    "CURSM", "KSNAFAUTH", "CLCK=", "CPWD", "CPIN=", "CPIN2=", "CPBW", "DPLMNLIST",
    "BLACKCELLLIST", "MCCFREQ", "DTMF", "UICCIMPU", "DMUSER", "IMSCTRLMSG", "IMSCTRLMSGU",
    "IMSPCSCF", "DMDYN", "IMSPSI", "NICKNAME", "VTDCONNV4", "VTDCONNV6", "DMCN",
    "LINEINDEXLIST", "LINEDETAIL", "CCHO=", "CCHP=", "CGLA", "CSIM=", "CSIM:", "CUSD",
    "SILENTPIN", "VOLTEIMPI:", "VOLTEDOMAIN:", "CSCA", "CGCONTRDP",
};

void at_line_reset(char* line_buf, char** line_cur, char** read_end) {
  line_buf[0] = '\0';
  *line_cur = line_buf;
  *read_end = line_buf;
}

int32_t at_line_next(char* line_buf, char** line_cur, char** read_end, AtReadFn read_fn,
                     void* arg, char** out_line) {
  char* end = nullptr;
  if (**line_cur == '\0') {
    at_line_reset(line_buf, line_cur, read_end);
  } else {
    *line_cur = skipLineEnds(*line_cur);
    end = findLineEnd(*line_cur);
    if (end == nullptr) compact(line_buf, line_cur, read_end);
  }

  while (end == nullptr) {
    if (*read_end - line_buf >= AT_LINE_BUF_DATA) {
      __android_log_buf_print(LOG_ID_RADIO, ANDROID_LOG_ERROR, kTag,
                              "ERROR: Input line exceeded buffer\n");
      at_line_reset(line_buf, line_cur, read_end);
    }
    int32_t room = AT_LINE_BUF_DATA - static_cast<int32_t>(*read_end - line_buf);
    int32_t n = read_fn(arg, *read_end, room);
    if (n < 0) return AT_LINE_READ_ERROR;
    if (n == 0) return AT_LINE_EOF;
    if (n > room) n = room;  // a read function never gets to overrun the buffer
    n = dropNuls(*read_end, n);
    (*read_end)[n] = '\0';
    *read_end += n;
    *line_cur = skipLineEnds(*line_cur);
    end = findLineEnd(*line_cur);
    if (end == nullptr) compact(line_buf, line_cur, read_end);
  }

  *end = '\0';
  *out_line = *line_cur;
  *line_cur = end + 1;
  return AT_LINE_READY;
}

AtLineKind at_classify_line(const char* line, int32_t pending, int32_t command_type,
                            int32_t has_intermediate, const char* response_prefix) {
  if (!pending) return AT_KIND_UNSOLICITED;
  if (startsWithAny(line, kFinalSuccess)) return AT_KIND_FINAL_SUCCESS;
  if (startsWithAny(line, final_error_prefixes)) return AT_KIND_FINAL_ERROR;
  if (has_intermediate) return AT_KIND_UNSOLICITED;
  const bool prefixed = response_prefix != nullptr && startsWith(line, response_prefix);
  if (command_type == at_type_singleline && prefixed) return AT_KIND_INTERMEDIATE;
  if (command_type == at_type_singleline_or_numeric && (prefixed || isBareNumber(line))) {
    return AT_KIND_INTERMEDIATE;
  }
  return AT_KIND_UNSOLICITED;
}

int32_t at_is_sms_unsolicited(const char* line) { return startsWithAny(line, kSmsUnsolicited) ? 1 : 0; }

const char* at_mask_find(const char* text) {
  if (text == nullptr) return nullptr;
  const MaskIndex& m = maskIndex();
  size_t best = static_cast<size_t>(AT_MASK_WORD_COUNT);  // earliest table index found so far
  for (const char* t = text; *t != '\0' && best > 0; ++t) {
    const unsigned char c = foldAscii(static_cast<unsigned char>(*t));
    for (uint8_t k = 0; k < m.count[c]; ++k) {
      const uint8_t w = m.first[c][k];
      if (w >= best) break;  // groups are in table order
      if (matchesAt(t, at_mask_words[w], m.length[w])) {
        best = w;
        break;
      }
    }
  }
  return best < static_cast<size_t>(AT_MASK_WORD_COUNT) ? at_mask_words[best] : nullptr;
}
