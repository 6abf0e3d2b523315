#!/usr/bin/env bash
# Writes a lighttpd configuration from deploy/lighttpd.conf.in.
#
#   lighttpd-conf.sh --out FILE --port N --run DIR --pidfile FILE --docroot DIR
#                    --velascgi PATH [--bind ADDR] [--env NAME=VALUE]... [--xsendfile-dir DIR]...
#                    [--errors DIR]
#
# --env adds a variable to the environment of velascgi (VELA_ROOT, ...).
# --xsendfile-dir allows X-Sendfile answers for files under DIR; without any,
# X-Sendfile is off. --errors names the folder of the JSON error answers
# (default deploy/errors). The run directory gets the upload buffer directory; the
# configuration is checked with lighttpd -tt before it replaces FILE.
set -euo pipefail

repo="$(cd "$(dirname "$0")/.." && pwd)"
template="$repo/deploy/lighttpd.conf.in"
out="" port="" run="" pidfile="" docroot="" velascgi="" bind="127.0.0.1" errors="$repo/deploy/errors"
envs=() sendfile_dirs=()

die() { echo "lighttpd-conf.sh: $*" >&2; exit 1; }

while [ $# -gt 0 ]; do
  [ $# -ge 2 ] || die "$1 needs a value"
  case "$1" in
    --out) out="$2" ;;
    --port) port="$2" ;;
    --run) run="$2" ;;
    --pidfile) pidfile="$2" ;;
    --docroot) docroot="$2" ;;
    --velascgi) velascgi="$2" ;;
    --bind) bind="$2" ;;
    --env) envs+=("$2") ;;
    --xsendfile-dir) sendfile_dirs+=("$2") ;;
    --errors) errors="$2" ;;
    *) die "unknown option $1" ;;
  esac
  shift 2
done
[ -n "$out" ] && [ -n "$port" ] && [ -n "$run" ] && [ -n "$pidfile" ] && [ -n "$docroot" ] && [ -n "$velascgi" ] ||
  die "--out, --port, --run, --pidfile, --docroot and --velascgi are required"
case "$port" in
  '' | *[!0-9]*) die "port \"$port\" is not a number" ;;
esac
[ "$port" -ge 1 ] && [ "$port" -le 65535 ] || die "port $port out of range"
for p in "$run" "$pidfile" "$docroot" "$velascgi" "$errors"; do
  case "$p" in /*) ;; *) die "\"$p\" is not an absolute path" ;; esac
done
[ -x "$velascgi" ] || die "$velascgi is not an executable"

# Every text goes into a lighttpd string literal as it is: refuse the
# characters that would end or escape it.
plain() {
  case "$1" in
    *[\"\\]* | *[[:cntrl:]]*) die "\"$1\" holds a quote, a backslash or a control character" ;;
  esac
}
quote() { plain "$1"; printf '"%s"' "$1"; }

for p in "$run" "$pidfile" "$docroot" "$velascgi" "$bind" "$errors"; do
  plain "$p"
done

cgi_env=""
for e in "${envs[@]+"${envs[@]}"}"; do
  name="${e%%=*}"
  [ "$name" != "$e" ] && [[ "$name" =~ ^[A-Za-z_][A-Za-z0-9_]*$ ]] || die "bad --env \"$e\""
  cgi_env+="$(quote "$name") => $(quote "${e#*=}"), "
done
xsendfile="disable" xsendfile_docroot=""
for d in "${sendfile_dirs[@]+"${sendfile_dirs[@]}"}"; do
  case "$d" in /*) ;; *) die "X-Sendfile directory \"$d\" is not an absolute path" ;; esac
  xsendfile="enable"
  xsendfile_docroot+="$(quote "$d"), "
done

mkdir -p "$run/upload"
chmod 0700 "$run/upload"
tmp="$(mktemp "$out.XXXXXX")"
trap 'rm -f "$tmp"' EXIT
while IFS= read -r line || [ -n "$line" ]; do
  # Text inside quotes of the template takes the raw value; the lists take
  # entries already quoted.
  line="${line//@BIND@/"$bind"}"
  line="${line//@PORT@/"$port"}"
  line="${line//@PID_FILE@/"$pidfile"}"
  line="${line//@RUN_DIR@/"$run"}"
  line="${line//@DOCROOT@/"$docroot"}"
  line="${line//@VELASCGI@/"$velascgi"}"
  line="${line//@CGI_ENV@/"$cgi_env"}"
  line="${line//@XSENDFILE_DOCROOT@/"$xsendfile_docroot"}"
  line="${line//@XSENDFILE@/"$xsendfile"}"
  line="${line//@ERRORS_DIR@/"$errors"}"
  printf '%s\n' "$line"
done <"$template" >"$tmp"
if ! lighttpd -tt -f "$tmp" >/dev/null 2>"$tmp.err"; then
  cat "$tmp.err" >&2
  rm -f "$tmp.err"
  die "lighttpd refuses the configuration"
fi
rm -f "$tmp.err"
mv "$tmp" "$out"
trap - EXIT
