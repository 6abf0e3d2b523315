#!/usr/bin/env bash
# Builds the project and runs the dispatcher benchmarks, printing the
# figures of each beside its baseline:
#   1. whole process: velarun answering the sample's echo against
#      vela-bench-minimal-echo (JsonCpp only, same answer), fork/exec,
#      interleaved, several rounds;
#   2. in process: one APIRunner::Process of the echo against the same
#      answer built with JsonCpp alone (Google Benchmark);
#   3. the login-session check of one call, with and without moving the
#      session's last use, against reading and parsing the session file;
#   4. when valgrind is installed: instructions executed by one whole run of
#      each program of part 1 (callgrind, dynamic loader included). Unlike
#      the times, this count does not move with the machine's load.
#
# usage: bench/run.sh [build-dir]          (default: build)
# Environment: BENCH_RUNS=300 BENCH_ROUNDS=3 (part 1).
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build}
runs=${BENCH_RUNS:-300}
rounds=${BENCH_ROUNDS:-3}

die() { echo "bench/run.sh: $*" >&2; exit 1; }

scripts/build.sh "$build" >/dev/null
# Without a log daemon every syslog line would cost a write to /dev/console:
# as root the script runs itself again in a private mount namespace whose
# /dev/log is a sink (nothing is mounted outside it). BENCH_PLAIN=1 runs on
# the machine as it is.
if [ ! -S /dev/log ] && [ -z "${VELA_BENCH_NS:-}" ] && [ "${BENCH_PLAIN:-0}" != 1 ] && [ "$(id -u)" = 0 ] &&
    command -v unshare >/dev/null && unshare -m true 2>/dev/null; then
    VELA_BENCH_NS=1 exec unshare -m --propagation private "$PWD/bench/run.sh" "$build"
fi
export VELA_ROOT=$PWD/$build/root
unset VELA_LOG_STDERR

if [ -n "${VELA_BENCH_NS:-}" ] && [ ! -S /dev/log ]; then
    work=$(mktemp -d "${TMPDIR:-/tmp}/vela-bench-XXXXXX") || die "cannot make a work directory"
    sink_pid=""
    trap '[ -z "$sink_pid" ] || kill "$sink_pid" 2>/dev/null; rm -rf "$work"' EXIT
    # shellcheck source=bench/devlog.sh
    . bench/devlog.sh
    bench_dev_log "$work" "$build/bench/web/vela-bench-log-sink" "$work/syslog.txt"
    echo "syslog: no log daemon on this machine, a sink on /dev/log takes the lines"
elif [ ! -S /dev/log ]; then
    echo "note: no syslog daemon (/dev/log missing): every log line of the call goes to /dev/console"
fi
echo "== whole process: velarun echo vs minimal JsonCpp program ($runs runs each, $rounds rounds) =="
"$build/bench/vela-bench-process" --runs "$runs" --rounds "$rounds" \
    "$build/velarun" "$build/bench/vela-bench-minimal-echo" "$PWD/bench/echo.json"

if [ -x "$build/bench/vela-bench-dispatch" ]; then
    echo
    echo "== in process: APIRunner::Process of the echo vs JsonCpp alone =="
    "$build/bench/vela-bench-dispatch" --benchmark_repetitions=3 --benchmark_report_aggregates_only=true
    echo
    echo "== session check: VelaCgiIsAuthorizedEx vs reading and parsing the session file =="
    "$build/bench/vela-bench-session" --benchmark_repetitions=3 --benchmark_report_aggregates_only=true
else
    echo "vela-bench-dispatch was not built (Google Benchmark missing)" >&2
fi

if command -v valgrind >/dev/null; then
    echo
    echo "== instructions per run (callgrind): velarun echo vs minimal JsonCpp program =="
    instructions() {
        local out
        out=$(mktemp)
        valgrind --tool=callgrind --callgrind-out-file=/dev/null "$@" 2>"$out" >/dev/null
        sed -n 's/.*Collected : *\([0-9]*\).*/\1/p' "$out"
        rm -f "$out"
    }
    vela=$(instructions "$build/velarun" "$PWD/bench/echo.json")
    minimal=$(instructions "$build/bench/vela-bench-minimal-echo" "$PWD/bench/echo.json")
    echo "velarun $vela | vela-bench-minimal-echo $minimal | ratio $(awk -v a="$vela" -v b="$minimal" 'BEGIN { printf "%.2fx", a / b }')"
else
    echo "valgrind not installed: no instruction counts"
fi
