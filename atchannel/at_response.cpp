// The helpers on a finished ATResponse. They touch no context, thread or
// descriptor, so code that fakes the channel can link them as they are.
#include <cstdlib>
#include <cstring>

#include "at_tok.h"
#include "atchannel.h"

void at_response_free(ATResponse* p_response) {
  if (p_response == nullptr) return;
  ATResponseLine* line = p_response->p_intermediates;
  while (line != nullptr) {
    ATResponseLine* next = line->next;
    free(line->text);
    free(line);
    line = next;
  }
  free(p_response->final_response);
  free(p_response);
}

int32_t at_get_cme_error(const ATResponse* p_response) {
  if (p_response == nullptr) return -1;
  if (p_response->success > 0) return 0;
  const char* prefix = "+CME ERROR:";
  if (p_response->final_response == nullptr ||
      strncmp(p_response->final_response, prefix, strlen(prefix)) != 0) {
    return -1;
  }
  char* cur = p_response->final_response;
  int32_t value = 0;
  if (at_tok_start(&cur) < 0 || at_tok_nextint(&cur, &value) < 0) return -1;
  return value;
}
