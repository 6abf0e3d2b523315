#!/usr/bin/env bash
# Compound requests through the real web server (a private lighttpd, as in
# e2e.sh): a browser's form or a curl query sends the list of calls as JSON
# text, and every call is checked like a request of its own. A session
# without administrator rights can never get an administrators-only method
# run by hiding it in a compound, in sequence or in parallel.
set -u

. "$(dirname "$0")/server.sh"
srv_args VELASCGI VELAADM WEBAPI SRC -- "$@"
srv_require "velascgi switches to the identity each API asks for" python3
srv_init "$SRC" "$VELASCGI" "$WEBAPI" || exit 1
srv_serve

# "nobody" is an ordinary account on every Debian machine: not in the
# administrators group. root is an administrator.
session() { VELA_ROOT=$ROOT "$VELAADM" session create "$1" | sed -n 's/^sid=//p'; }
USER_SID=$(session nobody)
ADMIN_SID=$(session root)
[ -n "$USER_SID" ] && [ -n "$ADMIN_SID" ] || { fail "velaadm created no session"; exit 1; }

ENTRY='api=VELA.Entry.Request&version=1&method=request'
sample() { printf '{"api":"VELA.Sample","version":1,"method":"%s"%s}' "$1" "${2:-}"; }
CALLS="[$(sample whoami),$(sample adminonly),$(sample echo ',"n":3'),$(sample download ',"name":"x"')]"

# result_code I CODE: the I-th answer of the compound is error CODE;
# result_ok I: it succeeded.
result_code() {
  python3 - "$TMP/body" "$1" "${2:-}" <<'PY' || fail "compound answer $1 is not ${2:-a success}: $(head -c 800 "$TMP/body")"
import json, sys
entry = json.load(open(sys.argv[1]))["data"]["result"][int(sys.argv[2])]
code = int(sys.argv[3]) if sys.argv[3] else None
sys.exit(0 if entry and entry["success"] == (code is None) and (code is None or entry["error"]["code"] == code) else 1)
PY
}
result_ok() { result_code "$1"; }

nobody_uid=$(id -u nobody)
for mode in sequential parallel; do
  # A form (POST), as a browser sends it.
  call --cookie "id=$USER_SID" --data-urlencode "compound=$CALLS" --data "$ENTRY&mode=$mode" "$URL"
  expect_status "$mode compound as a user" 200
  expect "$mode compound as a user" '"success":true' '"has_fail":true'
  result_ok 0
  expect "$mode whoami inside" "\"uid\":[$nobody_uid,"
  result_code 1 105
  result_ok 2
  result_code 3 113

  # The same list in a query string, as an administrator: the method opens.
  call --cookie "id=$ADMIN_SID" -G --data-urlencode "compound=$CALLS" --data "$ENTRY&mode=$mode" "$URL"
  expect "$mode compound as an administrator" '"success":true' '"has_fail":true'
  result_ok 1
  result_code 3 113
done

# Without a session every call is refused on its own; the compound answers.
call --data-urlencode "compound=[$(sample whoami)]" --data "$ENTRY" "$URL"
expect "compound without a session" '"success":true' '"has_fail":true'
result_code 0 119

# stop_when_error as form text: after the refused call nothing runs.
call --cookie "id=$USER_SID" --data-urlencode "compound=[$(sample adminonly),$(sample echo)]" \
  --data "$ENTRY&stop_when_error=true" "$URL"
result_code 0 105
result_code 1 112

# More calls than the limit: refused whole, before anything runs.
many=$(python3 -c 'import json; print(json.dumps([{"api":"VELA.Sample","version":1,"method":"echo"}]*129))')
call --cookie "id=$USER_SID" --data-urlencode "compound=$many" --data "$ENTRY" "$URL"
expect_error "129 calls" 110

# Not a list.
call --cookie "id=$USER_SID" --data "$ENTRY&compound=%7B%7D" "$URL"
expect_error "compound not a list" 110

srv_finish "all compound checks passed ($URL)"
