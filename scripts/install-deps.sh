#!/usr/bin/env bash
# Installs the Debian packages the project builds, tests and fuzzes with.
# Safe to run again: packages already present are skipped.
set -euo pipefail

packages=(
  build-essential cmake pkg-config
  libjsoncpp-dev
  libssl-dev openssl passwd
  libpam0g-dev
  libsqlite3-dev
  libcurl4-openssl-dev
  libfcgi-dev libfcgi-bin
  libgtest-dev libgmock-dev googletest
  libbenchmark-dev
  clang libclang-rt-dev
  wrk curl python3
  groff-base
  lighttpd media-types
  chromium
)
# Node.js and npm drive the browser test. A node that came from elsewhere
# (its own package that bundles npm) is kept: Debian's npm would replace it.
if ! command -v node >/dev/null 2>&1 || ! command -v npm >/dev/null 2>&1; then
  packages+=(nodejs npm)
fi

missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if [ "${#missing[@]}" -eq 0 ]; then
  exit 0
fi

sudo=""
if [ "$(id -u)" -ne 0 ]; then
  sudo="sudo"
fi
echo "installing: ${missing[*]}"
$sudo apt-get update -qq
DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq "${missing[@]}"
