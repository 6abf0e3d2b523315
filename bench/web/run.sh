#!/usr/bin/env bash
# Web-entry benchmarks: the web API's two front ends under lighttpd, velascgi
# (a CGI program run for every request) and velafcgi (a FastCGI server whose
# warm parents fork one child per request), against baselines measured in
# the same run, on the same server and the same disk.
#
#   rps       requests per second of the sample echo API, with a login
#             session, against a minimal C++ CGI (JsonCpp only) that builds
#             the same answer: through velascgi, through velafcgi forking a
#             child per request, and through velafcgi serving the echo in
#             its warm parent (the description of VELA.Sample in the state
#             root marks its echo "inProcess"); two lighttpd side by side,
#             one per front end, alternating rounds. Then the instructions
#             (callgrind, whole process, dynamic loader included) of one
#             request: the minimal CGI, velascgi, and velafcgi's request
#             child (velafcgi run under callgrind with one parent, the
#             requests sent with cgi-fcgi);
#   upload    a multipart upload through each front end against cat of the
#             file into a file on the same disk, with the peak memory of
#             every process of the front end that took part;
#   download  a download through each front end against cat of the file;
#   compound  a compound request (VELA.Entry.Request) of 10 echo calls, in
#             sequential and in parallel mode, against 10 separate requests
#             of the same echo: wall time through lighttpd (alternating
#             rounds in shuffled order, medians); CPU time and page faults
#             (perf) and instructions (callgrind) of the whole velascgi
#             process tree, forked children included, with velascgi run
#             directly with the environment and body lighttpd gave it
#             (recorded through a wrapper); beside them what the time is
#             spent on (a compound of no call, a compound whose calls run
#             in process, the forks alone, what a forked worker executes);
#             then 10 calls that each sleep 100 ms in one parallel compound
#             against the same in sequence and against one such call alone.
#             The in-process and sleeping calls come from the benchmark's
#             own API VELA.Bench.Compound (bench_compound.cpp), installed in
#             the state root only. perf and valgrind are optional. This part
#             measures velascgi only.
#
# usage: bench/web/run.sh [build-dir]          (default: build)
#
# Environment (all optional):
#   BENCH_SIZE_MB=1024        size of the transferred file, MiB
#   BENCH_PARTS="rps upload download compound"
#   BENCH_FRONT_ENDS="cgi fcgi"
#                             the front ends of the parts rps, upload and
#                             download: cgi (velascgi), fcgi (velafcgi)
#   BENCH_DURATION=10 BENCH_ROUNDS=3 BENCH_CONNECTIONS=8 BENCH_THREADS=2
#                             wrk: seconds per run, alternating rounds
#   BENCH_TRANSFER_ROUNDS=3   alternating rounds of each transfer
#   BENCH_COMPOUND_ROUNDS=21  rounds of the compound's wall-time figures
#   BENCH_SLEEP_ROUNDS=3      rounds of the sleeping calls
#   BENCH_CALLGRIND=1         0 leaves out the instruction counts (they need
#                             valgrind, and cgi-fcgi for velafcgi's, and
#                             take a minute or two)
#   BENCH_DIR=$TMPDIR         where the state root and the big files go
#   BENCH_XSENDFILE=1         also download with X-Sendfile on; the front
#                             ends use it only when BENCH_DIR and every
#                             directory above it are writable by root alone
#                             (not below /tmp), and stream the file otherwise
#   BENCH_STREAM_REQUEST_BODY, BENCH_STREAM_RESPONSE_BODY
#                             override lighttpd's server.stream-*-body
#   BENCH_LIGHTTPD_EXTRA      lines added to the lighttpd configuration
#   BENCH_ECHO_QUERY, BENCH_UPLOAD_QUERY, BENCH_DOWNLOAD_QUERY
#                             query strings of the sample's methods (the
#                             echo's parameters are also each call of the
#                             compound and of the in-process echo)
#   BENCH_PLAIN=1             no private mount namespace (see below)
#
# The servers are the project's own lighttpd configuration, written by
# scripts/lighttpd-conf.sh with --front-end cgi or fcgi, plus one block for
# the baselines under /bench/; each runs on a free port of 127.0.0.1 under
# one temporary state root, and they are stopped, and every file made here
# removed, on every way out.
set -u -o pipefail

. "$(dirname "$0")/../devlog.sh"

here=$(cd "$(dirname "$0")" && pwd)
top=$(cd "$here/../.." && pwd)
build=$(cd "${1:-$top/build}" 2>/dev/null && pwd) || {
    echo "run.sh: no build directory ${1:-$top/build}" >&2
    exit 2
}

SIZE_MB=${BENCH_SIZE_MB:-1024}
PARTS=${BENCH_PARTS:-rps upload download compound}
FRONT_ENDS=${BENCH_FRONT_ENDS:-cgi fcgi}
DURATION=${BENCH_DURATION:-10}
ROUNDS=${BENCH_ROUNDS:-3}
CONNS=${BENCH_CONNECTIONS:-8}
THREADS=${BENCH_THREADS:-2}
XROUNDS=${BENCH_TRANSFER_ROUNDS:-3}
CROUNDS=${BENCH_COMPOUND_ROUNDS:-21}
SROUNDS=${BENCH_SLEEP_ROUNDS:-3}
ECHO_QUERY=${BENCH_ECHO_QUERY:-api=VELA.Sample.Echo&version=1&method=echo&text=hello&count=3}
UPLOAD_QUERY=${BENCH_UPLOAD_QUERY:-api=VELA.Sample&version=1&method=upload}
DOWNLOAD_QUERY=${BENCH_DOWNLOAD_QUERY:-api=VELA.Sample&version=1&method=download&name=data.bin}
RECEIVE_QUERY="api=VELA.Bench.Transfer&version=1&method=receive"
# The echo's parameters, to the echo of VELA.Sample that velafcgi serves in
# process.
INPROC_QUERY="api=VELA.Sample&version=1&method=echo&$(printf '%s\n' "$ECHO_QUERY" | tr '&' '\n' |
    grep -v -E '^(api|version|method)(=|$)' | paste -sd '&')"
INPROC_MARK=""

VELASCGI=$build/velascgi
VELAFCGI=$build/velafcgi
VELAADM=$build/velaadm
MINIMAL=$build/bench/web/vela-bench-minimal-cgi
BENCH_LIB=$build/bench/web/libvela-bench-transfer.so
LOG_SINK=$build/bench/web/vela-bench-log-sink
PEAK_RSS=$build/bench/web/vela-bench-peak-rss
COMPOUND_LIB=$build/bench/web/libvela-bench-compound.so
FORK_COST=$build/bench/web/vela-bench-fork-cost
STAGE=$build/root

die() {
    echo "run.sh: $*" >&2
    exit 1
}
for tool in lighttpd curl wrk awk ss shuf; do
    command -v "$tool" >/dev/null || die "$tool is not installed (scripts/install-deps.sh)"
done
[ -x "$MINIMAL" ] && [ -x "$LOG_SINK" ] && [ -x "$PEAK_RSS" ] || die "the benchmark programs are not built in $build"
for n in "$SIZE_MB" "$DURATION" "$ROUNDS" "$CONNS" "$THREADS" "$XROUNDS" "$CROUNDS" "$SROUNDS"; do
    case $n in '' | *[!0-9]* | 0) die "sizes, durations and counts must be positive numbers" ;; esac
done
have_velascgi=0
[ -x "$VELASCGI" ] && [ -d "$STAGE/usr/vela/velaman/webapi" ] && [ -f "$BENCH_LIB" ] && have_velascgi=1
for front in $FRONT_ENDS; do
    case $front in
    cgi) ;;
    fcgi) [ -x "$VELAFCGI" ] || die "velafcgi is not built in $build (BENCH_FRONT_ENDS=cgi leaves it out)" ;;
    *) die "BENCH_FRONT_ENDS takes cgi and fcgi, not \"$front\"" ;;
    esac
done
# uses FRONT: whether the parts rps, upload and download measure FRONT.
uses() { [[ " $FRONT_ENDS " == *" $1 "* ]]; }

# The surroundings of a production machine, where they are cheap to give:
# the state root's /run is a tmpfs (session files are rewritten on every
# call), and a log daemon takes the syslog lines. Both need a private mount
# namespace, so the script runs itself again inside one (as root only);
# nothing is mounted outside it. BENCH_PLAIN=1 runs on the machine as it is.
if [ -z "${VELA_BENCH_NS:-}" ] && [ "${BENCH_PLAIN:-0}" != 1 ] && [ "$(id -u)" = 0 ] &&
    command -v unshare >/dev/null && unshare -m true 2>/dev/null; then
    VELA_BENCH_NS=1 exec unshare -m --propagation private "$here/run.sh" "$build"
fi

work=$(mktemp -d "${BENCH_DIR:-${TMPDIR:-/tmp}}/vela-webbench-XXXXXX") || die "cannot make a work directory"
ROOT=$work/root      # VELA_ROOT of the front ends
DOCROOT=$work/htdocs # static files and the baselines under /bench/
VOLUME=$ROOT/volume1 # the data volume: uploads land in its @tmp
DATA=$VOLUME/sample/data.bin # where the sample's download method finds "data.bin"
BYTES=$((SIZE_MB * 1024 * 1024))

