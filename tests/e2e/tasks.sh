#!/usr/bin/env bash
# Background tasks through the real web server: the sample's checksum task
# is started, polled until it finishes, stopped, killed, listed and queried
# by its owner, by another user and by an administrator, and outlives a
# restart of the web server.
#
# usage: tasks.sh VELASCGI VELAADM STAGED_WEBAPI_DIR SOURCE_DIR
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI VELAADM WEBAPI SRC -- "$@"
srv_require "velascgi switches to the identity each API asks for" python3 cksum
srv_traps
srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
mkdir -p "$ROOT/vol1/small/sub" "$ROOT/vol1/big"
echo /vol1 >"$ROOT/etc/vela/volumes.conf"
printf 'one\n' >"$ROOT/vol1/small/a.txt"
head -c 100000 /dev/urandom >"$ROOT/vol1/small/sub/b.bin"
ln -s /etc/shadow "$ROOT/vol1/small/link"
printf 'root only\n' >"$ROOT/vol1/small/secret" && chmod 0600 "$ROOT/vol1/small/secret"
head -c 4000000 /dev/urandom >"$ROOT/vol1/big/c.bin"
srv_serve

# "nobody" and "daemon" are ordinary accounts on every Debian machine; root
# is an administrator.
session() { VELA_ROOT=$ROOT "$VELAADM" session create "$1" | sed -n 's/^sid=//p'; }
NOBODY=$(session nobody)
DAEMON=$(session daemon)
ADMIN=$(session root)
[ -n "$NOBODY" ] && [ -n "$DAEMON" ] && [ -n "$ADMIN" ] || { fail "velaadm created no session"; exit 1; }

API='api=VELA.Sample&version=1'
# as SID METHOD [PARAMS]: one call of the sample API.
as() { call --cookie "id=$1" --data "$API&method=$2${3:+&$3}" "$URL"; }
# field EXPR: a value of the last answer, by a Python expression over `a`.
field() { python3 -c "import json,sys; a=json.load(open(sys.argv[1])); print($1)" "$TMP/body" 2>/dev/null; }
# start SID PARAMS: starts a checksum task, prints its id.
start() { as "$1" checksum "$2"; field 'a["data"]["task_id"]'; }
# wait_for SID ID EXPR: polls the status until EXPR holds (30 s at most).
wait_for() {
  local _
  for _ in $(seq 1 300); do
    as "$1" taskstatus "task_id=$2"
    [ "$(field "$3")" = True ] && return 0
    sleep 0.1
  done
  fail "task $2 never reached $3: $(head -c 600 "$TMP/body")"
  return 1
}
code_is() { expect "$1" '"success":false' "\"code\":$2"; }

# ---- A task runs to its end: progress, then every file's cksum, links
# skipped; the worker reads as its user, so a root-only file stays unread.
ID=$(start "$NOBODY" "path=small")
case "$ID" in nobody/cksum-*) ;; *) fail "task id: $ID ($(head -c 300 "$TMP/body"))" ;; esac
wait_for "$NOBODY" "$ID" 'a["data"]["finish"]'
expect "finished task" '"success":true' '"files":3' '"error":"unreadable","path":"secret"' '"percent":100' '"description":"done"' '"method":"checksum"'
want=$(cksum <"$ROOT/vol1/small/sub/b.bin" | cut -d' ' -f1)
[ "$(field '[f["cksum"] for f in a["data"]["data"]["list"] if f["path"]=="sub/b.bin"][0]')" = "$want" ] ||
  fail "cksum of sub/b.bin differs from cksum(1): $(head -c 600 "$TMP/body")"
! grep -q '"_sid"\|shadow' "$TMP/body" || fail "the record keeps the session id or followed the link"

# ---- Stopped while it runs: the worker ends and says so.
SLOW=$(start "$NOBODY" "path=big&pace_ms=100")
wait_for "$NOBODY" "$SLOW" '"progress" in a["data"] and not a["data"]["finish"]'
as "$NOBODY" taskstop "task_id=$SLOW"
expect "stop" '"success":true'
wait_for "$NOBODY" "$SLOW" 'a["data"].get("error",{}).get("errors",{}).get("reason")=="stopped"'
expect "stopped task" '"finish":true'

# ---- A worker killed outright is seen as finished with an error.
LOST=$(start "$NOBODY" "path=big&pace_ms=100")
pid=$(python3 -c 'import json,sys; print(json.load(open(sys.argv[1]))["create_pid"])' \
  "$ROOT/var/lib/vela/tasks/${LOST%%/*}/${LOST#*/}")
kill -KILL "$pid" 2>/dev/null || fail "no worker to kill ($pid)"
wait_for "$NOBODY" "$LOST" 'a["data"]["finish"]'
expect "lost worker" '"code":117' 'without finishing'

# ---- Who sees what.
as "$NOBODY" tasklist
[ "$(field 'a["data"]["total"]')" = 3 ] || fail "owner's list: $(head -c 600 "$TMP/body")"
as "$DAEMON" tasklist
[ "$(field 'a["data"]["total"]')" = 0 ] || fail "another user's list: $(head -c 600 "$TMP/body")"
for sid in "$DAEMON" "$ADMIN"; do
  as "$sid" taskstatus "task_id=$ID"
  code_is "another user's task" 503
  as "$sid" taskstop "task_id=$SLOW"
  code_is "stopping another user's task" 503
done
SHARED=$(start "$NOBODY" "path=small&share=everyone&auto_remove=false")
case "$SHARED" in @users/*) ;; *) fail "shared task id: $SHARED" ;; esac
as "$DAEMON" taskstatus "task_id=$SHARED"
expect "a task shared with everyone" '"success":true'
as "$DAEMON" taskstop "task_id=$SHARED"
expect "stopping a task shared with everyone" '"success":true'
as "$NOBODY" checksum "path=small&share=admin"
code_is "the admin group asked by a user" 505
as "$NOBODY" checksum "path=small&share=friends"
code_is "an unknown group" 502
ADMINS=$(start "$ADMIN" "path=small&share=admin")
case "$ADMINS" in @administrators/*) ;; *) fail "administrators' task id: $ADMINS" ;; esac
as "$NOBODY" taskstatus "task_id=$ADMINS"
code_is "administrators' task asked by a user" 503
as "$ADMIN" tasklist "group=admin"
[ "$(field 'a["data"]["total"]')" = 1 ] || fail "administrators' list: $(head -c 600 "$TMP/body")"
as "$NOBODY" tasklist "group=admin"
code_is "administrators' list asked by a user" 505

# ---- Ids that are not ids.
for bad in nobody-no-slash 'nobody/..%2Fx' '../nobody/x' 'nobody/.lock'; do
  as "$NOBODY" taskstatus "task_id=$bad"
  code_is "task id $bad" 503
done
as "$NOBODY" taskstatus "task_id=nobody/cksum-0000000000000000"
code_is "unknown task" 508
as "$NOBODY" checksum "path=../etc"
code_is "a path outside the volume" 101

# ---- The web server restarts; the running task goes on and finishes.
LONG=$(start "$NOBODY" "path=big&pace_ms=100&auto_remove=true")
srv_stop
srv_serve
as "$NOBODY" taskstatus "task_id=$LONG"
expect "task after the restart" '"success":true' '"finish":false'
for _ in $(seq 1 300); do
  as "$NOBODY" taskstatus "task_id=$LONG"
  grep -q '"code":508' "$TMP/body" && break
  sleep 0.1
done
code_is "an auto_remove task once it finished" 508

srv_finish "all task checks passed ($URL)"
