#!/usr/bin/env bash
# Runs every libFuzzer harness of a fuzz build for SECONDS each, one at a
# time (one core), and prints executions per harness.
#   scripts/fuzz.sh BUILD_DIR SECONDS [HARNESS...]
# The committed seeds (tests/fuzz/corpus/<harness>) are read, never written:
# what a run finds goes to BUILD_DIR/corpus/<harness>, crashes and broken
# invariants to BUILD_DIR/artifacts/. Exit status 1 when any harness failed.
set -uo pipefail
cd "$(dirname "$0")/.."
BUILD=${1:?build directory}
SECONDS_EACH=${2:?seconds per harness}
shift 2
if [ $# -gt 0 ]; then
  harnesses=("$@")
else
  harnesses=()
  for f in tests/fuzz/fuzz_*.cc; do harnesses+=("$(basename "$f" .cc)"); done
fi

export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1:symbolize=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}
mkdir -p "$BUILD/artifacts" "$BUILD/logs"
summary="$BUILD/fuzz-summary.txt"
: > "$summary"
failed=0
for h in "${harnesses[@]}"; do
  bin="$BUILD/fuzz/$h"
  if [ ! -x "$bin" ]; then
    echo "fuzz: $bin is missing" >&2
    failed=1
    continue
  fi
  work="$BUILD/corpus/$h"
  mkdir -p "$work"
  args=(-max_total_time="$SECONDS_EACH" -print_final_stats=1 -rss_limit_mb=2048 -timeout=20
        -artifact_prefix="$BUILD/artifacts/$h-")
  [ -f "tests/fuzz/dict/$h.dict" ] && args+=(-dict="tests/fuzz/dict/$h.dict")
  seeds=()
  [ -d "tests/fuzz/corpus/$h" ] && seeds+=("tests/fuzz/corpus/$h")
  log="$BUILD/logs/$h.log"
  "$bin" "${args[@]}" "$work" "${seeds[@]}" > "$log" 2>&1
  rc=$?
  execs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log" | tail -1)
  cov=$(grep -o 'cov: [0-9]*' "$log" | tail -1 | cut -d' ' -f2)
  if [ $rc -ne 0 ]; then
    failed=1
    printf '%-22s FAILED (exit %d) after %s executions; see %s\n' "$h" "$rc" "${execs:-?}" "$log" | tee -a "$summary"
    grep -E 'invariant broken|ERROR: (AddressSanitizer|libFuzzer)|runtime error|Test unit written' "$log" | head -5
  else
    printf '%-22s %12s executions in %ss, coverage %s\n' "$h" "${execs:-?}" "$SECONDS_EACH" "${cov:-?}" | tee -a "$summary"
  fi
done
exit $failed
