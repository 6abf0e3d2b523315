#!/usr/bin/env bash
# Sharing links through the real web server: an owner ("nobody", an
# ordinary account) makes a link with VELA.Sharing and lists it; a visitor
# without an account opens it with curl, with and without the right
# password, and gets the session cookie; revoking ends the visitor's session
# at once; expired and used-up links are refused; repeated wrong passwords
# block the address. A link of the file-sharing sample is used end to end:
# made, opened, listed and downloaded from through the link, revoked. Sessions
# of the owner and of an administrator (root) come from velaadm.
#
# usage: sharing_links.sh VELASCGI VELAADM CHECK_LIBRARY STAGED_WEBAPI_DIR SOURCE_DIR
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI VELAADM CHECKLIB WEBAPI SRC -- "$@"
srv_require "the owner's identity is taken to open the shared item"
srv_traps
srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
mkdir -p "$ROOT/usr/lib/sharing/permission_lib" &&
  install -m 0755 "$CHECKLIB" "$ROOT/usr/lib/sharing/permission_lib/sample-share.so" || exit 1

# Error codes of VELA.Sharing (webapi/sharing/).
ERR_NO_LINK=470 ERR_EXPIRED=471 ERR_USE_LIMIT=472 ERR_BAD_PASSWORD=473 ERR_BLOCKED=474

mkdir -p "$ROOT/volume1/photos" && echo "a picture" >"$ROOT/volume1/photos/cat.jpg"
chmod -R a+rX "$ROOT/volume1"
echo /volume1 >"$ROOT/etc/vela/volumes.conf"
printf 'login_max_failures="3"\nlogin_window_minutes="30"\nlogin_block_minutes="30"\n' >"$ROOT/etc/vela/webapi.conf"
srv_serve

session() { VELA_ROOT=$ROOT "$VELAADM" session create "$1" | sed -n 's/^sid=//p'; }
OWNER=$(session nobody)
ADMIN=$(session root)
[ -n "$OWNER" ] && [ -n "$ADMIN" ] || { fail "velaadm created no session"; exit 1; }

SHARING="$URL?api=VELA.Sharing&version=1"
OPEN="$URL?api=VELA.Sharing.Visitor&version=1&method=open"
member() { sed -n "s/.*\"$1\":\"\\([^\"]*\\)\".*/\\1/p" "$TMP/body"; }
refused() {
  expect "$1" '"success":false'
  grep -qE "\"code\":$2[,}]" "$TMP/body" || fail "$1: not error $2: $(head -c 600 "$TMP/body")"
  ! grep -qi '^Set-Cookie: sharing_sid=' "$TMP/headers" || fail "$1: a refused open sets a cookie"
}
# create NAME FORM: the owner makes a link; its id in $link.
create() {
  call -b "id=$OWNER" --data "$2" "$SHARING&method=create"
  link=$(member id)
  expect "$1" '"success":true'
  [ -n "$link" ] || fail "$1: no link id"
}

# ---- The owner makes a link with a password and lists it.
create "create" "project=vela.photos&path=/volume1/photos&password=open-sesame&uses=10"
LINK=$link
expect "create" "\"url\":\"$BASE/sharing/vela.photos/$LINK\"" '"hasPassword":true' '"name":"photos"'
grep -q 'open-sesame' "$TMP/body" && fail "create answers the password"
call -b "id=$OWNER" "$SHARING&method=list"
expect "list" "\"id\":\"$LINK\"" '"total":1' '"useCount":0'
call -b "id=$ADMIN" "$SHARING&method=list&all=true"
expect "list all" "\"id\":\"$LINK\""

# ---- A visitor opens it: no or a wrong password refused, the right one
# gives the cookie.
call --data "link=$LINK" "$OPEN"
refused "open without password" $ERR_BAD_PASSWORD
call --data "link=$LINK&password=nope" "$OPEN"
refused "open with a wrong password" $ERR_BAD_PASSWORD
JAR=$TMP/visitor
call -c "$JAR" --data "link=$LINK&password=open-sesame" "$OPEN"
expect "open" '"success":true' '"project":"vela.photos"' '"name":"photos"'
expect_header "open" "Set-Cookie: sharing_sid="
grep -i '^Set-Cookie: sharing_sid=' "$TMP/headers" | grep -qi 'httponly; SameSite=Strict' ||
  fail "open: the cookie is not HttpOnly and SameSite=Strict: $(tr -d '\r' <"$TMP/headers")"
