#!/usr/bin/env bash
# End-to-end: login and access control through the real web server. Real
# Linux accounts (a user and a member of the administrators group) log in
# through PAM with VELA.Auth, then curl calls the sample API with the session
# cookie and the anti-forgery token, and the refusals of the session check
# are provoked through the server: crafted or logged-out session ids,
# another client address, a missing or wrong token, a user on an
# administrators' API. Also: a login with parameters encrypted by openssl.
# Attacks that must fail: an account named "system" (the dispatcher's
# run-as name) taken for root, forwarding headers of a client that is no
# configured proxy, a password in the URL, and the login guard played
# (blocking an address of the attacker's choice, spraying from forged
# addresses). The audit trail holds the logins, failures, blocks and
# logouts, the sessions and tokens velaadm made, the calls of the audited
# method adminonly, and no secret. (The login API's own rules, the block, the replacement of a
# session and the session settings among them: webapi/AuthTest.cpp; idle
# and expired sessions: access/PermissionCheckTest.cpp.)
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI VELAADM WEBAPI SRC -- "$@"
srv_require "accounts, PAM, identity switches" openssl useradd chpasswd

srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
srv_pam
# Names unique to the run: a run killed before its clean-up cannot collide
# with the next, nor a run beside it on the same machine.
tag=$(printf '%04x%04x' $RANDOM $RANDOM)
USER1="vtu$tag" PASS1=$(srv_password)
ADMIN="vta$tag" PASSA=$(srv_password)
ADMINS="vtg$tag"

# The administrators group of the root is a group of the run's own
# (admin_group), so the machine's "administrators" is never touched. Low
# failure limits so that blocking is reached quickly; windows long enough
# that a slow machine cannot let the block lapse during the test.
cat >"$ROOT/etc/vela/webapi.conf" <<EOF
admin_group="$ADMINS"
login_max_failures="3"
login_window_minutes="30"
login_block_minutes="30"
EOF

srv_add_user "$USER1" "$PASS1"
srv_add_user "$ADMIN" "$PASSA" "$ADMINS"

srv_serve

# ---- Helpers (call, expect, expect_error, fail, member, login: server.sh).
# logged TEXT: a line velascgi logged since log_mark holds TEXT.
log_mark() { log_from=$(($(wc -l <"$RUN/cgi.log" 2>/dev/null || echo 0) + 1)); }
logged() { tail -n "+$log_from" "$RUN/cgi.log" 2>/dev/null | grep -qF -- "$1" || fail "not in cgi.log: $1"; }

AUTH="$URL?api=VELA.Auth&version=1"
WHOAMI="$URL?api=VELA.Sample&version=1&method=whoami"
ADMINONLY="$URL?api=VELA.Sample&version=1&method=adminonly"
nobody_uid=$(id -u nobody)

# login_refused NAME CODE ACCOUNT PASSWORD [CURL ARGS...]: a form login
# refused with error CODE and no cookie; login_fails: with 400, a wrong
# password (407: blocked, 403: a password in the URL).
login_refused() {
  call "${@:5}" --data-urlencode "account=$3" --data-urlencode "passwd=$4" "$AUTH&method=login"
  expect_error "$1" "$2"
  grep -qi '^Set-Cookie: id=' "$TMP/headers" && fail "$1: a refused login sets a cookie"
}
login_fails() { login_refused "$1" 400 "${@:2}"; }

# ---- A user logs in (the cookie's attributes: webapi/AuthTest.cpp).
JAR1=$TMP/jar1
login "login" "$USER1" "$PASS1" -c "$JAR1" && expect "login" "\"account\":\"$USER1\"" '"isAdmin":false'
SID1=$sid TOKEN1=$token

# ---- The session opens a method that needs a login: cookie plus token, in
# the header or as the parameter VelaToken.
call -b "$JAR1" -H "X-Vela-Token: $TOKEN1" "$WHOAMI"
expect "whoami with cookie and token" '"success":true' "\"user\":\"$USER1\"" "\"uid\":[$nobody_uid,"
call -b "$JAR1" "$WHOAMI&VelaToken=$TOKEN1"
expect "whoami with VelaToken" '"success":true' "\"user\":\"$USER1\""

