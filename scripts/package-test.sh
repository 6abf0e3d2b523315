#!/usr/bin/env bash
# Builds the Debian packages (vela-webapi, vela-webapi-dev) with CPack,
# installs them with apt-get (dependencies from Debian), and tests the
# installed system with the root "/": the files in place, the state
# directories and their modes, the conffiles, the units (systemd-analyze
# verify), an install over itself; velafcgi started the way its systemd
# units start it, lighttpd with the package's snippet enabled on a free
# port, then calls through it (an echo with a session of the installed
# velaadm, the sign-in page, the end-to-end scenarios of
# tests/e2e/scenarios.sh when present) and `velaapi list`; the scenarios
# again through Apache's mod_cgid running the installed velascgi set-user-id
# root, when apache2 and mod_xsendfile are installed. Then it removes
# the packages (only conffiles may stay), purges them (the state goes) and
# leaves the machine as it found it: the processes it started, the packages
# it installed (those apt-get pulled in as well), the administrators' group
# when it made it, /etc/vela and the lighttpd links are put back.
#
#   scripts/package-test.sh [BUILD_DIR]     (default build-pkg, as root)
#
# The packages are built in BUILD_DIR, configured for the prefix /usr
# without the test suite. The test refuses to run where the web API is
# installed or has state already (it would remove it).
set -euo pipefail
repo="$(cd "$(dirname "$0")/.." && pwd)"
build="${1:-$repo/build-pkg}"
case "$build" in /*) ;; *) build="$PWD/$build" ;; esac

say() { echo "== package-test: $*"; }
die() { echo "package-test: $*" >&2; exit 1; }

[ "$(id -u)" -eq 0 ] || die "needs root (installs packages)"
for tool in dpkg apt-get cpack cmake lighttpd lighty-enable-mod curl python3 getent; do
  command -v "$tool" >/dev/null 2>&1 || die "$tool is not installed"
done
for p in vela-webapi vela-webapi-dev; do
  if dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -qv "not-installed"; then
    die "$p is installed here: the test would remove it"
  fi
done
for d in /var/lib/vela /var/spool/webapi /var/log/vela /run/vela /etc/vela /usr/vela; do
  [ ! -e "$d" ] || die "$d exists: the test would remove it"
done

# ---- build -------------------------------------------------------------
say "building the packages in $build"
launcher=()
if command -v ccache >/dev/null 2>&1; then
  launcher=(-DCMAKE_C_COMPILER_LAUNCHER=ccache -DCMAKE_CXX_COMPILER_LAUNCHER=ccache)
fi
cmake -S "$repo" -B "$build" -DCMAKE_INSTALL_PREFIX=/usr -DVELA_TESTS=OFF "${launcher[@]}" >/dev/null
cmake --build "$build" -j"$(nproc)" >/dev/null
rm -f "$build"/*.deb
(cd "$build" && cpack -G DEB >/dev/null)
debs=("$build"/vela-webapi_*.deb "$build"/vela-webapi-dev_*.deb)
for deb in "${debs[@]}"; do
  [ -f "$deb" ] || die "cpack made no $deb"
done

# ---- checks and clean-up -----------------------------------------------
failures=0 status=""
fail() {
  echo "FAIL: $*"
  failures=$((failures + 1))
}
check() {
  local name=$1
  shift
  "$@" || fail "$name"
}

TMP=$(mktemp -d /tmp/vela-pkgtest.XXXXXX)
chmod 0755 "$TMP"
VOLUME="" FCGI_PID="" LPID="" APID="" override_made=no
packages_before="$TMP/packages.before"
dpkg-query -W -f='${Package}:${Architecture} ${db:Status-Status}\n' | awk '$2 == "installed" {print $1}' |
  sort >"$packages_before"
admin_group_existed=no
getent group administrators >/dev/null && admin_group_existed=yes
links_made=()
policy=/usr/sbin/policy-rc.d policy_saved=""

stop_servers() {
  if [ -n "$APID" ]; then
    kill -TERM "$APID" 2>/dev/null || true
    wait "$APID" 2>/dev/null || true
    APID=""
  fi
  if [ -n "$LPID" ]; then
    kill -TERM "$LPID" 2>/dev/null || true
    wait "$LPID" 2>/dev/null || true
    LPID=""
  fi
  if [ -n "$FCGI_PID" ]; then
    kill -TERM "$FCGI_PID" 2>/dev/null || true
    wait "$FCGI_PID" 2>/dev/null || true
    FCGI_PID=""
  fi
}

cleanup() {
  local rc=$? link new
  set +e
  stop_servers
  declare -F srv_cleanup_accounts >/dev/null && srv_cleanup_accounts
  for link in "${links_made[@]+"${links_made[@]}"}"; do
    [ -L "$link" ] && rm -f "$link"
  done
  [ "$override_made" = yes ] && dpkg-statoverride --remove /usr/libexec/vela/velascgi >/dev/null 2>&1
  for p in vela-webapi-dev vela-webapi; do
    if dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -qv "not-installed"; then
      DEBIAN_FRONTEND=noninteractive apt-get purge -y -qq "$p" >/dev/null 2>&1
    fi
  done
  # What apt-get installed for the packages goes too.
  new=$(dpkg-query -W -f='${Package}:${Architecture} ${db:Status-Status}\n' | awk '$2 == "installed" {print $1}' |
    sort | comm -13 "$packages_before" -)
  if [ -n "$new" ]; then
    # shellcheck disable=SC2086
    DEBIAN_FRONTEND=noninteractive apt-get purge -y -qq $new >/dev/null 2>&1
  fi
  if [ "$admin_group_existed" = no ] && getent group administrators >/dev/null; then
    groupdel administrators
  fi
  rm -rf /etc/vela /var/lib/vela /var/spool/webapi /var/log/vela /run/vela
  [ -n "$VOLUME" ] && rm -rf "$VOLUME"
  rm -f "$policy"
  [ -n "$policy_saved" ] && mv "$policy_saved" "$policy"
  rm -rf "$TMP"
  exit "$rc"
}
trap cleanup EXIT
trap 'exit 1' HUP INT TERM

# No daemon starts from the packages' scripts while the test runs.
if [ -e "$policy" ] || [ -L "$policy" ]; then
  policy_saved="$TMP/policy-rc.d.saved"
  mv "$policy" "$policy_saved"
fi
printf '#!/bin/sh\nexit 101\n' >"$policy"
chmod 0755 "$policy"

# The files of the packages, and which of them were here before.
for deb in "${debs[@]}"; do
  dpkg-deb --fsys-tarfile "$deb" | tar -t | sed 's#^\./#/#; s#/$##' | grep -v '^$'
done | sort -u >"$TMP/files"
while read -r f; do
  if [ -e "$f" ] || [ -L "$f" ]; then echo "$f"; fi
done <"$TMP/files" >"$TMP/files.before"

# ---- install -----------------------------------------------------------
say "installing ${debs[*]##*/}"
apt_install() {
  DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends "$@" >"$TMP/apt.log" 2>&1 ||
    { cat "$TMP/apt.log"; die "apt-get install failed"; }
}
apt_install "${debs[@]}"

