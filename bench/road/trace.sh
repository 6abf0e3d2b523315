#!/usr/bin/env bash
# The structure of the request road, measured on one real call: the sample's
# echo (VELA.Sample, version 1) through velascgi, run as a CGI program with a
# login session, under callgrind. Prints
#   (a) hand-offs: executed calls from a function of one project folder to a
#       function of another, among webentry/, dispatcher/ and access/ (the
#       headline), and a table over every project folder;
#   (b) registry look-ups: executed calls of every function of the registry
#       file(s) and of the named look-up functions wherever they are defined;
#   (c) the 15 longest functions of the production code (universal-ctags).
#
# Method: callgrind counts how often each caller called each callee; a
# function belongs to the folder of the file its debug information names
# (an inline function of a header: the header's folder, include/ being one).
# A hand-off is a caller/callee pair of two different project folders,
# counted as often as it ran; code outside the source tree (C++ library,
# JsonCpp, libc) is neither a caller nor a callee of one. From run to run
# only the instruction count and the checks of the random session id
# (IsCheckedName, by one) move.
#
# usage: bench/road/trace.sh BUILD_DIR SOURCE_DIR [REGISTRY_FILE...]
#   BUILD_DIR      a build of SOURCE_DIR configured with
#                  -DCMAKE_BUILD_TYPE=Debug (-O0 -g, sanitizers off), so that
#                  every call is a real call and every function has its file:
#                    cmake -S SOURCE_DIR -B BUILD_DIR -DCMAKE_BUILD_TYPE=Debug
#                    cmake --build BUILD_DIR -j2
#   REGISTRY_FILE  the registry's source file(s), relative to SOURCE_DIR
#                  (default dispatcher/Registry.cpp).
# Environment: TRACE_KEEP=DIR keeps the callgrind output and the answer there.
# Needs valgrind, universal-ctags and python3; run as root (velascgi switches
# to the identity the API asks for). Run by hand: not part of the test suite.
set -euo pipefail

if [ $# -lt 2 ]; then
    echo "usage: bench/road/trace.sh BUILD_DIR SOURCE_DIR [REGISTRY_FILE...]" >&2
    exit 2
fi
BUILD=$(realpath -e "$1")
SRC=$(realpath -e "$2")
shift 2
REGISTRY=("$@")
if [ ${#REGISTRY[@]} -eq 0 ]; then
    REGISTRY=(dispatcher/Registry.cpp)
fi
HERE=$(cd "$(dirname "$0")" && pwd)

for tool in valgrind ctags python3; do
    command -v "$tool" >/dev/null || { echo "trace.sh: $tool is not installed" >&2; exit 1; }
done
ctags --version 2>/dev/null | grep -q 'Universal Ctags' || { echo "trace.sh: ctags is not universal-ctags" >&2; exit 1; }
WEBAPI=$BUILD/root/usr/vela/velaman/webapi
for file in "$BUILD/velascgi" "$BUILD/velaadm" "$WEBAPI/VELA.Sample.lib"; do
    [ -e "$file" ] || { echo "trace.sh: $file is missing (build BUILD_DIR first)" >&2; exit 1; }
done
build_type=$(sed -n 's/^CMAKE_BUILD_TYPE:[A-Z]*=//p' "$BUILD/CMakeCache.txt" 2>/dev/null || true)
if [ "$build_type" != "Debug" ]; then
    echo "trace.sh: warning: $BUILD is a '${build_type:-?}' build, not Debug: inlined calls are not counted" >&2
fi

TMP=$(mktemp -d "${TMPDIR:-/tmp}/vela-road-XXXXXX")
trap 'rm -rf "$TMP"' EXIT
chmod 0755 "$TMP"

# ---- A private system root serving the build's staged web-API directory,
# and a login session of root bound to the caller's address.
ROOT=$TMP/root
mkdir -p "$ROOT/usr/vela/velaman" "$ROOT/etc/vela"
ln -s "$WEBAPI" "$ROOT/usr/vela/velaman/webapi"
ADDRESS=127.0.0.1
sid=$(VELA_ROOT=$ROOT "$BUILD/velaadm" session create root --ip "$ADDRESS" | sed -n 's/^sid=//p')
[ -n "$sid" ] || { echo "trace.sh: velaadm created no session" >&2; exit 1; }

# ---- The call: velascgi as the web server would run it, under callgrind.
# The call's process keeps valgrind's process id (env and valgrind exec), so
# its output is told apart from any child's by that id.
QUERY='api=VELA.Sample&version=1&method=echo&text=road'
env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin VELA_ROOT="$ROOT" VELA_LOG_STDERR=1 \
    GATEWAY_INTERFACE=CGI/1.1 SERVER_SOFTWARE=trace SERVER_PROTOCOL=HTTP/1.1 \
    SERVER_NAME=127.0.0.1 SERVER_ADDR=127.0.0.1 SERVER_PORT=80 \
    REQUEST_METHOD=GET QUERY_STRING="$QUERY" REQUEST_URI="/webapi/entry.cgi?$QUERY" \
    SCRIPT_NAME=/webapi/entry.cgi SCRIPT_FILENAME="$BUILD/velascgi" DOCUMENT_ROOT="$TMP" \
    REMOTE_ADDR="$ADDRESS" REMOTE_PORT=40000 HTTP_HOST=127.0.0.1 \
    HTTP_USER_AGENT=road-trace HTTP_ACCEPT='*/*' HTTP_COOKIE="id=$sid" \
    valgrind --tool=callgrind --trace-children=no --log-file="$TMP/valgrind.log" \
    --callgrind-out-file="$TMP/callgrind.out.%p" "$BUILD/velascgi" >"$TMP/answer" 2>"$TMP/stderr" &
pid=$!
rc=0
wait "$pid" || rc=$?
OUT=$TMP/callgrind.out.$pid

if [ -n "${TRACE_KEEP:-}" ]; then
    mkdir -p "$TRACE_KEEP"
    cp "$TMP"/callgrind.out.* "$TMP/answer" "$TMP/stderr" "$TMP/valgrind.log" "$TRACE_KEEP/" 2>/dev/null || true
fi

# Success only: the call went the whole road, through the permission check,
# to the handler, which echoed the parameter back.
if [ "$rc" -ne 0 ] || [ ! -s "$OUT" ] || ! grep -qF '"success":true' "$TMP/answer" \
    || ! grep -qF '"text":"road"' "$TMP/answer"; then
    echo "trace.sh: the echo call did not succeed (exit $rc); answer:" >&2
    cat "$TMP/answer" >&2
    echo >&2
    echo "---- velascgi's log" >&2
    tail -n 30 "$TMP/stderr" >&2
    echo "---- valgrind" >&2
    tail -n 10 "$TMP/valgrind.log" >&2
    exit 1
fi

echo "road of one call: GET ?$QUERY through velascgi with a login session"
echo "source $SRC ($(git -C "$SRC" rev-parse --short HEAD 2>/dev/null || echo 'not a git tree')), build $BUILD (${build_type:-?})"
echo "answer: $(sed -n '/^\r\{0,1\}$/,$p' "$TMP/answer" | tr -d '\r\n' | head -c 200)"
echo
python3 "$HERE/callgrind_edges.py" edges "$SRC" "$OUT" "${REGISTRY[@]}"
echo
python3 "$HERE/callgrind_edges.py" longest "$SRC" 15