# ---- Crafted session ids reach no file: refused like any unknown session
# ("_sid" of the query becomes this cookie: webentry/WebEntryTest.cpp). A
# NUL byte must not cut a cookie down to the real id either.
for crafted in ../../../etc/passwd ..%2F..%2Fetc%2Fshadow "$SID1/../$SID1" "$SID1%00x"; do
  call -b "id=$crafted" -H "X-Vela-Token: $TOKEN1" "$WHOAMI"
  expect_error "whoami with the cookie id=$crafted" 105 noprivilege
done

# ---- The token missing or wrong: refused, and velascgi says why.
log_mark
call -b "$JAR1" "$WHOAMI"
expect_error "whoami without the token" 105 noprivilege
logged 'Token Authentication Fail.'
# The first character changed (to one it is not).
wrong=x
[ "${TOKEN1:0:1}" != x ] || wrong=y
call -b "$JAR1" -H "X-Vela-Token: $wrong${TOKEN1:1}" "$WHOAMI"
expect_error "whoami with a wrong token" 105 noprivilege

# ---- Another client address: a second loopback address as the source.
call --interface 127.0.0.2 -b "$JAR1" -H "X-Vela-Token: $TOKEN1" "$WHOAMI"
expect_error "whoami from 127.0.0.2" 150 errorip

# ---- Forwarding headers count only from a configured proxy; no proxy is
# trusted by default, loopback included. A local client's X-Forwarded-For
# neither moves the session's address nor binds a new session elsewhere,
# and its X-Forwarded-Proto does not make the cookie Secure.
SESSIONS=$ROOT/run/vela/sessions
# forwarded NAME IP SECURE: a login with X-Forwarded-For 203.0.113.7 and
# X-Forwarded-Proto https binds its session to IP, with a cookie that is
# Secure or not (yes, no).
forwarded() {
  local secure=no
  login "$1" "$USER1" "$PASS1" -H "X-Forwarded-For: 203.0.113.7" -H "X-Forwarded-Proto: https" || return 1
  grep -qE "\"clientIP\" *: *\"${2//./\\.}\"" "$SESSIONS/$sid" || fail "$1: the session is not bound to $2: $(cat "$SESSIONS/$sid")"
  tr -d '\r' <"$TMP/headers" | grep -i '^Set-Cookie: id=' | grep -qi '; *secure' && secure=yes
  [ "$secure" = "$3" ] || fail "$1: Secure cookie: $secure: $(grep -i '^Set-Cookie' "$TMP/headers")"
}
call -H "X-Forwarded-For: 192.0.2.44" -b "$JAR1" -H "X-Vela-Token: $TOKEN1" "$WHOAMI"
expect "whoami with a forged X-Forwarded-For" '"success":true' "\"user\":\"$USER1\""
if forwarded "login with forged forwarding headers" 127.0.0.1 no; then
  call -b "id=$sid" -H "X-Vela-Token: $token" "$WHOAMI"
  expect "whoami of a session opened with a forged X-Forwarded-For" '"success":true'
fi
# With 127.0.0.1 configured as the proxy, both headers count.
cp "$ROOT/etc/vela/webapi.conf" "$TMP/webapi.conf"
echo 'trusted_proxies="127.0.0.1"' >>"$ROOT/etc/vela/webapi.conf"
call -H "X-Forwarded-For: 192.0.2.44" -b "$JAR1" -H "X-Vela-Token: $TOKEN1" "$WHOAMI"
expect_error "whoami forwarded for 192.0.2.44 by a configured proxy" 150 errorip
forwarded "login through a configured proxy" 203.0.113.7 yes
cp "$TMP/webapi.conf" "$ROOT/etc/vela/webapi.conf"

# ---- An administrators' method: refused to the user, open to an
# administrator.
call -b "$JAR1" -H "X-Vela-Token: $TOKEN1" "$ADMINONLY"
expect_error "adminonly as a user" 105
JARA=$TMP/jara
if login "admin login" "$ADMIN" "$PASSA" -c "$JARA"; then
  expect "admin login" "\"account\":\"$ADMIN\"" '"isAdmin":true'
  call -b "$JARA" -H "X-Vela-Token: $token" "$ADMINONLY"
  expect "adminonly as an administrator" '"success":true' "\"user\":\"$ADMIN\"" '"isAdmin":true'
