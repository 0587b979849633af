// Port calls of the request worker, for fuzz targets that link the worker's
// unit for its pure helpers only; reaching any of them is a harness error.
#include <cstdlib>

#include <atchannel.h>

#include "session_release.h"

int32_t at_open(int32_t, AtUnsolHandler, int32_t) { abort(); }
void at_close(void) { abort(); }
void at_set_on_timeout(AtTimeoutCallback) { abort(); }
int32_t at_send_command(const char*, ATResponse**) { abort(); }
int32_t at_send_command_singleline(const char*, const char*, ATResponse**) { abort(); }
void at_response_free(ATResponse*) { abort(); }
int32_t at_get_cme_error(const ATResponse*) { abort(); }
int32_t at_send_command_singleline_or_numeric(const char*, const char*, ATResponse**) { abort(); }
int32_t get_ac_index(void) { abort(); }
int32_t at_is_closed(void) { abort(); }
int64_t at_silence_micros(int32_t) { abort(); }
int asyncCmdOpenPort(const char*) { abort(); }
void request_get_card_present(void) { abort(); }
void request_get_atr(void) { abort(); }
void request_open_logical_channel(void) { abort(); }
void request_close_logical_channel(void) { abort(); }
void request_transmit_apdu(void) { abort(); }
void clear_session_table(int32_t) { abort(); }
void session_release_later(int32_t, int32_t) { abort(); }
void session_release_all(int32_t) { abort(); }
void session_release_pending(int32_t) { abort(); }
void session_release_forget(int32_t) { abort(); }
int32_t session_release_count(int32_t) { abort(); }
int32_t session_release_now(const char*, int32_t) { abort(); }
