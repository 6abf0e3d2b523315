#!/usr/bin/env bash
# End-to-end: what only the FastCGI front end has, through a private lighttpd
# that started velafcgi. A child that dies before answering (killed, crashed,
# _exit) gives the client a JSON error and the parent goes on; a description
# that changes is read anew; a parent that dies is replaced; the children at
# once are capped with a clear answer; a stop lets a request under way
# finish; and a few hundred requests leave no descriptor and no zombie
# behind.
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI WEBAPI PIPE_LIB SRC -- "$@"
srv_require "velafcgi runs as root under the server" pgrep

export VELA_FRONT_END=fcgi
# A sanitizer build leaves the crash below to the kernel, so that the child
# dies of SIGSEGV as it would in a plain build (and no report is written).
[ -z "${ASAN_OPTIONS:-}" ] || export ASAN_OPTIONS="$ASAN_OPTIONS:handle_segv=0"
srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
describe() {
  srv_api VELA.Pipe.Sub <<EOF
{"VELA.Pipe.Sub": {"lib": "$PIPE_LIB", "minVersion": 1, "maxVersion": 1, "authLevel": 0,
  "methods": {"1": [$1]}}}
EOF
}
describe '"crash", "sleep", "report"'
cat >"$ROOT/etc/vela/webapi.conf" <<'CONF'
fcgi_parents="2"
fcgi_max_children="2"
CONF
srv_serve
SUB="$URL?api=VELA.Pipe.Sub&version=1"

# The master is lighttpd's child; the parents are the master's.
master() { pgrep -P "$LPID" -x velafcgi | head -n 1; }
parents() { pgrep -P "$(master)" | sort; }
parent_count() { parents | wc -l; }
fds_of() {
  local pid n=0
  for pid in "$@"; do n=$((n + $(ls "/proc/$pid/fd" 2>/dev/null | wc -l))); done
  echo "$n"
}
two_parents() { [ "$(parent_count)" -eq 2 ]; }
at_least() { [ "$(srv_request_count)" -ge "$1" ]; }
at_most() { [ "$(srv_request_count)" -le "$1" ]; }
gone() { [ ! -d "/proc/$1" ]; }
zombies() { ps -o stat= --ppid "$(parents | paste -sd, -)" 2>/dev/null | grep -c '^Z'; }
m=$(master)
[ -n "$m" ] || { fail "no velafcgi master under lighttpd"; srv_finish ""; }
srv_wait 50 0.1 two_parents || fail "not two parents: $(parents | xargs)"

# ---- Children that die before answering: the client gets error 117 as JSON,
# the log says how, and the next request is served.
for how in kill segv exit; do
  call "$SUB&method=crash&how=$how"
  expect_status "crash $how" 500
  expect_error "crash $how" 117
  expect_header "crash $how" 'Content-type: application/json'
done
grep -q 'killed by signal 9 before answering' "$RUN/cgi.log" || fail "no log line for the killed child"
grep -q 'killed by signal 11 before answering' "$RUN/cgi.log" || fail "no log line for the crashed child"
grep -q 'ended with status 3 before answering' "$RUN/cgi.log" || fail "no log line for the child's _exit"
call "$SUB&method=report"
expect "served after the crashes" '"success":true'

# ---- A description that changes is read anew (within a second).
call "$SUB&method=fail"
expect_error "method not described yet" 103
describe '"crash", "sleep", "report", "fail"'
touch -d '+2 seconds' "$ROOT/usr/vela/velaman/webapi/VELA.Pipe.Sub.lib"
described() {
  call "$SUB&method=fail"
  ! grep -q '"code":103' "$TMP/body"
}
srv_wait 50 0.1 described || fail "the new method is still unknown: $(cat "$TMP/body")"

# ---- A method that asks to run in process is served by a parent itself
# once its API is warm there (a child's first call warms it up), and the
# parent goes on serving children afterwards.
describe '"crash", "sleep", "report", "fail", {"reportDefault": {"inProcess": true}}'
touch -d '+4 seconds' "$ROOT/usr/vela/velaman/webapi/VELA.Pipe.Sub.lib"
# (Until both parents have seen the new description, one may still refuse.)
in_process() {
  call "$SUB&method=reportDefault$1"
  local pid
  pid=$(sed -n 's/.*"pid":\([0-9]*\).*/\1/p' "$TMP/body")
  [ -n "$pid" ] && parents | grep -qx "$pid"
}
srv_wait 40 0.1 in_process "&x=1" || fail "never served in process: $(cat "$TMP/body")"
expect "in process" '"success":true' '"uid":[0,0,0]' '"params":{"api":"VELA.Pipe.Sub","method":"reportDefault","version":"1","x":"1"}'
srv_wait 40 0.1 in_process "" || fail "not served in process again: $(cat "$TMP/body")"
expect "in process again, the earlier call's parameters gone" '"params":{"api":"VELA.Pipe.Sub","method":"reportDefault","version":"1"}'
call "$SUB&method=report"
expect "a child after calls in process" '"success":true'
# Another API of the same library, already loaded for the first: it gets
# warm as well, and is served in process too.
srv_api VELA.Pipe.Ids <<EOF
{"VELA.Pipe.Ids": {"lib": "$PIPE_LIB", "minVersion": 1, "maxVersion": 1, "authLevel": 0,
  "methods": {"1": [{"dropped": {"inProcess": true}}]}}}
