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
# The other web servers the end-to-end tests run privately
# (tests/e2e/websrv.sh). Installed apart, below.
web_servers=(apache2 libapache2-mod-xsendfile nginx fcgiwrap)
# Node.js and npm drive the browser test. A node that came from elsewhere
# (its own package that bundles npm) is kept: Debian's npm would replace it.
if ! command -v node >/dev/null 2>&1 || ! command -v npm >/dev/null 2>&1; then
  packages+=(nodejs npm)
fi

installed() { dpkg-query -W -f='${Status}' "$1" 2>/dev/null | grep -q "install ok installed"; }
missing=() missing_web=()
for p in "${packages[@]}"; do
  installed "$p" || missing+=("$p")
done
for p in "${web_servers[@]}"; do
  installed "$p" || missing_web+=("$p")
done
if [ "${#missing[@]}" -eq 0 ] && [ "${#missing_web[@]}" -eq 0 ]; then
  exit 0
fi

sudo=""
if [ "$(id -u)" -ne 0 ]; then
  sudo="sudo"
fi
$sudo apt-get update -qq
if [ "${#missing[@]}" -gt 0 ]; then
  echo "installing: ${missing[*]}"
  DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq "${missing[@]}"
fi
if [ "${#missing_web[@]}" -eq 0 ]; then
  exit 0
fi

# The web servers' packages would start the machine's own daemons (apache2
# and nginx on port 80, where one fails beside the other or beside lighttpd,
# failing the install) and have them start at boot. The tests need neither:
# for the length of the install, a policy-rc.d (unless the machine has one)
# tells the maintainer scripts to start no service; afterwards the services
# that came with the install are disabled and, should one run, stopped.
policy=/usr/sbin/policy-rc.d
if [ ! -e "$policy" ]; then
  printf '#!/bin/sh\n# Written by the project'"'"'s scripts/install-deps.sh for one install: start no service.\nexit 101\n' |
    $sudo tee "$policy" >/dev/null
  $sudo chmod 0755 "$policy"
  trap '$sudo rm -f "$policy"' EXIT
fi
echo "installing: ${missing_web[*]}"
DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq "${missing_web[@]}"
for service in apache2 apache-htcacheclean nginx fcgiwrap; do
  case " ${missing_web[*]} " in
    *" ${service%%-*}"*) ;;
    *) continue ;;
  esac
  if [ -d /run/systemd/system ] && command -v systemctl >/dev/null 2>&1; then
    $sudo systemctl disable --now "$service" >/dev/null 2>&1 || true
    [ "$service" != fcgiwrap ] || $sudo systemctl disable --now fcgiwrap.socket >/dev/null 2>&1 || true
  fi
  if [ -x "/etc/init.d/$service" ]; then
    $sudo update-rc.d "$service" disable >/dev/null 2>&1 || true
    if $sudo "/etc/init.d/$service" status >/dev/null 2>&1; then
      $sudo "/etc/init.d/$service" stop >/dev/null 2>&1 || true
    fi
  fi
done
