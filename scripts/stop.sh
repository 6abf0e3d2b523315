#!/usr/bin/env bash
# Stops the lighttpd that scripts/start.sh started (the same system root:
# VELA_ROOT, "/" when installed there, else <build>/root; the same
# VELA_BUILD_DIR).
set -euo pipefail
repo="$(cd "$(dirname "$0")/.." && pwd)"

die() { echo "stop.sh: $*" >&2; exit 1; }

. "$repo/scripts/server-paths.sh"

if ! pid="$(running_pid)"; then
  echo "lighttpd is not running ($pidfile)"
  exit 0
fi
kill -TERM "$pid"
# Bounded by tries, not by the clock: lighttpd finishes the requests it
# serves, then exits.
for _ in $(seq 1 150); do
  [ -d "/proc/$pid" ] || break
  sleep 0.2
done
if [ -d "/proc/$pid" ]; then
  die "lighttpd (pid $pid) is still running"
fi
rm -f "$pidfile"
echo "lighttpd (pid $pid) stopped"
