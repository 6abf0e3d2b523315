#!/usr/bin/env bash
# Calls through sharing links on the real web server (a private lighttpd, as
# in e2e.sh): a visitor of a link of the project "sample-share" lists and
# downloads inside the shared folder, byte ranges included, as the link's
# owner; a visitor without the link's session, of a revoked link, of another
# API, or naming a path that leads out of the folder is refused.
#
# usage: sharing.sh VELASCGI SHARING_LINK CHECK_LIBRARY STAGED_WEBAPI_DIR SOURCE_DIR
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI LINKTOOL CHECKLIB WEBAPI SRC -- "$@"
srv_require "velascgi switches to the identity of the link's owner"
srv_traps
srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
mkdir -p "$ROOT/usr/lib/sharing/permission_lib" &&
  install -m 0755 "$CHECKLIB" "$ROOT/usr/lib/sharing/permission_lib/sample-share.so" || exit 1
srv_serve

# The shared folder /share of the system root, readable by its owner
# "nobody"; a root-only file beside it and a link to that file inside it.
SHARE=$ROOT/share
mkdir -p "$SHARE/sub" && printf '0123456789' >"$SHARE/sub/digits.txt" && echo topsecret >"$ROOT/secret" &&
  chmod 0600 "$ROOT/secret" && ln -s ../secret "$SHARE/out" && chmod -R a+rX "$SHARE" &&
  echo rootonly >"$SHARE/rootonly" && chmod 0600 "$SHARE/rootonly" || exit 1
link() { VELA_ROOT=$ROOT "$LINKTOOL" "$@"; }
HASH=$(link create sample-share /share nobody | sed -n 's/^hash=//p')
SID=$(link session "$HASH" 127.0.0.1 | sed -n 's/^sid=//p')
[ -n "$HASH" ] && [ -n "$SID" ] || { fail "no link or visitor session was made"; exit 1; }
OTHER=$(link create sample-share /share nobody | sed -n 's/^hash=//p')
OTHER_SID=$(link session "$OTHER" 127.0.0.1 | sed -n 's/^sid=//p')

SHARE_API="$URL?api=VELA.Sample.Share&version=1"
visit() { call -H "X-Vela-Sharing: $HASH" --cookie "sharing_sid=$SID" "$@"; }

visit "$SHARE_API&method=list"
expect "list the shared folder" '"success":true' '"name":"sub"' '"name":"out"'
visit "$SHARE_API&method=list&path=sub"
expect "list a folder inside" '"success":true' '"name":"digits.txt"' '"size":10'
call "$SHARE_API&method=list&path=sub&_sharing_id=$HASH&_sharing_sid=$SID"
expect "link and session as parameters" '"success":true' '"name":"digits.txt"'

visit -H "Range: bytes=2-5" "$SHARE_API&method=download&path=sub/digits.txt"
expect_status "download a range" 206
[ "$(cat "$TMP/body")" = "2345" ] || fail "range body: $(head -c 100 "$TMP/body")"
visit "$SHARE_API&method=download&path=sub/digits.txt"
expect_status "download whole" 200
[ "$(cat "$TMP/body")" = "0123456789" ] || fail "whole body: $(head -c 100 "$TMP/body")"

# The handler has the owner's rights, not root's.
visit "$SHARE_API&method=download&path=rootonly"
expect "a file its owner may not read" '"success":false' '"code":1002'

for path in ../secret /etc/passwd sub/../../secret out %2e%2e/secret "sub%00/digits.txt"; do
  visit "$SHARE_API&method=download&path=$path"
  expect "download $path" '"success":false'
  grep -q topsecret "$TMP/body" && fail "download $path leaked the file beside the share"
  visit "$SHARE_API&method=list&path=$path"
  expect "list $path" '"success":false'
done

call -H "X-Vela-Sharing: $HASH" "$SHARE_API&method=list"
expect "no visitor session" '"success":false' '"code":124'
call -H "X-Vela-Sharing: $HASH" --cookie "sharing_sid=$OTHER_SID" "$SHARE_API&method=list"
expect "another link's session" '"success":false' '"code":124'
call -H "X-Vela-Sharing: AAAAAAAAAAAAAAAAAAAAAA" --cookie "sharing_sid=$SID" "$SHARE_API&method=list"
expect "no such link" '"success":false' '"code":122'
visit "$URL?api=VELA.Sample&version=1&method=echo"
expect "a method not open to links" '"success":false' '"code":126'

link revoke "$HASH" || fail "revoke refused"
visit "$SHARE_API&method=list"
expect "revoked link" '"success":false' '"code":123'

srv_finish "all sharing-link checks passed ($URL)"
