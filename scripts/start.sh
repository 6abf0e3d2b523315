#!/usr/bin/env bash
# The main job: installs what is missing, builds, and serves the web API
# through lighttpd at http://127.0.0.1:<port>/webapi/entry.cgi (port 8080, or
# VELA_PORT). lighttpd runs in the background; scripts/stop.sh stops it. The
# front end is the FastCGI server velafcgi, which lighttpd starts and stops;
# VELA_FRONT_END=cgi runs the CGI program velascgi for every request instead.
#
# The system root is VELA_ROOT when set, "/" when the web-API directory is
# installed there (/usr/vela/velaman/webapi/lib.def), and otherwise
# <build>/root, where the build stages the web-API directory. The build
# directory is build, or VELA_BUILD_DIR.
set -euo pipefail
repo="$(cd "$(dirname "$0")/.." && pwd)"
cd "$repo"

die() { echo "start.sh: $*" >&2; exit 1; }

port="${VELA_PORT:-8080}"
case "$port" in
  '' | *[!0-9]*) die "VELA_PORT \"$port\" is not a port number" ;;
esac
[ "$port" -ge 1 ] && [ "$port" -le 65535 ] || die "VELA_PORT $port is out of range"

. "$repo/scripts/server-paths.sh"

./scripts/install-deps.sh
./scripts/build.sh "$build"
velascgi="$build/velascgi"
[ -x "$velascgi" ] || die "$velascgi was not built"
[ -d "$root/usr/vela/velaman/webapi" ] || die "no web-API directory under $root"
# The PAM service of the login API, read from <root>/etc/pam.d (the build
# stages it under build/root). Installed when missing; an existing file is
# the administrator's and stays as it is.
pamfile="${root%/}/etc/pam.d/vela-webapi"
if [ ! -e "$pamfile" ]; then
  if [ "$root" != / ] || [ "$(id -u)" -eq 0 ]; then
    install -D -m 0644 "$repo/deploy/pam/vela-webapi" "$pamfile"
  else
    echo "start.sh: $pamfile is missing; logins fail until root installs deploy/pam/vela-webapi there" >&2
  fi
fi

if pid="$(running_pid)"; then
  die "lighttpd already runs (pid $pid, $pidfile); stop it with scripts/stop.sh"
fi
# Something already listening on the port would make lighttpd fail with a
# less helpful message.
if (exec 3<>"/dev/tcp/127.0.0.1/$port") 2>/dev/null; then
  die "port $port on 127.0.0.1 is taken; choose another with VELA_PORT=<port>"
fi

mkdir -p "$run" "$(dirname "$pidfile")"
docroot="$repo/deploy/www"
if [ ! -d "$docroot" ]; then
  docroot="$run/www"
  mkdir -p "$docroot"
fi

args=(--out "$run/lighttpd.conf" --port "$port" --run "$run" --pidfile "$pidfile"
      --docroot "$docroot" --velascgi "$velascgi"
      --env "PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin"
      --env "VELA_LOG_STDERR=1")
if [ "$root" != "/" ]; then
  args+=(--env "VELA_ROOT=$root")
fi
# X-Sendfile only from the data volumes.
while IFS= read -r volume; do
  args+=(--xsendfile-dir "$volume")
done < <(volume_dirs)
./scripts/lighttpd-conf.sh "${args[@]}"

: >"$run/error.log"
lighttpd -f "$run/lighttpd.conf" || {
  cat "$run/error.log" >&2
  die "lighttpd did not start"
}

# Wait (bounded by tries, not by the clock) until it answers.
url="http://127.0.0.1:$port/webapi/entry.cgi"
answered=""
for _ in $(seq 1 100); do
  if curl -s -o /dev/null --max-time 5 "$url"; then
    answered=yes
    break
  fi
  sleep 0.2
done
if [ -z "$answered" ]; then
  cat "$run/error.log" >&2
  die "lighttpd started but does not answer on $url"
fi

user="$(id -un)"
stop="scripts/stop.sh"
if [ -n "${VELA_BUILD_DIR:-}" ]; then
  stop="VELA_BUILD_DIR=$VELA_BUILD_DIR $stop"
fi
if [ -n "${VELA_ROOT:-}" ]; then
  stop="VELA_ROOT=$VELA_ROOT $stop"
fi
cat <<EOF
The web API answers at $url
  lighttpd pid $(cat "$pidfile"), configuration $run/lighttpd.conf
  front end ${VELA_FRONT_END:-fcgi} (VELA_FRONT_END=cgi or fcgi)
  logs $run/error.log (server) and $run/cgi.log (the front end)
  system root $root

Every sample method needs a login. Without one the answer is error 119:
  curl '$url?api=VELA.Sample&version=1&method=echo&text=hello'

Create a login session for $user, then send its id as the cookie "id":
  sid=\$(VELA_ROOT=$root $build/velaadm session create $user --ip 127.0.0.1 | sed -n 's/^sid=//p')
  curl --cookie "id=\$sid" '$url?api=VELA.Sample&version=1&method=echo&text=hello'
  curl --cookie "id=\$sid" '$url?api=VELA.Sample&version=1&method=whoami'

Or log in with an account of this machine (PAM); later calls send the
cookie and the answer's "token" as the header X-Vela-Token:
  curl -c jar --data-urlencode account=$user --data-urlencode 'passwd=<password>' '$url?api=VELA.Auth&version=1&method=login'
or in a browser on this machine, through the sign-in page:
  http://127.0.0.1:$port/login.html

Stop it with: $stop
EOF
