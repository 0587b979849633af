#!/usr/bin/env bash
# Builds the daemon, the simulators and the benchmark (Release, in
# build-bench/) and prints one table: what one APDU costs through the daemon
# against its floors. Extra arguments go to se-bench (see se-bench --help);
# BUILD_DIR picks another build folder. scripts/bench.sh --pcsc [ARGS] runs
# se-bench-pcsc instead: eSE1 over PC/SC (pcscd, card-vpcd) and its floor.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
build=${BUILD_DIR:-build-bench}
cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release >/dev/null
if [ "${1:-}" = --pcsc ]; then
  # eSE1 through the PC/SC library and card-vpcd, against SCardTransmit.
  shift
  cmake --build "$build" -j"$(nproc)" --target se-bench-pcsc >/dev/null
  exec "$build/bin/se-bench-pcsc" "$@"
fi
cmake --build "$build" -j"$(nproc)" --target se-bench >/dev/null
exec "$build/bin/se-bench" "$@"
