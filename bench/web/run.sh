#!/usr/bin/env bash
# Web-entry benchmarks: velascgi under lighttpd against baselines measured in
# the same run, on the same server and the same disk.
#
#   rps       requests per second of the sample echo API against a minimal
#             C++ CGI (JsonCpp only) that builds the same answer;
#   upload    a multipart upload through velascgi against cat of the file
#             into a file on the same disk, with velascgi's peak memory;
#   download  a download through velascgi against cat of the file.
#
# usage: bench/web/run.sh [build-dir]          (default: build)
#
# Environment (all optional):
#   BENCH_SIZE_MB=1024        size of the transferred file, MiB
#   BENCH_PARTS="rps upload download"
#   BENCH_DURATION=10 BENCH_ROUNDS=3 BENCH_CONNECTIONS=8 BENCH_THREADS=2
#                             wrk: seconds per run, alternating rounds
#   BENCH_TRANSFER_ROUNDS=3   alternating rounds of each transfer
#   BENCH_DIR=$TMPDIR         where the state root and the big files go
#   BENCH_XSENDFILE=1         also download with X-Sendfile on; velascgi uses
#                             it only when BENCH_DIR and every directory above
#                             it are writable by root alone (not below /tmp),
#                             and streams the file otherwise
#   BENCH_STREAM_REQUEST_BODY, BENCH_STREAM_RESPONSE_BODY
#                             override lighttpd's server.stream-*-body
#   BENCH_LIGHTTPD_EXTRA      lines added to the lighttpd configuration
#   BENCH_ECHO_QUERY, BENCH_UPLOAD_QUERY, BENCH_DOWNLOAD_QUERY
#                             query strings of the sample's methods
#   BENCH_PLAIN=1             no private mount namespace (see below)
#
# The server is the project's own lighttpd configuration, written by
# scripts/lighttpd-conf.sh, plus one block for the baselines under /bench/;
# it runs on a free port of 127.0.0.1 under a temporary state root, and is
# stopped, and every file made here removed, on every way out.
set -u -o pipefail

here=$(cd "$(dirname "$0")" && pwd)
top=$(cd "$here/../.." && pwd)
build=$(cd "${1:-$top/build}" 2>/dev/null && pwd) || {
    echo "run.sh: no build directory ${1:-$top/build}" >&2
    exit 2
}

SIZE_MB=${BENCH_SIZE_MB:-1024}
PARTS=${BENCH_PARTS:-rps upload download}
DURATION=${BENCH_DURATION:-10}
ROUNDS=${BENCH_ROUNDS:-3}
CONNS=${BENCH_CONNECTIONS:-8}
THREADS=${BENCH_THREADS:-2}
XROUNDS=${BENCH_TRANSFER_ROUNDS:-3}
ECHO_QUERY=${BENCH_ECHO_QUERY:-api=VELA.Sample.Echo&version=1&method=echo&text=hello&count=3}
UPLOAD_QUERY=${BENCH_UPLOAD_QUERY:-api=VELA.Sample&version=1&method=upload}
DOWNLOAD_QUERY=${BENCH_DOWNLOAD_QUERY:-api=VELA.Sample&version=1&method=download&name=data.bin}
RECEIVE_QUERY="api=VELA.Bench.Transfer&version=1&method=receive"

VELASCGI=$build/velascgi
VELAADM=$build/velaadm
MINIMAL=$build/bench/web/vela-bench-minimal-cgi
BENCH_LIB=$build/bench/web/libvela-bench-transfer.so
LOG_SINK=$build/bench/web/vela-bench-log-sink
PEAK_RSS=$build/bench/web/vela-bench-peak-rss
STAGE=$build/root

die() {
    echo "run.sh: $*" >&2
    exit 1
}
for tool in lighttpd curl wrk awk ss shuf; do
    command -v "$tool" >/dev/null || die "$tool is not installed (scripts/install-deps.sh)"