state_dirs=(
  "/var/lib/vela 755 root" "/var/lib/vela/keys 700 root" "/var/lib/vela/tokens 700 root"
  "/var/lib/vela/tasks 700 root" "/var/lib/vela/sharing 700 root" "/var/lib/vela/preference 755 root"
  "/var/lib/vela/preference/user 755 root" "/var/lib/vela/preference/group 755 root"
  "/var/spool/webapi 700 root" "/var/log/vela 750 adm"
  "/run/vela 755 root" "/run/vela/sessions 700 root" "/run/vela/login-guard 700 root"
)
check_installed() {
  local what=$1 f entry dir mode group conffiles installed
  for f in /usr/libexec/vela/velafcgi /usr/libexec/vela/velascgi /usr/sbin/velaadm /usr/sbin/velaapi \
           /usr/bin/velarun /usr/vela/velaman/webapi/lib.def /usr/share/vela/www/login.html \
           /usr/include/webapi/APIRequest.h /etc/pam.d/vela-webapi /etc/lighttpd/conf-available/50-vela-webapi.conf \
           /lib/systemd/system/velafcgi.socket /lib/systemd/system/velafcgi.service \
           /usr/lib/tmpfiles.d/vela-webapi.conf /etc/logrotate.d/vela-webapi; do
    dpkg -S "$f" >/dev/null 2>&1 || fail "$what: $f belongs to no package"
    [ -e "$f" ] || fail "$what: $f is missing"
  done
  dpkg -L vela-webapi vela-webapi-dev | grep -v '^$' | while read -r f; do
    [ -e "$f" ] || echo "FAIL: $what: $f listed by dpkg -L is missing"
  done | tee "$TMP/missing"
  [ -s "$TMP/missing" ] && fail "$what: files of dpkg -L missing"
  ldd /usr/libexec/vela/velafcgi | grep -q "not found" && fail "$what: velafcgi lacks a library"
  for entry in "${state_dirs[@]}"; do
    read -r dir mode group <<<"$entry"
    [ -d "$dir" ] && [ ! -L "$dir" ] || { fail "$what: no directory $dir"; continue; }
    [ "$(stat -c '%a %U %G' "$dir")" = "$mode root $group" ] ||
      fail "$what: $dir is $(stat -c '%a %U %G' "$dir"), expected $mode root $group"
  done
  getent group administrators >/dev/null || fail "$what: no group administrators"
  conffiles=$(dpkg-query -W -f='${Conffiles}\n' vela-webapi | awk 'NF {print $1}' | sort | tr '\n' ' ')
  [ "$conffiles" = "/etc/lighttpd/conf-available/50-vela-webapi.conf /etc/logrotate.d/vela-webapi /etc/pam.d/vela-webapi " ] ||
    fail "$what: conffiles are: $conffiles"
  # Nothing the packages installed or made is writable by everyone (a
  # directory only with the sticky bit).
  mapfile -t installed < <(dpkg -L vela-webapi vela-webapi-dev | grep -v '^/\{0,1\}$')
  { find "${installed[@]}" /var/lib/vela /var/spool/webapi /var/log/vela /run/vela -maxdepth 0 -perm -0002 ! \( -type d -perm -1000 \) ! -type l 2>/dev/null || true; } | sort -u >"$TMP/writable"
  [ -s "$TMP/writable" ] && fail "$what: writable by everyone: $(tr '\n' ' ' <"$TMP/writable")"
  return 0
}
check_installed "install"

