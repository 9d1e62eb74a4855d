#!/bin/sh
# Runs every benchmark of a build directory in turn: scripts/bench.sh BUILD_DIR
set -eu
build="${1:?usage: $0 BUILD_DIR}"
found=0
for bench in "$build"/bin/bench-*; do
  [ -x "$bench" ] || continue
  found=1
  echo "== $(basename "$bench")"
  "$bench"
done
[ "$found" -eq 1 ] || { echo "no benchmarks in $build/bin" >&2; exit 1; }