done
[ -x "$MINIMAL" ] && [ -x "$LOG_SINK" ] && [ -x "$PEAK_RSS" ] || die "the benchmark programs are not built in $build"
for n in "$SIZE_MB" "$DURATION" "$ROUNDS" "$CONNS" "$THREADS" "$XROUNDS"; do
    case $n in '' | *[!0-9]* | 0) die "sizes, durations and counts must be positive numbers" ;; esac
done
have_velascgi=0
[ -x "$VELASCGI" ] && [ -d "$STAGE/usr/vela/velaman/webapi" ] && [ -f "$BENCH_LIB" ] && have_velascgi=1

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
ROOT=$work/root      # VELA_ROOT of velascgi
DOCROOT=$work/htdocs # static files and the baselines under /bench/
VOLUME=$ROOT/volume1 # the data volume: uploads land in its @tmp
DATA=$VOLUME/sample/data.bin # where the sample's download method finds "data.bin"
BYTES=$((SIZE_MB * 1024 * 1024))

lt_pid=""
sink_pid=""
stop_server() {
    if [ -n "$lt_pid" ]; then
        kill "$lt_pid" 2>/dev/null
        wait "$lt_pid" 2>/dev/null
        lt_pid=""
    fi
}
cleanup() {
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
        # A /dev of this namespace only: the machine's nodes bound again, and
        # a log sink on /dev/log.
        mkdir "$work/dev" && mount --rbind /dev "$work/dev" &&
            mount -t tmpfs -o mode=755,size=1m vela-bench-dev /dev || die "cannot give the namespace its /dev"
        for node in "$work"/dev/*; do
            name=${node##*/}
            if [ -L "$node" ]; then
                cp -P "$node" "/dev/$name"
            elif [ -d "$node" ]; then
                mkdir "/dev/$name" && mount --rbind "$node" "/dev/$name"
            else
                touch "/dev/$name" && mount --bind "$node" "/dev/$name"
            fi || die "cannot bind /dev/$name"
        done
        umount -l "$work/dev"
        "$LOG_SINK" /dev/log "$SYSLOG" &
        sink_pid=$!
        for i in $(seq 1 50); do
            [ -S /dev/log ] && break
            sleep 0.1
        done
        [ -S /dev/log ] || die "the log sink did not start"
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
SERVED=""
# start_server PROGRAM XSENDFILE: one lighttpd on a free port running PROGRAM
# as /webapi/entry.cgi, X-Sendfile allowed (1) or not (0) for the volume.
start_server() {
    local program=$1 xsendfile=$2 try port i conf=$work/lighttpd.conf
    local -a args=(--env "VELA_ROOT=$ROOT")
    [ "$xsendfile" = 1 ] && args+=(--xsendfile-dir "$VOLUME")
    for try in 1 2 3 4 5 6 7 8 9 10; do
        port=$(shuf -i 20000-60999 -n 1)
        [ -z "$(ss -Htln "sport = :$port" 2>/dev/null)" ] || continue
        "$top/scripts/lighttpd-conf.sh" --out "$conf" --port "$port" --run "$work/run" --pidfile "$work/run/lighttpd.pid" \
            --docroot "$DOCROOT" --velascgi "$program" "${args[@]}" || die "cannot write the lighttpd configuration"
        if [ -n "${BENCH_STREAM_REQUEST_BODY:-}" ]; then
            sed -i "s/^server.stream-request-body *=.*/server.stream-request-body = $BENCH_STREAM_REQUEST_BODY/" "$conf"
        fi
        if [ -n "${BENCH_STREAM_RESPONSE_BODY:-}" ]; then
            sed -i "s/^server.stream-response-body *=.*/server.stream-response-body = $BENCH_STREAM_RESPONSE_BODY/" "$conf"
        fi
        if [ -n "${BENCH_LIGHTTPD_EXTRA:-}" ]; then
            printf '\n## Added by BENCH_LIGHTTPD_EXTRA.\n%s\n' "$BENCH_LIGHTTPD_EXTRA" >>"$conf"
        fi
        printf '\n## Benchmark baselines.\n$HTTP["url"] =~ "^/bench/" {\n  cgi.assign = ( ".cgi" => "", ".sh" => "/bin/sh" )\n}\n' >>"$conf"
        lighttpd -tt -f "$conf" >"$work/lighttpd-check.log" 2>&1 || {
            cat "$work/lighttpd-check.log" >&2
            die "lighttpd refuses $conf"
        }
        lighttpd -D -f "$conf" >>"$work/lighttpd-stdout.log" 2>&1 &
        lt_pid=$!
        for i in $(seq 1 100); do
            if ! kill -0 "$lt_pid" 2>/dev/null; then
                wait "$lt_pid" 2>/dev/null
                lt_pid=""
                break
            fi
            if curl -s -o /dev/null "http://127.0.0.1:$port/bench/minimal.cgi"; then
                BASE="http://127.0.0.1:$port"
                SERVED="$program $xsendfile"
                return 0
            fi
            sleep 0.1
        done
        stop_server
    done
    cat "$work/run/error.log" "$work/lighttpd-stdout.log" >&2 2>/dev/null
    die "lighttpd did not start"
}
# serve PROGRAM XSENDFILE: (re)starts the server unless it already runs so.
serve() {
    [ -n "$lt_pid" ] && [ "$SERVED" = "$1 $2" ] && return 0
    stop_server
    start_server "$1" "$2"
}
server_setting() { sed -n "s/^$1 *= *//p" "$work/lighttpd.conf" | head -1; }

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

