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
WEBAPI=$VELA_ROOT/usr/vela/velaman/webapi
. "$(dirname "$0")/checks.sh"

# call STATUS JSON [ARGS...]: runs velarun with JSON on standard input.
call() {
    want=$1 IN=$TMP/in
    printf '%s' "$2" >"$IN"
    shift 2
    runs "$want" "$RUN" "$@"
}

# answers STATUS TEXT JSON [ARGS...]: call, and the one line printed is
# exactly TEXT.
answers() {
    status=$1 text=$2
    shift 2
    call "$status" "$@"
    stdout_is "$text"
    [ "$(wc -l <"$OUT")" -eq 1 ] || fail "answer is not one line"
}

req() { printf '{"getParam": {"api": "%s", "version": %s, "method": "%s"%s}}' "$1" "$2" "$3" "${4:-}"; }

case $PART in
refusals)
    answers 1 '{"error":{"code":102},"httpd_restart":false,"success":false}' "$(req VELA.Nope 1 get)"
    answers 1 '{"error":{"code":103},"httpd_restart":false,"success":false}' "$(req VELA.Sample 1 nope)"
    answers 1 '{"error":{"code":102},"httpd_restart":false,"success":false}' "$(req ../VELA.Sample 1 echo)"
    answers 1 '{"error":{"code":101},"httpd_restart":false,"success":false}' '{}'

    call 2 '{"getParam": ' -
    stderr_has "not valid JSON"
    stdout_empty
    call 2 '{}' "$TMP/missing.json"
    stderr_has "cannot open"
    call 2 '{}' --bogus
    call 2 '{}' a.json b.json
    call 2 '{}' -C
    call 2 '{}' -C "$TMP/nowhere"
    stderr_has "cannot enter"
    ;;
sample)
    [ "$(id -u)" -eq 0 ] || { echo "skipped: the sample's calls switch identity and need root"; exit 77; }
    answers 0 '{"data":{"api":"VELA.Sample","method":"echo","n":[1,2],"text":"hi","version":1},"httpd_restart":false,"success":true}' \
        "$(req VELA.Sample 1 echo ', "text": "hi", "n": [1, 2]')"

    # From a file, with the directory given.
    req VELA.Sample.Echo 1 echo >"$TMP/echo.json"
    answers 0 '{"data":{"api":"VELA.Sample.Echo","method":"echo","version":1},"httpd_restart":false,"success":true}' \
        '' -C "$WEBAPI" "$TMP/echo.json"

    call 1 "$(req VELA.Sample 1 fail)"
    stdout_has '"code":1001'

    answers 0 '{"data":{"enabled":false,"name":"disk-1","port":5000,"portIsDefault":true,"tags":["a"]},"httpd_restart":false,"success":true}' \
        "$(req VELA.Sample 1 typed ', "name": "disk-1", "tags": ["a"]')"
    answers 1 '{"error":{"code":101,"errors":[{"name":"name","reason":"invalid"},{"name":"port","reason":"invalid"},{"name":"tags","reason":"invalid"}]},"httpd_restart":false,"success":false}' \
        "$(req VELA.Sample 1 typed ', "name": "a/b", "port": 70000, "tags": [1]')"
    call 1 "$(req VELA.Sample 1 typed)"
    stdout_has '{"name":"name","reason":"missing"}'

    if nobody=$(id -u nobody 2>/dev/null) && group=$(id -g nobody 2>/dev/null); then
        answers 0 "{\"data\":{\"gid\":[$group,$group,$group],\"uid\":[$nobody,$nobody,$nobody],\"user\":\"\"},\"httpd_restart\":false,\"success\":true}" \
            "$(req VELA.Sample 1 whoami)"
    fi
    ;;
*)
    echo "unknown part $PART" >&2
    exit 2
    ;;
esac

finish "velarun $PART"