grep -i '^Set-Cookie: sharing_sid=' "$TMP/headers" | grep -qi 'secure' && fail "open: Secure over plain HTTP"
grep -q sharing_sid "$JAR" || fail "open: curl kept no cookie"
# The held session is kept (no use spent again).
call -b "$JAR" --data "link=$LINK" "$OPEN"
expect "open again" '"success":true'
call -b "id=$OWNER" "$SHARING&method=list"
expect "uses counted" '"useCount":1'

# ---- Revoking ends the visitor's session at once.
call -b "id=$OWNER" --data "id=$LINK" "$SHARING&method=revoke"
expect "revoke" '"success":true'
call -b "$JAR" --data "link=$LINK" "$OPEN"
refused "open after revoke" $ERR_NO_LINK
VELA_ROOT=$ROOT "$VELAADM" link show "$LINK" | grep -q '"revoked" : true' || fail "velaadm does not show the link revoked"

# ---- The file-sharing sample through a link: the visitor's cookie and the
# link header (or the link as a query parameter, as a plain download link
# sends it) let it list and download; without the cookie it is refused, and
# revoking ends it.
create "create sample-share" "project=sample-share&path=/volume1/photos"
SHARED=$link
SHARE_API="$URL?api=VELA.Sample.Share&version=1"
call -c "$TMP/shared" --data "link=$SHARED" "$OPEN"
expect "open sample-share" '"success":true' '"project":"sample-share"' '"name":"photos"'
through() { call -b "$TMP/shared" -H "X-Vela-Sharing: $SHARED" "$@"; }
through "$SHARE_API&method=list"
expect "list through the link" '"success":true' '"name":"cat.jpg","size":10,'
for how in header query; do
  if [ $how = header ]; then
    through -H "Range: bytes=2-8" "$SHARE_API&method=download&path=cat.jpg"
  else
    call -b "$TMP/shared" -H "Range: bytes=2-8" "$SHARE_API&method=download&path=cat.jpg&_sharing_id=$SHARED"
  fi
  expect_status "ranged download, link in the $how" 206
  [ "$(cat "$TMP/body")" = picture ] || fail "ranged download, link in the $how: $(head -c 100 "$TMP/body")"
done
call -H "X-Vela-Sharing: $SHARED" "$SHARE_API&method=list"
expect_error "list without the cookie" 124
call -H "X-Vela-Sharing: $SHARED" -H "Range: bytes=2-8" "$SHARE_API&method=download&path=cat.jpg"
expect_error "download without the cookie" 124
expect_header "download without the cookie" "Accept-Ranges: none"
call -b "id=$OWNER" --data "id=$SHARED" "$SHARING&method=revoke"
expect "revoke sample-share" '"success":true'
through "$SHARE_API&method=list"
expect_error "list after revoke" 123
grep -q '"name":"cat.jpg"' "$TMP/body" && fail "list after revoke still lists the folder"

# ---- A link of one use, and one that expires two seconds after it is made
# (the wait only ever makes it more expired).
create "create once" "project=p&path=/volume1/photos/cat.jpg&uses=1"
ONCE=$link
call --data "link=$ONCE" "$OPEN"
expect "open once" '"success":true' '"name":"cat.jpg"'
call --data "link=$ONCE" "$OPEN"
refused "open a used-up link" $ERR_USE_LIMIT
create "create short" "project=p&path=/volume1/photos&expires=2"
SHORT=$link
sleep 3
call --data "link=$SHORT" "$OPEN"
refused "open an expired link" $ERR_EXPIRED

# ---- Repeated wrong passwords block the address (last: the block holds for
# the address as a whole).
create "create guarded" "project=p&path=/volume1/photos&password=right"
for guess in a b c; do
  call --data "link=$link&password=$guess" "$OPEN"
  refused "wrong password $guess" $ERR_BAD_PASSWORD
done
call --data "link=$link&password=right" "$OPEN"
refused "open when blocked" $ERR_BLOCKED

srv_finish "sharing links: all checks passed"