say "building the handler template against vela-webapi-dev"
[ "$(pkg-config --modversion vela-webapi 2>&1)" = "$(dpkg-query -W -f='${Version}' vela-webapi-dev)" ] ||
  fail "pkg-config does not find vela-webapi of the package"
if cmake -S "$repo/sdk/handler-template" -B "$TMP/template" >"$TMP/template.log" 2>&1 &&
   cmake --build "$TMP/template" -j"$(nproc)" >>"$TMP/template.log" 2>&1; then
  grep -q "^VelaWebAPI_DIR:PATH=/usr/lib/.*/cmake/VelaWebAPI$" "$TMP/template/CMakeCache.txt" ||
    fail "the handler template found VelaWebAPI elsewhere: $(grep VelaWebAPI_DIR "$TMP/template/CMakeCache.txt")"
  (cd "$TMP/template" && ctest --output-on-failure >>"$TMP/template.log" 2>&1) ||
    { tail -n 30 "$TMP/template.log"; fail "the handler template's tests"; }
  # A handler library's package gets its dependency on vela-webapi from
  # the shlibs file.
  handler=$(find "$TMP/template" -name '*.so' -newer "$TMP/template/CMakeCache.txt" | head -n 1)
  mkdir -p "$TMP/shlibdeps/debian"
  printf 'Source: greet\n\nPackage: greet\nArchitecture: any\n' >"$TMP/shlibdeps/debian/control"
  deps=$(cd "$TMP/shlibdeps" && dpkg-shlibdeps -O "$handler" 2>&1) || true
  grep -q "^shlibs:Depends=.*vela-webapi" <<<"$deps" || fail "dpkg-shlibdeps of a handler library: $deps"
else
  tail -n 30 "$TMP/template.log"
  fail "the handler template does not build against vela-webapi-dev"
fi

say "checking the units"
if command -v systemd-analyze >/dev/null 2>&1; then
  systemd-analyze verify --man=no /lib/systemd/system/velafcgi.socket /lib/systemd/system/velafcgi.service \
    >"$TMP/verify.log" 2>&1 || fail "systemd-analyze verify: $(cat "$TMP/verify.log")"
  [ -s "$TMP/verify.log" ] && fail "systemd-analyze verify warns: $(cat "$TMP/verify.log")"
fi

# The same packages again over themselves (an upgrade to the same
# version): the scripts run again, the state stays.
say "installing again over the installed packages"
touch /var/lib/vela/keys/marker
dpkg -i "${debs[@]}" >"$TMP/dpkg.log" 2>&1 || { cat "$TMP/dpkg.log"; fail "dpkg -i over itself"; }
check_installed "install over itself"
[ -e /var/lib/vela/keys/marker ] || fail "install over itself: the state was not kept"
rm -f /var/lib/vela/keys/marker

