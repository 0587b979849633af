#!/usr/bin/env bash
# Builds everything and runs every test.
#
#   scripts/test.sh          one plain build (build/) and its tests: the quick
#                            check while developing
#   scripts/test.sh --all    what CI runs (also when CI=true): a short run of
#                            every fuzz target (build-fuzz/, clang), then the
#                            whole suite built and run with address+undefined
#                            (build-asan/), thread (build-tsan/) and no
#                            sanitizer (build/), with the chaos soak
#                            (scripts/chaos.sh, 2 x 30 s) before the plain
#                            tests. The plain pass comes last, so the output
#                            ends with its ctest summary.
#
# Besides ctest (one process per test), every pass also runs each test binary
# whole, once, in shuffled order (whole_runs below), which shows state that
# leaks from one test to the next.
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

# Runs every test binary of build folder $1 whole and shuffled, $jobs at a
# time, under the wrapper given after it; one line per binary, the failed
# tests of those that fail, their output in $1/whole-runs/. Fails if any fails.
whole_runs() {
  local dir=$1
  shift
  mkdir -p "$dir/whole-runs"
  local bins=("$dir"/bin/*_test)
  [ -e "${bins[0]}" ] || { echo "no test binaries in $dir/bin"; return 1; }
  printf '%s\n' "${bins[@]}" | xargs -P "$jobs" -I{} sh -c '
    b=$1; shift; log="$0/whole-runs/$(basename "$b").log"
    # pcscd and its socket folder are machine-wide: its users take turns.
    case $(basename "$b") in *pcsc*) set -- flock "$0/whole-runs/pcscd.lock" "$@" ;; esac
    if "$@" timeout 600 "$b" --gtest_shuffle >"$log" 2>&1; then
      printf "whole %-28s ok\n" "$(basename "$b")"
    else
      printf "whole %-28s FAIL (%s)\n" "$(basename "$b")" "$log"
      grep -E "^\[  FAILED  \] .*\(" "$log" | head -10 | sed "s/^/    /"
      grep -E "seed of|AddressSanitizer|ThreadSanitizer|terminate|Segmentation" "$log" | head -3 | sed "s/^/    /"
      exit 1
    fi' "$dir" {} "$@"
}

if [ $all -eq 0 ]; then
  scripts/deps.sh
  build=${BUILD_DIR:-build}
  cmake -S . -B "$build" -DSE_SANITIZE="${SE_SANITIZE:-}" >/dev/null
  cmake --build "$build" -j"$jobs"
  status=0
  whole_runs "$build" || status=1
  ctest --test-dir "$build" --output-on-failure -j"$jobs" --timeout 300 || status=1
  [ $status -eq 0 ] || echo "=== failed: see the FAIL lines above and the ctest summary"
  exit $status
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
  stamp "$name: each test binary whole, shuffled"
  whole_runs "$dir" "$@" || failed+=("$name-whole")
  stamp "$name: tests"
  "$@" ctest --test-dir "$dir" --output-on-failure -j"$jobs" --timeout 300 || failed+=("$name")
}

pass address "${ASAN_DIR:-build-asan}" address
pass thread "${TSAN_DIR:-build-tsan}" thread "${tsan_wrap[@]}"
if [ ${#failed[@]} -ne 0 ]; then echo "=== failed so far: ${failed[*]}"; fi
# The chaos soak, 60 s in all: the fixed seed, then a new one; se-chaos
# prints each seed first, so a failure can be replayed. It runs before the
# plain pass's tests (it builds the same folder) so that the output still
# ends with their ctest summary.
stamp "chaos: 2 x 30 s"
scripts/chaos.sh --seconds 30 --seed 1207 || failed+=(chaos-1207)
scripts/chaos.sh --seconds 30 || failed+=(chaos)
pass plain "${BUILD_DIR:-build}" ""
# Nothing but the list of failed steps follows the last ctest summary.
if [ ${#failed[@]} -ne 0 ]; then echo "=== failed: ${failed[*]}"; exit 1; fi
