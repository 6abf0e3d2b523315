#!/usr/bin/env bash
# End-to-end: the operators' API VELA.Admin through the real web server,
# with an administrator (a member of the run's administrators group) and an
# ordinary user, each with a login session: "apis" answers each what they
# may call, the other methods refuse the user, "revoke" ends the user's
# session for good, "blocked" shows an address after failed logins through
# VELA.Auth, and "usage" the counts of calls the server counted. (The
# answers in detail: webapi/AdminTest.cpp.)
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI VELAADM WEBAPI SRC -- "$@"
srv_require "accounts, PAM, identity switches" useradd chpasswd

srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
srv_pam
tag=$(printf '%04x%04x' $RANDOM $RANDOM)
USER1="vtu$tag" PASS1=$(srv_password)
ADMIN="vta$tag" PASSA=$(srv_password)
ADMINS="vtg$tag"
printf '%s\n' "admin_group=\"$ADMINS\"" 'login_max_failures="3"' 'login_window_minutes="30"' \
  'login_block_minutes="30"' >"$ROOT/etc/vela/webapi.conf"
echo 'enable_data_collect="yes"' >"$ROOT/etc/velainfo.conf"
srv_add_user "$USER1" "$PASS1"
srv_add_user "$ADMIN" "$PASSA" "$ADMINS"
srv_serve

ADMINAPI="$URL?api=VELA.Admin&version=1"
# session USER: a session id of USER from 127.0.0.1.
session() { VELA_ROOT=$ROOT "$VELAADM" session create "$1" --ip 127.0.0.1 | sed -n 's/^sid=//p'; }
SIDA=$(session "$ADMIN") SIDU=$(session "$USER1")
if [ -z "$SIDA" ] || [ -z "$SIDU" ]; then
  fail "velaadm created no session"
  srv_finish "admin"
fi

# ---- apis: the administrator sees the administrators' methods, the user
# only what is open to users.
call -b "id=$SIDA" "$ADMINAPI&method=apis"
expect "apis as the administrator" '"success":true' '"api":"VELA.Admin"' '"sessions"' '"revoke"' \
  '"api":"VELA.Sample"' '"adminonly"'
cp "$TMP/body" "$TMP/apis-admin"
call -b "id=$SIDU" "$ADMINAPI&method=apis"
expect "apis as the user" '"success":true' '"api":"VELA.Admin"' '"methods":{"1":["apis"]}' '"echo"'
grep -qF '"adminonly"' "$TMP/body" && fail "apis as the user lists an administrators' method"
cmp -s "$TMP/body" "$TMP/apis-admin" && fail "apis answers the user and the administrator alike"

# ---- The administrators' methods refuse the user.
for m in sessions revoke blocked usage tasks; do
  call -b "id=$SIDU" "$ADMINAPI&method=$m"
  expect_error "$m as the user" 105
done

# ---- sessions: handles, never the ids; the caller's own is "current".
call -b "id=$SIDA" "$ADMINAPI&method=sessions"
expect "sessions" '"success":true' "\"user\":\"$USER1\"" "\"user\":\"$ADMIN\"" '"current":true' \
  '"address":"127.0.0.1"'
grep -qF -e "$SIDA" -e "$SIDU" "$TMP/body" && fail "sessions shows a session id"
handle=$(grep -o '{[^{}]*}' "$TMP/body" | grep -F "\"user\":\"$USER1\"" |
  sed -n 's/.*"id":"\([0-9a-f]\{16\}\)".*/\1/p')
[ -n "$handle" ] || fail "no handle of the user's session in: $(head -c 600 "$TMP/body")"

# ---- revoke: the user's session ends; its next call is refused.
call -b "id=$SIDA" "$ADMINAPI&method=revoke&id=../$handle"
expect_error "revoke with a malformed handle" 101
call -b "id=$SIDA" "$ADMINAPI&method=revoke&id=$handle"
expect "revoke" '"success":true' '"revoked":true'
[ -e "$ROOT/run/vela/sessions/$SIDU" ] && fail "revoke: the session file is still there"
call -b "id=$SIDU" "$ADMINAPI&method=apis"
expect_error "apis with the revoked session" 105
call -b "id=$SIDA" "$ADMINAPI&method=revoke&id=$handle"
expect_error "revoke of an ended session" 480

# ---- blocked: three wrong passwords from 127.0.0.3 block that address.
for _ in 1 2 3; do
  call --interface 127.0.0.3 --data-urlencode "account=$USER1" --data-urlencode "passwd=x$PASS1" \
    "$URL?api=VELA.Auth&version=1&method=login"
  expect_error "a wrong password" 400
done
call -b "id=$SIDA" "$ADMINAPI&method=blocked"
expect "blocked" '"success":true' '{"address":"127.0.0.3","failures":3,"until":'

# ---- usage: the server counted the sample's calls (not the operators').
call -b "id=$SIDA" "$URL?api=VELA.Sample&version=1&method=echo"
call -b "id=$SIDA" "$ADMINAPI&method=usage"
expect "usage" '"success":true' '"enabled":true' '{"api":"VELA.Sample","count":1,"method":"echo","version":1}'
grep -qF '"api":"VELA.Admin"' "$TMP/body" && fail "usage counted the operators' own calls"

srv_finish "admin: apis, sessions, revoke, blocked and usage through the server"
