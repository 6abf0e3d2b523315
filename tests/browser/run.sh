#!/usr/bin/env bash
# Browser tests of the static pages: a private lighttpd (tests/e2e/server.sh)
# serves deploy/www and the web API under a temporary system root, and
# playwright-core drives headless Chromium through a page:
#   login  a Linux account made for the run signs in (login.test.js);
#   share  a visitor opens a sharing link of the file-sharing sample owned
#          by "nobody", with a password, and downloads from it (share.test.js);
#   admin  an administrator signs in and reads the status page (usage counts,
#          a running task, sessions, a blocked address), revokes a session
#          made with velaadm; an ordinary user is told the page is not for
#          them (admin.test.js).
# The three share harness.js, which they require from beside themselves, so
# they run from SRC/tests/browser and only node_modules lives in WORK_DIR.
#
# usage: run.sh VELASCGI STAGED_WEBAPI_DIR SOURCE_DIR WORK_DIR [share VELAADM CHECK_LIBRARY | admin VELAADM]
# WORK_DIR receives node_modules (npm ci from package-lock.json, again only
# when the lock changes). Exit 0 passed, 1 failed, 77 (skipped) when
# chromium, node, npm, lighttpd or curl is missing or when not run as root
# (accounts, PAM, the identity switches and the sharing store need it).
set -u

. "$(dirname "$0")/../e2e/server.sh"
mkdir -p "${4:?usage: run.sh VELASCGI STAGED_WEBAPI_DIR SOURCE_DIR WORK_DIR [share VELAADM CHECK_LIBRARY | admin VELAADM]}" || exit 1
if [ "${5:-}" = share ]; then
  page=share
  srv_args VELASCGI WEBAPI SRC WORK VELAADM CHECKLIB -- "${@:1:4}" "${@:6}"
elif [ "${5:-}" = admin ]; then
  page=admin
  srv_args VELASCGI WEBAPI SRC WORK VELAADM -- "${@:1:4}" "${@:6}"
else
  page=login
  srv_args VELASCGI WEBAPI SRC WORK -- "$@"
fi

CHROMIUM=${CHROMIUM:-/usr/bin/chromium}
if [ ! -x "$CHROMIUM" ]; then
  echo "SKIP: $CHROMIUM is not installed"
  exit 77
fi
if [ $page != share ]; then
  srv_require "Linux accounts, PAM, identity switches" node npm useradd chpasswd
else
  srv_require "the identity of the link's owner" node npm
fi

# ---- playwright-core, exactly as the lock file pins it.
if ! cmp -s "$SRC/tests/browser/package-lock.json" "$WORK/package-lock.json" ||
   [ ! -f "$WORK/node_modules/playwright-core/package.json" ]; then
  cp "$SRC/tests/browser/package.json" "$SRC/tests/browser/package-lock.json" "$WORK/" || exit 1
  if ! (cd "$WORK" && npm ci --no-audit --no-fund --loglevel=error); then
    rm -f "$WORK/package-lock.json"
    echo "FAIL: npm ci in $WORK"
    exit 1
  fi
fi

srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
run_page() {
  NODE_PATH="$WORK/node_modules" CHROMIUM="$CHROMIUM" node "$SRC/tests/browser/$page.test.js" "$@" ||
    fail "the page's checks"
  srv_finish "browser $page passed"
}

# ---- Sign-in: the server and an account.
if [ $page = login ]; then
  srv_pam
  account="vtw$(printf '%04x%04x' $RANDOM $RANDOM)"
  password=$(srv_password)
  srv_add_user "$account" "$password"
  srv_start "$SRC/deploy/www" || { failures=1; exit 1; }
  run_page "$BASE" "$account" "$password"
fi

# ---- Status page: an administrator and a user, usage counting on, low
# failure limits (windows long enough that a slow machine cannot let the
# block lapse), a folder for the sample's checksum task.
if [ $page = admin ]; then
  srv_pam
  tag=$(printf '%04x%04x' $RANDOM $RANDOM)
  admin="vta$tag" admin_pass=$(srv_password)
  user="vtu$tag" user_pass=$(srv_password)
  cat >"$ROOT/etc/vela/webapi.conf" <<EOF
