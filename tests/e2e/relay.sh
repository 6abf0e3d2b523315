#!/usr/bin/env bash
# Calls relayed to a peer appliance: two servers of their own (each its own
# system root, sessions and tokens), the peer on 127.0.0.2 and this server
# on 127.0.0.1, which names the peer in its peers file with an access token
# the peer issued. Then: calls relayed as query and as form, a download with
# and without a range, an upload; callers without a session or without the
# relay privilege; peers that are unknown, down, silent, garbled or too
# talkative, or behind TLS with a certificate trusted or not, pinned or
# not; a peers file others may read; the same from velaapi; the peer's
# token revoked there.
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI VELAADM VELAAPI WEBAPI SRC -- "$@"
srv_require "velascgi switches to the identity each API asks for" python3 cmp cksum openssl base64

# ---- The peer: its own root, a data volume with a file (this server has
# no volume: a file that comes back came from the peer).
SRV_BIND=127.0.0.2
srv_init "$SRC" "$VELASCGI" "$WEBAPI" private || exit 1
mkdir -p "$ROOT/vol1/sample"
echo /vol1 >"$ROOT/etc/vela/volumes.conf"
head -c 300000 /dev/urandom >"$ROOT/vol1/sample/data.bin"
srv_serve
PEER_ROOT=$ROOT PEER_RUN=$RUN PEER_BASE=$BASE
issued=$(VELA_ROOT=$PEER_ROOT "$VELAADM" token create root --api 'VELA.*' --method '*')
PEER_TOKEN=$(sed -n 's/^token=//p' <<<"$issued")
PEER_TOKEN_ID=$(sed -n 's/^id=//p' <<<"$issued")
[ -n "$PEER_TOKEN" ] || { fail "the peer issued no token"; exit 1; }
cp "$PEER_ROOT/vol1/sample/data.bin" "$PEER_RUN/../data.bin.copy"
DATA=$PEER_RUN/../data.bin.copy
srv_aside

LISTENERS=()
srv_traps 'kill "${LISTENERS[@]}" 2>/dev/null; if [ "$failures" -ne 0 ]; then
  echo "---- peer logs"; tail -n 60 "$PEER_RUN/cgi.log" "$PEER_RUN/error.log" 2>/dev/null; fi'

# ---- This server. Its echo may be served in process by a warm velafcgi
# parent: a relayed echo never is.
SRV_BIND=127.0.0.1
srv_init "$SRC" "$VELASCGI" "$WEBAPI" private || exit 1
srv_api VELA.Sample.Echo <<'EOF'
{"VELA.Sample.Echo": {"lib": "sample/libvela-sample.so", "minVersion": 1, "maxVersion": 1,
                      "methods": {"1": [{"echo": {"inProcess": true}}]}}}
EOF
srv_serve
adm() { VELA_ROOT=$ROOT "$VELAADM" "$@"; }
session() { adm session create "$1" | sed -n 's/^sid=//p'; }
ADMIN_SID=$(session root)
USER_SID=$(session nobody)
[ -n "$ADMIN_SID" ] && [ -n "$USER_SID" ] || { fail "velaadm created no session"; exit 1; }

