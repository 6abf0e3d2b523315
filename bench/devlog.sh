# Sourced by the benchmarks that run in a private mount namespace: gives the
# namespace a /dev of its own (the machine's nodes bound again) with a log
# sink listening on /dev/log, so that syslog lines cost what they cost on a
# machine with a log daemon instead of a write to /dev/console each.
#
#   bench_dev_log WORK SINK OUT   WORK: a scratch directory; SINK: the
#                                 vela-bench-log-sink program; OUT: the file
#                                 the lines go to. Sets sink_pid; dies
#                                 (through the caller's die) on failure.
bench_dev_log() {
    local work=$1 sink=$2 out=$3 node name
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
    "$sink" /dev/log "$out" &
    sink_pid=$!
    for _ in $(seq 1 50); do
        [ -S /dev/log ] && break
        sleep 0.1
    done
    [ -S /dev/log ] || die "the log sink did not start"
}
