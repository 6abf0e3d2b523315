#!/usr/bin/env bash
# Writes a lighttpd configuration from deploy/lighttpd.conf.in.
#
#   lighttpd-conf.sh --out FILE --port N --run DIR --pidfile FILE --docroot DIR
#                    --velascgi PATH [--bind ADDR] [--env NAME=VALUE]... [--xsendfile-dir DIR]...
#                    [--errors DIR] [--front-end cgi|fcgi] [--velafcgi PATH]
#
# --front-end chooses who serves the web API: fcgi (velafcgi, the FastCGI
# server lighttpd starts; --velafcgi names it, default: velafcgi beside
# velascgi) or cgi (velascgi run for every request). Default: the
# environment's VELA_FRONT_END, else fcgi.
# --env adds a variable to the environment of the front end (VELA_ROOT, ...).
# --xsendfile-dir allows X-Sendfile answers for files under DIR; without any,
# X-Sendfile is off. --errors names the folder of the JSON error answers
# (default deploy/errors). The run directory gets the upload buffer directory; the
# configuration is checked with lighttpd -tt before it replaces FILE.
set -euo pipefail

repo="$(cd "$(dirname "$0")/.." && pwd)"
template="$repo/deploy/lighttpd.conf.in"
out="" port="" run="" pidfile="" docroot="" velascgi="" velafcgi="" bind="127.0.0.1" errors="$repo/deploy/errors"
front="${VELA_FRONT_END:-fcgi}"
envs=() sendfile_dirs=()

die() { echo "lighttpd-conf.sh: $*" >&2; exit 1; }
. "$repo/scripts/conf-common.sh"

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
    --front-end) front="$2" ;;
    --velafcgi) velafcgi="$2" ;;
    *) die "unknown option $1" ;;
  esac
  shift 2
done
[ -n "$out" ] && [ -n "$port" ] && [ -n "$run" ] && [ -n "$pidfile" ] && [ -n "$docroot" ] && [ -n "$velascgi" ] ||
  die "--out, --port, --run, --pidfile, --docroot and --velascgi are required"
conf_port "$port"
conf_absolute "$run" "$pidfile" "$docroot" "$velascgi" "$errors"
[ -x "$velascgi" ] || die "$velascgi is not an executable"
case "$front" in
  cgi) module=mod_cgi ;;
  fcgi)
    module=mod_fastcgi
    [ -n "$velafcgi" ] || velafcgi="$(dirname "$velascgi")/velafcgi"
    conf_absolute "$velafcgi"
    [ -x "$velafcgi" ] || die "$velafcgi is not an executable"
    # lighttpd splits the program's command line at spaces.
    case "$velafcgi$run" in *[[:space:]]*) die "the paths of velafcgi and the run directory may not hold spaces" ;; esac
    ;;
  *) die "--front-end takes cgi or fcgi, not \"$front\"" ;;
esac

# Every text goes into a lighttpd string literal as it is: refuse the
# characters that would end or escape it.
plain() {
  case "$1" in
    *[\"\\]* | *[[:cntrl:]]*) die "\"$1\" holds a quote, a backslash or a control character" ;;
  esac
}
quote() { plain "$1"; printf '"%s"' "$1"; }

for p in "$run" "$pidfile" "$docroot" "$velascgi" "$velafcgi" "$bind" "$errors"; do
  plain "$p"
done

cgi_env=""
for e in "${envs[@]+"${envs[@]}"}"; do
  conf_env_name "$e"
  cgi_env+="$(quote "${e%%=*}") => $(quote "${e#*=}"), "
done
xsendfile="disable" xsendfile_docroot=""
for d in "${sendfile_dirs[@]+"${sendfile_dirs[@]}"}"; do
  conf_absolute "$d"
  xsendfile="enable"
  xsendfile_docroot+="$(quote "$d"), "
done

mkdir -p "$run/upload"
chmod 0700 "$run/upload"
tmp="$(mktemp "$out.XXXXXX")"
trap 'rm -f "$tmp"' EXIT
# The template with the front end's block in place of @ENTRY@.
expanded() { conf_expand "$template" cat "$repo/deploy/entry-$front.conf.in"; }
while IFS= read -r line || [ -n "$line" ]; do
  # Text inside quotes of the template takes the raw value; the lists take
  # entries already quoted.
  line="${line//@BIND@/"$bind"}"
  line="${line//@PORT@/"$port"}"
  line="${line//@PID_FILE@/"$pidfile"}"
  line="${line//@RUN_DIR@/"$run"}"
  line="${line//@DOCROOT@/"$docroot"}"
  line="${line//@VELASCGI@/"$velascgi"}"
  line="${line//@VELAFCGI@/"$velafcgi"}"
  line="${line//@ENTRY_MODULE@/"$module"}"
  line="${line//@CGI_ENV@/"$cgi_env"}"
  line="${line//@XSENDFILE_DOCROOT@/"$xsendfile_docroot"}"
  line="${line//@XSENDFILE@/"$xsendfile"}"
  line="${line//@ERRORS_DIR@/"$errors"}"
  printf '%s\n' "$line"
done < <(expanded) >"$tmp"
if ! lighttpd -tt -f "$tmp" >/dev/null 2>"$tmp.err"; then
  cat "$tmp.err" >&2
  rm -f "$tmp.err"
  die "lighttpd refuses the configuration"
fi
rm -f "$tmp.err"
mv "$tmp" "$out"
trap - EXIT
