#!/usr/bin/env bash
# Builds the daemon, the simulators and the benchmark (Release, in
# build-bench/) and prints one table: what one APDU costs through the daemon
# against its floors. Extra arguments go to se-bench (see se-bench --help);
# BUILD_DIR picks another build folder.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
build=${BUILD_DIR:-build-bench}
cmake -S . -B "$build" -DCMAKE_BUILD_TYPE=Release >/dev/null
cmake --build "$build" -j"$(nproc)" --target se-bench >/dev/null
exec "$build/bin/se-bench" "$@"