# Listeners that play broken peers: "silent" accepts and never answers,
# "garbage" answers HTML, "huge" answers more JSON than is taken,
# "telltale" answers with the token it was given. Started
# here, not in a subshell, so that the exit trap ends them; the port is in
# $port.
listener() {
  python3 - "$1" >"$TMP/$1.port" 2>/dev/null <<'PY' &
import socket, sys
mode = sys.argv[1]
s = socket.socket()
s.bind(("127.0.0.1", 0))
s.listen(16)
print(s.getsockname()[1], flush=True)
held = []
while True:
    c, _ = s.accept()
    if mode == "silent":
        held.append(c)
        continue
    head = c.recv(65536)
    if mode == "telltale":
        token = [l.split(b":", 1)[1].strip() for l in head.split(b"\r\n") if l.lower().startswith(b"x-vela-access-token:")]
        c.sendall(b"HTTP/1.0 200 OK\r\nContent-Type: application/json\r\n\r\n" +
                  b'{"success":true,"data":{"heard":"' + (token[0] if token else b"") + b'"}}')
    elif mode == "garbage":
        c.sendall(b"HTTP/1.0 200 OK\r\nContent-Type: text/html\r\n\r\n<html>not json</html>")
    else:
        body = b'{"success":true,"data":"' + b"x" * (6 << 20) + b'"}'
        c.sendall(b"HTTP/1.0 200 OK\r\nContent-Type: application/json\r\n\r\n" + body)
    c.close()
PY
  LISTENERS+=($!)
  srv_wait 50 0.1 test -s "$TMP/$1.port" || fail "listener $1 did not start"
  port=$(cat "$TMP/$1.port")
}
add_peer() { printf '%s\n' "$2" | adm peer add "$1" --url "$3" --token-stdin >/dev/null || fail "peer add $1"; }
add_peer b "$PEER_TOKEN" "$PEER_BASE"
add_peer down x.y "http://127.0.0.1:1"
for mode in silent garbage huge telltale; do
  listener $mode
  add_peer $mode "$mode.token-of-this-appliance" "http://127.0.0.1:$port"
done

# A peer behind TLS with a certificate of its own: trusted through the CA
# file named for it, and with its public key pinned, never by default.
mkdir -p "$ROOT/etc/vela/certs"
openssl req -x509 -newkey rsa:2048 -nodes -days 2 -subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 \
  -keyout "$TMP/tls.key" -out "$ROOT/etc/vela/certs/tls.pem" 2>/dev/null || fail "openssl made no certificate"
pin=sha256//$(openssl x509 -in "$ROOT/etc/vela/certs/tls.pem" -pubkey -noout | openssl pkey -pubin -outform der |
  openssl dgst -sha256 -binary | base64)
python3 - "$ROOT/etc/vela/certs/tls.pem" "$TMP/tls.key" >"$TMP/tls.port" 2>/dev/null <<'PY' &
import http.server, ssl, sys
class Answer(http.server.BaseHTTPRequestHandler):
    def do_POST(self):
        self.rfile.read(int(self.headers.get("Content-Length", 0)))
        body = b'{"success":true,"data":{"over":"tls"}}'
        self.send_response(200)
        self.send_header("Content-Type", "application/json")
        self.send_header("Content-Length", str(len(body)))
        self.end_headers()
        self.wfile.write(body)
    def log_message(self, *args):
        pass
server = http.server.HTTPServer(("127.0.0.1", 0), Answer)
context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
context.load_cert_chain(sys.argv[1], sys.argv[2])
server.socket = context.wrap_socket(server.socket, server_side=True)
print(server.server_address[1], flush=True)
server.serve_forever()
PY
LISTENERS+=($!)
srv_wait 50 0.1 test -s "$TMP/tls.port" || fail "the TLS listener did not start"
TLS_URL=https://127.0.0.1:$(cat "$TMP/tls.port")
printf 'x.y\n' | adm peer add tls --url "$TLS_URL" --ca-file /etc/vela/certs/tls.pem --token-stdin >/dev/null ||
  fail "peer add tls"
printf 'x.y\n' | adm peer add tlspin --url "$TLS_URL" --ca-file /etc/vela/certs/tls.pem --pin "$pin" \
  --token-stdin >/dev/null || fail "peer add tlspin"
printf 'x.y\n' | adm peer add tlsbadpin --url "$TLS_URL" --ca-file /etc/vela/certs/tls.pem \
  --pin "sha256//$(head -c 32 /dev/urandom | base64)" --token-stdin >/dev/null || fail "peer add tlsbadpin"