fi

# ---- "system" names the superuser only as the dispatcher's run-as identity;
# as a login name, a session's user or an access token's user it is an
# ordinary account. A real account "system" is made for the run when the
# machine has none (and removed afterwards).
PASSS=$(srv_password)
getent passwd system >/dev/null || srv_add_user system "$PASSS"
log_mark
login_fails "login as system" system "$PASSS" --interface 127.0.0.11
logged 'account name "system" is reserved'
# (An empty id or token from a failing velaadm is refused otherwise.)
out=$(VELA_ROOT=$ROOT "$VELAADM" session create system --ip 127.0.0.1 --token)
call -b "id=$(printf '%s\n' "$out" | sed -n 's/^sid=//p')" \
  -H "X-Vela-Token: $(printf '%s\n' "$out" | sed -n 's/^token=//p')" "$ADMINONLY"
expect_error "adminonly with a session of the account system" 105
tok=$(VELA_ROOT=$ROOT "$VELAADM" token create system --api VELA.Sample --method adminonly | sed -n 's/^token=//p')
call "$ADMINONLY&tid=$tok"
expect_error "adminonly with an access token of the account system" 105

# ---- Logout: the session is gone, and its id sent anyway is refused.
call -b "$JAR1" -H "X-Vela-Token: $TOKEN1" "$AUTH&method=logout"
expect "logout" '"success":true'
[ -e "$SESSIONS/$SID1" ] && fail "logout: the session file is still there"
call -b "id=$SID1" -H "X-Vela-Token: $TOKEN1" "$WHOAMI"
expect_error "whoami after logout" 105 noprivilege

# ---- Wrong passwords and unknown accounts get the same answer. From an
# address of their own, so that these failures count against no other
# check's address.
login_fails "wrong password" "$USER1" "x$PASS1" --interface 127.0.0.4
login_fails "unknown account" "nosuch$tag" "$PASS1" --interface 127.0.0.4

# ---- A login with the parameters encrypted by openssl: the server's public
# key, RSA-OAEP with SHA-256, base64, percent-encoded.
call "$AUTH&method=key"
expect "key" '"success":true' '-----BEGIN PUBLIC KEY-----'
member publicKey | sed 's/\\n/\n/g' >"$TMP/server.pem"
if openssl pkey -pubin -in "$TMP/server.pem" -noout 2>"$TMP/openssl.err"; then
  printf 'account=%s&passwd=%s' "$USER1" "$PASS1" |  # letters and digits only
    openssl pkeyutl -encrypt -pubin -inkey "$TMP/server.pem" -pkeyopt rsa_padding_mode:oaep \
      -pkeyopt rsa_oaep_md:sha256 -pkeyopt rsa_mgf1_md:sha256 -out "$TMP/cipher" 2>>"$TMP/openssl.err" ||
    fail "openssl cannot encrypt: $(cat "$TMP/openssl.err")"
  base64 -w0 "$TMP/cipher" >"$TMP/cipher.b64"
  call -c "$TMP/jarc" --data-urlencode "__cIpHeRtExT@$TMP/cipher.b64" "$AUTH&method=login"
  expect "encrypted login" '"success":true' "\"account\":\"$USER1\""
  token=$(member token)
  call -b "$TMP/jarc" -H "X-Vela-Token: $token" "$WHOAMI"
  expect "whoami after the encrypted login" '"success":true' "\"user\":\"$USER1\""
else
  fail "key: not an SPKI PEM key: $(cat "$TMP/openssl.err") $(head -c 600 "$TMP/body")"
fi

# ---- The block after login_max_failures failures, through the server: the
# address that failed is blocked, and forged X-Forwarded-For addresses
# neither rotate it (a password spray from one client, a new forged address
# each time) nor block an address of the attacker's choice. (The guard's own
# rules and log lines: platform/session/LoginGuardTest.cpp; the right
# password while blocked, the owner from elsewhere: webapi/AuthTest.cpp.)
for i in 1 2 3; do
  login_fails "spray $i" "spray$i$tag" "$PASS1" --interface 127.0.0.6 -H "X-Forwarded-For: 198.51.100.$i"