# ---- serve -------------------------------------------------------------
# A data volume for the scenarios, outside /tmp (X-Sendfile takes only
# paths nobody else can change), and X-Sendfile on.
VOLUME=$(mktemp -d /srv/vela-pkgtest.XXXXXX 2>/dev/null || mktemp -d /var/lib/vela-pkgtest.XXXXXX)
chmod 0755 "$VOLUME"
mkdir -p /etc/vela
echo "$VOLUME" >/etc/vela/volumes.conf
echo 'xsendfile="yes"' >/etc/vela/webapi.conf

say "starting velafcgi as its units do"
unit_value() { sed -n "s/^$2=//p" "/lib/systemd/system/$1" | tail -n 1; }
exec_start=$(unit_value velafcgi.service ExecStart)
socket=$(unit_value velafcgi.socket ListenStream)
socket_mode=$(unit_value velafcgi.socket SocketMode)
socket_group=$(unit_value velafcgi.socket SocketGroup)
[ "$(unit_value velafcgi.service StandardInput)" = socket ] || fail "velafcgi.service does not take the socket on standard input"
[ -n "$exec_start" ] && [ -n "$socket" ] || die "no ExecStart or ListenStream in the units"
# Like systemd: the socket made, then the program started with it as
# standard input, standard output and error to a log.
python3 - "$socket" "$socket_mode" "$socket_group" "$TMP/velafcgi.log" $exec_start <<'EOF' &
import grp, os, socket, sys
path, mode, group, log, argv = sys.argv[1], int(sys.argv[2], 8), sys.argv[3], sys.argv[4], sys.argv[5:]
if os.path.exists(path):
    os.unlink(path)
s = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
s.bind(path)
os.chown(path, 0, grp.getgrnam(group).gr_gid)
os.chmod(path, mode)
s.listen(128)
os.dup2(s.fileno(), 0)
out = os.open(log, os.O_WRONLY | os.O_CREAT | os.O_APPEND, 0o640)
os.dup2(out, 1)
os.dup2(out, 2)
os.umask(0o022)
os.chdir("/")
os.execv(argv[0], argv)
EOF
FCGI_PID=$!

say "enabling the lighttpd snippet"
for link in /etc/lighttpd/conf-enabled/10-fastcgi.conf /etc/lighttpd/conf-enabled/50-vela-webapi.conf; do
  [ -e "$link" ] || [ -L "$link" ] || links_made+=("$link")
done
lighty-enable-mod vela-webapi >"$TMP/enable.log" 2>&1 || { cat "$TMP/enable.log"; fail "lighty-enable-mod vela-webapi"; }
for link in /etc/lighttpd/conf-enabled/10-fastcgi.conf /etc/lighttpd/conf-enabled/50-vela-webapi.conf; do
  [ -e "$link" ] || fail "lighty-enable-mod did not enable $link"
done

# lighttpd as Debian runs it (www-data), on a free port of 127.0.0.1, with
# the enabled snippet and its fastcgi module, and nothing else of the
# system's configuration (no port 80).
port=$(python3 -c 'import socket; s = socket.socket(); s.bind(("127.0.0.1", 0)); print(s.getsockname()[1])')
mkdir -p "$TMP/www" "$TMP/upload" "$TMP/log"
chown www-data:www-data "$TMP/upload" "$TMP/log"
cat >"$TMP/lighttpd.conf" <<EOF
server.modules = ( "mod_indexfile", "mod_access", "mod_alias", "mod_redirect" )
server.document-root = "$TMP/www"
server.upload-dirs   = ( "$TMP/upload" )
server.errorlog      = "$TMP/log/error.log"
server.pid-file      = "$TMP/lighttpd.pid"
server.username      = "www-data"
server.groupname     = "www-data"
server.bind          = "127.0.0.1"
server.port          = $port
include_shell "/usr/share/lighttpd/create-mime.conf.pl"
include "/etc/lighttpd/conf-enabled/10-fastcgi.conf"
include "/etc/lighttpd/conf-enabled/50-vela-webapi.conf"
server.modules += ( "mod_staticfile" )
EOF
lighttpd -tt -f "$TMP/lighttpd.conf" || die "the lighttpd configuration with the snippet does not load"
lighttpd -D -f "$TMP/lighttpd.conf" &
LPID=$!
BASE="http://127.0.0.1:$port"
URL="$BASE/webapi/entry.cgi"
for _ in $(seq 50); do
  curl -s -o /dev/null "$BASE/webapi/login.html" && break
  kill -0 "$LPID" 2>/dev/null || die "lighttpd did not start: $(cat "$TMP/log/error.log" 2>/dev/null)"
  sleep 0.2