add_peer tlsnoca x.y "$TLS_URL"
[ "$(stat -c '%a %U' "$ROOT/etc/vela/peers.json")" = "600 root" ] || fail "peers.json is not 0600 root"
adm peer list | grep -qF "$PEER_TOKEN" && fail "peer list shows the token"
adm peer list | grep -q "^b .*$PEER_BASE" || fail "peer list lacks b"
printf 'x.y\n' | adm peer add evil --url "http://10.1.1.1" --token-stdin 2>/dev/null &&
  fail "plain http to another machine was accepted"
printf 'x.y\n' | adm peer add ../x --url "$PEER_BASE" --token-stdin 2>/dev/null && fail "peer name ../x accepted"
adm peer test b --api VELA.Sample --method echo | grep -qF '"success":true' || fail "peer test b"
adm peer test down >/dev/null 2>&1 && fail "peer test of a peer that is down succeeded"

ONLY="api=VELA.Sample.Echo&version=1&method=echo"

# ---- Relayed calls, as query and as form.
call --cookie "id=$ADMIN_SID" "$URL?$ONLY&text=hi&relay_ds=b"
expect_status "relayed GET" 200
expect "relayed GET" '"success":true' '"text":"hi"' '"api":"VELA.Sample.Echo"'
grep -qF relay_ds "$TMP/body" && fail "relay_ds reached the peer"
# The caller's session id stays here; the peer's echo shows what it got.
call "$URL?$ONLY&text=sid&_sid=$ADMIN_SID&relay_ds=b"
expect "relayed with _sid" '"success":true' '"text":"sid"'
grep -qF -e "$ADMIN_SID" -e "$PEER_TOKEN" "$TMP/body" && fail "a session id or token came back from the peer: $(cat "$TMP/body")"
call --cookie "id=$ADMIN_SID" --data "$ONLY&text=posted&n=7&relay_ds=b&relay_timeout=30" "$URL"
expect "relayed POST form" '"success":true' '"text":"posted"' '"n":"7"'

# Once every velafcgi parent is warm (has the sample library mapped), the
# echo could be served by a parent itself; relayed, it never is: no parent
# maps libcurl.
if [ "${VELA_FRONT_END:-fcgi}" = fcgi ]; then
  master=$(pgrep -P "$LPID" -x velafcgi | head -n 1)
  all_warm() {
    call --cookie "id=$ADMIN_SID" "$URL?$ONLY&text=warm"
    local parent
    for parent in $(pgrep -P "$master"); do
      grep -q libvela-sample "/proc/$parent/maps" || return 1
    done
  }
  srv_wait 50 0.1 all_warm || fail "the velafcgi parents never got warm"
  for _ in 1 2 3 4; do
    call --cookie "id=$ADMIN_SID" "$URL?$ONLY&text=again&relay_ds=b"
    expect "relayed GET of a method served in process" '"success":true' '"text":"again"'
  done
  for parent in $(pgrep -P "$master"); do
    grep -q libcurl "/proc/$parent/maps" && fail "velafcgi parent $parent mapped libcurl"
  done
fi

# ---- A download, whole and ranged, and an upload stream through.
DL="$URL?api=VELA.Sample&version=1&method=download&name=data.bin&relay_ds=b"
call --cookie "id=$ADMIN_SID" "${DL%&relay_ds=b}"
expect "download here" '"success":false'
call --cookie "id=$ADMIN_SID" "$DL"
expect_status "relayed download" 200
cmp -s "$TMP/body" "$DATA" || fail "relayed download: bytes differ"
expect_header "relayed download" 'Content-Length: 300000'
call --cookie "id=$ADMIN_SID" -r 1000-1999 "$DL"
expect_status "relayed range" 206
expect_header "relayed range" 'Content-Range: bytes 1000-1999/300000'
tail -c +1001 "$DATA" | head -c 1000 | cmp -s - "$TMP/body" || fail "relayed range: bytes differ"
call --cookie "id=$ADMIN_SID" -r 400000-400001 "$DL"
expect_status "relayed range past the end" 416
expect_header "relayed range past the end" 'Content-Range: bytes \*/300000'
call --cookie "id=$ADMIN_SID" -F "note=up" -F "file=@$DATA;filename=data.bin" \
  "$URL?api=VELA.Sample&version=1&method=upload&relay_ds=b"
