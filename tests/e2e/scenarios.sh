# The scenarios every web server the project runs under is held to
# (sourced after server.sh). web_scenarios calls the server at $URL, whose
# system root is $ROOT ("/" for an installed system), as clients do, and
# counts failed checks in $failures:
#   session   a call with a session made by $VELAADM (whoami, run as nobody)
#   login     a Linux account made for the run logs in through PAM
#             (VELA.Auth), then calls with its session and token
#   upload    two files and a field to VELA.Sample's upload
#   range     VELA.Sample's download, whole (200) and one byte range (206,
#             Content-Range, the right bytes)
#   fast      with $FAST_HEADER (X-Sendfile or X-Accel-Redirect; the
#             caller configured the front end for it in webapi.conf) the
#             web server sends the file itself: the header does not reach
#             the client, the body is the file, and the answer carries an
#             ETag, which the web server makes from the file it opened and
#             the front ends never write. Empty: the front end streams the
#             file, whole, without either header or an ETag.
# Needs TMP (scratch), VELAADM, a data volume first in the root's
# volumes.conf (the downloads' files go to its folder "sample" and are
# removed again), the PAM service vela-webapi in the root (srv_pam when it
# is missing), and root (accounts).
#
#   scn_download NAME COOKIE FILE  the two downloads of "range" for FILE of
#                                  the volume's folder "sample" (the range
#                                  answer is left in $TMP/headers, body)

scn_download() {
  local name=$1 cookie=$2 file=$3 size
  local get="$URL?api=VELA.Sample&version=1&method=download&name=${file##*/}"
  size=$(stat -c %s "$file")
  call --cookie "$cookie" "$get"
  expect_status "download ($name)" 200
  cmp -s "$TMP/body" "$file" || fail "download ($name): bytes differ"
  expect_header "download ($name)" "Content-Length: $size" 'X-Content-Type-Options: nosniff'
  tail -c +1001 "$file" | head -c 1000 >"$TMP/range.expected"
  call --cookie "$cookie" -r 1000-1999 "$get"
  expect_status "range ($name)" 206
  cmp -s "$TMP/body" "$TMP/range.expected" || fail "range ($name): bytes differ"
  expect_header "range ($name)" "Content-Range: bytes 1000-1999/$size"
}

web_scenarios() {
  local cookie tag user pass volume folder made="" data nobody_uid
  nobody_uid=$(id -u nobody)

  # ---- session: a call with a session velaadm made.
  srv_session
  cookie="id=$sid"
  call --cookie "$cookie" "$URL?api=VELA.Sample&version=1&method=whoami"
  expect_status "session call" 200
  expect "session call" '"success":true' '"user":"root"' "\"uid\":[$nobody_uid,$nobody_uid,$nobody_uid]"
  call "$URL?api=VELA.Sample&version=1&method=whoami"
  expect_error "call without a session" 119 unauth

  # ---- login: a Linux account through PAM.
  [ -e "$ROOT/etc/pam.d/vela-webapi" ] || srv_pam
  tag=$(printf '%04x%04x' $RANDOM $RANDOM)
  user="vts$tag" pass=$(srv_password)
  srv_add_user "$user" "$pass"
  if login "login" "$user" "$pass"; then
    expect "login" "\"account\":\"$user\""
    call -b "id=$sid" -H "X-Vela-Token: $token" "$URL?api=VELA.Sample&version=1&method=whoami"
    expect "call with the login's session" '"success":true' "\"user\":\"$user\""
  fi

  # ---- upload: two files and a field.
  head -c 1048576 /dev/urandom >"$TMP/scn-one.bin"
  printf 'second file\r\nwith two lines\n' >"$TMP/scn-two.txt"
  call --cookie "$cookie" -F "title=Holiday 2024" -F "file1=@$TMP/scn-one.bin" \
    -F "file2=@$TMP/scn-two.txt;filename=notes.txt" "$URL?api=VELA.Sample&version=1&method=upload"
  expect_status "upload" 200
  expect "upload" '"success":true' '"fields":{"title":"Holiday 2024"}'
  expect_file "upload file1" file1 scn-one.bin "$TMP/scn-one.bin"
  expect_file "upload file2" file2 notes.txt "$TMP/scn-two.txt"

  # ---- range and fast: a file of the volume's download folder.
  if ! volume=$(srv_volume); then
    fail "no data volume in $ROOT/etc/vela/volumes.conf"
    return
  fi
  folder=$volume/sample
  [ -d "$folder" ] || { mkdir -p -m 0755 "$folder" && made=yes; } || { fail "cannot make $folder"; return; }
  data="$folder/scn-$tag.bin"
  head -c 2097152 /dev/urandom >"$data" && chmod 0644 "$data" || fail "cannot write $data"
  scn_download "range" "$cookie" "$data"

  call --cookie "$cookie" "$URL?api=VELA.Sample&version=1&method=download&name=${data##*/}"
  expect_status "fast" 200
  cmp -s "$TMP/body" "$data" || fail "fast: bytes differ"
  grep -qiE '^(X-Sendfile|X-Accel-Redirect):' "$TMP/headers" &&
    fail "fast: the front end's header reached the client: $(grep -iE '^X-(Sendfile|Accel)' "$TMP/headers")"
  if [ -n "${FAST_HEADER:-}" ]; then
    grep -qi '^ETag:' "$TMP/headers" || fail "fast: no ETag: the file did not come from the web server"
  else
    grep -qi '^ETag:' "$TMP/headers" && fail "fast: an ETag without fast output configured"
  fi
  rm -f "$data"
  [ -z "$made" ] || rmdir "$folder"
}
