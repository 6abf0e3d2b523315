#!/usr/bin/env bash
# The scenarios every web server is held to (scenarios.sh) through Apache or
# nginx, each a private server configured by scripts/websrv-conf.sh on a free
# port of 127.0.0.1, with the front end VELA_FRONT_END names:
#   apache fcgi   mod_proxy_fcgi to velafcgi on a socket of its own
#   apache cgi    mod_cgid running velascgi, as Apache's User (never root):
#                 velascgi can take no identity, so instead of the
#                 scenarios the answers a front end without root gives
#                 (set-user-id root it serves only the root "/": the
#                 package test runs the scenarios so)
#   nginx fcgi    fastcgi_pass to velafcgi on a socket of its own
#   nginx cgi     fastcgi_pass to fcgiwrap, which runs velascgi
# Fast file output: X-Sendfile through mod_xsendfile (Apache), X-Accel-Redirect
# to an internal location (nginx).
#
#   websrv.sh apache|nginx VELASCGI VELAADM WEBAPI SRC
set -u

. "$(dirname "$0")/server.sh"
. "$(dirname "$0")/scenarios.sh"
server=${1:-}
shift
front=${VELA_FRONT_END:-fcgi}
need=()
case "$server" in
  apache) SRV_SERVER=apache2 FAST_HEADER=X-Sendfile ;;
  nginx)
    SRV_SERVER=nginx FAST_HEADER=X-Accel-Redirect
    [ "$front" = fcgi ] || need=(fcgiwrap)
    ;;
  *) echo "usage: ${0##*/} apache|nginx VELASCGI VELAADM WEBAPI SRC" >&2; exit 2 ;;
esac
srv_args VELASCGI VELAADM WEBAPI SRC -- "$@"
srv_require "the front end runs as root beside the server" cmp cksum stat useradd chpasswd "${need[@]}"
[ "$server" = apache ] && [ ! -f /usr/lib/apache2/modules/mod_xsendfile.so ] &&
  { echo "SKIP: mod_xsendfile is not installed"; exit 77; }

srv_init "$SRC" "$VELASCGI" "$WEBAPI" private || exit 1
# nginx: a volume whose path X-Accel-Redirect must encode.
name=/vol1
[ "$server" = apache ] || name="/vol 1%x"
volume=$ROOT$name
mkdir -p "$volume"
echo "$name" >"$ROOT/etc/vela/volumes.conf"
user=www-data
id -u "$user" >/dev/null 2>&1 || user=nobody
group=$(id -gn "$user")
# The sockets: reached by root and the server's account only.
sockets=$RUN/sock
mkdir -m 0750 "$sockets" && chgrp "$group" "$sockets" || exit 1
socket=$sockets/$front.sock

# srv_front_env as arguments of env.
mapfile -t front_env < <(srv_front_env)
if [ "$server/$front" = apache/cgi ]; then
  :  # mod_cgid runs velascgi
elif [ "$front" = fcgi ]; then
  srv_daemon velafcgi env -i "${front_env[@]}" "$(dirname "$VELASCGI")/velafcgi" --socket "$socket" \
    --socket-group "$group" --stderr "$RUN/cgi.log"
else
  # fcgiwrap makes its socket with its umask: the directory above guards it.
  # velascgi's standard error (its log lines) goes to cgi.log.
  srv_daemon cgi env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin sh -c 'umask 0; exec fcgiwrap -s "unix:$1"' sh "$socket"
fi
[ "$server/$front" = apache/cgi ] || srv_wait 100 0.1 test -S "$socket" || { fail "no socket $socket"; srv_finish ""; }

conf_args=(--server "$server" --out "$RUN/$server.conf" --run "$RUN" --pidfile "$RUN/$server.pid"
           --docroot "$RUN/www" --velascgi "$VELASCGI" --socket "$socket" --user "$user" --group "$group"
           --fast-dir "$volume" --front-end "$front")
for line in "${front_env[@]}"; do
  conf_args+=(--env "$line")
done
write_conf() { "$SRC/scripts/websrv-conf.sh" "${conf_args[@]}" --port "$1"; }
run_apache() { exec apache2 -f "$RUN/apache.conf" -DFOREGROUND; }
run_nginx() { exec nginx -c "$RUN/nginx.conf" -p "$RUN" -e "$RUN/error.log" -g "daemon off;"; }
srv_launch write_conf "run_$server" || { failures=1; exit 1; }

# ---- The server's own refusals answer in the web API's JSON shape.
call "$BASE/no-such-page"
expect_status "a missing page" 404
expect "a missing page" '"success":false' '"code":101'
expect_header "a missing page" 'Content-Type: application/json'

# ---- mod_cgid: velascgi runs as Apache's User. It answers, with the body
# of the request read, but refuses what needs root: the session store
# (105), the identity of an API (117).
if [ "$server/$front" = apache/cgi ]; then
  call "$URL?api=VELA.Sample&version=1&method=whoami"
  expect_error "whoami without a session" 119 unauth
  srv_session
  call --cookie "id=$sid" "$URL?api=VELA.Sample&version=1&method=whoami"
  expect_error "whoami with root's session" 105 noprivilege
  call --data-urlencode "account=root" --data-urlencode "passwd=x" "$URL?api=VELA.Auth&version=1&method=login"
  expect_error "login" 117
  srv_finish "apache checks passed (cgi: velascgi as $user, which cannot switch identity; $URL)"
fi

# ---- The scenarios, fast output on.
if [ "$server" = nginx ]; then
  printf 'xsendfile="yes"\nxaccel_prefix="/vela-files"\n' >"$ROOT/etc/vela/webapi.conf"
else
  # Debian's mod_xsendfile (0.12) takes the path as it is (a path that
  # needs encoding is streamed: HttpFileOutputerTest.cpp).
  printf 'xsendfile="yes"\nxsendfile_encoded="no"\n' >"$ROOT/etc/vela/webapi.conf"
fi
srv_pam
web_scenarios

# ---- The internal location answers nobody from outside.
if [ "$server" = nginx ]; then
  echo secret >"$volume/outside.txt"
  encoded=${volume//%/%25}
  call "$BASE/vela-files${encoded// /%20}/outside.txt"
  expect_status "the internal location from outside" 404
  grep -q secret "$TMP/body" && fail "the internal location answered from outside"
fi

srv_finish "all $server checks passed ($front, $URL)"
