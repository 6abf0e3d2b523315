#!/usr/bin/env bash
# Browser test of the sign-in page: a private lighttpd (tests/e2e/server.sh)
# serves deploy/www and the web API under a temporary system root; a Linux
# account made for the run signs in through the page in headless Chromium,
# driven by playwright-core (login.test.js).
#
# usage: run.sh VELASCGI STAGED_WEBAPI_DIR SOURCE_DIR WORK_DIR
# WORK_DIR receives node_modules (npm ci from package-lock.json, again only
# when the lock changes). Exit 0 passed, 1 failed, 77 (skipped) when
# chromium, node, npm, lighttpd or curl is missing or when not run as root
# (the account, PAM and the identity switches need it).
set -u

. "$(dirname "$0")/../e2e/server.sh"
mkdir -p "${4:?usage: run.sh VELASCGI STAGED_WEBAPI_DIR SOURCE_DIR WORK_DIR}" || exit 1
srv_args VELASCGI WEBAPI SRC WORK -- "$@"

CHROMIUM=${CHROMIUM:-/usr/bin/chromium}
if [ ! -x "$CHROMIUM" ]; then
  echo "SKIP: $CHROMIUM is not installed"
  exit 77
fi
srv_require "a Linux account, PAM, identity switches" node npm useradd chpasswd

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

# ---- The server and an account.
srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
srv_pam
account="vtw$(printf '%04x%04x' $RANDOM $RANDOM)"
password=$(srv_password)
srv_add_user "$account" "$password"
srv_start "$SRC/deploy/www" || { failures=1; exit 1; }

NODE_PATH="$WORK/node_modules" CHROMIUM="$CHROMIUM" \
  node "$SRC/tests/browser/login.test.js" "$BASE" "$account" "$password" || fail "the page's checks"
srv_finish "browser login passed"
