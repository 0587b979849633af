#!/usr/bin/env bash
# Runs every fuzz target (or the ones named) for a fixed time each.
#   fuzz/run.sh [-b build-dir] [-t seconds] [-j parallel] [target...]
# Seeds come from fuzz/corpus/<target>; what a run learns goes to
# <build-dir>/fuzz/work/<target> (kept between runs, so a long local run
# resumes where the last stopped); crashes to <build-dir>/fuzz/artifacts.
# Exit status is non-zero when any target found a crash, leak or time-out.
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
build="$here/../build-fuzz"
secs=30
jobs=1
while getopts "b:t:j:" o; do
  case $o in
    b) build=$OPTARG ;;
    t) secs=$OPTARG ;;
    j) jobs=$OPTARG ;;
    *) echo "usage: $0 [-b build-dir] [-t seconds] [-j parallel] [target...]" >&2; exit 2 ;;
  esac
done
shift $((OPTIND - 1))
targets=("$@")
if [ ${#targets[@]} -eq 0 ]; then
  for d in "$here"/corpus/*/; do targets+=("$(basename "$d")"); done
fi

mkdir -p "$build/fuzz/artifacts" "$build/fuzz/logs"
run_one() {
  local t=$1 bin="$build/fuzz/$1" work="$build/fuzz/work/$1" log="$build/fuzz/logs/$1.log"
  [ -x "$bin" ] || { echo "$t: missing $bin (build target fuzz_all with -DSE_FUZZ=ON)"; return 1; }
  mkdir -p "$work"
  # -close_fd_mask=2 keeps the daemon code's log lines off the terminal;
  # sanitizer reports still reach the log through libFuzzer's own descriptor.
  if "$bin" "$work" "$here/corpus/$t" -max_total_time="$secs" -timeout=10 -rss_limit_mb=2048 \
      -max_len=4096 -print_final_stats=1 -close_fd_mask=2 \
      -artifact_prefix="$build/fuzz/artifacts/$t-" >"$log" 2>&1; then
    printf '%-18s ok    %s\n' "$t" "$(grep -E '^(#[0-9]+.*DONE|stat::number_of_executed_units)' "$log" | tr '\n' ' ')"
  else
    printf '%-18s FAIL  see %s\n' "$t" "$log"
    grep -E 'ERROR|SUMMARY|==[0-9]+==|deadly signal' "$log" | head -5
    return 1
  fi
}

# xargs exits non-zero when any run does.
export -f run_one
export build here secs
printf '%s\n' "${targets[@]}" | xargs -P "$jobs" -I{} bash -c 'run_one "$1"' _ {}
