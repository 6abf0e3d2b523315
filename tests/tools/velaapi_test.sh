#!/bin/sh
# Drives velaapi against the staged web-API directory.
# usage: velaapi_test.sh cli|calls /path/to/velaapi <stage root>
#   cli    the manual, usage errors, hostile or forbidden --user values
#          (the part about another account runs as nobody when started as root)
#   calls  calls and lists of the sample library for root and for nobody
#          (needs root: the sample's methods switch identity)
set -u

PART=${1:?usage: velaapi_test.sh cli|calls velaapi root}
API=${2:?velaapi path}
VELA_ROOT=${3:?stage root}
export VELA_ROOT
unset VELA_LOG_STDERR
TMP=$(mktemp -d "${TMPDIR:-/tmp}/velaapi-test-XXXXXX") || exit 1
trap 'rm -rf "$TMP"' EXIT
OUT=$TMP/out
ERR=$TMP/err

failures=0
fail() {
    echo "FAIL: $*" >&2
    echo "  stdout: $(head -c 2000 "$OUT" 2>/dev/null)" >&2
    echo "  stderr: $(head -c 2000 "$ERR" 2>/dev/null)" >&2
    failures=$((failures + 1))
}

# run STATUS ARGS...: runs velaapi with standard input from $IN (default
# empty) and checks its exit status.
IN=/dev/null
run() {
    want=$1
    shift
    "$API" "$@" <"$IN" >"$OUT" 2>"$ERR"
    got=$?
    [ "$got" -eq "$want" ] || fail "velaapi $* exited $got, expected $want"
}

# As run, but as the account nobody (the caller of run_nobody checks that
# it can).
run_nobody() {
    want=$1
    shift
    setpriv --reuid=nobody --regid="$(id -g nobody)" --clear-groups "$API" "$@" <"$IN" >"$OUT" 2>"$ERR"
    got=$?
    [ "$got" -eq "$want" ] || fail "velaapi $* as nobody exited $got, expected $want"
}

answer_is() {
    [ "$(cat "$OUT")" = "$1" ] || fail "answer is not $1"
}
err_has() {
    grep -q -- "$1" "$ERR" || fail "no \"$1\" on standard error"
}
out_empty() {
    [ ! -s "$OUT" ] || fail "something was printed on standard output"
}

# Whether nobody can run velaapi at all (the build tree may sit where it
# cannot reach).
nobody_can_run() {
    [ "$(id -u)" -eq 0 ] && command -v setpriv >/dev/null 2>&1 && id nobody >/dev/null 2>&1 &&
        setpriv --reuid=nobody --regid="$(id -g nobody)" --clear-groups "$API" --help >/dev/null 2>&1
}

case $PART in
cli)
    run 0 --help
    for section in NAME SYNOPSIS DESCRIPTION OPTIONS "EXIT STATUS" EXAMPLES; do
        grep -q "^$section\$" "$OUT" || fail "--help has no $section section"
    done
    run 0 call VELA.Sample echo --help
    grep -q "^SYNOPSIS" "$OUT" || fail "--help after a command prints no manual"

    run 2
    err_has "no command"
    run 2 frobnicate
    err_has "unknown command"
    run 2 call VELA.Sample
    run 2 call VELA.Sample echo --bogus
    err_has "unknown option"
    run 2 call VELA.Sample echo novalue
    run 2 call VELA.Sample echo =x
    run 2 call VELA.Sample echo '{"a": '
    err_has "not a JSON object"
    run 2 call VELA.Sample echo '[1, 2]'
    run 2 call VELA.Sample echo '{"a": 1}' b=2
    run 2 call VELA.Sample echo api=VELA.Other
    run 2 call VELA.Sample echo '{"method": "fail"}'
    for v in 0 -1 abc 1.5 99999999999 ''; do
        run 2 call VELA.Sample echo --version "$v"
    done
    run 2 call VELA.Sample echo --version
    run 2 call VELA.Sample echo --version 1 --version 1
    run 2 list extra
    run 2 list --version 1
    # Standard input is bounded.
    head -c $((17 * 1024 * 1024)) /dev/zero | tr '\0' ' ' >"$TMP/huge"
    IN=$TMP/huge run 2 call VELA.Sample echo -
    err_has "cannot read the parameters"
    out_empty

    # Hostile user names, refused before anything runs.
    long=$(head -c 300 /dev/zero | tr '\0' a)
    for user in '' 'a/b' '../../etc/passwd' "$(printf 'a\nb')" "$long" "vela-no-such-user-$$" ':'; do
        run 3 call VELA.Sample echo --user "$user"
        out_empty
        [ "$(wc -l <"$ERR")" -eq 1 ] || fail "the refusal of a user name is not one line"
    done

    # Only root acts for another account; anyone may name their own.
    if [ "$(id -u)" -ne 0 ]; then
        me=$(id -un)
        run 3 list --user root
        err_has "only root may act for another user"
        out_empty
        run 0 list --user "$me"
    elif nobody_can_run; then
        run_nobody 3 call VELA.Sample echo --user root
        err_has "only root may act for another user"
        out_empty
        run_nobody 3 list --user=root
        err_has "only root"
        run_nobody 0 list --user nobody
        grep -q '^VELA.Sample 1 echo$' "$OUT" || fail "nobody's own list lacks the sample's echo"
    else
        echo "note: nobody cannot run $API; the non-root refusal was not driven"
    fi
    ;;
