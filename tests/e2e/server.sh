# Shared by the end-to-end scripts that drive the real server (sourced, not
# run): a temporary system root that serves the staged web-API directory, a
# private lighttpd from deploy/lighttpd.conf.in on a free port of 127.0.0.1,
# and Linux accounts made for the run and removed afterwards. A script takes
# the paths its srv_args names and exits 0 when every check passed, 1
# otherwise, 77 (skipped) without a tool it needs or without root. The web
# server is lighttpd unless a script sets SRV_SERVER (apache2, nginx) and
# starts it with srv_launch.
#
#   srv_args NAME... -- ARG...     each NAME the real path of its ARG (exit 2
#                                  with the usage when the counts differ)
#   srv_require WHY TOOL...        exit 77 without a TOOL, SRV_SERVER or curl, or
#                                  without root (WHY needs it); then srv_traps
#   srv_traps [COMMAND]            at exit: COMMAND, the logs after a failure,
#                                  srv_cleanup (server, accounts, groups, TMP)
#   srv_init SRC VELASCGI WEBAPI [private]
#                                  TMP, ROOT, RUN (with RUN/www), the root's
#                                  web-API directory; "private": not below /tmp
#                                  (X-Sendfile paths must not be)
#   srv_api NAME <DESCRIPTION      links to the staged web-API directory, and
#                                  NAME.lib from standard input
#   srv_start DOCROOT [ARG...]     lighttpd (ARGs to scripts/lighttpd-conf.sh)
#                                  on SRV_BIND (default 127.0.0.1): BASE and
#                                  URL (the entry), or 1; srv_stop
#   srv_launch CONF RUN            a web server on a free port of SRV_BIND:
#                                  "CONF PORT" writes its configuration, RUN
#                                  runs it in the foreground; BASE, URL, LPID
#                                  once it answers, or 1
#   srv_daemon NAME CMD...         CMD in the background until srv_cleanup
#                                  (its output in RUN/NAME.log)
#   srv_front_env                  the front end's environment as NAME=VALUE
#                                  lines (VELA_ROOT, logs to standard error,
#                                  PATH, sanitizer options)
#   srv_aside                      keeps the current server running and sets
#                                  it aside (TMP, ROOT, RUN, BASE, URL, LPID
#                                  emptied): srv_init may start another one;
#                                  srv_cleanup stops both
#   srv_serve [ARG...]             srv_start RUN/www, or exit 1
#   srv_session                    sid: a session of root from 127.0.0.1
#   srv_request_count              processes serving a request of this server
#                                  now (velascgi programs, or velafcgi children)
#   srv_pam                        the PAM service of deploy/pam in the root
#   srv_add_user NAME PASS [GROUP] a Linux account with that password, or exit 1
#   srv_password                   a password of letters and digits only
#   srv_as_nobody CMD...           CMD as the account nobody
#   srv_wait TRIES PAUSE CMD...    CMD until it succeeds, at most TRIES times
#                                  PAUSE seconds apart (else 1)
#   srv_volume                     the first data volume of the root's
#                                  volumes.conf, as a path of this machine
#   srv_finish TEXT                exit 1 after failed checks or sanitizer
#                                  reports, else 0 printing TEXT
#
# Checks, counted in $failures:
#   fail TEXT                      one failed check
#   call CURL_ARGS...              the answer in $TMP/body, the header block in
#                                  $TMP/headers, the HTTP status in $status
#   expect NAME TEXT...            the answer holds every TEXT (compact JSON)
#   expect_header NAME HEADER...   the header block has a line starting with
#                                  each HEADER
#   expect_status NAME CODE        the HTTP status was CODE
#   expect_error NAME CODE [WORD]  the answer is error CODE, with the header
#                                  "x-request-error: WORD" when WORD is given
#   member NAME                    a string member of the answer
#   login NAME ACCOUNT PASSWORD [CURL_ARGS...]
#                                  a form login with VELA.Auth: $sid and $token
#   expect_file NAME FIELD FILE PATH
#                                  the upload answer describes PATH stored as
#                                  FILE of the form field FIELD