bench_rps() {
    serve "$VELASCGI" 0
    prepare_login || die "the echo call does not succeed: set BENCH_ECHO_QUERY"
    echo "== requests per second: sample echo through velascgi vs minimal C++ CGI =="
    echo "wrk -t$THREADS -c$CONNS -d${DURATION}s, $ROUNDS alternating rounds; $LOGIN_NOTE"
    local echo_url="$BASE/webapi/entry.cgi?$ECHO_QUERY"
    local base_url="$BASE/bench/minimal.cgi?$ECHO_QUERY"
    echo "velascgi answer: $(curl -s "${COOKIE_ARGS[@]}" "$echo_url")"
    echo "baseline answer: $(curl -s "$base_url")"
    # Warm-up: page cache, libraries, description files.
    wrk_rps "$echo_url" 2 >/dev/null || die "wrk failed on the echo call"
    wrk_rps "$base_url" 2 >/dev/null || die "wrk failed on the baseline"
    local r a b all_a="" all_b=""
    for r in $(seq 1 "$ROUNDS"); do
        a=$(wrk_rps "$echo_url") || die "wrk failed on the echo call"
        b=$(wrk_rps "$base_url") || die "wrk failed on the baseline"
        printf 'round %d: velascgi echo %8.1f req/s   baseline %8.1f req/s\n' "$r" "$a" "$b"
        all_a+="$a "
        all_b+="$b "
    done
    a=$(echo "$all_a" | median)
    b=$(echo "$all_b" | median)
    printf 'median:  velascgi echo %8.1f req/s   baseline %8.1f req/s   ratio %sx (goal >= 0.85x: %s)\n' \
        "$a" "$b" "$(ratio "$a" "$b")" "$(at_least "$(ratio "$a" "$b")" 0.85)"

    serve "$VELASCGI_MEM" 0
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

# ---- upload ------------------------------------------------------------------------

# upload_via QUERY NAME: one upload of the data file through velascgi; its
# wall time goes to T, its peak RSS to PEAK; the first answer is printed.
PEAK=0
upload_via() {
    local query=$1 name=$2 code answer=$work/upload-answer.txt t
    : >"$MEMLOG"
    timed curl -sS -o "$answer" -w '%{http_code}' -H 'Expect:' "${COOKIE_ARGS[@]}" \
        -F "file=@$DATA;type=application/octet-stream" "$BASE/webapi/entry.cgi?$query" >"$work/code" ||
        die "curl upload to $name failed"
    t=$T
    code=$(cat "$work/code")
    if [ "$code" != 200 ] || ! grep -q '"success":true' "$answer"; then
        echo "upload answer of $name (HTTP $code): $(head -c 600 "$answer")" >&2
        die "the upload through velascgi failed"
    fi
    if [[ $ANSWERED != *" $name "* ]]; then
        echo "$name answer: $(head -c 300 "$answer")"
        ANSWERED+=" $name "
    fi
    PEAK=$(peak_kib "$MEMLOG")
    remove_uploads
    sync
    T=$t
}
ANSWERED=" "

bench_upload() {
    make_data
    serve "$VELASCGI_MEM" 0
    prepare_login || true
    echo "== upload of $SIZE_MB MiB: velascgi multipart vs cat into a file on the same disk =="
    echo "lighttpd server.stream-request-body = $(server_setting server.stream-request-body)"
    echo "receive: VELA.Bench.Transfer receive, the framework's upload path and nothing else;"
    echo "sample:  VELA.Sample upload, which reads each stored file again for its cksum"
    local r tc tr ts tsh pr ps all_c="" all_r="" all_s="" all_sh="" peaks=""
    for r in $(seq 1 "$XROUNDS"); do
        sync
        timed cat "$DATA" >"$VOLUME/cat-copy.bin" || die "cat failed"
        tc=$T
        rm -f "$VOLUME/cat-copy.bin"
        sync
        upload_via "$RECEIVE_QUERY" receive
        tr=$T
        pr=$PEAK
        upload_via "$UPLOAD_QUERY" sample
        ts=$T
        ps=$PEAK
        timed curl -sS -o /dev/null -H 'Expect:' -F "file=@$DATA;type=application/octet-stream" \
            "$BASE/bench/cat_upload.sh" || die "curl upload to the shell CGI failed"
        tsh=$T
        rm -f "$work/cgi-upload.out"
        sync

        printf 'round %d: cat %7.1f MB/s   receive %7.1f MB/s (peak RSS %s KiB)   sample %7.1f MB/s (peak RSS %s KiB)   shell CGI cat %7.1f MB/s\n' \
            "$r" "$(mbps "$BYTES" "$tc")" "$(mbps "$BYTES" "$tr")" "$pr" "$(mbps "$BYTES" "$ts")" "$ps" "$(mbps "$BYTES" "$tsh")"
        all_c+="$(mbps "$BYTES" "$tc") "
        all_r+="$(mbps "$BYTES" "$tr") "
        all_s+="$(mbps "$BYTES" "$ts") "
        all_sh+="$(mbps "$BYTES" "$tsh") "
        peaks+="$pr $ps "
    done
    local mc mr ms msh mp
    mc=$(echo "$all_c" | median)
    mr=$(echo "$all_r" | median)
    ms=$(echo "$all_s" | median)
    msh=$(echo "$all_sh" | median)
    mp=$(echo "$peaks" | largest)
    printf 'median:  cat %.1f MB/s   receive %.1f MB/s = %s (goal >= 85%%: %s)   sample %.1f MB/s = %s (%s)\n' \
        "$mc" "$mr" "$(percent "$mr" "$mc")" "$(at_least "$(ratio "$mr" "$mc")" 0.85)" \
        "$ms" "$(percent "$ms" "$mc")" "$(at_least "$(ratio "$ms" "$mc")" 0.85)"
    printf '         shell CGI cat through the same lighttpd %.1f MB/s (receive is %s of it)\n' "$msh" "$(percent "$mr" "$msh")"
    printf 'velascgi peak RSS: %s KiB = %.1f MiB (goal < 16 MiB: %s)\n' "$mp" "$(awk -v k="$mp" 'BEGIN { print k / 1024 }')" \
        "$(awk -v k="$mp" 'BEGIN { print (k < 16384) ? "met" : "MISSED" }')"
}

# ---- download ----------------------------------------------------------------------

bench_download() {
    local xsendfile=$1 label
    make_data
    if [ "$xsendfile" = 1 ]; then
        label="X-Sendfile on: lighttpd sends the file"
        fast_output yes
    else
        label="X-Sendfile off: velascgi streams the file"
        fast_output no
    fi
    serve "$VELASCGI_MEM" "$xsendfile"
    prepare_login || true
    ln -sf "$DATA" "$DOCROOT/bench/static.bin"
    echo "== download of $SIZE_MB MiB: velascgi ($label) vs cat of the file =="
    echo "lighttpd server.stream-response-body = $(server_setting server.stream-response-body)"
    local r meta tc tv ts tt peak all_c="" all_v="" all_s="" all_t="" peaks=""
    for r in $(seq 1 "$XROUNDS"); do
        timed cat "$DATA" >/dev/null || die "cat failed"
        tc=$T

        : >"$MEMLOG"
        timed curl -sS -o /dev/null -w '%{http_code} %{size_download}' "${COOKIE_ARGS[@]}" \
            "$BASE/webapi/entry.cgi?$DOWNLOAD_QUERY" >"$work/meta" || die "curl download failed"
        tv=$T
        meta=$(cat "$work/meta")
        if [ "$meta" != "200 $BYTES" ]; then
            echo "download: HTTP status and size $meta, expected 200 $BYTES; the answer begins:" >&2
            curl -s -i "${COOKIE_ARGS[@]}" -r 0-299 "$BASE/webapi/entry.cgi?$DOWNLOAD_QUERY" | head -c 900 >&2
            die "the download through velascgi failed"
        fi
        peak=$(peak_kib "$MEMLOG")

        timed curl -sS -o /dev/null "$BASE/bench/cat_download.sh" || die "curl download from the shell CGI failed"
        ts=$T
        timed curl -sS -o /dev/null "$BASE/bench/static.bin" || die "curl static download failed"
        tt=$T

        printf 'round %d: velascgi %7.1f MB/s (peak RSS %s KiB)   cat %7.1f MB/s   shell CGI cat %7.1f MB/s   lighttpd static file %7.1f MB/s\n' \
            "$r" "$(mbps "$BYTES" "$tv")" "$peak" "$(mbps "$BYTES" "$tc")" "$(mbps "$BYTES" "$ts")" "$(mbps "$BYTES" "$tt")"
        all_v+="$(mbps "$BYTES" "$tv") "
        all_c+="$(mbps "$BYTES" "$tc") "
        all_s+="$(mbps "$BYTES" "$ts") "
        all_t+="$(mbps "$BYTES" "$tt") "
        peaks+="$peak "
    done
    local mv mc ms mt mp
    mv=$(echo "$all_v" | median)
    mc=$(echo "$all_c" | median)
    ms=$(echo "$all_s" | median)
    mt=$(echo "$all_t" | median)
    mp=$(echo "$peaks" | largest)
    printf 'median:  velascgi %.1f MB/s   cat %.1f MB/s   ratio %s (goal >= 90%%: %s)\n' \
        "$mv" "$mc" "$(percent "$mv" "$mc")" "$(at_least "$(ratio "$mv" "$mc")" 0.90)"
    printf '         shell CGI cat %.1f MB/s (velascgi is %s of it), lighttpd static file %.1f MB/s (%s)\n' \
        "$ms" "$(percent "$mv" "$ms")" "$mt" "$(percent "$mv" "$mt")"
    printf 'velascgi peak RSS: %s KiB\n' "$mp"
}

# ---- baselines alone -------------------------------------------------------------

# Without velascgi: the baselines, to see the script and the machine work.
bench_baselines_only() {
    serve "$MINIMAL" 0
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
    *) die "unknown part $part" ;;
    esac
done
