#!/usr/bin/env bash
# Installs the Debian packages the build, the tests and the demo need.
# Idempotent: apt-get runs only when something is missing.
set -euo pipefail

PACKAGES=(
  cmake ninja-build g++ pkg-config ccache make
  libasio-dev libspdlog-dev libfmt-dev nlohmann-json3-dev
  libcurl4-openssl-dev libssl-dev zlib1g-dev libplist-dev
  libprotobuf-dev protobuf-compiler libsqlite3-dev sqlite3
  libicu-dev liburiparser-dev libpsl-dev publicsuffix
  systemtap-sdt-dev libsystemd-dev libglib2.0-dev
  libgtest-dev libgmock-dev libbenchmark-dev
  faketime openssl curl python3
  clang libclang-rt-14-dev systemd libseccomp-dev
)

missing=()
for p in "${PACKAGES[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$p")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  exit 0
fi

SUDO=""
if [ "$(id -u)" -ne 0 ]; then SUDO="sudo"; fi
echo "Installing: ${missing[*]}"
$SUDO apt-get update
DEBIAN_FRONTEND=noninteractive $SUDO apt-get install -y --no-install-recommends "${missing[@]}"
