#pragma once
// The parts of the AT channel that need neither threads nor descriptors:
// cutting a byte stream into lines, sorting a line against the pending
// command, and finding the masked word of a logged text. The reader thread
// builds on them; tests and fuzzers can drive them directly.
#include <cstdint>

// Port data the input buffer holds; one more byte keeps it NUL-terminated.
constexpr int32_t AT_LINE_BUF_DATA = 8192;
constexpr int32_t AT_LINE_BUF_SIZE = AT_LINE_BUF_DATA + 1;

// Fills at most `max_len` bytes at `dest`: the count read, 0 at end of file,
// -1 on failure (errno set).
typedef int32_t (*AtReadFn)(void* arg, char* dest, int32_t max_len);

enum AtLineResult {
  AT_LINE_READ_ERROR = -1,  // the read function failed
  AT_LINE_EOF = 0,          // the read function gave 0 bytes; calling again goes on
  AT_LINE_READY = 1,        // *out_line holds the next line
};

// Resets the buffer to empty.
void at_line_reset(char* line_buf, char** line_cur, char** read_end);

// Hands out the next line of the stream. `line_buf` has AT_LINE_BUF_SIZE
// bytes; `line_cur` and `read_end` point into it (set them with
// at_line_reset first). Lines end at CR or LF, runs of them are skipped, and
// unconsumed data that is exactly "> " is the prompt line ">". NUL bytes in
// the input are dropped. A line that reaches AT_LINE_BUF_DATA bytes without
// an end is discarded (logged) and reading goes on. The returned line lives
// in `line_buf` until the next call.
int32_t at_line_next(char* line_buf, char** line_cur, char** read_end, AtReadFn read_fn,
                     void* arg, char** out_line);

// What a line means to the command that is waiting for its answer.
enum AtLineKind {
  AT_KIND_UNSOLICITED = 0,
  AT_KIND_FINAL_SUCCESS = 1,
  AT_KIND_FINAL_ERROR = 2,
  AT_KIND_INTERMEDIATE = 3,
};

extern const char* const final_error_prefixes[9];

// `pending` is non-zero while a command waits; `has_intermediate` non-zero
// when it already holds an intermediate line; `response_prefix` may be null.
AtLineKind at_classify_line(const char* line, int32_t pending, int32_t command_type,
                            int32_t has_intermediate, const char* response_prefix);

// Non-zero when `line` opens an SMS-type pair, whose next line belongs to it.
int32_t at_is_sms_unsolicited(const char* line);

// Words whose presence keeps a command or received line out of the log.
constexpr int32_t AT_MASK_WORD_COUNT = 70;
extern const char* const at_mask_words[AT_MASK_WORD_COUNT];

// The first word of at_mask_words (in table order) found anywhere in `text`,
// compared without regard to case; null when none is.
const char* at_mask_find(const char* text);
