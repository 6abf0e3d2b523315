#!/usr/bin/env bash
# End-to-end through the real web server: a private lighttpd, configured from
# deploy/lighttpd.conf.in, runs velascgi on a free port of 127.0.0.1 under a
# temporary system root that serves the staged web-API directory; curl then
# calls the sample API the way a browser or a client program would. Then
# the scenarios every web server is held to (scenarios.sh), with X-Sendfile.
set -u

. "$(dirname "$0")/server.sh"
. "$(dirname "$0")/scenarios.sh"
srv_args VELASCGI VELAADM WEBAPI SRC -- "$@"
srv_require "velascgi switches to the identity each API asks for" cksum cmp useradd chpasswd

# ---- The system root: the staged web-API directory, one data volume.
srv_init "$SRC" "$VELASCGI" "$WEBAPI" private || exit 1
mkdir -p "$ROOT/vol1/sample"
echo /vol1 >"$ROOT/etc/vela/volumes.conf"
srv_serve --xsendfile-dir "$ROOT/vol1"
srv_session
COOKIE="id=$sid"

# ---- The sample's echo (form bodies: webentry/WebEntryTest.cpp).
call --cookie "$COOKIE" "$URL?api=VELA.Sample&version=1&method=echo&text=hi%20there&n=5"
expect_status "GET echo" 200
expect "GET echo" '"success":true' '"text":"hi there"' '"n":"5"' '"method":"echo"'
expect_header "GET echo" 'Content-type: application/json' 'X-Content-Type-Options: nosniff' \
  'Cache-Control: max-age=0, no-cache, no-store, must-revalidate'

# ---- A method that needs a login: without the session, with it as cookie,
# and with it as the parameter "_sid".
nobody_uid=$(id -u nobody)
call "$URL?api=VELA.Sample&version=1&method=whoami"
expect_error "whoami without session" 119 unauth
call --cookie "$COOKIE" "$URL?api=VELA.Sample&version=1&method=whoami"
expect "whoami with session" '"success":true' "\"uid\":[$nobody_uid,$nobody_uid,$nobody_uid]"
call --cookie "id=not-a-session" "$URL?api=VELA.Sample&version=1&method=whoami&_sid=$sid"
expect "whoami with _sid" '"success":true' "\"uid\":[$nobody_uid,"
# A method a page polls ("allowTimeout") answers the session like any other.
call --cookie "$COOKIE" "$URL?api=VELA.Sample&version=1&method=status"
expect "status" '"success":true' '"user":"root"' '"idleTimeout":'

# ---- Upload: two fields and two files to a method with "allowUpload".
head -c 1048576 /dev/urandom >"$TMP/one.bin"
printf 'second file\r\nwith two lines\n' >"$TMP/two.txt"
call --cookie "$COOKIE" -F "title=Holiday 2024" -F "note=x&y=z" \
  -F "file1=@$TMP/one.bin" -F "file2=@$TMP/two.txt;filename=notes.txt" \
  "$URL?api=VELA.Sample&version=1&method=upload"
expect_status "upload" 200
expect "upload" '"success":true' '"fields":{"note":"x&y=z","title":"Holiday 2024"}'
expect_file "upload file1" file1 one.bin "$TMP/one.bin"
expect_file "upload file2" file2 notes.txt "$TMP/two.txt"
leftover=$(find "$ROOT/vol1" -path "$ROOT/vol1/sample" -prune -o -type f -print)
[ -z "$leftover" ] || fail "upload left files behind: $leftover"

call --cookie "$COOKIE" -F "file1=@$TMP/two.txt" "$URL?api=VELA.Sample&version=1&method=echo"
expect_error "upload to a method without allowUpload" 115

# ---- Download, whole and one range, first streamed by velascgi, then
# through lighttpd's X-Sendfile.
head -c 2097152 /dev/urandom >"$ROOT/vol1/sample/data.bin"
scn_download "streamed" "$COOKIE" "$ROOT/vol1/sample/data.bin"
grep -qi '^ETag:' "$TMP/headers" && fail "streamed download came from X-Sendfile"
echo 'xsendfile="yes"' >"$ROOT/etc/vela/webapi.conf"
scn_download "X-Sendfile" "$COOKIE" "$ROOT/vol1/sample/data.bin"
# lighttpd's own file answer carries an ETag; velascgi never writes one.
expect_header "download (X-Sendfile)" 'ETag:'
call --cookie "$COOKIE" "$URL?api=VELA.Sample&version=1&method=download&name=../../etc/passwd"
expect_error "download outside the folder" 101
# (The refusals of the front end and the registry, the same through the
# server: webentry/OutputTest.cpp.)

# ---- The scenarios of every web server, fast output on.
srv_pam
FAST_HEADER=X-Sendfile web_scenarios

srv_finish "all end-to-end checks passed ($URL)"
