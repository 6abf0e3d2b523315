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
. "$(dirname "$0")/checks.sh"

run() {
    want=$1
    shift
    runs "$want" "$API" "$@"
}
run_nobody() {
    want=$1
    shift
    runs "$want" setpriv --reuid=nobody --regid="$(id -g nobody)" --clear-groups "$API" "$@"
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
    stdout_has '^NAME$' '^SYNOPSIS$' '^DESCRIPTION$' '^OPTIONS$' '^EXIT STATUS$' '^EXAMPLES$'
    run 0 call VELA.Sample echo --help
    stdout_has "^SYNOPSIS"

    run 2
    stderr_has "no command"
    run 2 frobnicate
    stderr_has "unknown command"
    run 2 call VELA.Sample
    run 2 call VELA.Sample echo --bogus
    stderr_has "unknown option"
    run 2 call VELA.Sample echo '{"a": '
    stderr_has "not a JSON object"
    # More parameters and versions refused, each a list of shell words.
    for args in novalue =x "'[1, 2]'" "'{\"a\": 1}' b=2" api=VELA.Other "'{\"method\": \"fail\"}'" --version \
        "--version 1 --version 1" "--version 0" "--version -1" "--version abc" "--version 1.5" \
        "--version 99999999999" "--version ''" --peer "--peer a --peer b"; do
        eval "run 2 call VELA.Sample echo $args"
    done
    run 2 list extra
    run 2 list --version 1
    run 2 list --peer nas2
    stderr_has "options of call"
    # A peer that is not in the peers file (there is none here): 109, or
    # 105 for an account without the relay privilege.
    run 1 call VELA.Sample echo --peer nas2
    stdout_has '"code":10[59]'
    # Standard input is bounded.
    head -c $((17 * 1024 * 1024)) /dev/zero | tr '\0' ' ' >"$TMP/huge"
    IN=$TMP/huge run 2 call VELA.Sample echo -
    stderr_has "cannot read the parameters"
    stdout_empty

    # Hostile user names, refused before anything runs.
    long=$(head -c 300 /dev/zero | tr '\0' a)
    for user in '' 'a/b' '../../etc/passwd' "$(printf 'a\nb')" "$long" "vela-no-such-user-$$" ':'; do
        run 3 call VELA.Sample echo --user "$user"
        stdout_empty
        [ "$(wc -l <"$ERR")" -eq 1 ] || fail "the refusal of a user name is not one line"
    done

    # Only root acts for another account; anyone may name their own.
    if [ "$(id -u)" -ne 0 ]; then
        me=$(id -un)
        run 3 list --user root
        stderr_has "only root may act for another user"
        stdout_empty
        run 0 list --user "$me"
    elif nobody_can_run; then
        run_nobody 3 call VELA.Sample echo --user root
        stderr_has "only root may act for another user"
        stdout_empty
        run_nobody 3 list --user=root
        stderr_has "only root"
        run_nobody 0 list --user nobody
        stdout_has '^VELA.Sample 1 echo$'
    else
        echo "note: nobody cannot run $API; the non-root refusal was not driven"
    fi
    ;;
calls)
    [ "$(id -u)" -eq 0 ] || { echo "skipped: the sample's calls switch identity and need root"; exit 77; }
    run 0 call VELA.Sample echo text=hi n=5 on=true tags='["a",1]' quoted='"5"' empty= obj='{"k": null}'
    stdout_is '{"data":{"api":"VELA.Sample","empty":"","method":"echo","n":5,"obj":{"k":null},"on":true,"quoted":"5","tags":["a",1],"text":"hi","version":1},"httpd_restart":false,"success":true}'
    run 0 call VELA.Sample echo '{"text": "json", "deep": [[[]]]}' --version 1
    stdout_is '{"data":{"api":"VELA.Sample","deep":[[[]]],"method":"echo","text":"json","version":1},"httpd_restart":false,"success":true}'
    printf '{"text": "stdin"}' >"$TMP/params"
    IN=$TMP/params run 0 call VELA.Sample echo -
    stdout_has '"text":"stdin"'
    [ "$(wc -l <"$OUT")" -eq 1 ] || fail "the answer to a pipe is not one line"

    # Large parameters cross the child and back.
    big=$(head -c $((4 * 1024 * 1024)) /dev/zero | tr '\0' x)
    printf '{"blob": "%s"}' "$big" >"$TMP/big"
    IN=$TMP/big run 0 call VELA.Sample echo -
    [ "$(wc -c <"$OUT")" -gt $((4 * 1024 * 1024)) ] || fail "a 4 MiB parameter did not come back"

    # Errors of the call: exit status 1 with the answer printed.
    run 1 call VELA.Sample fail
    stdout_has '"code":1001'
    run 1 call VELA.Nope get
    stdout_is '{"error":{"code":102},"httpd_restart":false,"success":false}'
    run 1 call VELA.Sample nope
    stdout_has '"code":103'
    run 1 call VELA.Sample echo --version 2
    stdout_has '"code":104'
    run 1 call ../VELA.Sample echo
    stdout_has '"code":102'

    # Root is an administrator; nobody is an ordinary local user.
    run 0 call VELA.Sample adminonly
    stdout_has '"user":"root"'
    run 1 call VELA.Sample adminonly --user nobody
    stdout_is '{"error":{"code":105},"success":false}'
    stderr_has "nobody may not call VELA.Sample 1 adminonly"

    # The handler sees the user; whoami runs as its "runAs" account.
    nuid=$(id -u nobody)
    ngid=$(id -g nobody)
    run 0 call VELA.Sample whoami --user nobody
    stdout_is "{\"data\":{\"gid\":[$ngid,$ngid,$ngid],\"uid\":[$nuid,$nuid,$nuid],\"user\":\"nobody\"},\"httpd_restart\":false,\"success\":true}"

    # The caller's CGI variables do not reach the request.
    CONTENT_TYPE='multipart/form-data; boundary=x' REQUEST_METHOD=GET run 0 call VELA.Sample echo a=1

    # A terminal gets the answer indented.
    if command -v script >/dev/null 2>&1; then
        script -qec "$API call VELA.Sample echo text=tty" /dev/null >"$OUT" 2>"$ERR" </dev/null
        stdout_has '^  "success": true'
    fi

    run 0 list
    stdout_has '^VELA.Sample 1 adminonly$' '^VELA.Sample.Echo 1 echo$'
    grep -vq '^[A-Za-z0-9._-]* [0-9]* [A-Za-z0-9_]*$' "$OUT" && fail "a list line is not API VERSION METHOD"
    run 0 list --user nobody
    stdout_has '^VELA.Sample 1 echo$' '^VELA.Auth 1 login$'  # the login: authLevel 0
    stdout_lacks adminonly

    if nobody_can_run; then
        # Run by nobody, a method that runs as the superuser cannot switch.
        run_nobody 1 call VELA.Sample echo
        stdout_has '"code":117'
    fi
    ;;
*)
    echo "unknown part $PART" >&2
    exit 2
    ;;
esac

finish "velaapi $PART"