EOF
ids_in_process() {
  call "$URL?api=VELA.Pipe.Ids&version=1&method=dropped"
  local pid
  pid=$(sed -n 's/.*"pid":\([0-9]*\).*/\1/p' "$TMP/body")
  [ -n "$pid" ] && parents | grep -qx "$pid"
}
srv_wait 40 0.1 ids_in_process || fail "an API sharing a warm library is never served in process: $(cat "$TMP/body")"

# ---- At most two children at once (one per parent): two sleeping requests
# hold them, a third is refused with 503 and a JSON error. They sleep long
# enough for a loaded machine to start both before the first ends.
curl -s -o "$TMP/sleep1" --max-time 60 "$SUB&method=sleep&ms=8000" &
s1=$!
curl -s -o "$TMP/sleep2" --max-time 60 "$SUB&method=sleep&ms=8000" &
s2=$!
srv_wait 400 0.05 at_least 2 || fail "the sleeping requests did not start"
call "$SUB&method=report"
expect_status "third request at once" 503
expect_header "third request at once" 'Retry-After:'
expect_error "third request at once" 117
wait "$s1" "$s2"
grep -q '"success":true' "$TMP/sleep1" && grep -q '"success":true' "$TMP/sleep2" ||
  fail "the sleeping requests were not served: $(cat "$TMP/sleep1" "$TMP/sleep2")"

# ---- A parent that dies is replaced; requests go on meanwhile.
victim=$(parents | head -n 1)
kill -KILL "$victim"
replaced() { [ "$(parent_count)" -eq 2 ] && ! parents | grep -qx "$victim"; }
srv_wait 50 0.1 replaced || fail "the killed parent was not replaced: $(parents | xargs)"
call "$SUB&method=report"
expect "served after a parent died" '"success":true'

# ---- Many requests (served, refused, crashed) leave the master and the
# parents with the descriptors they had, and no zombie.
srv_wait 100 0.05 at_most 0
before=$(fds_of "$m" $(parents))
for i in $(seq 1 150); do
  curl -s -o /dev/null --max-time 20 "$SUB&method=report" &
  beside=$!
  curl -s -o /dev/null --max-time 20 -w '%{http_code}\n' "$SUB&method=crash&how=exit" >>"$TMP/codes"
  wait "$beside"
done
echo "crashing requests answered: $(sort "$TMP/codes" | uniq -c | xargs)"
srv_wait 100 0.05 at_most 0 || fail "request children left: $(srv_request_count)"
after=$(fds_of "$m" $(parents))
[ "$before" = "$after" ] || fail "descriptors of the master and parents: $before before, $after after"
[ "$(zombies)" -eq 0 ] || fail "zombies under the parents"

# ---- SIGTERM: no new request is taken, the one under way finishes.
curl -s -o "$TMP/last" --max-time 30 "$SUB&method=sleep&ms=2000" &
last=$!
srv_wait 100 0.05 at_least 1 || fail "the last request did not start"
kill -TERM "$m"
wait "$last"
grep -q '"success":true' "$TMP/last" || fail "the request under way at the stop: $(cat "$TMP/last")"
srv_wait 100 0.05 gone "$m" || fail "the master did not stop"

# ---- velafcgi on its own socket, as for nginx or Apache, asked directly with
# cgi-fcgi (every variable of its environment is a parameter): a parameter
# never sets the server's own variables, and the socket is not for others.
if command -v cgi-fcgi >/dev/null 2>&1; then
  VELAFCGI=$(dirname "$VELASCGI")/velafcgi
  "$VELAFCGI" --socket / 2>/dev/null && fail "velafcgi listened on /"
  "$VELAFCGI" --tcp 0.0.0.0:9 2>/dev/null && fail "velafcgi listened beyond the loopback address"
  "$VELAFCGI" --parents 0 2>/dev/null && fail "velafcgi took --parents 0"
  sock=$RUN/own.sock
  VELA_ROOT=$ROOT VELA_LOG_STDERR=1 "$VELAFCGI" --socket "$sock" --parents 1 --stderr "$RUN/cgi.log" &
  own=$!
  srv_wait 50 0.1 test -S "$sock" || fail "no socket $sock"
  [ "$(stat -c %a "$sock")" = 660 ] || fail "the socket's mode is $(stat -c %a "$sock")"
  direct() {
    env -i REQUEST_METHOD=GET QUERY_STRING="api=VELA.Pipe.Sub&version=1&method=report" REMOTE_ADDR=127.0.0.1 \
      SERVER_PROTOCOL=HTTP/1.1 VELA_WEBAPI_USERNAME=mallory "$@" cgi-fcgi -bind -connect "$sock" >"$TMP/direct"
  }
  srv_wait 50 0.1 direct || fail "cgi-fcgi could not ask velafcgi"
  grep -q '"success":true' "$TMP/direct" || fail "direct call: $(cat "$TMP/direct")"
  grep -q '"VELA_WEBAPI_USERNAME":"(unset)"' "$TMP/direct" || fail "a parameter set VELA_WEBAPI_USERNAME: $(cat "$TMP/direct")"
  # More parameters than a web server ever sends: refused with 117.
  mapfile -t many < <(seq -f 'P%g=x' 1 1001)
  direct "${many[@]}"
  grep -q '"code":117' "$TMP/direct" || fail "1001 parameters: $(head -c 300 "$TMP/direct")"
  grep -q 'more than 1000 parameters' "$RUN/cgi.log" || fail "no log line for 1001 parameters"
  kill -TERM "$own"
  wait "$own" || fail "velafcgi did not stop cleanly"
  [ ! -e "$sock" ] || fail "the socket was left behind"
fi

srv_finish "velafcgi checks passed ($URL)"