# One lighttpd at most per front end ("cgi", "fcgi"): its process, what it
# serves ("PROGRAM XSENDFILE") and its address.
declare -A LT_PID=() LT_SERVED=() LT_BASE=()
sink_pid=""
sampler_pid=""
# stop_server [FRONT]: stops the server of FRONT, or every server; lighttpd
# stops the velafcgi it started. A velafcgi master seen while measuring that
# is still there a few seconds later is stopped too.
FCGI_MASTERS=""
stop_server() {
    local front pid i
    for front in ${1:-cgi fcgi}; do
        pid=${LT_PID[$front]:-}
        [ -n "$pid" ] || continue
        kill "$pid" 2>/dev/null
        wait "$pid" 2>/dev/null
        LT_PID[$front]=""
        LT_SERVED[$front]=""
    done
    [ "${1:-fcgi}" = fcgi ] || return 0
    for pid in $FCGI_MASTERS; do
        for i in $(seq 1 50); do
            [ "$(readlink "/proc/$pid/exe" 2>/dev/null)" = "$VELAFCGI" ] || break
            sleep 0.1
        done
        [ "$(readlink "/proc/$pid/exe" 2>/dev/null)" = "$VELAFCGI" ] && kill "$pid" 2>/dev/null
    done
    FCGI_MASTERS=""
}
cleanup() {
    if [ -n "$sampler_pid" ]; then
        kill "$sampler_pid" 2>/dev/null
        wait "$sampler_pid" 2>/dev/null
    fi
    stop_server
    if [ -n "$sink_pid" ]; then
        kill "$sink_pid" 2>/dev/null
        wait "$sink_pid" 2>/dev/null
    fi
    if [ -n "${VELA_BENCH_NS:-}" ] && mountpoint -q "$ROOT/run"; then
        umount -l "$ROOT/run"
    fi
    rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT
trap 'exit 143' TERM HUP

mkdir -p "$ROOT/run" "$ROOT/etc/vela" "$VOLUME/sample" "$DOCROOT/bench" "$work/bin" || die "cannot populate $work"
SYSLOG=$work/syslog.txt
SYSLOG_NOTE="syslog: the machine's log daemon"
if [ -n "${VELA_BENCH_NS:-}" ]; then
    mount -t tmpfs -o mode=755,size=64m vela-bench-run "$ROOT/run" || die "cannot mount a tmpfs on $ROOT/run"
    if [ ! -S /dev/log ]; then
        bench_dev_log "$work" "$LOG_SINK" "$SYSLOG"
        SYSLOG_NOTE="syslog: no log daemon on this machine, a sink on /dev/log takes the lines"
    fi
elif [ ! -S /dev/log ]; then
    SYSLOG_NOTE="syslog: no log daemon, so every line goes to /dev/console (slow)"
fi
RUN_NOTE="state root /run on $(stat -f -c %T "$ROOT/run")"

if [ "$have_velascgi" = 1 ]; then
    cp -a "$STAGE/." "$ROOT/" || die "cannot copy the staged root $STAGE"
    # The upload benchmark's own API, in this root only.
    WEBAPI_DIR=$ROOT/usr/vela/velaman/webapi
    mkdir -p "$WEBAPI_DIR/bench" && cp "$BENCH_LIB" "$WEBAPI_DIR/bench/" || die "cannot install $BENCH_LIB"
    cat >"$WEBAPI_DIR/VELA.Bench.Transfer.lib" <<EOF
{
    "VELA.Bench.Transfer": {
        "lib": "bench/libvela-bench-transfer.so",
        "minVersion": 1,
        "maxVersion": 1,
        "methods": {"1": [{"receive": {"allowUpload": true, "deferUpload": true}}]}
    }
}
EOF
    # velafcgi's warm parents serve a method marked "inProcess" themselves:
    # in this root only, the echo of VELA.Sample is (VELA.Sample.Echo, the
    # echo of the other figures, stays as it is). The same handler answers
    # both.
    sed -i '0,/^\( *\)"echo",$/s//\1{"echo": {"inProcess": true}},/' "$WEBAPI_DIR/VELA.Sample.lib" ||
        die "cannot edit $WEBAPI_DIR/VELA.Sample.lib"
    grep -q '"inProcess": true' "$WEBAPI_DIR/VELA.Sample.lib" || INPROC_MARK="the echo of VELA.Sample could not be marked"
    # The compound benchmark's own API, in this root only: its "echo" is
    # grantable, so a sequential compound runs it in process.
    if [ -f "$COMPOUND_LIB" ]; then
        cp "$COMPOUND_LIB" "$WEBAPI_DIR/bench/" || die "cannot install $COMPOUND_LIB"
        cat >"$WEBAPI_DIR/VELA.Bench.Compound.lib" <<EOF
{
    "VELA.Bench.Compound": {
        "lib": "bench/libvela-bench-compound.so",
        "minVersion": 1,
        "maxVersion": 1,
        "methods": {"1": ["sleep", {"echo": {"grantable": true}}]}
    }
}
EOF
    fi
fi

echo "/volume1" >"$ROOT/etc/vela/volumes.conf"

# ---- helpers -------------------------------------------------------------

T=0
# timed CMD...: runs CMD; its wall time in seconds goes to T.
timed() {
    local t0=$EPOCHREALTIME rc
    "$@"
    rc=$?
    T=$(awk -v a="$t0" -v b="$EPOCHREALTIME" 'BEGIN { printf "%.3f", b - a }')
    return $rc
}
median() {
    tr ' ' '\n' | grep . | sort -g |
        awk '{ v[NR] = $1 } END { if (NR == 0) print 0; else if (NR % 2) print v[(NR + 1) / 2]; else printf "%.2f\n", (v[NR / 2] + v[NR / 2 + 1]) / 2 }'
}
largest() { tr ' ' '\n' | grep . | sort -g | tail -1; }
mbps() { awk -v b="$1" -v t="$2" 'BEGIN { if (t <= 0) print "inf"; else printf "%.1f", b / t / 1e6 }'; }
ratio() { awk -v a="$1" -v b="$2" 'BEGIN { if (b <= 0) print "n/a"; else printf "%.3f", a / b }'; }
percent() { awk -v a="$1" -v b="$2" 'BEGIN { if (b <= 0) print "n/a"; else printf "%.1f%%", 100 * a / b }'; }
at_least() { awk -v r="$1" -v g="$2" 'BEGIN { print (r + 0 >= g + 0) ? "met" : "MISSED" }'; }
# Peak resident memory (KiB) the wrapper recorded for the last process; the
# wrapper writes it after the process ended, which may be just after the
# client has its answer.
peak_kib() {
    local i
    for i in $(seq 1 50); do
        grep -q '^[0-9][0-9]*$' "$1" 2>/dev/null && break
        sleep 0.1
    done
    awk '/^[0-9]+$/ { v = $1 } END { print v + 0 }' "$1" 2>/dev/null
}
# A wrapper that runs PROGRAM and records its peak RSS (the ru_maxrss of
# wait4) into LOG.
make_mem_wrapper() {
    local program=$1 out=$2 log=$3
    printf '#!/bin/sh\nexec %s %s %s\n' "'$PEAK_RSS'" "'$log'" "'$program'" >"$out"
    chmod 755 "$out"
}
# fast_output yes|no: the platform's X-Sendfile switch in webapi.conf.
fast_output() {
    local conf=$ROOT/etc/vela/webapi.conf
    touch "$conf"
    sed -i '/^xsendfile=/d' "$conf"
    echo "xsendfile=\"$1\"" >>"$conf"
}

# ---- programs --------------------------------------------------------------

MEMLOG=$work/mem-velascgi.log
VELASCGI_MEM=$work/bin/velascgi-mem
ln -s "$MINIMAL" "$DOCROOT/bench/minimal.cgi"
make_mem_wrapper "$MINIMAL" "$DOCROOT/bench/minimal_mem.cgi" "$work/mem-minimal.log"
[ "$have_velascgi" = 1 ] && make_mem_wrapper "$VELASCGI" "$VELASCGI_MEM" "$MEMLOG"
# Transport references: the same bytes through a shell CGI that only runs cat.
cat >"$DOCROOT/bench/cat_upload.sh" <<EOF
cat >'$work/cgi-upload.out' || exit 1
printf 'Content-type: text/plain\r\n\r\nok\n'
EOF
cat >"$DOCROOT/bench/cat_download.sh" <<EOF
printf 'Content-type: application/octet-stream\r\nContent-Length: %s\r\n\r\n' $BYTES
exec cat '$DATA'
EOF

# ---- lighttpd --------------------------------------------------------------

BASE=""
# start_server FRONT PROGRAM XSENDFILE: one lighttpd on a free port whose
# front end FRONT runs PROGRAM (velascgi, or a wrapper, for cgi; velafcgi for
# fcgi) as /webapi/entry.cgi, X-Sendfile allowed (1) or not (0) for the
# volume. Its address goes to BASE.
start_server() {
    local front=$1 program=$2 xsendfile=$3 try port i conf=$work/lighttpd-$1.conf run=$work/run-$1
    local -a args=(--env "VELA_ROOT=$ROOT" --front-end "$front")
    if [ "$front" = fcgi ]; then
        args+=(--velascgi "$VELASCGI" --velafcgi "$program")
    else
        args+=(--velascgi "$program")
    fi
    [ "$xsendfile" = 1 ] && args+=(--xsendfile-dir "$VOLUME")
    for try in 1 2 3 4 5 6 7 8 9 10; do
        port=$(shuf -i 20000-60999 -n 1)
        [ -z "$(ss -Htln "sport = :$port" 2>/dev/null)" ] || continue
        "$top/scripts/lighttpd-conf.sh" --out "$conf" --port "$port" --run "$run" --pidfile "$run/lighttpd.pid" \
            --docroot "$DOCROOT" "${args[@]}" || die "cannot write the lighttpd configuration"
        if [ -n "${BENCH_STREAM_REQUEST_BODY:-}" ]; then
            sed -i "s/^server.stream-request-body *=.*/server.stream-request-body = $BENCH_STREAM_REQUEST_BODY/" "$conf"
        fi
        if [ -n "${BENCH_STREAM_RESPONSE_BODY:-}" ]; then
            sed -i "s/^server.stream-response-body *=.*/server.stream-response-body = $BENCH_STREAM_RESPONSE_BODY/" "$conf"
        fi
        if [ -n "${BENCH_LIGHTTPD_EXTRA:-}" ]; then
            printf '\n## Added by BENCH_LIGHTTPD_EXTRA.\n%s\n' "$BENCH_LIGHTTPD_EXTRA" >>"$conf"
        fi
        # The baselines are CGI programs under either front end: mod_cgi
        # beside mod_fastcgi, before mod_staticfile.
        if [ "$front" = fcgi ]; then
            sed -i 's/^\( *\)"mod_fastcgi",$/&\n\1"mod_cgi",/' "$conf"
            grep -q '^ *"mod_cgi",$' "$conf" || die "cannot add mod_cgi to $conf"
        fi
        printf '\n## Benchmark baselines.\n$HTTP["url"] =~ "^/bench/" {\n  cgi.assign = ( ".cgi" => "", ".sh" => "/bin/sh" )\n}\n' >>"$conf"
        lighttpd -tt -f "$conf" >"$work/lighttpd-check.log" 2>&1 || {
            cat "$work/lighttpd-check.log" >&2
            die "lighttpd refuses $conf"
        }
        lighttpd -D -f "$conf" >>"$work/lighttpd-stdout.log" 2>&1 &
        LT_PID[$front]=$!
        for i in $(seq 1 100); do
            if ! kill -0 "${LT_PID[$front]}" 2>/dev/null; then
                wait "${LT_PID[$front]}" 2>/dev/null
                LT_PID[$front]=""
                break
            fi
            if curl -s -o /dev/null "http://127.0.0.1:$port/bench/minimal.cgi"; then
                BASE="http://127.0.0.1:$port"
                LT_BASE[$front]=$BASE
                LT_SERVED[$front]="$program $xsendfile"
                [ "$front" = fcgi ] && FCGI_MASTERS+=" $(fcgi_master)"
                return 0
            fi
            sleep 0.1
        done
        stop_server "$front"
    done
    cat "$run/error.log" "$work/lighttpd-stdout.log" >&2 2>/dev/null
    die "lighttpd did not start"
}
# serve FRONT PROGRAM XSENDFILE [keep]: (re)starts the server of FRONT unless
# it already runs so, and stops the other front end's server unless "keep"
# is given; BASE is the server's address.
serve() {
    local other=cgi
    [ "$1" = cgi ] && other=fcgi
    [ "${4:-}" = keep ] || stop_server "$other"
    if [ -n "${LT_PID[$1]:-}" ] && [ "${LT_SERVED[$1]}" = "$2 $3" ]; then
        BASE=${LT_BASE[$1]}
        return 0
    fi
    stop_server "$1"
    start_server "$1" "$2" "$3"
}
# server_setting NAME: a setting of the last configuration written.
server_setting() { sed -n "s/^$1 *= *//p" "$(ls -t "$work"/lighttpd-*.conf | head -1)" | head -1; }

# ---- velafcgi's processes --------------------------------------------------------

# children PID: the children of PID (none when it is gone).
children() {
    local list=""
    read -r list <"/proc/$1/task/$1/children" 2>/dev/null
    echo $list
}
# fcgi_master: the velafcgi master of the fcgi server (a child of lighttpd).
fcgi_master() {
    local pid
    for pid in $(children "${LT_PID[fcgi]:-0}"); do
        [ "$(readlink "/proc/$pid/exe" 2>/dev/null)" = "$VELAFCGI" ] && echo "$pid"
    done
}
# fcgi_parents: velafcgi's warm parents (the master's children).
fcgi_parents() {
    local m
    for m in $(fcgi_master); do
        children "$m"
    done
}
# children_faults: the page faults of the children the parents have reaped
# (cminflt of /proc/PID/stat, summed over the parents); a request served in
# process adds none.
children_faults() {
    local p line sum=0
    for p in $(fcgi_parents); do
        read -r line <"/proc/$p/stat" 2>/dev/null || continue
        line=${line##*) }
        set -- $line
        sum=$((sum + $9))
    done
    echo "$sum"
}
# hwm PID: the peak resident memory (VmHWM, KiB) of PID so far, empty when
# it is gone.
hwm() {
    local key value rest
    while read -r key value rest; do
        [ "$key" = VmHWM: ] && echo "$value" && return 0
    done <"/proc/$1/status" 2>/dev/null
}
# fcgi_mem_start: samples every 50 ms, until fcgi_mem_stop, the peak
# resident memory of the velafcgi master, of its parents and of their
# request children into FCGI_MEMLOG as "role pid KiB" lines. A peak figure
# only grows, so the last sample of a process is its peak up to then.
FCGI_MEMLOG=$work/mem-velafcgi.log
fcgi_mem_start() {
    : >"$FCGI_MEMLOG"
    (
        local m p c k
        while :; do
            for m in $(fcgi_master); do
                k=$(hwm "$m") && [ -n "$k" ] && echo "master $m $k"
                for p in $(children "$m"); do
                    k=$(hwm "$p") && [ -n "$k" ] && echo "parent $p $k"
                    for c in $(children "$p"); do
                        k=$(hwm "$c") && [ -n "$k" ] && echo "child $c $k"
                    done
                done
            done
            sleep 0.05
        done >>"$FCGI_MEMLOG"
    ) &
    sampler_pid=$!
}
# fcgi_mem_stop: "master parents child children-seen": the largest peak of
# each role (KiB) since fcgi_mem_start, and how many request children the
# samples saw.
fcgi_mem_stop() {
    sleep 0.1
    kill "$sampler_pid" 2>/dev/null
    wait "$sampler_pid" 2>/dev/null
    sampler_pid=""
    awk '{ if ($3 > m[$1]) m[$1] = $3; if ($1 == "child") seen[$2] = 1 }
        END { printf "%d %d %d %d\n", m["master"], m["parent"], m["child"], length(seen) }' "$FCGI_MEMLOG"
}

# ---- the echo call and its login ------------------------------------------------

COOKIE_ARGS=()
LOGIN_NOTE="no login: the echo method needs no session"
LOGIN_DONE=0
# Makes the echo call succeed: when the sample refuses it for want of a
# session, one is made with velaadm and its cookie goes with every call.
prepare_login() {
    [ "$LOGIN_DONE" = 1 ] && return 0
    local answer created sid token
    answer=$(curl -s "$BASE/webapi/entry.cgi?$ECHO_QUERY")
    case $answer in
    *'"success":true'*)
        LOGIN_DONE=1
        return 0
        ;;
    *'"code":105'* | *'"code":106'* | *'"code":107'* | *'"code":119'*) ;;
    *)
        echo "echo answer: $answer" >&2
        return 1
        ;;
    esac
    created=$(VELA_ROOT=$ROOT "$VELAADM" session create root --ip 127.0.0.1 --timeout 3600) || return 1
    sid=$(printf '%s\n' "$created" | sed -n 's/^sid=//p')
    token=$(printf '%s\n' "$created" | sed -n 's/^token=//p')
    [ -n "$sid" ] || return 1
    COOKIE_ARGS=(-H "Cookie: id=$sid")
    [ -n "$token" ] && COOKIE_ARGS+=(-H "X-Vela-Token: $token")
    LOGIN_NOTE="the echo method needs a session: one for root made with velaadm, its cookie sent with every call"
    answer=$(curl -s "${COOKIE_ARGS[@]}" "$BASE/webapi/entry.cgi?$ECHO_QUERY")
    case $answer in
    *'"success":true'*)
        LOGIN_DONE=1
        return 0
        ;;
    esac
    echo "echo answer with a session: $answer" >&2
    return 1
}

