#!/usr/bin/env bash
# Checks the shipped units: `systemd-analyze verify` must be clean and the
# service's exposure score at most 2.5. Runs without a user manager: the
# units are verified for a throw-away home whose ~/.local/bin holds the
# daemon (or, before a build, a placeholder), as `make install` would lay out.
set -euo pipefail
cd "$(dirname "$0")/.."
MAX_EXPOSURE=${MAX_EXPOSURE:-2.5}
BIN=${1:-build/release/bin/vireon-fbf}

if ! command -v systemd-analyze >/dev/null; then
  echo "check-unit: systemd-analyze is missing (package systemd)" >&2
  exit 1
fi

home=$(mktemp -d)
trap 'rm -rf "$home"' EXIT
mkdir -p -m 0700 "$home/.local/bin" "$home/run" "$home/.config/systemd/user"
if [ -x "$BIN" ]; then
  ln -s "$(realpath "$BIN")" "$home/.local/bin/vireon-fbf"
else
  printf '#!/bin/sh\nexit 0\n' > "$home/.local/bin/vireon-fbf"
  chmod 0755 "$home/.local/bin/vireon-fbf"
fi
cp packaging/vireon-fbf.service packaging/vireon-fbf.socket packaging/vireon-fbf.timer "$home/.config/systemd/user/"

status=0
for mode in --system --user; do
  out=$(HOME="$home" XDG_RUNTIME_DIR="$home/run" XDG_CONFIG_HOME="$home/.config" \
        systemd-analyze $mode verify --man=no "$home"/.config/systemd/user/vireon-fbf.{service,socket,timer} 2>&1) || status=1
  if [ -n "$out" ]; then
    echo "check-unit: systemd-analyze $mode verify:" >&2
    echo "$out" >&2
    status=1
  fi
done

score=$(HOME="$home" systemd-analyze security --offline=yes --no-pager packaging/vireon-fbf.service 2>/dev/null |
        sed -n 's/.*Overall exposure level for vireon-fbf.service: \([0-9.]*\).*/\1/p')
if [ -z "$score" ]; then
  echo "check-unit: no exposure score from systemd-analyze security" >&2
  exit 1
fi
echo "check-unit: exposure $score (at most $MAX_EXPOSURE)"
if ! awk -v s="$score" -v m="$MAX_EXPOSURE" 'BEGIN { exit !(s <= m) }'; then
  echo "check-unit: exposure $score is above $MAX_EXPOSURE" >&2
  status=1
fi
exit $status
