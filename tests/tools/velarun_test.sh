#!/bin/sh
# Drives velarun against the staged web-API directory.
# usage: velarun_test.sh refusals|sample /path/to/velarun <stage root>
#   refusals  usage errors, unreadable input, an unknown API
#   sample    the sample library's methods (needs root: they switch identity)
set -u

PART=${1:?usage: velarun_test.sh refusals|sample velarun root}
RUN=${2:?velarun path}
VELA_ROOT=${3:?stage root}
export VELA_ROOT
unset VELA_LOG_STDERR
WEBAPI=$VELA_ROOT/usr/vela/velaman/webapi
TMP=$(mktemp -d "${TMPDIR:-/tmp}/velarun-test-XXXXXX") || exit 1
trap 'rm -rf "$TMP"' EXIT
OUT=$TMP/out
ERR=$TMP/err

failures=0
fail() {
    echo "FAIL: $*" >&2
    echo "  stdout: $(cat "$OUT" 2>/dev/null)" >&2
    echo "  stderr: $(cat "$ERR" 2>/dev/null)" >&2
    failures=$((failures + 1))
}

# call STATUS JSON [ARGS...]: runs velarun with JSON on standard input.
call() {
    want=$1
    json=$2
    shift 2
    printf '%s' "$json" | "$RUN" "$@" >"$OUT" 2>"$ERR"
    got=$?
    [ "$got" -eq "$want" ] || fail "velarun $* <<< $json exited $got, expected $want"
}

# answer_is TEXT: the one line printed is exactly TEXT.
answer_is() {
    [ "$(cat "$OUT")" = "$1" ] || fail "answer is not $1"
    [ "$(wc -l <"$OUT")" -eq 1 ] || fail "answer is not one line"
}

req() { printf '{"getParam": {"api": "%s", "version": %s, "method": "%s"%s}}' "$1" "$2" "$3" "${4:-}"; }

case $PART in
refusals)
    call 1 "$(req VELA.Nope 1 get)"
    answer_is '{"error":{"code":102},"httpd_restart":false,"success":false}'
    call 1 "$(req VELA.Sample 1 nope)"
    answer_is '{"error":{"code":103},"httpd_restart":false,"success":false}'
    call 1 "$(req ../VELA.Sample 1 echo)"
    answer_is '{"error":{"code":102},"httpd_restart":false,"success":false}'
    call 1 '{}'
    answer_is '{"error":{"code":101},"httpd_restart":false,"success":false}'

    call 2 '{"getParam": ' -
    grep -q "not valid JSON" "$ERR" || fail "no message for bad JSON"
    [ ! -s "$OUT" ] || fail "an answer was printed for bad JSON"
    call 2 '{}' "$TMP/missing.json"
    grep -q "cannot open" "$ERR" || fail "no message for a missing file"
    call 2 '{}' --bogus
    call 2 '{}' a.json b.json
    call 2 '{}' -C
    call 2 '{}' -C "$TMP/nowhere"
    grep -q "cannot enter" "$ERR" || fail "no message for a missing directory"
    ;;
sample)
    [ "$(id -u)" -eq 0 ] || { echo "skipped: the sample's calls switch identity and need root"; exit 77; }
    call 0 "$(req VELA.Sample 1 echo ', "text": "hi", "n": [1, 2]')"
    answer_is '{"data":{"api":"VELA.Sample","method":"echo","n":[1,2],"text":"hi","version":1},"httpd_restart":false,"success":true}'

    # From a file, with the directory given.
    req VELA.Sample.Echo 1 echo >"$TMP/echo.json"
    call 0 '' -C "$WEBAPI" "$TMP/echo.json"
    answer_is '{"data":{"api":"VELA.Sample.Echo","method":"echo","version":1},"httpd_restart":false,"success":true}'

    call 1 "$(req VELA.Sample 1 fail)"
    grep -q '"code":1001' "$OUT" || fail "fail does not answer 1001"

    call 0 "$(req VELA.Sample 1 typed ', "name": "disk-1", "tags": ["a"]')"
    answer_is '{"data":{"enabled":false,"name":"disk-1","port":5000,"portIsDefault":true,"tags":["a"]},"httpd_restart":false,"success":true}'
    call 1 "$(req VELA.Sample 1 typed ', "name": "a/b", "port": 70000, "tags": [1]')"
    answer_is '{"error":{"code":101,"errors":[{"name":"name","reason":"invalid"},{"name":"port","reason":"invalid"},{"name":"tags","reason":"invalid"}]},"httpd_restart":false,"success":false}'
    call 1 "$(req VELA.Sample 1 typed)"
    grep -q '{"name":"name","reason":"missing"}' "$OUT" || fail "a missing name is not reported"

    if nobody=$(id -u nobody 2>/dev/null) && group=$(id -g nobody 2>/dev/null); then
        call 0 "$(req VELA.Sample 1 whoami)"
        answer_is "{\"data\":{\"gid\":[$group,$group,$group],\"uid\":[$nobody,$nobody,$nobody],\"user\":\"\"},\"httpd_restart\":false,\"success\":true}"
    fi
    ;;
*)
    echo "unknown part $PART" >&2
    exit 2
    ;;
esac

[ "$failures" -eq 0 ] || exit 1
echo "velarun $PART: all checks passed"
