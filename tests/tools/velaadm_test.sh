#!/bin/sh
# Drives the velaadm binary against a fresh VELA_ROOT: every subcommand, its
# output, exit status and error messages, and the files it leaves.
# usage: velaadm_test.sh /path/to/velaadm
set -u

ADM=${1:?usage: velaadm_test.sh /path/to/velaadm}
. "$(dirname "$0")/checks.sh"
worker=
trap 'rm -rf "$TMP"; [ -z "$worker" ] || kill "$worker" 2>/dev/null' EXIT
VELA_ROOT=$TMP/root
export VELA_ROOT
mkdir "$VELA_ROOT" || exit 1

# expect STATUS ARGS...: runs velaadm, checks its exit status.
expect() {
    want=$1
    shift
    runs "$want" "$ADM" "$@"
}

# refused STATUS TEXT ARGS...: velaadm ARGS exits STATUS saying TEXT.
refused() {
    want=$1 text=$2
    shift 2
    expect "$want" "$@"
    stderr_has "$text"
}

# ---- usage errors
refused 2 "no command given"
stderr_has "velaadm --help"
refused 2 "unknown command" frobnicate
for args in session "session frobnicate" "session create" "session list extra"; do
    eval "expect 2 $args"
done
refused 2 "\-\-timeout must be" session create root --timeout abc
expect 2 session create root --timeout -5
refused 2 "needs a value" session create root --ip
refused 2 "unknown option --bogus" session create root --bogus
expect 0 --help
stdout_has "session create"

# ---- sessions
refused 1 "no user \"vela-no-such-user\"" session create vela-no-such-user
refused 1 "not an IP address" session create root --ip 999.1.1.1

expect 0 session create root --ip 192.0.2.7 --timeout 600 --token
sid=$(sed -n 's/^sid=//p' "$OUT")
token=$(sed -n 's/^token=//p' "$OUT")
echo "$sid" | grep -Eq '^[A-Za-z0-9_-]{32}$' || fail "session id \"$sid\" has the wrong form"
echo "$token" | grep -Eq '^[A-Za-z0-9_-]{32}$' || fail "anti-forgery token \"$token\" has the wrong form"
# (The modes of the files it makes: platform/session/SessionTest.cpp and
# AccessTokenTest.cpp.)
grep -q '"idleTimeout":600' "$VELA_ROOT/run/vela/sessions/$sid" || fail "idle timeout not stored"
grep -q '"tokenProtect":true' "$VELA_ROOT/run/vela/sessions/$sid" || fail "token protection not stored"

expect 0 session create nobody
sid2=$(sed -n 's/^sid=//p' "$OUT")
grep -q '"skipIP":true' "$VELA_ROOT/run/vela/sessions/$sid2" || fail "a session without --ip must skip the address check"

expect 0 session list
stdout_has "$sid" "192.0.2.7" "$sid2" "nobody"
stdout_lacks "$token"

expect 0 session revoke "$sid"
[ ! -e "$VELA_ROOT/run/vela/sessions/$sid" ] || fail "revoked session file still exists"
refused 1 "no session" session revoke "$sid"
expect 1 session revoke ../x
expect 2 session revoke
expect 0 session list
stdout_lacks "$sid"

# ---- access tokens
refused 2 "at least one --api" token create root --method get
refused 2 "invalid pattern" token create root --api 'a*b' --method get
expect 2 token create root --api x --method y --expires 0
refused 1 "no user \"vela-no-such-user\"" token create vela-no-such-user --api x --method y

expect 0 token create root --api 'VELA.Demo.*' --api VELA.Other --method 'get*' --expires 3600
tid=$(sed -n 's/^id=//p' "$OUT")
tok=$(sed -n 's/^token=//p' "$OUT")
echo "$tid" | grep -Eq '^[A-Za-z0-9_-]{22}$' || fail "token id \"$tid\" has the wrong form"
case "$tok" in
"$tid".*) ;;
*) fail "token \"$tok\" does not start with its id" ;;
esac

expect 0 token list
stdout_has "$tid" "VELA.Demo.\*,VELA.Other / get\*"
stdout_lacks "${tok#*.}"

expect 0 token revoke "$tid"
[ ! -e "$VELA_ROOT/var/lib/vela/tokens/$tid" ] || fail "revoked token file still exists"
refused 1 "no access token" token revoke "$tid"
expect 1 token revoke ../../x

# ---- background tasks, on records written by hand. The worker of
# alice/sum-1 runs; bob/sum-3 names the same pid under another start time
# (a reused pid), so it is lost and its "worker" is never signalled.
tasks="$VELA_ROOT/var/lib/vela/tasks"
mkdir -p "$tasks/alice" "$tasks/bob" "$tasks/@administrators"
sleep 300 &
worker=$!
start=$(cut -d' ' -f22 "/proc/$worker/stat")
record() { # OWNER ID FINISHED PID START PROPERTIES
    printf '{"version":1,"owner":"%s","id":"%s","created":1700000000,"updated":1700000000,"finished":%s,"finished_at":0,"create_pid":%s,"create_start":%s,"properties":%s}\n' \
        "$@" >"$tasks/$1/$2"
}
record alice sum-1 false "$worker" "$start" \
    '{"info":{"api":"VELA.Sample","method":"cksum\u001b[2J"},"progress":{"percent":40}}'
