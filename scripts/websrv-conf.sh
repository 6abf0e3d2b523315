#!/usr/bin/env bash
# Writes a private Apache or nginx configuration of the web-API server from
# deploy/apache/ or deploy/nginx/ (lighttpd: scripts/lighttpd-conf.sh). The
# server then reads nothing of the machine's own configuration:
#   apache2 -f FILE -DFOREGROUND
#   nginx -c FILE -p RUN -e RUN/error.log -g "daemon off;"
#
#   websrv-conf.sh --server apache|nginx --out FILE --port N --run DIR --pidfile FILE
#                  --docroot DIR --velascgi PATH [--socket PATH] [--bind ADDR]
#                  [--user NAME] [--group NAME] [--env NAME=VALUE]...
#                  [--fast-dir DIR]... [--xaccel-prefix /PREFIX] [--errors DIR]
#                  [--front-end cgi|fcgi] [--modules DIR]
#
# --front-end chooses who serves the web API (default: the environment's
# VELA_FRONT_END, else fcgi): fcgi is velafcgi listening on --socket
# (Apache: mod_proxy_fcgi; nginx: fastcgi_pass); cgi is velascgi run for
# every request (Apache: mod_cgid, no socket; nginx: through fcgiwrap
# listening on --socket). Neither server starts velafcgi or fcgiwrap.
# --env adds a variable to velascgi's environment (VELA_ROOT, ...).
# --fast-dir allows fast file output for files under DIR: Apache's
# X-Sendfile (mod_xsendfile), nginx's X-Accel-Redirect to an internal
# location --xaccel-prefix DIR/ (default /vela-files), which must be the
# xaccel_prefix of /etc/vela/webapi.conf. --user/--group: the account of the
# server's processes (default www-data). --modules: Apache's modules
# (default /usr/lib/apache2/modules). The configuration is checked by the
# server before it replaces FILE.
set -euo pipefail

repo="$(cd "$(dirname "$0")/.." && pwd)"
server="" out="" port="" run="" pidfile="" docroot="" velascgi="" socket="" bind="127.0.0.1"
user="www-data" group="" errors="$repo/deploy/errors" prefix="/vela-files" modules="/usr/lib/apache2/modules"
front="${VELA_FRONT_END:-fcgi}"
envs=() fast_dirs=()

die() { echo "websrv-conf.sh: $*" >&2; exit 1; }
. "$repo/scripts/conf-common.sh"

while [ $# -gt 0 ]; do
  [ $# -ge 2 ] || die "$1 needs a value"
  case "$1" in
    --server) server="$2" ;;
    --out) out="$2" ;;
    --port) port="$2" ;;
    --run) run="$2" ;;
    --pidfile) pidfile="$2" ;;
    --docroot) docroot="$2" ;;
    --velascgi) velascgi="$2" ;;
    --socket) socket="$2" ;;
    --bind) bind="$2" ;;
    --user) user="$2" ;;
    --group) group="$2" ;;
    --env) envs+=("$2") ;;
    --fast-dir) fast_dirs+=("$2") ;;
    --xaccel-prefix) prefix="$2" ;;
    --errors) errors="$2" ;;
    --front-end) front="$2" ;;
    --modules) modules="$2" ;;
    *) die "unknown option $1" ;;
  esac
  shift 2
done
case "$server" in
  apache | nginx) ;;
  *) die "--server takes apache or nginx, not \"$server\"" ;;
esac
[ -n "$out" ] && [ -n "$port" ] && [ -n "$run" ] && [ -n "$pidfile" ] && [ -n "$docroot" ] && [ -n "$velascgi" ] ||
  die "--out, --port, --run, --pidfile, --docroot and --velascgi are required"
conf_port "$port"
[ -n "$group" ] || group="$user"
[[ "$user" =~ ^[a-z_][a-z0-9_-]*$ ]] && [[ "$group" =~ ^[a-z_][a-z0-9_-]*$ ]] || die "bad --user or --group"
[[ "$prefix" =~ ^(/[A-Za-z0-9_~-]+)+$ ]] || die "--xaccel-prefix takes /SEGMENT... of letters, digits, _ ~ -"
case "$front" in
  cgi | fcgi) ;;
  *) die "--front-end takes cgi or fcgi, not \"$front\"" ;;
esac
[ "$server/$front" = apache/cgi ] || [ -n "$socket" ] || die "--socket is required for $server with $front"
# Every path goes into a quoted string of the configuration as it is:
# refuse what would end or escape it, or name a variable there.
plain() {
  case "$1" in
    *[\"\\\'\;\$\{\}]* | *[[:cntrl:]]*) die "\"$1\" holds a quote, \\, ;, \$, {, } or a control character" ;;
  esac
}
conf_absolute "$run" "$pidfile" "$docroot" "$velascgi" "$errors" "$modules" ${socket:+"$socket"}
for p in "$run" "$pidfile" "$docroot" "$velascgi" "$errors" "$modules" ${socket:+"$socket"}; do
  plain "$p"
done
plain "$bind"
case "$bind$socket" in *' '*) die "the address and the socket may not hold blanks" ;; esac
[ -x "$velascgi" ] || die "$velascgi is not an executable"