# ---- requests per second ----------------------------------------------------------

# wrk_rps URL [SECONDS]: requests per second of one wrk run; a non-2xx
# answer fails it, socket errors (time-outs of a loaded machine) are shown.
wrk_rps() {
    local out
    out=$(wrk -t"$THREADS" -c"$CONNS" -d"${2:-$DURATION}s" "${COOKIE_ARGS[@]}" "$1") || {
        echo "$out" >&2
        return 1
    }
    if printf '%s\n' "$out" | grep -q 'Non-2xx'; then
        echo "$out" >&2
        return 1
    fi
    printf '%s\n' "$out" | grep 'Socket errors' | sed "s|^ *|wrk on ${1%%\?*}: |" >&2
    printf '%s\n' "$out" | awk '/^Requests\/sec:/ { print $2 }'
}

# verdict VALUE GOAL [at-most]: "goal met" when VALUE >= GOAL (<= with
# at-most), else "goal not met".
verdict() {
    awk -v v="$1" -v g="$2" -v most="${3:-}" 'BEGIN {
        ok = (most == "at-most") ? (v + 0 <= g + 0) : (v + 0 >= g + 0)
        print ok ? "goal met" : "goal not met" }'
}
# get_n N URL: N GETs of URL, one after the other on one connection.
get_n() {
    local i
    local -a args=()
    for ((i = 0; i < $1; i++)); do
        args+=(-o /dev/null "$2")
    done
    curl -sS "${COOKIE_ARGS[@]}" "${args[@]}" || die "curl failed on $2"
}
# forks_for URL: how many page faults the children the velafcgi parents
# reaped took over 20 calls of URL: none when the parents serve it in
# process.
forks_for() {
    local before
    before=$(children_faults)
    get_n 20 "$1"
    sleep 0.3 # a child is reaped just after its answer
    echo $(($(children_faults) - before))
}
rss_of() {
    local key value rest
    while read -r key value rest; do
        [ "$key" = VmRSS: ] && echo "$value" && return 0
    done <"/proc/$1/status" 2>/dev/null
}
# fcgi_rss: the resident memory (KiB) of velafcgi's master and parents.
fcgi_rss() { echo "master $(rss_of "$(fcgi_master)") KiB, parents $(for p in $(fcgi_parents); do printf '%s ' "$(rss_of "$p")"; done)KiB"; }

