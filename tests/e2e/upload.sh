#!/usr/bin/env bash
# Uploads that are attacked or go wrong, through the real web server (a
# private lighttpd, as in e2e.sh): a form field that names another method of
# the API, a local user going for the files of an upload in flight, a client
# that goes away in the middle of the body, and directories left behind by
# requests that died.
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI VELAADM WEBAPI PIPE_LIB SRC -- "$@"
srv_require "velascgi stores uploads as root and switches identity" setpriv flock find stat

# ---- The system root: the staged web-API directory plus VELA.Pipe.Ids of the
# test handler library, whose "upload" runs as nobody and whose "byDefault"
# runs with root's rights; one data volume whose "@tmp" is world-writable
# without the sticky bit, as earlier versions made it.
srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
srv_api VELA.Pipe.Ids <<EOF
{"VELA.Pipe.Ids": {"lib": "$PIPE_LIB", "minVersion": 1, "maxVersion": 1, "authLevel": 0,
  "methods": {"1": [{"upload": {"allowUpload": true, "runAs": "nobody"}},
                    {"byDefault": {"grantByDefault": true}}]}}}
EOF
echo /vol1 >"$ROOT/etc/vela/volumes.conf"
UP=$ROOT/vol1/@tmp
mkdir -p "$UP" && chmod 0777 "$UP" || exit 1
srv_serve
srv_session
COOKIE="id=$sid"
printf 'small file\n' >"$TMP/small.txt"
head -c 33554432 /dev/urandom >"$TMP/big.bin"
IDS="$URL?api=VELA.Pipe.Ids&version=1&method=upload"
DEFERRED="$URL?api=VELA.Sample&version=1&method=upload"

# left: what is in "@tmp" besides the entries named as arguments; clean:
# nothing is. found: $partial, a file being stored in "@tmp".
left() {
  local skip=() name
  for name in "$@"; do skip+=(! -name "$name"); done
  find "$UP" -mindepth 1 -maxdepth 1 "${skip[@]}" -printf '%f ' 2>/dev/null
}
clean() { [ -z "$(left)" ]; }
found() { partial=$(find "$UP" -type f -size +0 -print -quit 2>/dev/null) && [ -n "$partial" ]; }

# ---- A form field naming the method with root's rights: the handler of the
# method called still runs, as nobody, and sees that method.
nobody_uid=$(id -u nobody)
call --cookie "$COOKIE" -F "method=byDefault" -F "f=@$TMP/small.txt" "$IDS"
expect "upload naming another method" '"success":true' "\"uid\":[$nobody_uid,$nobody_uid,$nobody_uid]" \
  '"method":"upload"' '"methodParam":"upload"'
[ "$(stat -c %a "$UP")" = 1777 ] || fail "@tmp is $(stat -c %a "$UP") after an upload, not 1777"
clean || fail "an upload left $(left)in @tmp"

# ---- A client that goes away in the middle of a big file, for an upload the
# front end stores and one the handler reads itself. In flight, another local
# user can neither read the partial file, nor replace it, nor move its
# directory away; shortly after the client is gone, nothing of it is left.
for target in "$IDS" "$DEFERRED"; do
  name=${target#*api=}
  name="client gone (${name%%&*})"
  curl -s -o /dev/null --max-time 120 --limit-rate 1M --cookie "$COOKIE" -F "f=@$TMP/big.bin" "$target" &
  client=$!
  if ! srv_wait 100 0.1 found; then
    fail "$name: no partial file appeared in @tmp"
  else
    srv_as_nobody head -c 16 "$partial" >/dev/null 2>&1 && fail "$name: nobody read the partial file $partial"
    srv_as_nobody sh -c 'echo evil >"$1/evil" && mv -f "$1/evil" "$2"' sh "$UP" "$partial" 2>/dev/null &&
      fail "$name: nobody replaced the partial file $partial"
    srv_as_nobody mv -f "$(dirname "$partial")" "$UP/moved" 2>/dev/null &&
      fail "$name: nobody moved the directory of the partial file $partial"
    rm -f "$UP/evil"
  fi
  kill "$client" 2>/dev/null
  wait "$client" 2>/dev/null
  srv_wait 50 0.1 clean || fail "$name: left behind in @tmp: $(find "$UP" -mindepth 1 -printf '%P(%s) ')"
done

# ---- Directories of requests that died without removing theirs: the next
# upload sweeps a stale one and leaves a live one (its lock held) alone.
stale=vela-upload-stalestale22
live=vela-upload-livelivelive
for dir in "$stale" "$live"; do
  mkdir -m 0700 "$UP/$dir" && echo 'left behind' >"$UP/$dir/upload-abcdefghijklmnop" &&
    touch -d '-20 minutes' "$UP/$dir" || fail "cannot make $UP/$dir"
done
exec {lockfd}<"$UP/$live"
flock -x "$lockfd" || fail "cannot lock $UP/$live"
call --cookie "$COOKIE" -F "f=@$TMP/small.txt" "$IDS"
expect "upload after dead requests" '"success":true'
[ -e "$UP/$stale" ] && fail "the stale directory $stale was not swept"
[ -e "$UP/$live/upload-abcdefghijklmnop" ] || fail "the live directory $live was swept"
[ -z "$(left "$live")" ] || fail "left in @tmp: $(left "$live")"
exec {lockfd}<&-
rm -rf "${UP:?}/$live"

srv_finish "all upload checks passed ($URL)"
