#pragma once
// Takes an AT response line apart in place: at_tok_start skips up to and
// past the first colon, then fields are read one by one, quoted or not.
#include <cstdint>

int32_t at_tok_start(char** p_cur);
int32_t at_tok_nextint(char** p_cur, int32_t* p_out);
int32_t at_tok_nextstr(char** p_cur, char** p_out);