record @administrators sum-2 true 0 -1 '{}'
record bob sum-3 false "$worker" "$((start + 1))" '{"info":{"api":"VELA.Sample","method":"list"}}'
: >"$tasks/alice/.lock"

expect 0 task list
stdout_has "^alice/sum-1 *running *2023-11-14T22:13:20Z *VELA.Sample / cksum?\[2J *40%$"
stdout_has "^@administrators/sum-2 *finished"
stdout_has "^bob/sum-3 *lost *.*VELA.Sample / list"
stdout_lacks "$(printf '\033')"
stdout_lacks ".lock"
expect 0 task list --owner bob
stdout_has "bob/sum-3"
stdout_lacks "alice"
refused 2 "invalid owner" task list --owner ../alice

expect 0 task show alice/sum-1
stdout_has '"percent" : 40'
stdout_has '"cksum\\u001b\[2J"'
for bad in alice ../etc/passwd alice/../bob alice/.x .x/sum-1 @other/sum-1 "alice/sum 1"; do
    refused 2 "invalid task id" task show "$bad"
done
refused 1 "no task alice/sum-9" task stop alice/sum-9
expect 2 task stop
expect 2 task frobnicate

expect 0 task stop bob/sum-3
stdout_lacks SIGTERM
grep -q '"finished":true' "$tasks/bob/sum-3" || fail "stop of a lost task did not mark it finished"
kill -0 "$worker" 2>/dev/null || fail "the process holding a reused pid was signalled"
expect 0 task stop alice/sum-1 --remove
stdout_has "worker $worker sent SIGTERM"
wait "$worker"
[ $? -eq 143 ] || fail "the worker did not end by SIGTERM"
worker=
[ ! -e "$tasks/alice/sum-1" ] || fail "stop --remove left the record"

# ---- sharing links. The password never reaches the command line; list and
# show never print its hash; a path must exist below the root.
mkdir -p "$VELA_ROOT/srv/photos" && echo data >"$VELA_ROOT/srv/photos/a.txt"
ln -s ../photos/a.txt "$VELA_ROOT/srv/photos/alias"
printf 'Pw-one\nsecond line\n' >"$VELA_ROOT/srv/pw"
refused 2 "needs --owner, --project and --path" link create --owner nobody --path /srv/photos
refused 2 "exclude each other" link create --owner nobody --project p --path /srv/photos \
    --password-stdin --password-file "$VELA_ROOT/srv/pw"
refused 2 "unknown option --password" link create --owner nobody --project p --path /srv/photos --password x
refused 2 "\-\-path must be" link create --owner nobody --project p --path srv/photos
refused 2 "\-\-path must be" link create --owner nobody --project p --path /srv/../etc
refused 2 "\-\-uses must be" link create --owner nobody --project p --path /srv/photos --uses 0
refused 1 "No such file" link create --owner nobody --project p --path /srv/none
refused 1 "no user" link create --owner vela-no-such-user --project p --path /srv/photos
expect 1 link create --owner nobody --project ../p --path /srv/photos
for pw in '' 'a\tb' "$(head -c 300 /dev/zero | tr '\0' x)"; do
    printf "$pw\n" | "$ADM" link create --owner nobody --project p --path /srv/photos --password-stdin \
        >"$OUT" 2>"$ERR" && fail "the password \"$pw\" was taken"
    stderr_has "the password must be 1 to 256 bytes"
done
printf 'p\303\244ss\n' | "$ADM" link create --owner nobody --project p --path /srv/photos --password-stdin \
    >"$OUT" 2>"$ERR" || fail "a UTF-8 password was refused"

expect 0 link create --owner nobody --project vela.photos --path /srv/photos/alias --expires 3600 \
    --uses 5 --match-ip --password-file "$VELA_ROOT/srv/pw"
lid=$(sed -n 's/^id=//p' "$OUT")
echo "$lid" | grep -Eq '^[A-Za-z0-9_-]{22}$' || fail "link id \"$lid\" has the wrong form"
stdout_has "^url=/sharing/vela.photos/$lid$"
printf 'Pw-two\n' | "$ADM" link create --owner root --project p --path /srv/photos --password-stdin >"$OUT" 2>"$ERR" ||
    fail "link create with --password-stdin failed"
lid2=$(sed -n 's/^id=//p' "$OUT")