done

# ---- end to end --------------------------------------------------------
call() {
  status=$(curl -s --max-time 60 -D "$TMP/headers" -o "$TMP/body" -w '%{http_code}' "$@") || status="curl failed"
}
say "calls through lighttpd at $BASE"
sid=$(/usr/sbin/velaadm session create root --ip 127.0.0.1 | sed -n 's/^sid=//p')
[ -n "$sid" ] || fail "the installed velaadm made no session"
call --cookie "id=$sid" "$URL?api=VELA.Sample&version=1&method=echo&text=installed"
[ "$status" = 200 ] && grep -qF '"success":true' "$TMP/body" && grep -qF 'installed' "$TMP/body" ||
  fail "echo with a session: HTTP $status: $(head -c 400 "$TMP/body")"
call "$URL?api=VELA.Sample&version=1&method=echo&text=x"
grep -qF '"success":false' "$TMP/body" || fail "echo without a session was answered: $(head -c 400 "$TMP/body")"
for page in login.html vela.js; do
  call "$BASE/webapi/$page"
  [ "$status" = 200 ] && cmp -s "$TMP/body" "/usr/share/vela/www/$page" || fail "/webapi/$page: HTTP $status"
done
call "$BASE/webapi/lib.def"
[ "$status" = 404 ] || fail "/webapi/lib.def: HTTP $status, expected 404 (only the pages and the entry)"
[ -S "$socket" ] && [ "$(stat -c '%a %U %G' "$socket")" = "660 root $socket_group" ] ||
  fail "socket $socket: $(stat -c '%a %U %G' "$socket" 2>&1)"

say "velaapi list"
/usr/sbin/velaapi list >"$TMP/list" 2>&1 || fail "velaapi list: $(head -c 400 "$TMP/list")"
grep -q '^VELA.Sample 1 echo$' "$TMP/list" || fail "velaapi list lacks VELA.Sample 1 echo: $(head -c 400 "$TMP/list")"

if [ -f "$repo/tests/e2e/scenarios.sh" ]; then
  say "end-to-end scenarios against the installed system"
  srv_cleanup_accounts() {
    local name
    for name in "${SRV_USERS[@]+"${SRV_USERS[@]}"}"; do userdel "$name" 2>/dev/null; done
    for name in "${SRV_GROUPS[@]+"${SRV_GROUPS[@]}"}"; do groupdel "$name" 2>/dev/null; done
    SRV_USERS=() SRV_GROUPS=()
  }
  # server.sh defines the checks anew and empties its variables (TMP,
  # LPID, failures...): ours are kept aside.
  own_failures=$failures own_tmp=$TMP own_lpid=$LPID own_base=$BASE
  set +eu
  # shellcheck source=/dev/null
  source "$repo/tests/e2e/server.sh"
  # shellcheck source=/dev/null
  source "$repo/tests/e2e/scenarios.sh"
  trap cleanup EXIT
  trap 'exit 1' HUP INT TERM
  TMP=$own_tmp LPID=$own_lpid BASE=$own_base URL="$own_base/webapi/entry.cgi" ROOT=/ RUN=$own_tmp
  VELAADM=/usr/sbin/velaadm FAST_HEADER=X-Sendfile SRV_SRC=$repo
  web_scenarios
  srv_cleanup_accounts
  [ "$failures" -eq 0 ] || { cat "$TMP/velafcgi.log" "$TMP/log/error.log" 2>/dev/null | tail -n 50; }

  # Apache's mod_cgid runs CGI programs only as its User: the installed
  # velascgi is made set-user-id root for the server's group, as an
  # administrator does it (dpkg-statoverride), and held to the same
  # scenarios, Debian's mod_xsendfile taking the path as it is.
  if command -v apache2 >/dev/null 2>&1 && [ -f /usr/lib/apache2/modules/mod_xsendfile.so ]; then
    say "end-to-end scenarios through Apache (mod_cgid, velascgi set-user-id root)"
    velascgi=/usr/libexec/vela/velascgi
    dpkg-statoverride --update --add root www-data 4750 "$velascgi" && override_made=yes
    [ "$(stat -c '%a %U %G' "$velascgi")" = "4750 root www-data" ] ||
      fail "statoverride: velascgi is $(stat -c '%a %U %G' "$velascgi")"
    printf 'xsendfile="yes"\nxsendfile_encoded="no"\n' >/etc/vela/webapi.conf
    aport=$(python3 -c 'import socket; s = socket.socket(); s.bind(("127.0.0.1", 0)); print(s.getsockname()[1])')
    if "$repo/scripts/websrv-conf.sh" --server apache --front-end cgi --out "$TMP/apache/apache.conf" \
         --port "$aport" --run "$TMP/apache" --pidfile "$TMP/apache/apache.pid" --docroot "$TMP/www" \
         --velascgi "$velascgi" --fast-dir "$VOLUME"; then
      apache2 -f "$TMP/apache/apache.conf" -DFOREGROUND &
      APID=$!
      BASE="http://127.0.0.1:$aport" URL="http://127.0.0.1:$aport/webapi/entry.cgi"
      for _ in $(seq 50); do
        curl -s -o /dev/null "$BASE/" && break
        sleep 0.2
      done
      web_scenarios
      srv_cleanup_accounts
      [ "$failures" -eq 0 ] || tail -n 50 "$TMP/apache/error.log"
      kill -TERM "$APID" 2>/dev/null
      wait "$APID" 2>/dev/null
      APID=""
    else
      fail "websrv-conf.sh wrote no Apache configuration"
    fi
    dpkg-statoverride --remove "$velascgi" && override_made=no
    echo 'xsendfile="yes"' >/etc/vela/webapi.conf
  fi
  set -eu
  failures=$((failures + own_failures))