TMP="" ROOT="" RUN="" BASE="" URL="" LPID=""
SRV_SRC="" SRV_VELASCGI=""
SRV_USERS=() SRV_GROUPS=() SRV_ASIDE=() SRV_DAEMONS=()
SRV_BIND=${SRV_BIND:-127.0.0.1}
SRV_SERVER=${SRV_SERVER:-lighttpd}
failures=0 status=""

srv_args() {
  local names=() name path
  while [ "$1" != -- ]; do
    names+=("$1")
    shift
  done
  shift
  if [ $# -ne ${#names[@]} ]; then
    echo "usage: ${0##*/} ${names[*]}" >&2
    exit 2
  fi
  for name in "${names[@]}"; do
    path=$(realpath -e "$1") || exit 1
    printf -v "$name" '%s' "$path"
    shift
  done
}

srv_require() {
  local why=$1 tool
  shift
  for tool in "$SRV_SERVER" curl "$@"; do
    command -v "$tool" >/dev/null 2>&1 || { echo "SKIP: $tool is not installed"; exit 77; }
  done
  [ "$(id -u)" -eq 0 ] || { echo "SKIP: needs root ($why)"; exit 77; }
  srv_traps
}

srv_traps() {
  trap "${1:-:}"'; if [ "$failures" -ne 0 ]; then srv_logs; fi; srv_cleanup' EXIT
  trap 'exit 1' HUP INT TERM
}

fail() {
  echo "FAIL: $*"
  failures=$((failures + 1))
}

call() {
  status=$(curl -s --max-time 60 -D "$TMP/headers" -o "$TMP/body" -w '%{http_code}' "$@") || status="curl failed"
}

expect() {
  local name=$1 text
  shift
  for text in "$@"; do
    grep -qF -- "$text" "$TMP/body" || fail "$name: answer lacks $text: $(head -c 600 "$TMP/body")"
  done
}

expect_header() {
  local name=$1 header
  shift
  for header in "$@"; do
    grep -qi -- "^$header" "$TMP/headers" || fail "$name: no header \"$header\" in: $(tr -d '\r' <"$TMP/headers")"
  done
}

expect_status() {
  [ "$status" = "$2" ] || fail "$1: HTTP status $status, expected $2"
}

expect_error() {
  expect "$1" '"success":false'
  grep -qE "\"code\":$2[,}]" "$TMP/body" || fail "$1: not error $2: $(head -c 600 "$TMP/body")"
  [ -z "${3:-}" ] || expect_header "$1" "x-request-error: $3"
}

member() { sed -n "s/.*\"$1\":\"\\([^\"]*\\)\".*/\\1/p" "$TMP/body"; }

# (On success sets $sid and $token.)
sid="" token=""
login() {
  call "${@:4}" --data-urlencode "account=$2" --data-urlencode "passwd=$3" "$URL?api=VELA.Auth&version=1&method=login"
  sid=$(member sid) token=$(member token)
  if [ "$status" != 200 ] || ! grep -qF '"success":true' "$TMP/body" || [ -z "$sid" ] || [ -z "$token" ]; then
    fail "$1: login of $2 failed (HTTP $status): $(head -c 600 "$TMP/body")"
    return 1
  fi
}

expect_file() {
  local sum size
  read -r sum size _ < <(cksum <"$4")
  expect "$1" "{\"cksum\":$sum,\"field\":\"$2\",\"name\":\"$3\",\"size\":$size}"
}

srv_init() {
  SRV_SRC=$1 SRV_VELASCGI=$2
  if [ "${4:-}" = private ] && [ -d /run ] && [ -w /run ]; then export TMPDIR=/run; fi
  TMP=$(mktemp -d "${TMPDIR:-/tmp}/vela-e2e-XXXXXX") || return 1
  # Searchable like the real "/": what an account of the run can reach
  # below the root then depends on the modes the server gives its files.
  chmod 0755 "$TMP"
  ROOT=$TMP/root
  RUN=$TMP/run
  mkdir -p "$ROOT/usr/vela/velaman" "$ROOT/etc/vela" "$RUN/www" || return 1
  ln -s "$3" "$ROOT/usr/vela/velaman/webapi"
}

srv_pam() {
  mkdir -p "$ROOT/etc/pam.d" && cp "$SRV_SRC/deploy/pam/vela-webapi" "$ROOT/etc/pam.d/vela-webapi" || exit 1
}

srv_api() {
  local api=$ROOT/usr/vela/velaman/webapi staged
  if [ -L "$api" ]; then
    staged=$(readlink "$api")
    rm "$api" && mkdir "$api" && ln -s "$staged"/* "$api"/ || exit 1
  fi
  cat >"$api/$1.lib" || exit 1
}

# The server runs in the foreground as a child of the script, so that
# whoever ends the script's process tree ends the server as well. Another
# program may take the port between the look and the bind: then try another.
srv_launch() {
  local conf=$1 run=$2 port _
  BASE="" URL=""
  for _ in $(seq 1 20); do
    port=$((20000 + RANDOM % 40000))
    (exec 3<>"/dev/tcp/$SRV_BIND/$port") 2>/dev/null && continue
    "$conf" "$port" || return 1
    "$run" 2>>"$RUN/start.log" &
    LPID=$!
    # Up when it answers; gone (the port was taken meanwhile) when it exits.
    for _ in $(seq 1 200); do
      if ! kill -0 "$LPID" 2>/dev/null; then
        wait "$LPID" 2>/dev/null
        LPID=""
        break
      fi
      if curl -s -o /dev/null --max-time 5 "http://$SRV_BIND:$port/webapi/entry.cgi"; then
        BASE="http://$SRV_BIND:$port"
        URL="$BASE/webapi/entry.cgi"
        return 0
      fi
      sleep 0.1
    done
    srv_stop
  done
  cat "$RUN/start.log" "$RUN/error.log" 2>/dev/null
  echo "$SRV_SERVER did not start"
  return 1
}

srv_front_env() {
  local var
  printf '%s\n' "VELA_ROOT=$ROOT" "VELA_LOG_STDERR=1" "PATH=/usr/sbin:/usr/bin:/sbin:/bin"
  # Sanitizer builds: the options reach the front end too.
  for var in ASAN_OPTIONS UBSAN_OPTIONS LSAN_OPTIONS; do
    [ -z "${!var:-}" ] || printf '%s\n' "$var=${!var}"
  done
}

srv_start() {
  local docroot=$1 line
  shift
  SRV_CONF_ARGS=(--out "$RUN/lighttpd.conf" --run "$RUN" --pidfile "$RUN/lighttpd.pid" --docroot "$docroot"
                 --velascgi "$SRV_VELASCGI" --bind "$SRV_BIND" "$@")
  while IFS= read -r line; do
    SRV_CONF_ARGS+=(--env "$line")
  done < <(srv_front_env)
  srv_launch srv_lighttpd_conf srv_lighttpd_run
}
srv_lighttpd_conf() { "$SRV_SRC/scripts/lighttpd-conf.sh" "${SRV_CONF_ARGS[@]}" --port "$1"; }
srv_lighttpd_run() { exec lighttpd -D -f "$RUN/lighttpd.conf"; }

srv_daemon() {
  local name=$1
  shift
  "$@" >>"$RUN/$name.log" 2>&1 &
  SRV_DAEMONS+=($!)
}

srv_serve() {
  srv_start "$RUN/www" "$@" || { failures=1; exit 1; }
}

# By executable and by ancestry, since other tests run servers of their own
# at the same time: a velascgi program is lighttpd's child; a velafcgi child
# is the child of a parent, the child of the master lighttpd started. (The
# processes rename themselves after the API they serve.)
srv_request_count() {
  local dir n=0 exe want depth=1 pid i
  if [ "${VELA_FRONT_END:-fcgi}" = fcgi ]; then
    want=$(dirname "$SRV_VELASCGI")/velafcgi depth=3
  else
    want=$SRV_VELASCGI
  fi
  for dir in /proc/[0-9]*; do
    exe=$(readlink "$dir/exe" 2>/dev/null) || continue
    [ "$exe" = "$want" ] || continue
    pid=${dir#/proc/}
    for ((i = 0; i < depth; i++)); do
      pid=$(awk '/^PPid:/ { print $2 }' "/proc/$pid/status" 2>/dev/null) || break
    done
    [ "$pid" = "$LPID" ] && n=$((n + 1))
  done
  echo "$n"
}

srv_session() {
  sid=$(VELA_ROOT=$ROOT "$VELAADM" session create root --ip 127.0.0.1 | sed -n 's/^sid=//p')
  [ -n "$sid" ] || fail "velaadm created no session"
}

srv_aside() {
  SRV_ASIDE+=("$LPID" "$TMP")
  TMP="" ROOT="" RUN="" BASE="" URL="" LPID=""
}

srv_stop() {
  [ -n "$LPID" ] || return 0
  kill -TERM "$LPID" 2>/dev/null
  wait "$LPID" 2>/dev/null
  LPID=""
}

srv_logs() {
  local log
  for log in start.log error.log cgi.log velafcgi.log fcgiwrap.log; do
    [ -s "$RUN/$log" ] && echo "---- $log (last 100 lines)" && tail -n 100 "$RUN/$log"
  done
}

# A group made for the run is removed again; an existing one is left alone.
srv_add_user() {
  local name=$1 pass=$2 group=${3:-}
  local args=(-M -N -s /usr/sbin/nologin)
  if [ -n "$group" ] && ! getent group "$group" >/dev/null; then
    groupadd "$group" || { fail "cannot create the group $group"; exit 1; }
    SRV_GROUPS+=("$group")
  fi
  [ -z "$group" ] || args+=(-G "$group")
  useradd "${args[@]}" "$name" || { fail "cannot create the account $name"; exit 1; }
  SRV_USERS+=("$name")
  printf '%s:%s\n' "$name" "$pass" | chpasswd || { fail "cannot set the password of $name"; exit 1; }
}

srv_as_nobody() { setpriv --reuid=nobody --regid="$(id -g nobody)" --clear-groups "$@"; }

srv_wait() {
  local tries=$1 pause=$2 _
  shift 2
  for _ in $(seq 1 "$tries"); do
    "$@" && return 0
    sleep "$pause"
  done
  return 1
}

srv_volume() {
  local line
  while IFS= read -r line || [ -n "$line" ]; do
    case "$line" in
      /*) echo "${ROOT%/}$line"; return 0 ;;
    esac
  done <"$ROOT/etc/vela/volumes.conf"
  return 1
}

# (No character that needs quoting in a form or a shell.)
srv_password() {
  printf 'Pw%s' "$(head -c 64 /dev/urandom | base64 -w0 | tr -dc 'A-Za-z0-9' | head -c 20)"
}

srv_sanitizer_clean() {
  ! grep -qE 'AddressSanitizer|LeakSanitizer|runtime error:' "$RUN/error.log" "$RUN/cgi.log" 2>/dev/null
}

srv_finish() {
  srv_sanitizer_clean || fail "sanitizer reports in the logs"
  [ "$failures" -eq 0 ] || { echo "$failures check(s) failed"; exit 1; }
  echo "$1"
  exit 0
}

srv_cleanup() {
  local name i
  srv_stop
  for ((i = 0; i < ${#SRV_ASIDE[@]}; i += 2)); do
    LPID=${SRV_ASIDE[i]}
    srv_stop
    [ -n "${SRV_ASIDE[i + 1]}" ] && rm -rf "${SRV_ASIDE[i + 1]}"
  done
  SRV_ASIDE=()
  for i in "${SRV_DAEMONS[@]+"${SRV_DAEMONS[@]}"}"; do
    kill -TERM "$i" 2>/dev/null
    wait "$i" 2>/dev/null
  done
  SRV_DAEMONS=()
  for name in "${SRV_USERS[@]+"${SRV_USERS[@]}"}"; do
    userdel "$name" 2>/dev/null
  done
  for name in "${SRV_GROUPS[@]+"${SRV_GROUPS[@]}"}"; do
    groupdel "$name" 2>/dev/null
  done
  SRV_USERS=() SRV_GROUPS=()
  [ -n "$TMP" ] && rm -rf "$TMP"
  TMP=""
}
