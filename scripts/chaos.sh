#!/usr/bin/env bash
# The chaos soak: builds what it needs, then runs build/bin/se-chaos, which
# starts modem-sim behind a fault relay, the daemon and eight clients in a
# fresh device root, injects faults at random times, checks every answer,
# every call's time, the channels left open and the daemon's figures, and
# prints a report whose last line is the summary. Everything it started is
# stopped when it ends, also when interrupted.
#
#   scripts/chaos.sh [--seconds N] [--seed S] [--pcsc] [se-chaos options...]
#
# --seconds N   length of the run (default 60)
# --seed S      the seed that fixes the schedule (default: from the clock);
#               a failure prints it, and the same seed replays the schedule
# --pcsc        eSE1 through the PC/SC library, pcscd and card-vpcd, with the
#               card pulled out and reset by another application (reported
#               as skipped where pcscd or vpcd is not installed)
# Other options go to se-chaos (build/bin/se-chaos --help). Environment:
# BUILD_DIR (default build), JOBS (default: the number of cores).
set -euo pipefail
cd "$(dirname "$0")/.."
if [ "${1:-}" = "--help" ] || [ "${1:-}" = "-h" ]; then
  sed -n '2,/^set -e/p' "$0" | sed -e '$d' -e 's/^# \{0,1\}//'
  exit 0
fi
build=${BUILD_DIR:-build}
jobs=${JOBS:-$(nproc)}

scripts/deps.sh >/dev/null
if ! { cmake -S . -B "$build" >/dev/null && cmake --build "$build" -j"$jobs" --target se-chaos >/dev/null; }; then
  echo "chaos: build failed (run: cmake --build $build --target se-chaos)" >&2
  exit 2
fi

pid=
stop() {
  # se-chaos stops its clients, the daemon and the simulators itself; its
  # children die with it should it be killed outright.
  if [ -n "$pid" ] && kill -0 "$pid" 2>/dev/null; then
    kill -TERM "$pid" 2>/dev/null || true
    wait "$pid" 2>/dev/null || true
  fi
  exit 130
}
trap stop INT TERM
"$build/bin/se-chaos" "$@" &
pid=$!
status=0
wait "$pid" || status=$?
pid=
exit $status