fi

# ---- remove and purge --------------------------------------------------
stop_servers
for link in "${links_made[@]+"${links_made[@]}"}"; do
  rm -f "$link"
done
links_made=()
rm -rf /etc/vela "$VOLUME"
VOLUME=""

say "removing the packages"
conffiles=$(dpkg-query -W -f='${Conffiles}\n' vela-webapi | awk 'NF {print $1}')
DEBIAN_FRONTEND=noninteractive apt-get remove -y -qq vela-webapi-dev vela-webapi >"$TMP/apt.log" 2>&1 ||
  { cat "$TMP/apt.log"; die "apt-get remove failed"; }
while read -r f; do
  grep -qxF "$f" "$TMP/files.before" && continue
  grep -qxF "$f" <<<"$conffiles" && { [ -e "$f" ] || fail "remove: conffile $f went"; continue; }
  if [ -d "$f" ] && [ ! -L "$f" ]; then
    # A directory of the package may stay only for the conffiles in it.
    grep -q "^$f/" <<<"$conffiles" || fail "remove left the directory $f"
  elif [ -e "$f" ] || [ -L "$f" ]; then
    fail "remove left $f"
  fi
  if [ ! -d "$f" ] && dpkg -S "$f" >/dev/null 2>&1 && ! grep -qxF "$f" <<<"$conffiles"; then
    fail "remove: dpkg still has $f"
  fi
done <"$TMP/files"
[ -d /var/lib/vela ] || fail "remove took the state (only a purge should)"

say "purging"
DEBIAN_FRONTEND=noninteractive apt-get purge -y -qq vela-webapi >"$TMP/apt.log" 2>&1 ||
  { cat "$TMP/apt.log"; die "apt-get purge failed"; }
for f in $conffiles /var/lib/vela /var/spool/webapi /var/log/vela /run/vela; do
  [ ! -e "$f" ] || fail "purge left $f"
done
dpkg-query -W -f='${Status}' vela-webapi 2>/dev/null | grep -qv "not-installed" && fail "purge: vela-webapi still known to dpkg"
[ ! -e /etc/systemd/system/sockets.target.wants/velafcgi.socket ] || fail "purge left the socket enabled"
[ -z "$(find /var/lib/systemd/deb-systemd-helper-enabled -name '*velafcgi*' 2>/dev/null)" ] ||
  fail "purge left deb-systemd-helper's state of velafcgi"
[ ! -e /etc/lighttpd/conf-enabled/50-vela-webapi.conf ] || fail "the lighttpd link stayed"

if [ "$failures" -ne 0 ]; then
  echo "package-test: $failures check(s) failed"
  exit 1
fi
say "all checks passed"
