#!/usr/bin/env bash
# The cost of one web-API call to the CGI program itself: velascgi run
# directly with the environment a web server gives it, for the sample's echo
# with a login session, against the minimal JsonCpp CGI answering the same
# query string (bench/web/minimal_cgi.cpp). For each build directory given:
#
#   instructions  of one whole velascgi process and of one minimal CGI
#                 process (callgrind, dynamic loader included), and their
#                 ratio: the fewest and the most of BENCH_CALLGRIND_RUNS runs
#                 (about a second apart). They differ when some calls
#                 rewrite the session's last use and others do not (how
#                 often depends on the build). Unlike the times, these
#                 counts do not move with the machine's load;
#   wall time     of a call of each, posix_spawn to wait4, interleaved
#                 (vela-bench-process, several rounds).
#
# Two build directories (a baseline and a change) are measured in the same
# run, one after the other, and summed up side by side at the end. The
# helper programs (minimal CGI, log sink, timer) come from the last.
#
# usage: bench/cgi_cost.sh [build-dir [build-dir]]      (default: build)
# Environment: BENCH_RUNS=200 BENCH_ROUNDS=3 BENCH_CALLGRIND_RUNS=5
#   BENCH_QUERY (default api=VELA.Sample&version=1&method=echo&text=hi)
#
# Each build's staged root (<build>/root) is copied into a temporary state
# root; a session for root is made in it with that build's velaadm. As root,
# the script runs itself again in a private mount namespace where the state
# roots lie on a tmpfs (the session file is rewritten on every call) and,
# when the machine has no log daemon, a log sink listens on /dev/log
# (without one every log line goes to /dev/console). Nothing is mounted
# outside the namespace; every file made here is removed on the way out.
set -u -o pipefail

. "$(dirname "$0")/devlog.sh"

here=$(cd "$(dirname "$0")" && pwd)
top=$(cd "$here/.." && pwd)
die() {
    echo "cgi_cost.sh: $*" >&2
    exit 1
}

builds=()
for dir in "${@:-$top/build}"; do
    builds+=("$(cd "$dir" 2>/dev/null && pwd)") || die "no build directory $dir"
done
[ "${#builds[@]}" -le 2 ] || die "at most two build directories"

RUNS=${BENCH_RUNS:-200}
ROUNDS=${BENCH_ROUNDS:-3}
CG_RUNS=${BENCH_CALLGRIND_RUNS:-5}
QUERY=${BENCH_QUERY:-api=VELA.Sample&version=1&method=echo&text=hi}
for n in "$RUNS" "$ROUNDS" "$CG_RUNS"; do
    case $n in '' | *[!0-9]* | 0) die "counts must be positive numbers" ;; esac
done

