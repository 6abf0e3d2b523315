#!/usr/bin/env bash
# The reply reaches the client at once, through the real web server (a
# private lighttpd, as in e2e.sh): work a handler leaves for after the reply
# (a slow callback, a restart of the web server) does not hold the answer
# open, and generated content (a download read from a pipe) goes out to its
# end without a length. No check measures time: the callback writes its
# marker file only when it ends, seconds after the reply, so the answer must
# be complete while the marker is still missing.
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI WEBAPI PIPE_LIB SRC -- "$@"
srv_require "the after-reply work runs as root" seq cmp sleep

# ---- The system root: the staged web-API directory plus VELA.Pipe.Test of
# the test handler library, run as root so that its callbacks are too; the
# web server to restart is a stand-in process ("sleep", which USR1 ends)
# named by a pid file under the root.
srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
srv_api VELA.Pipe.Test <<EOF
{"VELA.Pipe.Test": {"lib": "$PIPE_LIB", "minVersion": 1, "maxVersion": 1, "authLevel": 0, "runAs": "system",
  "methods": {"1": ["callback", {"stream": {"allowDownload": true}}]}}}
EOF
mkdir -p "$ROOT/run" || exit 1
sleep 600 &
standin=$!
disown "$standin"  # its end by USR1 is expected: no job report
srv_traps 'kill "$standin" 2>/dev/null'
echo "$standin" >"$ROOT/run/standin.pid"
chmod 0644 "$ROOT/run/standin.pid"
printf 'httpd_name="sleep"\nhttpd_pidfile="/run/standin.pid"\nhttpd_restart_signal="USR1"\n' \
  >"$ROOT/etc/vela/webapi.conf"
srv_serve

# The stand-in runs (a zombie, which kill -0 still finds, does not).
alive() {
  local state
  state=$(awk '{print $3}' "/proc/$standin/stat" 2>/dev/null)
  [ -n "$state" ] && [ "$state" != Z ]
}
gone() { ! alive; }

# ---- A handler whose callback takes 3 s, and a restart of the web server
# after it: the answer is complete before either has happened.
marker=$TMP/callback.done
call "$URL?api=VELA.Pipe.Test&version=1&method=callback&sleep=3&file=$marker"
expect_status "callback" 200
expect "callback" '"success":true'
[ -e "$marker" ] && fail "the answer was held until the callback ended"
srv_wait 600 0.1 test -s "$marker" || fail "the callback did not run"
call "$URL?api=VELA.Pipe.Test&version=1&method=callback&sleep=3&file=$marker.2&restart=1"
expect "callback and restart" '"success":true'
[ -e "$marker.2" ] && fail "the answer with a restart was held until the callback ended"
alive || fail "the answer with a restart was held until the web server was restarted"
srv_wait 600 0.1 gone || fail "the web server was not restarted after the reply"
srv_wait 600 0.1 test -s "$marker.2" || fail "the callback before the restart did not run"
kill "$standin" 2>/dev/null

# ---- Generated content: the output of a program, read from a pipe, whole
# and without a length of velascgi's own (a Range changes nothing).
seq 1 300000 >"$TMP/expected"
call -H "Range: bytes=0-9" "$URL?api=VELA.Pipe.Test&version=1&method=stream&count=300000"
expect_status "stream" 200
expect_header "stream" 'Content-Type: text/plain' 'Accept-Ranges: none'
cmp -s "$TMP/expected" "$TMP/body" || fail "stream: the body is not the program's output ($(wc -c <"$TMP/body") bytes)"

srv_finish "all reply checks passed ($URL)"
