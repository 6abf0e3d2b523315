#!/usr/bin/env bash
# End-to-end: what one client can make the server spend. A form body built to
# make the parser quadratic, a body that never arrives, more requests at once
# than a client may have, and "version" texts that only look like 1, each
# through a private lighttpd.
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI WEBAPI SRC -- "$@"
srv_require "velascgi runs as root under the server" timeout

srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
cat >"$ROOT/etc/vela/webapi.conf" <<'CONF'
request_body_idle_seconds="8"
request_max_per_client="3"
CONF
srv_serve
port=${BASE##*:}

cgi_count() { srv_request_count; }
cgi_none() { [ "$(cgi_count)" -eq 0 ]; }
# Client slots held: the one-byte locks on the slot file (/proc/locks names
# a file as MAJOR:MINOR:INODE).
slots_held() {
  local inode
  inode=$(stat -c %i "$ROOT/run/vela/clients.lock" 2>/dev/null) || { echo 0; return; }
  grep -cE " [0-9a-f]+:[0-9a-f]+:$inode " /proc/locks
}
slots_at_least() { [ "$(slots_held)" -ge "$1" ]; }

# ---- 16 MiB of "&": answered at once (the parser is linear), not after
# minutes of CPU.
head -c 16777216 /dev/zero | tr '\0' '&' >"$TMP/amps"
start=$(date +%s)
call --data-binary "@$TMP/amps" -H 'Content-Type: application/x-www-form-urlencoded' "$URL"
took=$(($(date +%s) - start))
# The answer itself is the check (curl gives up after 60 s; the quadratic
# parser took many minutes); the time is printed, not judged.
expect_error "16 MiB of &" 101
echo "16 MiB of & answered in $took s"

# ---- "version" texts that are not exactly a number name no version (101),
# refused in the same JSON shape by lighttpd itself ("1%00") or by velascgi.
for v in '1%00' '1e0' '%201' '%2B1' '1.0' '1.' '0x1' '99999999999999999999'; do
  call "$URL?api=VELA.Sample&version=$v&method=echo"
  expect_error "version $v" 101
  expect_header "version $v" 'Content-Type: application/json'
done
call "$URL?api=VELA.Sample&version=1&method=echo"
expect "version 1 reaches the session check" '"code":119'

# ---- lighttpd's other refusals answer JSON too.
call -H "X-Big: $(head -c 70000 /dev/zero | tr '\0' a)" "$URL?api=VELA.Sample&version=1&method=echo"
expect_error "header too large" 101
call "$BASE/no-such-page"
expect_status "missing page" 404
expect_error "missing page" 101

# ---- A chunked body reaches the API like one with a length.
call -H 'Transfer-Encoding: chunked' --data-binary 'api=VELA.Sample&version=1&method=echo' "$URL"
expect "chunked body" '"code":119'

# ---- Slow bodies: a client that announces 1000 bytes, sends 2 and waits
# holds a root process only for the idle time, and only a few at once. Each
# holder's answer goes to its own file (30 s at most). The idle time leaves
# a loaded machine (sanitizers, a parallel suite) room to start the three
# and ask the fourth before it runs out.
slow_body() {
  (
    exec 3<>"/dev/tcp/127.0.0.1/$port" || exit 1
    printf 'POST /webapi/entry.cgi HTTP/1.1\r\nHost: 127.0.0.1\r\nConnection: close\r\n%s\r\n%s\r\n\r\nap' \
      'Content-Type: application/x-www-form-urlencoded' 'Content-Length: 1000' >&3
    timeout 30 cat <&3 >"$1"
  ) &
}
# The requests above are over, their processes gone (a sanitizer build's
# exit takes a moment, and a process keeps its slot until it is gone).
srv_wait 200 0.1 cgi_none || fail "request processes left before the slow bodies: $(cgi_count)"
slow_body "$TMP/slow1"; p1=$!
slow_body "$TMP/slow2"; p2=$!
slow_body "$TMP/slow3"; p3=$!
# Started and holding their slots (a process may be slow to get there).
srv_wait 400 0.05 slots_at_least 3 || fail "slow body: $(slots_held) slots held, expected 3"
# A fourth request of the same client, while three are under way.
call "$URL?api=VELA.Sample&version=1&method=echo"
expect_status "fourth request at once" 503
expect_header "fourth request at once" 'Retry-After:'
expect "fourth request at once" '"success":false'
wait "$p1" "$p2" "$p3"
for f in "$TMP/slow1" "$TMP/slow2" "$TMP/slow3"; do
  grep -q '"code":101' "$f" || fail "slow body: no 101 answer after the idle time: $(head -c 300 "$f")"
done
grep -q 'nothing arrived for 8 s' "$RUN/cgi.log" || fail "slow body: no log line"
# Gone once their answers are out (a sanitizer build takes a moment to exit).
srv_wait 100 0.1 cgi_none || fail "request processes left: $(cgi_count)"
# Slots come back when their requests end.
call "$URL?api=VELA.Sample&version=1&method=echo"
expect "after the slow bodies" '"code":119'

srv_finish "all limit checks passed"