bench_rps() {
    local -a rows=() label=()
    local -A urls=()
    local B
    # Both servers run side by side, each with the baseline under /bench/.
    # velafcgi starts afresh after the login is made: a parent serves an
    # API's "inProcess" methods once a child of its own has served the API
    # (warmed it), so the in-process echo is called a few times first.
    if uses cgi; then
        serve cgi "$VELASCGI" 0 keep
    else
        serve fcgi "$VELAFCGI" 0 keep
    fi
    prepare_login || die "the echo call does not succeed: set BENCH_ECHO_QUERY"
    if uses fcgi; then
        stop_server fcgi
        serve fcgi "$VELAFCGI" 0 keep
        get_n 20 "${LT_BASE[fcgi]}/webapi/entry.cgi?$INPROC_QUERY"
    fi
    B=${LT_BASE[cgi]:-${LT_BASE[fcgi]:-}}
    rows+=(minimal)
    label[0]="minimal CGI (baseline)"
    urls[minimal]="$B/bench/minimal.cgi?$ECHO_QUERY"
    if uses cgi; then
        rows+=(velascgi)
        label[${#rows[@]} - 1]="velascgi (CGI)"
        urls[velascgi]="${LT_BASE[cgi]}/webapi/entry.cgi?$ECHO_QUERY"
    fi
    if uses fcgi; then
        rows+=(fork inproc)
        label[${#rows[@]} - 2]="velafcgi, a child per request"
        label[${#rows[@]} - 1]="velafcgi, in process"
        urls[fork]="${LT_BASE[fcgi]}/webapi/entry.cgi?$ECHO_QUERY"
        urls[inproc]="${LT_BASE[fcgi]}/webapi/entry.cgi?$INPROC_QUERY"
    fi
    echo "== requests per second: sample echo with a login session, minimal C++ CGI vs velascgi vs velafcgi =="
    echo "wrk -t$THREADS -c$CONNS -d${DURATION}s, $ROUNDS alternating rounds; $LOGIN_NOTE"
    [ -n "${LT_BASE[fcgi]:-}" ] && [ -n "${LT_BASE[cgi]:-}" ] &&
        echo "two lighttpd side by side: --front-end cgi on ${LT_BASE[cgi]#http://}, --front-end fcgi on ${LT_BASE[fcgi]#http://}"
    local row i answer
    for row in "${rows[@]}"; do
        answer=$(curl -s "${COOKIE_ARGS[@]}" "${urls[$row]}")
        case $answer in *'"success":true'*) ;; *)
            echo "answer of $row: $answer" >&2
            die "the $row echo does not succeed"
            ;;
        esac
        printf '  %-8s %s\n  %-8s -> %s\n' "$row" "${urls[$row]#http://*/}" "" "$answer"
    done
    # Warm-up: page cache, libraries, description files, warm parents.
    for row in "${rows[@]}"; do
        wrk_rps "${urls[$row]}" 2 >/dev/null || die "wrk failed on $row"
    done
    local inproc_note="" rss_warm=""
    if uses fcgi; then
        local f_fork f_in
        f_fork=$(forks_for "${urls[fork]}")
        f_in=$(forks_for "${urls[inproc]}")
        if [ -n "$INPROC_MARK" ]; then
            inproc_note="in-process not available: $INPROC_MARK"
        elif [ "$f_fork" -gt 0 ] && [ $((f_in * 4)) -lt "$f_fork" ]; then
            # A forked call's child may be reaped only after the next
            # measurement started, on a loaded machine: a few such faults
            # are not a fork of the in-process calls (each would cost as
            # many as a forked call).
            inproc_note="served in process: 20 calls, $f_in child page faults reaped meanwhile against $f_fork for 20 forked calls"
        else
            inproc_note="in-process not available in this build: the parents forked for it ($f_in child page faults over 20 calls, $f_fork for 20 forked calls)"
        fi
        rss_warm=$(fcgi_rss)
    fi
    local r v line
    local -A all=()
    for r in $(seq 1 "$ROUNDS"); do
        line="round $r:"
        for row in "${rows[@]}"; do
            v=$(wrk_rps "${urls[$row]}") || die "wrk failed on $row"
            all[$row]+="$v "
            line+=$(printf '  %s %.1f' "$row" "$v")
        done
        echo "$line req/s"
    done
    local base med rt
    base=$(echo "${all[minimal]}" | median)
    echo "median of $ROUNDS rounds, and the ratio to the minimal CGI:"
    for i in "${!rows[@]}"; do
        row=${rows[$i]}
        med=$(echo "${all[$row]}" | median)
        rt=$(ratio "$med" "$base")
        case $row in
        minimal) printf '  %-32s %9.1f req/s\n' "${label[$i]}" "$med" ;;
        velascgi) printf '  %-32s %9.1f req/s  %6sx (goal >= 0.85x: %s)\n' "${label[$i]}" "$med" "$rt" "$(verdict "$rt" 0.85)" ;;
        fork) printf '  %-32s %9.1f req/s  %6sx (goal >= 3x: %s)\n' "${label[$i]}" "$med" "$rt" "$(verdict "$rt" 3)" ;;
        inproc)
            printf '  %-32s %9.1f req/s  %6sx (goal >= 10x: %s)\n' "${label[$i]}" "$med" "$rt" "$(verdict "$rt" 10)"
            printf '  %-32s %s\n' "" "$inproc_note"
            ;;
        esac
    done
    echo "  (the machine is shared: load average $(loadavg))"
    if uses fcgi; then
        echo "velafcgi resident memory: after the warm-up $rss_warm; after the rounds $(fcgi_rss)"
    fi

    if uses cgi; then
        serve cgi "$VELASCGI_MEM" 0
        : >"$MEMLOG"
        : >"$work/mem-minimal.log"
        local lines=0
        [ -f "$SYSLOG" ] && lines=$(wc -l <"$SYSLOG")
        curl -s -o /dev/null "${COOKIE_ARGS[@]}" "$BASE/webapi/entry.cgi?$ECHO_QUERY"
        curl -s -o /dev/null "$BASE/bench/minimal_mem.cgi?$ECHO_QUERY"
        echo "peak RSS of one call: velascgi echo $(peak_kib "$MEMLOG") KiB, baseline $(peak_kib "$work/mem-minimal.log") KiB"
        if [ -f "$SYSLOG" ]; then
            sleep 0.5 # the sink may still be writing the last datagrams
            echo "syslog lines of one echo call: $(($(wc -l <"$SYSLOG") - lines))"
        fi
    fi
    if [ "${BENCH_CALLGRIND:-1}" != 1 ]; then
        echo "instructions: left out (BENCH_CALLGRIND=${BENCH_CALLGRIND:-})"
    elif ! VALGRIND=$(command -v valgrind); then
        echo "instructions: valgrind is not installed"
    else
        rps_instructions
    fi
}

# fcgi_request DIR CAPTURE N: N requests, with the environment and body
# recorded in CAPTURE, to the velafcgi listening on DIR/fcgi.sock, through
# cgi-fcgi; each must succeed.
fcgi_request() {
    local dir=$1 cap=$2 i
    replay_env "$cap"
    for ((i = 0; i < $3; i++)); do
        CG_RUNS=$((CG_RUNS + 1))
        env -i "${REPLAY_ENV[@]}" cgi-fcgi -bind -connect "$dir/fcgi.sock" <"$cap/body" >"$dir/answer.$CG_RUNS" 2>>"$dir/stderr"
        grep -q '"success":true' "$dir/answer.$CG_RUNS" || {
            head -c 600 "$dir/answer.$CG_RUNS" >&2
            tail -n 20 "$dir/stderr" >&2
            die "a request to velafcgi under callgrind did not succeed"
        }
    done
}
# fcgi_callgrind DIR FORKED INPROC: velafcgi with one parent under callgrind,
# every process it forks followed (counts dumped and zeroed before each
# fork, so a child counts only what it executes after the fork): 1 + INPROC
# echo requests the parent may serve itself (the first goes to a child, as
# the API is not warm yet), then FORKED echo requests, then SIGTERM. The
# in-process echo comes first: its API shares its library with the other.
fcgi_callgrind() {
    local dir=$1 vpid i
    mkdir -p "$dir"
    env -i PATH="$PATH" VELA_ROOT="$ROOT" "$VALGRIND" --tool=callgrind --trace-children=yes --dump-before='*fork*' \
        --log-file="$dir/valgrind.%p" --callgrind-out-file="$dir/callgrind.out.%p" \
        "$VELAFCGI" --socket "$dir/fcgi.sock" --parents 1 --stderr "$dir/velafcgi.log" </dev/null >>"$dir/stderr" 2>&1 &
    vpid=$!
    for i in $(seq 1 600); do
        [ -S "$dir/fcgi.sock" ] && break
        kill -0 "$vpid" 2>/dev/null || break
        sleep 0.1
    done
    [ -S "$dir/fcgi.sock" ] || {
        tail -n 20 "$dir/stderr" "$dir"/velafcgi.log >&2
        kill "$vpid" 2>/dev/null
        die "velafcgi under callgrind did not start"
    }
    fcgi_request "$dir" "$work/cap-inproc" $((1 + $3))
    fcgi_request "$dir" "$work/cap-echo" "$2"
    kill -TERM "$vpid"
    for i in $(seq 1 600); do
        kill -0 "$vpid" 2>/dev/null || break
        sleep 0.1
    done
    if kill -0 "$vpid" 2>/dev/null; then
        echo "velafcgi under callgrind did not stop within 60 s of SIGTERM: killed" >&2
        kill -KILL "$vpid"
    fi
    wait "$vpid" 2>/dev/null
}

