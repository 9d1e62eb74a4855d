#!/bin/sh
# Runs every benchmark of a build directory in turn: scripts/bench.sh BUILD_DIR
#
# The benchmarks' own dependencies are installed here, on demand, rather than
# by scripts/install-deps.sh, so that building and testing never need them:
# nginx with its echo module (the flush benchmark's receiver) and wrk (the
# load generator of the fbf-ingest benchmark).
set -eu
build="${1:?usage: $0 BUILD_DIR}"

BENCH_PACKAGES="nginx libnginx-mod-http-echo wrk"
missing=""
for p in $BENCH_PACKAGES; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing="$missing $p"
done
if [ -n "$missing" ]; then
  SUDO=""
  [ "$(id -u)" -eq 0 ] || SUDO="sudo"
  echo "Installing for the benchmarks:$missing"
  $SUDO apt-get update
  # No service of its own: the benchmark starts nginx with its own configuration.
  DEBIAN_FRONTEND=noninteractive RUNLEVEL=1 $SUDO apt-get install -y --no-install-recommends $missing
fi

found=0
for bench in "$build"/bin/bench-*; do
  [ -x "$bench" ] || continue
  found=1
  echo "== $(basename "$bench")"
  "$bench"
done
[ "$found" -eq 1 ] || { echo "no benchmarks in $build/bin" >&2; exit 1; }
