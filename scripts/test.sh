#!/usr/bin/env bash
# Builds everything and runs every test.
#
#   scripts/test.sh          one plain build (build/) and its tests: the quick
#                            check while developing
#   scripts/test.sh --all    what CI runs (also when CI=true): a short run of
#                            every fuzz target (build-fuzz/, clang), then the
#                            whole suite built and run with address+undefined
#                            (build-asan/), thread (build-tsan/) and no
#                            sanitizer (build/). The plain pass comes last, so
#                            the output ends with its ctest summary.
#
# Environment: BUILD_DIR (plain pass folder), ASAN_DIR, TSAN_DIR, FUZZ_DIR
# (the other passes' folders), SE_SANITIZE (plain mode only: build that one
# pass with a sanitizer), FUZZ_SECONDS (per target, default 30), JOBS
# (default: the number of cores).
set -euo pipefail
cd "$(dirname "$0")/.."

all=0
if [ "${1:-}" = "--all" ] || [ "${CI:-}" = "true" ]; then all=1; fi
jobs=${JOBS:-$(nproc)}

if [ $all -eq 0 ]; then
  scripts/deps.sh
  build=${BUILD_DIR:-build}
  cmake -S . -B "$build" -DSE_SANITIZE="${SE_SANITIZE:-}" >/dev/null
  cmake --build "$build" -j"$jobs"
  ctest --test-dir "$build" --output-on-failure -j"$jobs" --timeout 300
  exit
fi

scripts/deps.sh fuzz
failed=()
stamp() { echo "=== $(date -u +%H:%M:%S) $*"; }

# Thread sanitizer runtimes of this era refuse the high-entropy address
# layouts of recent kernels; without address randomisation they run.
tsan_wrap=()
if [ "$(cat /proc/sys/vm/mmap_rnd_bits 2>/dev/null || echo 0)" -gt 28 ]; then
  tsan_wrap=(setarch "$(uname -m)" -R)
fi

stamp "fuzz: build"
fuzz_dir=${FUZZ_DIR:-build-fuzz}
if CC=clang CXX=clang++ cmake -S . -B "$fuzz_dir" -DSE_FUZZ=ON -DSE_SANITIZE=address >/dev/null &&
   cmake --build "$fuzz_dir" -j"$jobs" --target fuzz_all >/dev/null; then
  stamp "fuzz: ${FUZZ_SECONDS:-30} s per target"
  fuzz/run.sh -b "$fuzz_dir" -t "${FUZZ_SECONDS:-30}" -j "$jobs" || failed+=(fuzz)
else
  failed+=(fuzz-build)
fi

pass() {  # name, build dir, sanitizer, [wrapper...]
  local name=$1 dir=$2 san=$3
  shift 3
  stamp "$name: build"
  if ! { cmake -S . -B "$dir" -DSE_SANITIZE="$san" >/dev/null && cmake --build "$dir" -j"$jobs" >/dev/null; }; then
    failed+=("$name-build")
    return
  fi
  stamp "$name: tests"
  "$@" ctest --test-dir "$dir" --output-on-failure -j"$jobs" --timeout 300 || failed+=("$name")
}

pass address "${ASAN_DIR:-build-asan}" address
pass thread "${TSAN_DIR:-build-tsan}" thread "${tsan_wrap[@]}"
if [ ${#failed[@]} -ne 0 ]; then echo "=== failed so far: ${failed[*]}"; fi
pass plain "${BUILD_DIR:-build}" ""
# Nothing is printed after the last ctest summary; the status tells the rest.
[ ${#failed[@]} -eq 0 ]
