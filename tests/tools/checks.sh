# Checks shared by the tool tests (sourced): a temporary directory $TMP
# (removed at exit), the tool's standard output in $OUT and its standard
# error in $ERR, failed checks counted in $failures.
#   runs STATUS CMD...  runs CMD with standard input from $IN (default empty)
#                       and checks its exit status
#   fail TEXT           one failed check, shown with the tool's output
#   stdout_has TEXT...  $OUT holds each TEXT (a grep pattern); stderr_has TEXT
#   stdout_lacks TEXT   $OUT does not hold it
#   stdout_is TEXT      $OUT is exactly TEXT; stdout_empty: $OUT is empty
#   finish NAME         exits 1 after failed checks, else 0 saying so

failures=0
IN=/dev/null
unset VELA_LOG_STDERR
TMP=$(mktemp -d "${TMPDIR:-/tmp}/vela-tool-XXXXXX") || exit 1
trap 'rm -rf "$TMP"' EXIT
OUT=$TMP/out
ERR=$TMP/err

fail() {
    echo "FAIL: $*" >&2
    echo "  stdout: $(head -c 2000 "$OUT" 2>/dev/null)" >&2
    echo "  stderr: $(head -c 2000 "$ERR" 2>/dev/null)" >&2
    failures=$((failures + 1))
}

runs() {
    want=$1
    shift
    "$@" <"$IN" >"$OUT" 2>"$ERR"
    got=$?
    [ "$got" -eq "$want" ] || fail "$* exited $got, expected $want"
}

stdout_has() {
    for text in "$@"; do
        grep -q -- "$text" "$OUT" || fail "stdout lacks \"$text\""
    done
}
stderr_has() { grep -q -- "$1" "$ERR" || fail "stderr lacks \"$1\""; }
stdout_lacks() { ! grep -q -- "$1" "$OUT" || fail "stdout shows \"$1\""; }
stdout_is() { [ "$(cat "$OUT")" = "$1" ] || fail "stdout is not $1"; }
stdout_empty() { [ ! -s "$OUT" ] || fail "something was printed on standard output"; }

finish() {
    if [ "$failures" -ne 0 ]; then
        echo "$failures check(s) failed" >&2
        exit 1
    fi
    echo "$1: all checks passed"
}