expect "relayed upload" '"success":true' '"size":300000' "\"cksum\":$(cksum <"$DATA" | cut -d' ' -f1)" \
  '"note":"up"'
# An upload that names its call only inside its body is not relayed.
call --cookie "id=$ADMIN_SID" -F api=VELA.Sample -F version=1 -F method=upload -F "file=@$DATA" "$URL?relay_ds=b"
expect_error "upload named in its body" 101

# ---- Callers: no session, no relay privilege, a bad time limit.
call "$URL?$ONLY&relay_ds=b"
expect_error "relay without a session" 119 unauth
call --cookie "id=$USER_SID" "$URL?$ONLY&relay_ds=b"
expect_error "relay without the privilege" 105 noprivilege
call --cookie "id=$ADMIN_SID" "$URL?$ONLY&relay_ds=b&relay_timeout=0"
expect_error "relay_timeout 0" 101

# ---- Peers that are not there or misbehave: 109 and why.
relay_fails() {
  call --cookie "id=$ADMIN_SID" "$URL?$ONLY&relay_ds=$1${3:-}"
  expect_error "relay to $1" 109
  expect "relay to $1" "\"reason\":\"$2\""
}
relay_fails nosuch "unknown peer"
relay_fails ..%2F..%2Fetc "unknown peer"
relay_fails down "peer unreachable"
relay_fails silent "peer timed out" "&relay_timeout=2"
relay_fails garbage "peer answer not JSON"
relay_fails huge "peer answer too large"
relay_fails telltale "peer answer not JSON"
relay_fails tlsnoca "peer certificate refused"
relay_fails tlsbadpin "peer certificate refused"
for peer in tls tlspin; do
  call --cookie "id=$ADMIN_SID" "$URL?$ONLY&relay_ds=$peer"
  expect "relay to $peer" '"success":true' '"over":"tls"'
done
chmod 0644 "$ROOT/etc/vela/peers.json"
relay_fails b "peers not configured"
chmod 0600 "$ROOT/etc/vela/peers.json"
grep -q 'relay request fail\[' "$RUN/cgi.log" "$RUN/error.log" 2>/dev/null || fail "no relay failure logged"

# ---- The same relay from the command line.
api() { VELA_ROOT=$ROOT "$VELAAPI" call VELA.Sample.Echo echo "$@"; }
out=$(api text=cli n=3 --peer b) || fail "velaapi --peer b: $out"
grep -qF '"text":"cli"' <<<"$out" || fail "velaapi --peer b answered $out"
out=$(api --peer b --user nobody 2>/dev/null) && fail "velaapi relayed for nobody"
grep -qF '"code":105' <<<"$out" || fail "velaapi --user nobody answered $out"
out=$(api --peer down 2>/dev/null) && fail "velaapi relayed to a peer that is down"
grep -qF '"code":109' <<<"$out" || fail "velaapi --peer down answered $out"

# ---- The peer revokes its token: its refusal comes back unchanged.
VELA_ROOT=$PEER_ROOT "$VELAADM" token revoke "$PEER_TOKEN_ID" >/dev/null || fail "token revoke on the peer"
call --cookie "id=$ADMIN_SID" "$URL?$ONLY&relay_ds=b"
expect_error "revoked token" 119

grep -qF "$PEER_TOKEN" "$RUN/cgi.log" "$RUN/error.log" 2>/dev/null && fail "the peer's token was logged"
srv_finish "all relay checks passed ($URL -> $PEER_BASE)"
