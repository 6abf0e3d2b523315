# What lighttpd-conf.sh and websrv-conf.sh check and expand alike. Sourced
# after the script has defined die.

# conf_port N: a TCP port, 1 to 65535.
conf_port() {
  case "$1" in
    '' | *[!0-9]*) die "port \"$1\" is not a number" ;;
  esac
  [ "$1" -ge 1 ] && [ "$1" -le 65535 ] || die "port $1 out of range"
}

# conf_absolute PATH...: every PATH is absolute.
conf_absolute() {
  local p
  for p in "$@"; do
    case "$p" in /*) ;; *) die "\"$p\" is not an absolute path" ;; esac
  done
}

# conf_env_name NAME=VALUE: NAME is a variable's name.
conf_env_name() {
  local name="${1%%=*}"
  [ "$name" != "$1" ] && [[ "$name" =~ ^[A-Za-z_][A-Za-z0-9_]*$ ]] || die "bad --env \"$1\""
}

# conf_expand TEMPLATE COMMAND...: the lines of TEMPLATE, the line @ENTRY@
# replaced by what COMMAND prints (the front end's block).
conf_expand() {
  local template=$1 line
  shift
  while IFS= read -r line || [ -n "$line" ]; do
    if [ "$line" = "@ENTRY@" ]; then
      "$@"
    else
      printf '%s\n' "$line"
    fi
  done <"$template"
}