rps_instructions() {
    local forked=5 inproc=3
    make_capture_wrapper
    serve cgi "$CAPTURE_CGI" 0
    capture echo "$BASE/webapi/entry.cgi?$ECHO_QUERY"
    uses fcgi && capture inproc "$BASE/webapi/entry.cgi?$INPROC_QUERY"
    stop_server
    echo "instructions of one echo request with a session (callgrind, whole process, dynamic loader included; the"
    echo "programs run directly with the environment lighttpd gave velascgi for the same request, recorded through a wrapper):"
    local -a tree
    callgrind_run "$work/cg-minimal" "$work/cap-echo" "$MINIMAL"
    read -r -a tree <<<"$(callgrind_tree "$work/cg-minimal")"
    local base=${tree[0]} rt
    printf '  %-32s %10s\n' "minimal CGI (baseline)" "$(mi "$base")"
    if uses cgi; then
        callgrind_run "$work/cg-velascgi" "$work/cap-echo"
        read -r -a tree <<<"$(callgrind_tree "$work/cg-velascgi")"
        rt=$(ratio "${tree[0]}" "$base")
        printf '  %-32s %10s  %6sx in %d process(es) (goal <= 1.5x: %s)\n' "velascgi (CGI)" "$(mi "${tree[0]}")" "$rt" \
            "${tree[1]}" "$(verdict "$rt" 1.5 at-most)"
    fi
    uses fcgi || return 0
    if ! command -v cgi-fcgi >/dev/null; then
        echo "  velafcgi: cgi-fcgi is not installed (package libfcgi-bin)"
        return 0
    fi
    local dir=$work/cg-velafcgi
    fcgi_callgrind "$dir" "$forked" "$inproc"
    # The request children, in the order they were forked: the first call
    # of the in-process echo, any further one the parent did not serve
    # itself, then the forked echoes.
    local -a kids
    mapfile -t kids < <(callgrind_procs "$dir" | awk '$2 == 2 { print $1, $3 }' | sort -n | awk '{ print $2 }')
    local med first n=${#kids[@]}
    [ "$n" -gt "$forked" ] || die "velafcgi under callgrind forked $n request children for $forked forked requests"
    first=${kids[0]}
    med=$(printf '%s\n' "${kids[@]:n-forked}" | median)
    rt=$(ratio "$med" "$base")
    printf '  %-32s %10s  %6sx median of %d children (goal <= 0.5x: %s)\n' \
        "velafcgi request child" "$(mi "$med")" "$rt" "$forked" "$(verdict "$rt" 0.5 at-most)"
    printf '  %-32s the first child, which opened the library before its parent warmed it: %s\n' "" "$(mi "$first")"
    read -r -a tree <<<"$(callgrind_procs "$dir" | awk '{ n[$2]++; i[$2] += $3 } END { print n[0], i[0], n[1], i[1] }')"
    printf '  %-32s master %s, parent %s over the whole run (%d + %d requests)\n' "" "$(mi "${tree[1]}")" "$(mi "${tree[3]}")" \
        $((1 + inproc)) "$forked"
    if [ "$n" = $((forked + 1)) ]; then
        printf '  %-32s %d calls of the echo marked "inProcess": the parent served them, no child forked\n' "velafcgi in process" "$inproc"
    elif [ "$n" = $((forked + 1 + inproc)) ]; then
        printf '  %-32s in-process not available in this build: %d calls of the echo marked "inProcess" forked %d children\n' \
            "velafcgi in process" "$inproc" "$inproc"
    else
        printf '  %-32s %d request children for %d requests\n' "velafcgi" "$n" $((forked + 1 + inproc))
    fi
}

# ---- the big file ------------------------------------------------------------------

make_data() {
    [ -f "$DATA" ] && return 0
    local need_kb=$(((SIZE_MB * 3 + 256) * 1024)) free_kb
    free_kb=$(df -Pk "$work" | awk 'NR == 2 { print $4 }')
    [ "$free_kb" -ge "$need_kb" ] || die "need $((need_kb / 1024)) MiB free in $work, have $((free_kb / 1024))"
    # Random bytes: no file-system shortcut for zeros, and the multipart
    # reader meets every byte value inside the file part.
    dd if=/dev/urandom of="$DATA" bs=1M count="$SIZE_MB" iflag=fullblock status=none || die "cannot write $DATA"
    sync
    cat "$DATA" >/dev/null
}
# The sample removes the files it stored; anything left is reported and removed.
remove_uploads() {
    local left
    left=$(find "$VOLUME" "$ROOT/tmp" "$ROOT/var/tmp" -type f ! -path "$DATA" 2>/dev/null)
    if [ -n "$left" ]; then
        echo "files left after the upload: $left" >&2
        printf '%s\n' "$left" | while IFS= read -r f; do rm -f "$f"; done
    fi
}

# ---- memory of a front end ---------------------------------------------------------

# mem_begin FRONT / mem_end FRONT: around one transfer through FRONT, the
# peak resident memory of every process of FRONT that took part goes to
# PEAK ("velascgi N KiB", or "master N, parents N, request child N KiB")
# and the largest of them (KiB) to PEAK_MAX; for velafcgi, NOCHILD is 1 when
# the samples saw no request child.
PEAK="" PEAK_MAX=0 NOCHILD=0
mem_begin() {
    if [ "$1" = cgi ]; then
        : >"$MEMLOG"
    else
        fcgi_mem_start
    fi
}
mem_end() {
    local -a m
    NOCHILD=0
    if [ "$1" = cgi ]; then
        PEAK_MAX=$(peak_kib "$MEMLOG")
        PEAK="velascgi $PEAK_MAX KiB"
    else
        read -r -a m <<<"$(fcgi_mem_stop)"
        PEAK="master ${m[0]}, parents ${m[1]}, request child ${m[2]} KiB"
        [ "${m[3]}" = 0 ] && NOCHILD=1 && PEAK+=" (no request child sampled)"
        PEAK_MAX=$(printf '%s\n' "${m[@]:0:3}" | largest)
    fi
}
front_name() { if [ "$1" = cgi ]; then echo velascgi; else echo velafcgi; fi; }
# serve_fronts XSENDFILE: a server for each front end measured, side by side.
serve_fronts() {
    uses fcgi && serve fcgi "$VELAFCGI" "$1" keep
    uses cgi && serve cgi "$VELASCGI_MEM" "$1" keep
    return 0
}
# mem_goal KIB NOCHILD: the verdict on peak memory under 16 MiB.
mem_goal() {
    if [ "$2" = 1 ]; then
        echo "not known: a request child was not sampled"
    else
        verdict "$1" 16383 at-most
    fi
}

# ---- upload ------------------------------------------------------------------------

# upload_via QUERY NAME FRONT: one upload of the data file through FRONT;
# its wall time goes to T, the peak memory to PEAK and PEAK_MAX (mem_end);
# the first answer is printed.
upload_via() {
    local query=$1 name=$2 front=$3 code answer=$work/upload-answer.txt t
    mem_begin "$front"
    timed curl -sS -o "$answer" -w '%{http_code}' -H 'Expect:' "${COOKIE_ARGS[@]}" \
        -F "file=@$DATA;type=application/octet-stream" "${LT_BASE[$front]}/webapi/entry.cgi?$query" >"$work/code" ||
        die "curl upload to $name through $(front_name "$front") failed"
    t=$T
    mem_end "$front"
    code=$(cat "$work/code")
    if [ "$code" != 200 ] || ! grep -q '"success":true' "$answer"; then
        echo "upload answer of $name (HTTP $code): $(head -c 600 "$answer")" >&2
        die "the upload through $(front_name "$front") failed"
    fi
    if [[ $ANSWERED != *" $name "* ]]; then
        echo "$name answer: $(head -c 300 "$answer")"
        ANSWERED+=" $name "
    fi
    remove_uploads
    sync
    T=$t
}
ANSWERED=" "

bench_upload() {
    make_data
    serve_fronts 0
    prepare_login || true
    echo "== upload of $SIZE_MB MiB: $(for f in $FRONT_ENDS; do printf '%s ' "$(front_name "$f")"; done)multipart vs cat into a file on the same disk =="
    echo "lighttpd server.stream-request-body = $(server_setting server.stream-request-body)"
    echo "receive: VELA.Bench.Transfer receive, the framework's upload path and nothing else;"
    echo "sample:  VELA.Sample upload, which reads each stored file again for its cksum"
    echo "peak RSS: velascgi's from wait4 (a wrapper); velafcgi's from VmHWM of every process, sampled every 50 ms"
    local r tc tsh front q line
    local -A all=() peaks=() nochild=()
    for r in $(seq 1 "$XROUNDS"); do
        sync
        timed cat "$DATA" >"$VOLUME/cat-copy.bin" || die "cat failed"
        tc=$T
        rm -f "$VOLUME/cat-copy.bin"
        sync
        all[cat]+="$(mbps "$BYTES" "$tc") "
        line=$(printf 'round %d: cat %.1f MB/s' "$r" "$(mbps "$BYTES" "$tc")")
        for front in $FRONT_ENDS; do
            for q in receive sample; do
                if [ "$q" = receive ]; then
                    upload_via "$RECEIVE_QUERY" receive "$front"
                else
                    upload_via "$UPLOAD_QUERY" sample "$front"
                fi
                all[$front-$q]+="$(mbps "$BYTES" "$T") "
                peaks[$front]+="$PEAK_MAX "
                [ "$NOCHILD" = 1 ] && nochild[$front]=1
                line+=$(printf '\n  %s %-7s %7.1f MB/s (peak RSS %s)' "$(front_name "$front")" "$q" "$(mbps "$BYTES" "$T")" "$PEAK")
            done
        done
        timed curl -sS -o /dev/null -H 'Expect:' -F "file=@$DATA;type=application/octet-stream" \
            "$BASE/bench/cat_upload.sh" || die "curl upload to the shell CGI failed"
        tsh=$T
        rm -f "$work/cgi-upload.out"
        sync
        all[shell]+="$(mbps "$BYTES" "$tsh") "
        line+=$(printf '\n  shell CGI cat %7.1f MB/s' "$(mbps "$BYTES" "$tsh")")
        echo "$line"
    done
    local mc msh m mp rt
    mc=$(echo "${all[cat]}" | median)
    msh=$(echo "${all[shell]}" | median)
    echo "median of $XROUNDS rounds:"
    printf '  %-22s %7.1f MB/s\n' "cat into a file" "$mc"
    printf '  %-22s %7.1f MB/s (the same bytes through the same lighttpd into a shell CGI)\n' "shell CGI cat" "$msh"
    if [ "$(ratio "$msh" "$mc")" != n/a ] && [ "$(verdict "$(ratio "$msh" "$mc")" 0.85)" != "goal met" ]; then
        echo "  lighttpd bounds the uploads here: a shell CGI that only runs cat reaches $(percent "$msh" "$mc") of cat,"
        echo "  so the front ends are better judged against it than against cat"
    fi
    for front in $FRONT_ENDS; do
        for q in receive sample; do
            m=$(echo "${all[$front-$q]}" | median)
            rt=$(ratio "$m" "$mc")
            line=$(printf '  %-22s %7.1f MB/s = %s of cat (goal >= 85%%: %s), %s of the shell CGI cat' \
                "$(front_name "$front") $q" "$m" "$(percent "$m" "$mc")" "$(verdict "$rt" 0.85)" "$(percent "$m" "$msh")")
            if [ "$front" = fcgi ] && uses cgi; then
                rt=$(ratio "$m" "$(echo "${all[cgi-$q]}" | median)")
                line+=$(printf '; %sx velascgi (goal >= 1x: %s)' "$rt" "$(verdict "$rt" 1)")
            fi
            echo "$line"
        done
    done
    for front in $FRONT_ENDS; do
        mp=$(echo "${peaks[$front]}" | largest)
        printf '  %s peak RSS, largest process of any upload: %s KiB = %.1f MiB (goal < 16 MiB in every process: %s)\n' \
            "$(front_name "$front")" "$mp" "$(awk -v k="$mp" 'BEGIN { print k / 1024 }')" "$(mem_goal "$mp" "${nochild[$front]:-0}")"
    done
    echo "  (the machine is shared: load average $(loadavg))"
}

# ---- download ----------------------------------------------------------------------

bench_download() {
    local xsendfile=$1 label
    make_data
    if [ "$xsendfile" = 1 ]; then
        label="X-Sendfile on: lighttpd sends the file"
        fast_output yes
    else
        label="X-Sendfile off: the front end streams the file"
        fast_output no
    fi
    serve_fronts "$xsendfile"
    prepare_login || true
    ln -sf "$DATA" "$DOCROOT/bench/static.bin"
    echo "== download of $SIZE_MB MiB: $(for f in $FRONT_ENDS; do printf '%s ' "$(front_name "$f")"; done)($label) vs cat of the file =="
    echo "lighttpd server.stream-response-body = $(server_setting server.stream-response-body)"
    local r meta tc ts tt front line
    local -A all=() peaks=() nochild=()
    for r in $(seq 1 "$XROUNDS"); do
        timed cat "$DATA" >/dev/null || die "cat failed"
        tc=$T
        all[cat]+="$(mbps "$BYTES" "$tc") "
        line=$(printf 'round %d: cat %.1f MB/s' "$r" "$(mbps "$BYTES" "$tc")")
        for front in $FRONT_ENDS; do
            mem_begin "$front"
            timed curl -sS -o /dev/null -w '%{http_code} %{size_download}' "${COOKIE_ARGS[@]}" \
                "${LT_BASE[$front]}/webapi/entry.cgi?$DOWNLOAD_QUERY" >"$work/meta" || die "curl download failed"
            mem_end "$front"
            meta=$(cat "$work/meta")
            if [ "$meta" != "200 $BYTES" ]; then
                echo "download: HTTP status and size $meta, expected 200 $BYTES; the answer begins:" >&2
                curl -s -i "${COOKIE_ARGS[@]}" -r 0-299 "${LT_BASE[$front]}/webapi/entry.cgi?$DOWNLOAD_QUERY" | head -c 900 >&2
                die "the download through $(front_name "$front") failed"
            fi
            all[$front]+="$(mbps "$BYTES" "$T") "
            peaks[$front]+="$PEAK_MAX "
            [ "$NOCHILD" = 1 ] && nochild[$front]=1
            line+=$(printf '\n  %s %7.1f MB/s (peak RSS %s)' "$(front_name "$front")" "$(mbps "$BYTES" "$T")" "$PEAK")
        done
        timed curl -sS -o /dev/null "$BASE/bench/cat_download.sh" || die "curl download from the shell CGI failed"
        ts=$T
        timed curl -sS -o /dev/null "$BASE/bench/static.bin" || die "curl static download failed"
        tt=$T
        all[shell]+="$(mbps "$BYTES" "$ts") "
        all[static]+="$(mbps "$BYTES" "$tt") "
        line+=$(printf '\n  shell CGI cat %7.1f MB/s   lighttpd static file %7.1f MB/s' "$(mbps "$BYTES" "$ts")" "$(mbps "$BYTES" "$tt")")
        echo "$line"
    done
    local mc ms mt m rt mp
    mc=$(echo "${all[cat]}" | median)
    ms=$(echo "${all[shell]}" | median)
    mt=$(echo "${all[static]}" | median)
    echo "median of $XROUNDS rounds:"
    printf '  %-22s %7.1f MB/s\n' "cat of the file" "$mc"
    printf '  %-22s %7.1f MB/s\n' "shell CGI cat" "$ms"
    printf '  %-22s %7.1f MB/s\n' "lighttpd static file" "$mt"
    for front in $FRONT_ENDS; do
        m=$(echo "${all[$front]}" | median)
        rt=$(ratio "$m" "$mc")
        line=$(printf '  %-22s %7.1f MB/s = %s of cat (goal >= 90%%: %s), %s of the shell CGI cat, %s of the static file' \
            "$(front_name "$front")" "$m" "$(percent "$m" "$mc")" "$(verdict "$rt" 0.90)" "$(percent "$m" "$ms")" "$(percent "$m" "$mt")")
        if [ "$front" = fcgi ] && uses cgi; then
            rt=$(ratio "$m" "$(echo "${all[cgi]}" | median)")
            line+=$(printf '; %sx velascgi (goal >= 1x: %s)' "$rt" "$(verdict "$rt" 1)")
        fi
        echo "$line"
    done
    for front in $FRONT_ENDS; do
        mp=$(echo "${peaks[$front]}" | largest)
        printf '  %s peak RSS, largest process of any download: %s KiB = %.1f MiB (goal < 16 MiB in every process: %s)\n' \
            "$(front_name "$front")" "$mp" "$(awk -v k="$mp" 'BEGIN { print k / 1024 }')" "$(mem_goal "$mp" "${nochild[$front]:-0}")"
    done
    echo "  (the machine is shared: load average $(loadavg))"
}

# ---- compound requests -----------------------------------------------------------

CALLS=10
SLEEP_MS=100
SLEEP_GOAL_MS=300
SPEEDUP_GOAL=5

# url_encode TEXT: TEXT percent-encoded for a form body, byte by byte (the
# unreserved characters of RFC 3986 stay as they are).
url_encode() {
    local LC_ALL=C
    local text=$1 out="" c i
    for ((i = 0; i < ${#text}; i++)); do
        c=${text:i:1}
        case $c in
        [A-Za-z0-9._~-]) out+=$c ;;
        *)
            printf -v c '%%%02X' "'$c"
            out+=$c
            ;;
        esac
    done
    printf '%s' "$out"
}
# query_json QUERY: the parameters of a query string as one JSON object of
# strings, the values a handler gets from that query string; fails for a
# parameter holding a control character.
query_json() {
    local -a pairs
    local pair name value part out="" sep=""
    IFS='&' read -r -a pairs <<<"$1"
    for pair in "${pairs[@]}"; do
        [ -n "$pair" ] || continue
        name=${pair%%=*}
        value=""
        [[ $pair == *=* ]] && value=${pair#*=}
        for part in name value; do
            local v=${!part}
            v=${v//+/ }
            v=${v//\\/\\\\}
            printf -v v '%b' "${v//%/\\x}"
            case $v in *[[:cntrl:]]*) return 1 ;; esac
            v=${v//\\/\\\\}
            v=${v//\"/\\\"}
            printf -v "$part" '"%s"' "$v"
        done
        out+="$sep$name:$value"
        sep=,
    done
    printf '{%s}' "$out"
}
# compound_form FILE MODE CALL N: the form body of a compound request of N
# copies of the JSON object CALL, in MODE, into FILE.
compound_form() {
    local list="" i
    for ((i = 0; i < $4; i++)); do
        list+="${list:+,}$3"
    done
    printf 'api=VELA.Entry.Request&version=1&method=request&mode=%s&compound=%s' "$2" "$(url_encode "[$list]")" >"$1"
}
# post_form BODY ANSWER: one POST of the form in file BODY to the entry;
# curl's time_total in milliseconds goes to T, the answer into file ANSWER.
post_form() {
    local out
    out=$(curl -sS -o "$2" -w '%{http_code} %{time_total}' "${COOKIE_ARGS[@]}" \
        -H 'Content-Type: application/x-www-form-urlencoded' --data-binary "@$1" "$BASE/webapi/entry.cgi") ||
        die "curl failed on a compound request"
    if [ "${out%% *}" != 200 ]; then
        head -c 600 "$2" >&2
        die "HTTP ${out%% *} for a compound request"
    fi
    T=$(awk -v s="${out#* }" 'BEGIN { printf "%.3f", s * 1000 }')
}
# get_each N URL: N GETs of URL one after the other on one keep-alive
# connection; the sum of their time_total in milliseconds goes to T, the
# answers into $work/answer-get-1 ... N, each checked for success.
get_each() {
    local n=$1 url=$2 i out
    local -a args=()
    for ((i = 1; i <= n; i++)); do
        args+=(-o "$work/answer-get-$i" "$url")
    done
    out=$(curl -sS -w '%{http_code} %{time_total}\n' "${COOKIE_ARGS[@]}" "${args[@]}") ||
        die "curl failed on the separate requests"
    T=$(printf '%s\n' "$out" | awk -v n="$n" '$1 == 200 { ok++; t += $2 } END { if (ok != n) exit 1; printf "%.3f", t * 1000 }') || {
        printf '%s\n' "$out" >&2
        die "a separate request did not answer 200"
    }
    for ((i = 1; i <= n; i++)); do
        grep -q '"success":true' "$work/answer-get-$i" || {
            head -c 600 "$work/answer-get-$i" >&2
            die "a separate request failed"
        }
    done
}
# compound_ok ANSWER N: the compound answered success, no call failed, and
# all N calls succeeded.
compound_ok() {
    grep -q '"has_fail":false' "$1" && [ "$(grep -o '"success":true' "$1" | wc -l)" = $(($2 + 1)) ] && return 0
    head -c 600 "$1" >&2
    echo >&2
    return 1
}
smallest() { tr ' ' '\n' | grep . | sort -g | head -1; }
ms() { awk -v t="$1" 'BEGIN { printf "%.1f", t }'; }
# spread VALUES: "median (smallest .. largest)" of milliseconds.
spread() { printf '%7.1f ms (%s .. %s)' "$(echo "$1" | median)" "$(ms "$(echo "$1" | smallest)")" "$(ms "$(echo "$1" | largest)")"; }
faster() { awk -v a="$1" -v b="$2" 'BEGIN { if (b <= 0) print "n/a"; else printf "%.2fx", a / b }'; }
goal_speedup() { at_least "$(awk -v a="$1" -v b="$2" 'BEGIN { if (b > 0) print a / b; else print 0 }')" "$SPEEDUP_GOAL"; }

# ---- the process tree of one request, run again outside lighttpd

# Records, through a wrapper lighttpd runs instead of velascgi, the
# environment and the body of one request, to run velascgi again with them.
CAPTURE_CGI=$work/bin/velascgi-capture
make_capture_wrapper() {
    mkdir -p "$work/capture"
    cat >"$CAPTURE_CGI" <<EOF
#!/bin/sh
env -0 >'$work/capture/env' && cat >'$work/capture/body' || exit 1
exec '$VELASCGI' <'$work/capture/body'
EOF
    chmod 755 "$CAPTURE_CGI"
}
# capture NAME CURL-ARGS...: the request of CURL-ARGS through the wrapper,
# kept as $work/cap-NAME/{env,body}.
capture() {
    local name=$1
    shift
    rm -f "$work/capture/env" "$work/capture/body"
    curl -sS -o "$work/capture/answer" "${COOKIE_ARGS[@]}" "$@" || die "curl failed while recording a request"
    grep -q '"success":true' "$work/capture/answer" || {
        head -c 600 "$work/capture/answer" >&2
        die "the recorded request $name failed"
    }
    mkdir -p "$work/cap-$name" && cp "$work/capture/env" "$work/capture/body" "$work/cap-$name/" ||
        die "the wrapper recorded nothing"
}
# capture_all: records the requests whose process trees are measured: one
# echo, and the compounds whose form bodies are in $work/body-NAME.
capture_all() {
    make_capture_wrapper
    serve cgi "$CAPTURE_CGI" 0
    capture separate "$BASE/webapi/entry.cgi?$ECHO_QUERY"
    local m
    for m in sequential parallel empty inprocess; do
        capture "$m" -H 'Content-Type: application/x-www-form-urlencoded' --data-binary "@$work/body-$m" "$BASE/webapi/entry.cgi"
    done
    serve cgi "$VELASCGI" 0
}
# replay_env CAPTURE: the recorded environment into REPLAY_ENV, as lighttpd
# gave it to velascgi.
REPLAY_ENV=()
replay_env() {
    local e
    local -a envs
    mapfile -d '' envs <"$1/env"
    REPLAY_ENV=()
    for e in "${envs[@]}"; do
        case $e in
        PWD=*) ;; # added by the wrapper's shell
        SCRIPT_FILENAME=*) REPLAY_ENV+=("SCRIPT_FILENAME=$VELASCGI") ;;
        *) REPLAY_ENV+=("$e") ;;
        esac
    done
}

# ---- CPU time of a process tree

# cpu_tree CAPTURE PROGRAM: "milliseconds page-faults" of CPU time
# (task-clock) and page faults of PROGRAM, run with the environment and body
# recorded in CAPTURE, and of every process it forks, detached ones
# included (perf counts every descendant). It runs under a chain of bash,
# env and cat that ends only when the last process holding its standard
# error has ended (a compound's children point only their standard input
# and output at /dev/null); the chain's own cost is measured with /bin/true
# as PROGRAM.
cpu_tree() {
    replay_env "$1"
    perf stat -x, -o "$work/perf-stat.txt" -e task-clock,page-faults -- \
        bash -c '"$@" <"$0" 2>&1 >/dev/null | cat >/dev/null' "$1/body" env -i "${REPLAY_ENV[@]}" "$2" ||
        die "perf stat failed"
    awk -F, '$3 ~ /^task-clock/ { t = $1 } $3 ~ /^page-faults/ { f = $1 } END { printf "%.3f %d\n", t, f }' \
        "$work/perf-stat.txt"
}
# cpu_median CAPTURE PROGRAM RUNS: medians of cpu_tree over RUNS runs.
cpu_median() {
    local i t f all_t="" all_f=""
    for ((i = 0; i < $3; i++)); do
        read -r t f <<<"$(cpu_tree "$1" "$2")"
        all_t+="$t "
        all_f+="$f "
    done
    echo "$(echo "$all_t" | median) $(echo "$all_f" | median)"
}
# sub A B [N]: (A - B) / N with two decimals.
sub() { awk -v a="$1" -v b="$2" -v n="${3:-1}" 'BEGIN { printf "%.2f", (a - b) / n }'; }

compound_cpu() {
    local runs=11 m
    local -a chain
    local -A t=() f=()
    read -r -a chain <<<"$(cpu_median "$work/cap-separate" /bin/true "$runs")"
    for m in separate sequential parallel empty inprocess; do
        read -r "t[$m]" "f[$m]" <<<"$(cpu_median "$work/cap-$m" "$VELASCGI" "$runs")"
        t[$m]=$(sub "${t[$m]}" "${chain[0]}")
        f[$m]=$(sub "${f[$m]}" "${chain[1]}")
    done
    echo "CPU time (perf stat: task-clock and page faults of the whole process tree, user and kernel, median of $runs runs;"
    echo "velascgi run directly as for the instructions below, less the launching chain: ${chain[0]} ms, ${chain[1]} faults):"
    printf '  %-34s %7.2f ms CPU %6.0f page faults\n' "one separate request" "${t[separate]}" "${f[separate]}"
    for m in sequential parallel empty inprocess; do
        printf '  %-34s %7.2f ms CPU %6.0f page faults\n' "$(compound_label "$m")" "${t[$m]}" "${f[$m]}"
    done
    printf '  %-34s %7s ms CPU %6s page faults (sequential; in-process: %s ms, %s faults)\n' "a forked call adds" \
        "$(sub "${t[sequential]}" "${t[empty]}" "$CALLS")" "$(sub "${f[sequential]}" "${f[empty]}" "$CALLS")" \
        "$(sub "${t[inprocess]}" "${t[empty]}" "$CALLS")" "$(sub "${f[inprocess]}" "${f[empty]}" "$CALLS")"
}
compound_label() {
    case $1 in
    sequential | parallel) echo "compound, $1" ;;
    empty) echo "compound of no call" ;;
    inprocess) echo "compound of $CALLS in-process calls" ;;
    esac
}