done
login_refused "spray 4 with yet another forged address" 407 "spray4$tag" "$PASS1" \
  --interface 127.0.0.6 -H "X-Forwarded-For: 198.51.100.4"
expect "spray 4 with yet another forged address" '"waitSeconds":'
for i in 1 2 3; do
  login_fails "failure $i for the address 127.0.0.9" "victim$i$tag" "$PASS1" --interface 127.0.0.8 \
    -H "X-Forwarded-For: 127.0.0.9"
done
login "a login from the address an attacker named" "$USER1" "$PASS1" --interface 127.0.0.9

# ---- The password only in the POST body: in the URL it is refused before
# any check, and never logged (its other spellings, the encrypted form
# among them: webapi/AuthTest.cpp).
log_mark
call --interface 127.0.0.12 --data "account=$USER1" "$AUTH&method=login&passwd=$PASS1"
expect_error "password in the query string of a POST" 403
logged 'login refused: a password in the query string'
grep -qF -- "$PASS1" "$RUN/cgi.log" && fail "a password is in cgi.log"

# ---- The audit trail: one JSON line per event in var/log/vela/audit.log
# (its format and bounds: platform/audit/AuditTest.cpp), each also in the
# log as "audit: ", and nothing secret in it.
AUDIT=$ROOT/var/log/vela/audit.log
# audited NAME TEXT...: some line of audit.log holds every TEXT.
audited() {
  local name=$1 lines
  shift
  lines=$(cat "$AUDIT" 2>/dev/null)
  for text in "$@"; do
    lines=$(printf '%s\n' "$lines" | grep -F -- "$text")
  done
  [ -n "$lines" ] || fail "$name: no line of audit.log holds: $*"
}
audited "audit: login" '"event":"login"' "\"user\":\"$USER1\"" '"address":"127.0.0.1"' '"api":"VELA.Auth"' \
  '"method":"login"' '"result":0' '"time":"20'
audited "audit: wrong password" '"event":"login-failed"' "\"user\":\"$USER1\"" '"address":"127.0.0.4"' '"result":400'
audited "audit: unknown account" '"event":"login-failed"' "\"user\":\"nosuch$tag\"" '"result":400'
audited "audit: blocked" '"event":"login-blocked"' "\"user\":\"spray4$tag\"" '"address":"127.0.0.6"' '"result":407'
audited "audit: logout" '"event":"logout"' "\"user\":\"$USER1\"" '"method":"logout"' '"result":0'
grep -F "\"user\":\"$USER1\"" "$AUDIT" | grep -qF '"event":"session-revoke"' &&
  fail "audit: the logout is also recorded as a revocation"
audited "audit: velaadm session" '"event":"session-create"' '"user":"system"' '"actor":"root"'
audited "audit: velaadm token" '"event":"token-create"' '"user":"system"' "\"tokenId\":\"${tok%%.*}\""
audited "audit: adminonly as an administrator" '"event":"call"' "\"user\":\"$ADMIN\"" '"api":"VELA.Sample"' \
  '"method":"adminonly"' '"result":0'
audited "audit: adminonly refused" '"event":"call"' '"method":"adminonly"' '"result":105'
grep -qF '"method":"whoami"' "$AUDIT" && fail "audit: whoami is not audited, yet it is in audit.log"
for secret in "$PASS1" "$PASSA" "$SID1" "$TOKEN1" "${tok#*.}"; do
  grep -qF -- "$secret" "$AUDIT" && fail "audit: a secret is in audit.log"
done
grep -qF "audit: {" "$RUN/cgi.log" || fail "audit: the events are not in the log"
[ "$(stat -c '%a %u' "$AUDIT")" = "640 0" ] || fail "audit: audit.log is $(stat -c '%a %u' "$AUDIT")"
[ "$(stat -c '%a %u' "$ROOT/var/log/vela")" = "750 0" ] || fail "audit: its directory is $(stat -c '%a %u' "$ROOT/var/log/vela")"

srv_finish "all login checks passed ($URL)"