expect 0 link list
stdout_has "^$lid *nobody *vela.photos .* 0/5 *active */srv/photos/a.txt \[password\] \[match-ip\]$"
stdout_has "^$lid2 *root .* never *0 *active */srv/photos \[password\]$"
stdout_has "^[A-Za-z0-9_-]* *nobody *p .* never *0 *active */srv/photos \[password\]$"
expect 0 link list --owner nobody
stdout_lacks "$lid2"
expect 0 link show "$lid"
stdout_has '"hasPassword" : true'
stdout_has '"useLimit" : 5'
stdout_lacks "Pw-one"
grep -q '"path" : "/srv/photos/a.txt"' "$OUT" || fail "the link does not keep the resolved path"
# The stored hash is not printed: nothing but the known members.
[ "$(grep -c ' : ' "$OUT")" -eq 13 ] || fail "link show prints other members"
refused 2 "invalid link id" link show "../$lid"
refused 1 "no link with that id" link show AAAAAAAAAAAAAAAAAAAAAA
expect 0 link revoke "$lid"
expect 0 link list --owner nobody
stdout_has "^$lid .* revoked "
expect 0 link revoke "$lid"
expect 2 link frobnicate
expect 2 link

# ---- relay peers. The token is read from a file or standard input, never
# an argument, and never printed; the file is root's alone.
refused 2 "needs --url and one of" peer add p --url https://a
refused 2 "unknown option --token" peer add p --url https://a --token x.y
refused 2 "exactly one peer name" peer add --url https://a --token-stdin
printf 'x.y\n' >"$TMP/token"
refused 1 "loopback" peer add p --url http://192.0.2.1 --token-file "$TMP/token"
refused 1 "peer name" peer add ../p --url https://a --token-file "$TMP/token"
refused 1 "scheme://host" peer add p --url https://a/path --token-file "$TMP/token"
refused 1 "not a regular file" peer add p --url https://a --token-file "$TMP"
printf 'a b\n' >"$TMP/badtoken"
IN=$TMP/badtoken
refused 1 "must be an access token" peer add p --url https://a --token-stdin
IN=/dev/null
[ ! -e "$VELA_ROOT/etc/vela/peers.json" ] || fail "a refused peer wrote the peers file"
printf 'tok-1.SECRET_one\n' | "$ADM" peer add nas2 --url https://192.0.2.2:5001 --token-stdin \
    --ca-file /etc/vela/nas2.pem --pin 'sha256//AAAA=' >"$OUT" 2>"$ERR" || fail "peer add nas2"
printf 'tok-2.SECRET_two\n' >"$TMP/token"
expect 0 peer add local --url http://127.0.0.1:8080 --token-file "$TMP/token"
[ "$(stat -c '%a %u' "$VELA_ROOT/etc/vela/peers.json")" = "600 0" ] || fail "peers.json is not 0600 root"
refused 1 "exists" peer add local --url http://127.0.0.2 --token-file "$TMP/token"
expect 0 peer add local --url http://127.0.0.2 --token-file "$TMP/token" --replace
expect 0 peer list
stdout_has "^nas2 *https://192.0.2.2:5001 *ca /etc/vela/nas2.pem, key pinned$" "^local *http://127.0.0.2 *none"
stdout_lacks SECRET
refused 2 "takes no arguments" peer list x
chmod 0644 "$VELA_ROOT/etc/vela/peers.json"
refused 1 "owned by root with mode 0600" peer list
chmod 0600 "$VELA_ROOT/etc/vela/peers.json"
refused 1 "no such peer" peer test nosuch
refused 2 "\-\-timeout must be" peer test local --timeout 0
refused 1 "no peer with that name" peer remove nosuch
expect 0 peer remove local
expect 0 peer list
stdout_lacks "^local"
refused 2 "peer needs an action" peer

# ---- public key: printed as PEM, or a clear refusal while none is available
"$ADM" pubkey >"$OUT" 2>"$ERR"
case $? in
0) stdout_has "BEGIN PUBLIC KEY" ;;
1) stderr_has "public key is not available" ;;
*) fail "pubkey exited with an unexpected status" ;;
esac
expect 2 pubkey extra

# Nothing was written outside the state directories.
extra=$(find "$VELA_ROOT" -mindepth 1 \( -path "$VELA_ROOT/run" -o -path "$VELA_ROOT/run/vela" \
    -o -path "$VELA_ROOT/run/vela/sessions*" -o -path "$VELA_ROOT/var" -o -path "$VELA_ROOT/var/lib" \
    -o -path "$VELA_ROOT/var/lib/vela" -o -path "$VELA_ROOT/var/lib/vela/tokens*" \
    -o -path "$VELA_ROOT/var/lib/vela/keys*" -o -path "$VELA_ROOT/var/lib/vela/sharing*" \
    -o -path "$VELA_ROOT/srv*" -o -path "$tasks*" -o -path "$VELA_ROOT/etc*" \) \
    -prune -o -print)
[ -z "$extra" ] || fail "unexpected files: $extra"
finish velaadm