admin_group="vtg$tag"
login_max_failures="3"
login_window_minutes="30"
login_block_minutes="30"
EOF
  echo 'enable_data_collect="yes"' >"$ROOT/etc/velainfo.conf"
  mkdir -p "$ROOT/vol1/big" && echo /vol1 >"$ROOT/etc/vela/volumes.conf" &&
    head -c 16000000 /dev/urandom >"$ROOT/vol1/big/c.bin" || exit 1
  srv_add_user "$admin" "$admin_pass" "vtg$tag"
  srv_add_user "$user" "$user_pass"
  srv_start "$SRC/deploy/www" || { failures=1; exit 1; }

  session() { VELA_ROOT=$ROOT "$VELAADM" session create "$@" | sed -n 's/^sid=//p'; }
  second=$(session "$admin" --ip 127.0.0.1) starter=$(session nobody)
  [ -n "$second" ] && [ -n "$starter" ] || { fail "velaadm created no session"; exit 1; }
  # Calls to count, and a task that runs through the page's checks (64 KiB
  # a second; stopped at the end).
  for _ in 1 2 3; do
    call --cookie "id=$second" "$URL?api=VELA.Sample&version=1&method=whoami"
    expect "whoami with the session made by velaadm" '"success":true'
  done
  sample() { call --cookie "id=$starter" --data "api=VELA.Sample&version=1&method=$1&$2" "$URL"; }
  sample checksum "path=big&pace_ms=1000"
  task=$(sed -n 's/.*"task_id":"\([^"]*\)".*/\1/p' "$TMP/body")
  [ -n "$task" ] || { fail "no task started: $(head -c 600 "$TMP/body")"; exit 1; }
  srv_traps 'sample taskstop "task_id=$task"'
  progress() { sample taskstatus "task_id=$task"; grep -q '"progress"' "$TMP/body"; }
  srv_wait 300 0.1 progress || fail "the task reports no progress: $(head -c 600 "$TMP/body")"
  # Failed sign-ins from another address of the machine block it; one
  # account name would be markup if the page inserted it as HTML.
  for name in "$user" "$user" '<img src=x onerror=document.title=1>'; do
    call --interface 127.0.0.2 --data-urlencode "account=$name" --data-urlencode "passwd=x$user_pass" \
      "$URL?api=VELA.Auth&version=1&method=login"
  done
  expect_error "the third failed sign-in" 400
  call --interface 127.0.0.2 --data-urlencode "account=$user" --data-urlencode "passwd=$user_pass" \
    "$URL?api=VELA.Auth&version=1&method=login"
  expect_error "a sign-in from the blocked address" 407
  run_page "$BASE" "$admin" "$admin_pass" "$user" "$user_pass" "$second" "$task" 127.0.0.2 \
    "$ROOT/etc/velainfo.conf"
fi

# ---- Sharing: a folder of "nobody" with a sub-folder holding random
# bytes, and a name that would be markup if the page inserted it as HTML.
mkdir -p "$ROOT/usr/lib/sharing/permission_lib" "$ROOT/volume1/pub/sub" &&
  install -m 0755 "$CHECKLIB" "$ROOT/usr/lib/sharing/permission_lib/sample-share.so" &&
  head -c 200000 /dev/urandom >"$ROOT/volume1/pub/sub/data.bin" &&
  echo hello >"$ROOT/volume1/pub/<img src=x onerror=alert(1)>.txt" && chmod -R a+rX "$ROOT/volume1" || exit 1
password=$(srv_password)
link=$(printf '%s\n' "$password" | VELA_ROOT=$ROOT "$VELAADM" link create --owner nobody --project sample-share \
         --path /volume1/pub --password-stdin | sed -n 's/^id=//p')
[ -n "$link" ] || { fail "velaadm made no link"; exit 1; }
srv_start "$SRC/deploy/www" || { failures=1; exit 1; }
run_page "$BASE" "$link" "$password" "$ROOT/volume1/pub/sub/data.bin"
