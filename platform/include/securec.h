#pragma once
// Bounded fill, copy, move and format routines. Every call takes the size of
// the destination; a call that would not fit writes nothing past the
// destination and returns an error instead.
#include <stddef.h>

#ifndef EOK
#define EOK 0
#endif
#ifndef ERANGE_AND_RESET
#define ERANGE_AND_RESET 162
#endif

#ifdef __cplusplus
extern "C" {
#endif

typedef int errno_t;

// Fills `count` bytes of `dest` with `c`; fails (EINVAL/ERANGE) when dest is
// null or count exceeds destMax.
errno_t memset_s(void* dest, size_t destMax, int c, size_t count);
// Copies `count` bytes; fails without copying when count exceeds destMax, a
// pointer is null or the ranges overlap.
errno_t memcpy_s(void* dest, size_t destMax, const void* src, size_t count);
// As memcpy_s, overlapping ranges allowed.
errno_t memmove_s(void* dest, size_t destMax, const void* src, size_t count);
// Formats at most min(count, destMax - 1) characters and always terminates.
// Returns the number of characters written, or -1 when the text was cut or
// the arguments are invalid (the destination then holds the cut text, or "").
int snprintf_s(char* strDest, size_t destMax, size_t count, const char* format, ...)
    __attribute__((format(printf, 4, 5)));
// Formats the whole text or nothing: -1 (and "") when it does not fit.
int sprintf_s(char* strDest, size_t destMax, const char* format, ...)
    __attribute__((format(printf, 3, 4)));

#ifdef __cplusplus
}
#endif
