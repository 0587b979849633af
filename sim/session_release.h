#pragma once
// Modem sessions that are still to be released. A release the modem could not
// take (it did not answer, or its port went away) is not dropped: the session
// is kept here and released before that modem's next request, so that no
// session stays open at the modem that no channel stands for.
#include <cstdint>

// Keeps `session` of `modem` for a later AT+CCHC.
void session_release_later(int32_t modem, int32_t session);
// Every session recorded for `modem` (its port was lost): kept for release
// once the port is back, and the table cleared. A modem that restarted
// answers the release with an error, which ends it as well.
void session_release_all(int32_t modem);
// On the worker of `modem`: sends AT+CCHC for each kept session; those the
// modem answered (with OK or an error) are done, the rest stay.
void session_release_pending(int32_t modem);
// Drops what is kept for `modem`: a modem replaced by another holds none.
void session_release_forget(int32_t modem);
// Sessions still kept for `modem` (tests and logs).
int32_t session_release_count(int32_t modem);
// AT+CCHC=session now: 1 released, 0 refused by the modem, -1 no answer.
int32_t session_release_now(const char* fn, int32_t session);
