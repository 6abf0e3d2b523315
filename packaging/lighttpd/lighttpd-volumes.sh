#!/bin/sh
# Prints, for lighttpd's include_shell, the X-Sendfile settings of the web
# API from the data volumes of /etc/vela/volumes.conf (one absolute path per
# line): var.vela_xsendfile is "enable" with at least one volume, else
# "disable" (lighttpd would take any path from an empty docroot list), and
# var.vela_xsendfile_docroot lists the volumes. A line that is not a plain
# absolute path (quote, backslash, control character) is left out.
conf=/etc/vela/volumes.conf
list=""
if [ -r "$conf" ]; then
  while IFS= read -r line || [ -n "$line" ]; do
    # Blanks around the path do not count, as for the framework.
    line=$(printf '%s' "$line" | sed 's/^[[:blank:]\r]*//; s/[[:blank:]\r]*$//')
    case "$line" in
      /*) ;;
      *) continue ;;
    esac
    case "$line" in
      *[\"\\]* | *[[:cntrl:]]*) continue ;;
    esac
    # A trailing slash keeps "/volume1" from also allowing "/volume10".
    case "$line" in
      */) ;;
      *) line="$line/" ;;
    esac
    list="$list\"$line\", "
  done <"$conf"
fi
if [ -n "$list" ]; then
  echo 'var.vela_xsendfile = "enable"'
else
  echo 'var.vela_xsendfile = "disable"'
fi
echo "var.vela_xsendfile_docroot = ( $list)"
