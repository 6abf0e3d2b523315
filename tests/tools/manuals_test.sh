#!/bin/sh
# Every program's --help against its manual page, so neither drifts from the
# other or from the program: --help exits 0 with the text on standard
# output; an unknown option exits 2 with one line of error and a pointer to
# --help on standard error; the long options the help names and those its
# page names are the same; every page renders without a warning (groff) and
# is installed.
# usage: manuals_test.sh SOURCE_DIR velascgi velafcgi velaadm velaapi velarun
set -u

SRC=${1:?usage: manuals_test.sh SOURCE_DIR velascgi velafcgi velaadm velaapi velarun}
shift
. "$(dirname "$0")/checks.sh"
MAN=$SRC/docs/man

# The long options a text names, one per line, sorted.
long_options() { grep -o -- '--[a-z][a-z0-9-]*' | sort -u; }
# The long options of a page's source: "\-" is a hyphen there, and font
# changes may sit inside an option's name.
page_options() { sed -e 's/\\-/-/g' -e 's/\\f[BIRP]//g' "$1" | long_options; }

for program in "$@"; do
    name=$(basename "$program")
    page=$(ls "$MAN/$name".[1-8] 2>/dev/null)
    [ -n "$page" ] || { fail "$name has no manual page in $MAN"; continue; }

    runs 0 env -u GATEWAY_INTERFACE "$program" --help
    [ -s "$OUT" ] || fail "$name --help printed nothing"
    [ ! -s "$ERR" ] || fail "$name --help wrote to standard error"
    long_options <"$OUT" >"$TMP/help"
    grep -qx -- --help "$TMP/help" || fail "$name --help does not name --help"
    page_options "$page" >"$TMP/page"
    if ! cmp -s "$TMP/help" "$TMP/page"; then
        fail "$name: options of --help (<) and of $(basename "$page") (>) differ:
$(diff "$TMP/help" "$TMP/page" | grep '^[<>]')"
    fi

    runs 2 env -u GATEWAY_INTERFACE "$program" --vela-no-such-option
    [ ! -s "$OUT" ] || fail "$name wrote to standard output for an unknown option"
    [ "$(wc -l <"$ERR")" -eq 2 ] || fail "$name: an unknown option is not one line of error and one of help"
    head -n 1 "$ERR" | grep -q "^$name: .*--vela-no-such-option" || fail "$name does not name the unknown option"
    tail -n 1 "$ERR" | grep -q -- "$name --help" || fail "$name does not point to --help"
done

# As a CGI program velascgi serves a call whatever its arguments: here the
# web-API directory is missing, so the answer is the setup failure (117).
for program in "$@"; do
    [ "$(basename "$program")" = velascgi ] || continue
    runs 0 env GATEWAY_INTERFACE=CGI/1.1 REQUEST_METHOD=GET VELA_ROOT="$TMP/none" "$program" --help
    stdout_has '^Status: 500' '"code":117'
    stdout_lacks 'usage'
done

# Every page is installed.
for page in "$MAN"/*.[1-8]; do
    grep -q "$(basename "$page")" "$SRC/CMakeLists.txt" || fail "$(basename "$page") is not installed"
done

if ! command -v groff >/dev/null 2>&1; then
    [ "$failures" -eq 0 ] || finish manuals
    echo "skipped: groff is not installed (scripts/install-deps.sh installs groff-base)"
    exit 77
fi
for page in "$MAN"/*.[1-8]; do
    if ! groff -man -ww -z "$page" >"$OUT" 2>"$ERR" || [ -s "$ERR" ]; then
        fail "$(basename "$page") does not render cleanly"
    fi
done
finish manuals
