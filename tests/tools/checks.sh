# Checks shared by the tool tests (sourced): the tool's standard output in
# $OUT and its standard error in $ERR, failed checks counted in $failures.
#   fail TEXT          one failed check, shown with the tool's output
#   stdout_has TEXT    $OUT holds TEXT (a grep pattern); stderr_has likewise
#   stdout_lacks TEXT  $OUT does not hold it
#   finish NAME        exits 1 after failed checks, else 0 saying so

failures=0

fail() {
    echo "FAIL: $*" >&2
    echo "  stdout: $(cat "$OUT" 2>/dev/null)" >&2
    echo "  stderr: $(cat "$ERR" 2>/dev/null)" >&2
    failures=$((failures + 1))
}

stdout_has() { grep -q -- "$1" "$OUT" || fail "stdout lacks \"$1\""; }
stderr_has() { grep -q -- "$1" "$ERR" || fail "stderr lacks \"$1\""; }
stdout_lacks() { ! grep -q -- "$1" "$OUT" || fail "stdout shows \"$1\""; }

finish() {
    if [ "$failures" -ne 0 ]; then
        echo "$failures check(s) failed" >&2
        exit 1
    fi
    echo "$1: all checks passed"
}