# ---- instructions of a process tree

# callgrind_run DIR CAPTURE: velascgi run directly with the environment and
# body recorded in CAPTURE, under callgrind with every process it forks. The
# counts are dumped and zeroed before each fork, so a child counts only its
# own instructions. The run is over when every process has ended (as for
# cpu_tree).
callgrind_run() {
    local dir=$1 cap=$2 program=${3:-$VELASCGI}
    mkdir -p "$dir"
    replay_env "$cap"
    CG_RUNS=$((CG_RUNS + 1))
    env -i "${REPLAY_ENV[@]}" "$VALGRIND" --tool=callgrind --trace-children=yes --dump-before='*fork*' \
        --log-file="$dir/valgrind.%p" --callgrind-out-file="$dir/callgrind.out.%p" "$program" \
        <"$cap/body" 2>&1 >"$dir/answer.$CG_RUNS" | cat >>"$dir/stderr"
    grep -q '"success":true' "$dir/answer.$CG_RUNS" || {
        head -c 600 "$dir/answer.$CG_RUNS" >&2
        tail -n 20 "$dir/stderr" "$dir"/valgrind.* >&2
        die "${program##*/} under callgrind did not succeed"
    }
}
CG_RUNS=0
# callgrind_procs DIR: one line "pid level instructions" for every process
# of DIR, its level in the process tree from the parent pids valgrind
# logged: 0 for a velascgi run, 1 for its children (the intermediate child
# of a detached fork), 2 for theirs (the workers), capped at 2.
callgrind_procs() {
    local dir=$1 f pid
    {
        for f in "$dir"/valgrind.*; do
            echo "P ${f##*.} $(sed -n 's/^==[0-9]*== Parent PID: //p' "$f")"
        done
        for f in "$dir"/callgrind.out.*; do
            pid=${f#"$dir"/callgrind.out.}
            echo "I ${pid%%.*} $(sed -n 's/^totals: *//p' "$f")"
        done
    } | awk '
        $1 == "P" { parent[$2] = $3 }
        $1 == "I" { if ($3 == "") bad = 1; ins[$2] += $3 }
        function level(p) { return (parent[p] in parent) ? 1 + level(parent[p]) : 0 }
        END {
            if (bad) exit 1
            for (p in parent) { l = level(p); print p, (l > 2 ? 2 : l), ins[p] + 0 }
        }' || die "a callgrind output of $dir is incomplete"
}
# callgrind_tree DIR: "total processes requests instr intermediates instr
# workers instr" of the processes of DIR.
callgrind_tree() {
    callgrind_procs "$1" | awk '
        { n[$2]++; i[$2] += $3; t += $3; np++ }
        END { printf "%d %d %d %d %d %d %d %d\n", t, np, n[0], i[0], n[1], i[1], n[2], i[2] }'
}
# callgrind_workers DIR: what a worker of DIR spends its instructions on, as
# the mean over the workers of the inclusive cost of a few functions:
#   "workers permission-check symbol-binding dlopen answer"
# The figures overlap: symbols are bound lazily inside the others.
callgrind_workers() {
    local dir=$1 pid level n f
    callgrind_procs "$dir" | while read -r pid level n; do
        [ "$level" = 2 ] || continue
        for f in "$dir/callgrind.out.$pid" "$dir/callgrind.out.$pid".*; do
            [ -f "$f" ] || continue
            callgrind_annotate --inclusive=yes --threshold=100 "$f" 2>/dev/null | awk -v pid="$pid" '
                function num(s) { gsub(",", "", s); return s + 0 }
                function keep(k) { v = num($1); if (v > m[k]) m[k] = v }
                index($0, "PermissionCheck::CheckPermission(VELA::APIRequest*") { keep("perm") }
                index($0, ":_dl_runtime_resolve") { keep("bind") }
                index($0, ":dlopen@@") { keep("dlopen") }
                index($0, "Pipe::WriteJson(") { keep("answer") }
                END { print pid, m["perm"] + 0, m["bind"] + 0, m["dlopen"] + 0, m["answer"] + 0 }'
        done
    done | awk '
        { w[$1] = 1; p += $2; b += $3; d += $4; a += $5 }
        END { n = length(w); if (n == 0) n = 1; printf "%d %d %d %d %d\n", length(w), p / n, b / n, d / n, a / n }'
}
# M: instructions in millions.
mi() { awk -v n="$1" 'BEGIN { if (n < 100000) printf "%.1f k", n / 1e3; else printf "%.2f M", n / 1e6 }'; }

compound_instructions() {
    local m
    echo "instructions (callgrind over the whole velascgi process tree, children counted; velascgi run directly"
    echo "with the environment and body lighttpd gave it for the same request, recorded through a wrapper):"
    local i
    for ((i = 0; i < CALLS; i++)); do
        callgrind_run "$work/cg-separate" "$work/cap-separate"
    done
    for m in sequential parallel empty inprocess; do
        callgrind_run "$work/cg-$m" "$work/cap-$m"
    done
    local -a sep empty inproc tree w
    read -r -a sep <<<"$(callgrind_tree "$work/cg-separate")"
    read -r -a empty <<<"$(callgrind_tree "$work/cg-empty")"
    read -r -a inproc <<<"$(callgrind_tree "$work/cg-inprocess")"
    printf '  %-34s %10s in %2d processes, %s a request\n' "$CALLS separate requests" "$(mi "${sep[0]}")" "${sep[1]}" \
        "$(mi $((sep[0] / sep[1])))"
    for m in sequential parallel; do
        read -r -a tree <<<"$(callgrind_tree "$work/cg-$m")"
        printf '  %-34s %10s in %2d processes, %s fewer (goal >= %sx: %s)\n' "compound, $m" "$(mi "${tree[0]}")" \
            "${tree[1]}" "$(faster "${sep[0]}" "${tree[0]}")" "$SPEEDUP_GOAL" "$(goal_speedup "${sep[0]}" "${tree[0]}")"
    done
    printf '  %-34s %10s in %2d process, %s fewer\n' "compound of $CALLS in-process calls" "$(mi "${inproc[0]}")" \
        "${inproc[1]}" "$(faster "${sep[0]}" "${inproc[0]}")"
    echo "where the instructions go:"
    printf '  %-34s %10s\n' "compound of no call" "$(mi "${empty[0]}")"
    printf '  %-34s %10s a call\n' "an in-process call" "$(mi $(((inproc[0] - empty[0]) / CALLS)))"
    for m in sequential parallel; do
        read -r -a tree <<<"$(callgrind_tree "$work/cg-$m")"
        printf '  %-34s %10s a call: request process %s, intermediate child %s, worker %s\n' "a forked call, $m" \
            "$(mi $(((tree[0] - empty[0]) / CALLS)))" "$(mi $(((tree[3] - empty[0]) / CALLS)))" \
            "$(mi $((tree[4] > 0 ? tree[5] / tree[4] : 0)))" "$(mi $((tree[6] > 0 ? tree[7] / tree[6] : 0)))"
        if command -v callgrind_annotate >/dev/null; then
            read -r -a w <<<"$(callgrind_workers "$work/cg-$m")"
            printf '  %-34s permission check %s, lazy symbol binding %s, dlopen %s, answer into the pipe %s\n' \
                "  a worker, inclusive costs:" "$(mi "${w[1]}")" "$(mi "${w[2]}")" "$(mi "${w[3]}")" "$(mi "${w[4]}")"
        fi
    done
    echo "  (the worker's figures overlap: symbols are bound lazily inside the others)"
}

bench_compound() {
    [ -f "$COMPOUND_LIB" ] && [ -x "$FORK_COST" ] || die "the compound benchmark's programs are not built in $build"
    serve cgi "$VELASCGI" 0
    prepare_login || die "the echo call does not succeed: set BENCH_ECHO_QUERY"
    local echo_url="$BASE/webapi/entry.cgi?$ECHO_QUERY" call inproc rest
    call=$(query_json "$ECHO_QUERY") || die "BENCH_ECHO_QUERY holds a control character"
    # The in-process echo gets the same parameters.
    rest=$(printf '%s\n' "$ECHO_QUERY" | tr '&' '\n' | grep -v -E '^(api|version|method)(=|$)' | paste -sd '&')
    inproc=$(query_json "api=VELA.Bench.Compound&version=1&method=echo&$rest") || die "BENCH_ECHO_QUERY holds a control character"
    compound_form "$work/body-sequential" sequential "$call" "$CALLS"
    compound_form "$work/body-parallel" parallel "$call" "$CALLS"
    compound_form "$work/body-empty" sequential "$call" 0
    compound_form "$work/body-inprocess" sequential "$inproc" "$CALLS"
    echo "== compound of $CALLS echo calls in one request vs $CALLS separate requests =="
    echo "one call: $call; $LOGIN_NOTE"
    echo "compounds are POST forms to VELA.Entry.Request, the separate requests GETs on one keep-alive connection"
    post_form "$work/body-sequential" "$work/answer-sequential"
    compound_ok "$work/answer-sequential" "$CALLS" || die "the compound of echo calls failed"
    echo "compound answer: $(head -c 240 "$work/answer-sequential")..."

    # Warm-up: page cache, libraries, description files.
    local m r
    get_each "$CALLS" "$echo_url"
    for m in sequential parallel empty inprocess; do
        post_form "$work/body-$m" "$work/answer-$m"
    done
    local -A times=()
    for r in $(seq 1 "$CROUNDS"); do
        for m in $(printf '%s\n' separate sequential parallel empty inprocess | shuf); do
            if [ "$m" = separate ]; then
                get_each "$CALLS" "$echo_url"
            else
                post_form "$work/body-$m" "$work/answer-$m"
                compound_ok "$work/answer-$m" "$([ "$m" = empty ] && echo 0 || echo "$CALLS")" || die "the $m compound failed"
            fi
            times[$m]+="$T "
        done
    done
    local sep seq par empty inproc_t
    sep=$(echo "${times[separate]}" | median)
    seq=$(echo "${times[sequential]}" | median)
    par=$(echo "${times[parallel]}" | median)
    empty=$(echo "${times[empty]}" | median)
    inproc_t=$(echo "${times[inprocess]}" | median)
    echo "wall time (curl's time_total), median (fastest .. slowest) of $CROUNDS rounds, each in a shuffled order;"
    echo "the machine is shared (load average $(loadavg)), so single rounds scatter:"
    printf '  %-34s %s   %s ms a request\n' "$CALLS separate requests" "$(spread "${times[separate]}")" \
        "$(awk -v t="$sep" -v n="$CALLS" 'BEGIN { printf "%.2f", t / n }')"
    for m in sequential parallel; do
        local t=$seq
        [ "$m" = parallel ] && t=$par
        printf '  %-34s %s   %s faster (goal >= %sx: %s)\n' "compound, $m" "$(spread "${times[$m]}")" \
            "$(faster "$sep" "$t")" "$SPEEDUP_GOAL" "$(goal_speedup "$sep" "$t")"
    done
    echo "where the time goes (medians):"
    printf '  %-34s %s   the request and the entry API alone (no call: no session check)\n' "compound of no call" "$(spread "${times[empty]}")"
    printf '  %-34s %s   %s ms a call, %s faster than the separate requests:\n' \
        "compound of $CALLS in-process calls" "$(spread "${times[inprocess]}")" \
        "$(awk -v a="$inproc_t" -v b="$empty" -v n="$CALLS" 'BEGIN { printf "%.2f", (a - b) / n }')" \
        "$(faster "$sep" "$inproc_t")"
    printf '  %-34s the echo of VELA.Bench.Compound, "grantable": a sequential compound runs it in process\n' ""
    printf '  %-34s %s ms sequential, %s ms parallel (each compound less the compound of no call, / %d)\n' \
        "a forked call adds" \
        "$(awk -v a="$seq" -v b="$empty" -v n="$CALLS" 'BEGIN { printf "%.2f", (a - b) / n }')" \
        "$(awk -v a="$par" -v b="$empty" -v n="$CALLS" 'BEGIN { printf "%.2f", (a - b) / n }')" "$CALLS"
    local forks
    forks=$("$FORK_COST" -n 200 "$ROOT/usr/vela/velaman/webapi/sample/libvela-sample.so" "$COMPOUND_LIB") ||
        die "vela-bench-fork-cost failed"
    printf '  %-34s %s\n' "the forks alone, median of 200" \
        "$(printf '%s\n' "$forks" | awk '{ printf "%s%s %.0f us", sep, $1, $2; sep = ", " }')"
    echo "  (vela-bench-fork-cost: fork and wait; fork, a byte through a pipe, wait; the detached fork of a compound's"
    echo "  children, a double fork, and a byte from the worker; in a process holding velascgi's libraries)"

    local perf=0 valgrind=0
    command -v perf >/dev/null && perf stat -e task-clock,page-faults -o /dev/null true 2>/dev/null && perf=1
    [ "${BENCH_CALLGRIND:-1}" = 1 ] && VALGRIND=$(command -v valgrind) && valgrind=1
    [ "$perf" = 1 ] || [ "$valgrind" = 1 ] && capture_all
    if [ "$perf" = 1 ]; then
        compound_cpu
    else
        echo "CPU time: perf is not installed or may not count here"
    fi
    if [ "${BENCH_CALLGRIND:-1}" != 1 ]; then
        echo "instructions: left out (BENCH_CALLGRIND=${BENCH_CALLGRIND:-})"
    elif [ "$valgrind" = 0 ]; then
        echo "instructions: valgrind is not installed"
    else
        compound_instructions
    fi
    bench_compound_sleep
}

bench_compound_sleep() {
    serve cgi "$VELASCGI" 0
    local url="$BASE/webapi/entry.cgi?api=VELA.Bench.Compound&version=1&method=sleep&ms=$SLEEP_MS"
    local call="{\"api\":\"VELA.Bench.Compound\",\"version\":1,\"method\":\"sleep\",\"ms\":$SLEEP_MS}"
    compound_form "$work/body-sleep-sequential" sequential "$call" "$CALLS"
    compound_form "$work/body-sleep-parallel" parallel "$call" "$CALLS"
    echo "== $CALLS calls that each sleep $SLEEP_MS ms: one parallel compound vs one sequential compound vs one call =="
    echo "one call: $call (VELA.Bench.Compound, forked in both modes); curl's time_total, $SROUNDS rounds in a shuffled order"
    local r m
    local -A times=()
    for r in $(seq 1 "$SROUNDS"); do
        for m in $(printf '%s\n' single sequential parallel | shuf); do
            if [ "$m" = single ]; then
                get_each 1 "$url"
            else
                post_form "$work/body-sleep-$m" "$work/answer-sleep-$m"
                compound_ok "$work/answer-sleep-$m" "$CALLS" || die "the $m compound of sleeping calls failed"
            fi
            times[$m]+="$T "
        done
        printf 'round %d: one call %7.1f ms   sequential compound %7.1f ms   parallel compound %7.1f ms\n' "$r" \
            "$(echo "${times[single]}" | awk '{ print $NF }')" "$(echo "${times[sequential]}" | awk '{ print $NF }')" \
            "$(echo "${times[parallel]}" | awk '{ print $NF }')"
    done
    local par
    par=$(echo "${times[parallel]}" | median)
    printf 'median:  one call %.1f ms   sequential compound %.1f ms   parallel compound %.1f ms (goal < %d ms: %s; slowest round %s ms)\n' \
        "$(echo "${times[single]}" | median)" "$(echo "${times[sequential]}" | median)" "$par" "$SLEEP_GOAL_MS" \
        "$(awk -v t="$par" -v g="$SLEEP_GOAL_MS" 'BEGIN { print (t + 0 < g + 0) ? "met" : "MISSED" }')" \
        "$(ms "$(echo "${times[parallel]}" | largest)")"
    echo "parallel answer: $(head -c 200 "$work/answer-sleep-parallel")..."
}

# ---- baselines alone -------------------------------------------------------------

# Without velascgi: the baselines, to see the script and the machine work.
bench_baselines_only() {
    serve cgi "$MINIMAL" 0
    echo "velascgi or the staged web-API directory is missing in $build: baselines only"
    echo "baseline answer: $(curl -s "$BASE/bench/minimal.cgi?$ECHO_QUERY")"
    echo "baseline: $(wrk_rps "$BASE/bench/minimal.cgi?$ECHO_QUERY") req/s (wrk -t$THREADS -c$CONNS -d${DURATION}s)"
    make_data
    timed cat "$DATA" >"$VOLUME/cat-copy.bin"
    echo "cat into a file: $(mbps "$BYTES" "$T") MB/s"
    rm -f "$VOLUME/cat-copy.bin"
    timed cat "$DATA" >/dev/null
    echo "cat into /dev/null: $(mbps "$BYTES" "$T") MB/s"
    timed curl -sS -o /dev/null -H 'Expect:' -F "file=@$DATA" "$BASE/bench/cat_upload.sh"
    echo "upload to a shell CGI cat: $(mbps "$BYTES" "$T") MB/s"
    rm -f "$work/cgi-upload.out"
    timed curl -sS -o /dev/null "$BASE/bench/cat_download.sh"
    echo "download from a shell CGI cat: $(mbps "$BYTES" "$T") MB/s"
}

# ---- main ------------------------------------------------------------------------

# Other work on the machine skews every figure: the load is printed with them.
loadavg() { cut -d' ' -f1-3 /proc/loadavg; }
trap 'echo "load average at the end: $(loadavg)"; cleanup' EXIT
echo "web-entry benchmarks: $(nproc) CPUs (load average $(loadavg)), lighttpd $(lighttpd -v 2>/dev/null | sed -n 's/^lighttpd\/\([^ ]*\).*/\1/p'), files on $(df -P "$work" | awk 'NR == 2 { print $1 }'), $SIZE_MB MiB transfers"
echo "$RUN_NOTE; $SYSLOG_NOTE"
if [ "$have_velascgi" = 0 ]; then
    bench_baselines_only
    exit 0
fi
for part in $PARTS; do
    case $part in
    rps) bench_rps ;;
    upload) bench_upload ;;
    download)
        bench_download 0
        if [ "${BENCH_XSENDFILE:-0}" = 1 ]; then
            bench_download 1
        fi
        ;;
    compound) bench_compound ;;
    *) die "unknown part $part" ;;
    esac
done
