# Sourced by start.sh and stop.sh (with $repo set and a die function): where
# the web server's files are.
#   build    the build directory: VELA_BUILD_DIR, else build
#   run      the generated configuration, the error log, upload buffers
#   root     the system root: VELA_ROOT when set; "/" when the web-API
#            directory is installed there; otherwise build/root, where the
#            build stages it
#   pidfile  <root>/run/lighttpd.pid, where the platform's web-server
#            control (restart after a reply) looks for it by default

build="${VELA_BUILD_DIR:-$repo/build}"
case "$build" in
  /*) ;;
  *) build="$repo/$build" ;;
esac
run="$build/run"
if [ -n "${VELA_ROOT:-}" ]; then
  root="$VELA_ROOT"
elif [ -f /usr/vela/velaman/webapi/lib.def ]; then
  root=/
else
  root="$build/root"
fi
case "$root" in
  /*) ;;
  *) die "VELA_ROOT \"$root\" is not an absolute path" ;;
esac
while [ "$root" != / ] && [ "${root%/}" != "$root" ]; do
  root="${root%/}"
done
if [ "$root" = / ]; then
  pidfile=/run/lighttpd.pid
else
  pidfile="$root/run/lighttpd.pid"
fi

# The pid of the lighttpd named by the pid file, if it runs; fails otherwise.
running_pid() {
  local pid
  [ -f "$pidfile" ] || return 1
  pid="$(head -c 32 "$pidfile" | tr -d '[:space:]')"
  case "$pid" in
    '' | *[!0-9]*) return 1 ;;
  esac
  [ "$(cat "/proc/$pid/comm" 2>/dev/null)" = lighttpd ] || return 1
  echo "$pid"
}

# The data volumes of <root>/etc/vela/volumes.conf that exist, resolved under
# the root, one per line (the platform skips the same entries).
volume_dirs() {
  local conf="$root/etc/vela/volumes.conf" line dir
  [ -f "$conf" ] || return 0
  while IFS= read -r line || [ -n "$line" ]; do
    line="${line#"${line%%[![:space:]]*}"}"
    line="${line%"${line##*[![:space:]]}"}"
    case "$line" in
      '' | '#'*) continue ;;
      /*) ;;
      *) continue ;;
    esac
    case "$line/" in *'/../'*) continue ;; esac
    if [ "$root" = / ]; then dir="$line"; else dir="$root$line"; fi
    [ -d "$dir" ] && echo "$dir"
  done <"$conf"
  return 0
}
