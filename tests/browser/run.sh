#!/usr/bin/env bash
# Browser tests of the static pages: a private lighttpd (tests/e2e/server.sh)
# serves deploy/www and the web API under a temporary system root, and
# playwright-core drives headless Chromium through a page:
#   login  a Linux account made for the run signs in (login.test.js);
#   share  a visitor opens a sharing link of the file-sharing sample owned
#          by "nobody", with a password, and downloads from it (share.test.js).
#
# usage: run.sh VELASCGI STAGED_WEBAPI_DIR SOURCE_DIR WORK_DIR [share VELAADM CHECK_LIBRARY]
# WORK_DIR receives node_modules (npm ci from package-lock.json, again only
# when the lock changes). Exit 0 passed, 1 failed, 77 (skipped) when
# chromium, node, npm, lighttpd or curl is missing or when not run as root
# (accounts, PAM, the identity switches and the sharing store need it).
set -u

. "$(dirname "$0")/../e2e/server.sh"
mkdir -p "${4:?usage: run.sh VELASCGI STAGED_WEBAPI_DIR SOURCE_DIR WORK_DIR [share VELAADM CHECK_LIBRARY]}" || exit 1
if [ "${5:-}" = share ]; then
  page=share
  srv_args VELASCGI WEBAPI SRC WORK VELAADM CHECKLIB -- "${@:1:4}" "${@:6}"
else
  page=login
  srv_args VELASCGI WEBAPI SRC WORK -- "$@"
fi

CHROMIUM=${CHROMIUM:-/usr/bin/chromium}
if [ ! -x "$CHROMIUM" ]; then
  echo "SKIP: $CHROMIUM is not installed"
  exit 77
fi
if [ $page = login ]; then
  srv_require "a Linux account, PAM, identity switches" node npm useradd chpasswd
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