cgi_env=""
for e in "${envs[@]+"${envs[@]}"}"; do
  conf_env_name "$e"
  name="${e%%=*}" value="${e#*=}"
  plain "$value"
  if [ "$server" = apache ]; then
    cgi_env+="    SetEnv $name \"$value\""$'\n'
  else
    cgi_env+="            fastcgi_param $name \"$value\";"$'\n'
  fi
done

fast_lines=""
xsendfile=Off
for d in "${fast_dirs[@]+"${fast_dirs[@]}"}"; do
  conf_absolute "$d"
  plain "$d"
  d="${d%/}"
  xsendfile=On
  if [ "$server" = apache ]; then
    fast_lines+="    XSendFilePath \"$d\""$'\n'
  else
    fast_lines+="        location ^~ \"$prefix$d/\" {"$'\n'"            internal;"$'\n'
    fast_lines+="            alias \"$d/\";"$'\n'
    fast_lines+="            add_header X-Content-Type-Options nosniff always;"$'\n'"        }"$'\n'
  fi
done
[ -z "$fast_lines" ] || [ "$server" = apache ] ||
  fast_lines="        ## Fast file output: the front end answers \"X-Accel-Redirect: $prefix<path>\"
        ## (nginx keeps few of its headers then: nosniff is said again)."$'\n'"$fast_lines"

entry_modules=""
have_xsendfile=no
if [ "$server" = apache ]; then
  if [ "$front" = cgi ]; then
    entry_modules="LoadModule cgid_module \"$modules/mod_cgid.so\""
  else
    entry_modules="LoadModule proxy_module \"$modules/mod_proxy.so\""$'\n'
    entry_modules+="LoadModule proxy_fcgi_module \"$modules/mod_proxy_fcgi.so\""
  fi
  if [ -f "$modules/mod_xsendfile.so" ]; then
    have_xsendfile=yes
    entry_modules+=$'\n'"LoadModule xsendfile_module \"$modules/mod_xsendfile.so\""
  elif [ "$xsendfile" = On ]; then
    die "--fast-dir needs mod_xsendfile ($modules/mod_xsendfile.so, Debian: libapache2-mod-xsendfile)"
  fi
fi

mkdir -p "$run"
[ "$server" = apache ] || mkdir -p "$run/nginx"
tmp="$(mktemp "$out.XXXXXX")"
trap 'rm -f "$tmp" "$tmp.err"' EXIT
# The template with the front end's block in place of @ENTRY@; the lines of
# mod_xsendfile left out when Apache has not got it.
expanded() { conf_expand "$repo/deploy/$server/$server.conf.in" expanded_file "$repo/deploy/$server/entry-$front.conf.in"; }
expanded_file() {
  local line
  while IFS= read -r line || [ -n "$line" ]; do
    case "$line" in
      *XSendFile* | *@XSENDFILE_PATHS@*) [ "$have_xsendfile" = yes ] || continue ;;
    esac
    printf '%s\n' "$line"
  done <"$1"
}
while IFS= read -r line || [ -n "$line" ]; do
  case "$line" in
    @CGI_ENV@) printf '%s' "$cgi_env"; continue ;;
    @XSENDFILE_PATHS@ | @XACCEL@) printf '%s' "$fast_lines"; continue ;;
    @ENTRY_MODULES@) printf '%s\n' "$entry_modules"; continue ;;
  esac
  line="${line//@MODULES@/"$modules"}"
  line="${line//@USER@/"$user"}"
  line="${line//@GROUP@/"$group"}"
  line="${line//@BIND@/"$bind"}"
  line="${line//@PORT@/"$port"}"
  line="${line//@PID_FILE@/"$pidfile"}"
  line="${line//@RUN_DIR@/"$run"}"
  line="${line//@DOCROOT@/"$docroot"}"
  line="${line//@VELASCGI@/"$velascgi"}"
  line="${line//@SOCKET@/"$socket"}"
  line="${line//@ERRORS_DIR@/"$errors"}"
  line="${line//@XSENDFILE@/"$xsendfile"}"
  printf '%s\n' "$line"
done < <(expanded) >"$tmp"
if [ "$server" = apache ]; then
  apache2 -t -f "$tmp" >/dev/null 2>"$tmp.err" || { cat "$tmp.err" >&2; die "apache2 refuses the configuration"; }
else
  nginx -t -q -c "$tmp" -p "$run" -e "$run/error.log" >/dev/null 2>"$tmp.err" ||
    { cat "$tmp.err" >&2; die "nginx refuses the configuration"; }
fi
mv "$tmp" "$out"
trap - EXIT
rm -f "$tmp.err"