calls)
    [ "$(id -u)" -eq 0 ] || { echo "skipped: the sample's calls switch identity and need root"; exit 77; }
    run 0 call VELA.Sample echo text=hi n=5 on=true tags='["a",1]' quoted='"5"' empty= obj='{"k": null}'
    answer_is '{"data":{"api":"VELA.Sample","empty":"","method":"echo","n":5,"obj":{"k":null},"on":true,"quoted":"5","tags":["a",1],"text":"hi","version":1},"httpd_restart":false,"success":true}'
    run 0 call VELA.Sample echo '{"text": "json", "deep": [[[]]]}' --version 1
    answer_is '{"data":{"api":"VELA.Sample","deep":[[[]]],"method":"echo","text":"json","version":1},"httpd_restart":false,"success":true}'
    printf '{"text": "stdin"}' >"$TMP/params"
    IN=$TMP/params run 0 call VELA.Sample echo -
    grep -q '"text":"stdin"' "$OUT" || fail "parameters from standard input did not arrive"
    [ "$(wc -l <"$OUT")" -eq 1 ] || fail "the answer to a pipe is not one line"

    # Large parameters cross the child and back.
    big=$(head -c $((4 * 1024 * 1024)) /dev/zero | tr '\0' x)
    printf '{"blob": "%s"}' "$big" >"$TMP/big"
    IN=$TMP/big run 0 call VELA.Sample echo -
    [ "$(wc -c <"$OUT")" -gt $((4 * 1024 * 1024)) ] || fail "a 4 MiB parameter did not come back"

    # Errors of the call: exit status 1 with the answer printed.
    run 1 call VELA.Sample fail
    grep -q '"code":1001' "$OUT" || fail "fail does not answer 1001"
    run 1 call VELA.Nope get
    answer_is '{"error":{"code":102},"httpd_restart":false,"success":false}'
    run 1 call VELA.Sample nope
    grep -q '"code":103' "$OUT" || fail "an unknown method is not 103"
    run 1 call VELA.Sample echo --version 2
    grep -q '"code":104' "$OUT" || fail "an unknown version is not 104"
    run 1 call ../VELA.Sample echo
    grep -q '"code":102' "$OUT" || fail "a path as API name is not 102"

    # Root is an administrator; nobody is an ordinary local user.
    run 0 call VELA.Sample adminonly
    grep -q '"user":"root"' "$OUT" || fail "adminonly does not see root"
    run 1 call VELA.Sample adminonly --user nobody
    answer_is '{"error":{"code":105},"success":false}'
    err_has "nobody may not call VELA.Sample 1 adminonly"

    # The handler sees the user; whoami runs as its "runAs" account.
    nuid=$(id -u nobody)
    ngid=$(id -g nobody)
    run 0 call VELA.Sample whoami --user nobody
    answer_is "{\"data\":{\"gid\":[$ngid,$ngid,$ngid],\"uid\":[$nuid,$nuid,$nuid],\"user\":\"nobody\"},\"httpd_restart\":false,\"success\":true}"

    # The caller's CGI variables do not reach the request.
    CONTENT_TYPE='multipart/form-data; boundary=x' REQUEST_METHOD=GET run 0 call VELA.Sample echo a=1

    # A terminal gets the answer indented.
    if command -v script >/dev/null 2>&1; then
        script -qec "$API call VELA.Sample echo text=tty" /dev/null >"$OUT" 2>"$ERR" </dev/null
        grep -q '^  "success": true' "$OUT" || fail "the answer on a terminal is not indented"
    fi

    run 0 list
    grep -q '^VELA.Sample 1 adminonly$' "$OUT" || fail "root's list lacks adminonly"
    grep -q '^VELA.Sample.Echo 1 echo$' "$OUT" || fail "root's list lacks VELA.Sample.Echo"
    grep -vq '^[A-Za-z0-9._-]* [0-9]* [A-Za-z0-9_]*$' "$OUT" && fail "a list line is not API VERSION METHOD"
    run 0 list --user nobody
    grep -q '^VELA.Sample 1 echo$' "$OUT" || fail "nobody's list lacks echo"
    grep -q 'adminonly' "$OUT" && fail "nobody's list holds adminonly"
    grep -q '^VELA.Auth 1 login$' "$OUT" || fail "nobody's list lacks the login (authLevel 0)"

    if nobody_can_run; then
        # Run by nobody, a method that runs as the superuser cannot switch.
        run_nobody 1 call VELA.Sample echo
        grep -q '"code":117' "$OUT" || fail "nobody's echo is not 117"
    fi
    ;;
*)
    echo "unknown part $PART" >&2
    exit 2
    ;;
esac

[ "$failures" -eq 0 ] || exit 1
echo "velaapi $PART: all checks passed"