last=${builds[${#builds[@]} - 1]}
MINIMAL=$last/bench/web/vela-bench-minimal-cgi
LOG_SINK=$last/bench/web/vela-bench-log-sink
PROCESS=$last/bench/vela-bench-process
[ -x "$MINIMAL" ] && [ -x "$LOG_SINK" ] && [ -x "$PROCESS" ] || die "the benchmark programs are not built in $last"
for b in "${builds[@]}"; do
    [ -x "$b/velascgi" ] && [ -x "$b/velaadm" ] && [ -d "$b/root/usr/vela/velaman/webapi" ] ||
        die "velascgi, velaadm or the staged root is missing in $b"
done
command -v valgrind >/dev/null || die "valgrind is not installed"

if [ -z "${VELA_BENCH_NS:-}" ] && [ "${BENCH_PLAIN:-0}" != 1 ] && [ "$(id -u)" = 0 ] &&
    command -v unshare >/dev/null && unshare -m true 2>/dev/null; then
    VELA_BENCH_NS=1 exec unshare -m --propagation private "$here/cgi_cost.sh" "${builds[@]}"
fi

work=$(mktemp -d "${TMPDIR:-/tmp}/vela-cgicost-XXXXXX") || die "cannot make a work directory"
sink_pid=""
cleanup() {
    if [ -n "$sink_pid" ]; then
        kill "$sink_pid" 2>/dev/null
        wait "$sink_pid" 2>/dev/null
    fi
    if [ -n "${VELA_BENCH_NS:-}" ] && mountpoint -q "$work/state"; then
        umount -l "$work/state"
    fi
    rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT
trap 'exit 143' TERM HUP

mkdir "$work/state" || die "cannot populate $work"
NOTE="state roots on $(stat -f -c %T "$work"), syslog: the machine's log daemon"
if [ -n "${VELA_BENCH_NS:-}" ]; then
    mount -t tmpfs -o mode=755,size=256m vela-cgicost "$work/state" || die "cannot mount a tmpfs"
    NOTE="state roots on tmpfs, syslog: the machine's log daemon"
    if [ ! -S /dev/log ]; then
        bench_dev_log "$work" "$LOG_SINK" "$work/syslog.txt"
        NOTE="state roots on tmpfs, syslog: a sink on /dev/log (no log daemon on this machine)"
    fi
elif [ ! -S /dev/log ]; then
    NOTE="$NOTE; no log daemon, so every log line goes to /dev/console (slow)"
fi

# instructions PROGRAM ENV...: "fewest most" of CG_RUNS whole runs of
# PROGRAM under `env -i ENV...`.
instructions() {
    local program=$1 i out=$work/callgrind.txt
    shift
    for ((i = 0; i < CG_RUNS; i++)); do
        env -i "$@" valgrind --tool=callgrind --callgrind-out-file=/dev/null "$program" 2>"$out" >/dev/null
        sed -n 's/.*Collected : *\([0-9]*\).*/\1/p' "$out"
    done | sort -n | awk '{ v[NR] = $1 } END { print v[1], v[NR] }'
}
ratio() { awk -v a="$1" -v b="$2" 'BEGIN { if (b <= 0) print "n/a"; else printf "%.3f", a / b }'; }
mi() { awk -v n="$1" 'BEGIN { printf "%.3f M", n / 1e6 }'; }

echo "velascgi, one call run directly: $QUERY with a session; $(nproc) CPUs, load average $(cut -d' ' -f1-3 /proc/loadavg)"
echo "$NOTE"
summary=()
n=0
for b in "${builds[@]}"; do
    n=$((n + 1))
    root=$work/state/root$n
    mkdir -p "$root" && cp -a "$b/root/." "$root/" || die "cannot copy the staged root of $b"
    mkdir -p "$root/run" "$root/etc/vela"
    created=$(VELA_ROOT=$root "$b/velaadm" session create root --ip 127.0.0.1 --timeout 3600) ||
        die "velaadm of $b cannot make a session"
    sid=$(printf '%s\n' "$created" | sed -n 's/^sid=//p')
    token=$(printf '%s\n' "$created" | sed -n 's/^token=//p')
    [ -n "$sid" ] || die "velaadm of $b printed no session id"

    echo
    echo "== $b =="
    cgi_env=(PATH=/usr/bin:/bin VELA_ROOT="$root" GATEWAY_INTERFACE=CGI/1.1 REQUEST_METHOD=GET
        QUERY_STRING="$QUERY" REMOTE_ADDR=127.0.0.1 SERVER_PROTOCOL=HTTP/1.1 SCRIPT_NAME=/webapi/entry.cgi
        HTTP_COOKIE="id=$sid" HTTP_X_VELA_TOKEN="$token")
    answer=$(env -i "${cgi_env[@]}" "$b/velascgi" | tr -d '\r' | tail -1)
    case $answer in
    *'"success":true'*) echo "velascgi answer: $answer" ;;
    *) die "the echo with a session fails in $b: $answer" ;;
    esac
    read -r vela vela_max <<<"$(instructions "$b/velascgi" "${cgi_env[@]}")"
    read -r minimal minimal_max <<<"$(instructions "$MINIMAL" "${cgi_env[@]}")"
    [ -n "$vela" ] && [ -n "$minimal" ] || die "callgrind gave no count"
    echo "instructions (callgrind, whole process, fewest and most of $CG_RUNS runs): velascgi $(mi "$vela")" \
        ".. $(mi "$vela_max") | minimal CGI $(mi "$minimal") .. $(mi "$minimal_max")" \
        "| ratio $(ratio "$vela" "$minimal")x, $(ratio "$vela_max" "$minimal")x"
    times=$(env -i "${cgi_env[@]}" "$PROCESS" --any-output --runs "$RUNS" --rounds "$ROUNDS" "$b/velascgi" "$MINIMAL" "") ||
        die "vela-bench-process failed on $b"
    printf '%s\n' "$times"
    wall=$(printf '%s\n' "$times" | sed -n 's/^all .*: velascgi median \([0-9]*\) us.*| vela-bench-minimal-cgi median \([0-9]*\) us.*/\1 \2/p')
    summary+=("$(printf '%-32s instructions %s (%sx of the minimal CGI), most %s (%sx)  wall median %s us (minimal %s us)' \
        "$b" "$(mi "$vela")" "$(ratio "$vela" "$minimal")" "$(mi "$vela_max")" "$(ratio "$vela_max" "$minimal")" ${wall:-? ?})")
done
echo
echo "== summary: one velascgi echo with a session against the minimal JsonCpp CGI =="
printf '%s\n' "${summary[@]}"
