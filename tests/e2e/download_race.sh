#!/usr/bin/env bash
# End-to-end: a download raced by the owner of the folder it comes from.
# The sample serves <volume>/sample/file.txt from a folder that "nobody"
# owns, while a loop running as "nobody" keeps replacing the file by a
# symbolic link to a file only root may read, and back, by renames.
# Hundreds of downloads, streamed by velascgi and with X-Sendfile on: no
# answer may carry the root-only content. (Which paths X-Sendfile may take:
# platform/transfer/HttpFileOutputerTest.cpp.) A fifth argument: the
# downloads per mode (250).
set -u

. "$(dirname "$0")/server.sh"
REQUESTS=${5:-250}
srv_args VELASCGI VELAADM WEBAPI SRC -- "${@:1:4}"
srv_require "a root-only file, an unprivileged account, identity switches" perl setpriv
srv_traps stop_swapper
SWAPPER=""
stop_swapper() {
  [ -n "$SWAPPER" ] || return 0
  kill "$SWAPPER" 2>/dev/null
  wait "$SWAPPER" 2>/dev/null
  SWAPPER=""
}

srv_init "$SRC" "$VELASCGI" "$WEBAPI" private || exit 1
mkdir -p "$ROOT/vol1/sample"
echo /vol1 >"$ROOT/etc/vela/volumes.conf"
DIR=$ROOT/vol1/sample
SECRET=$TMP/secret
secret_text="ROOT-ONLY-$(head -c 24 /dev/urandom | base64 -w0 | tr -dc 'A-Za-z0-9')"
(umask 077 && printf '%s\n' "$secret_text" >"$SECRET")
printf 'public\n' >"$DIR/file.txt"
chown -R nobody "$DIR"
srv_as_nobody test -r "$SECRET" &&
  { fail "nobody can read the secret: the test proves nothing"; exit 1; }

srv_serve --xsendfile-dir "$ROOT/vol1"
srv_session
DOWNLOAD="$URL?api=VELA.Sample&version=1&method=download&name=file.txt"

# The swap, as "nobody", in one of two ways:
#   exchange  file.txt and a link to the secret trade places flat out with
#             renameat2(RENAME_EXCHANGE), one system call a swap: best at
#             velascgi's own window of a few microseconds (two renames each
#             way where the call is missing);
#   renew     a fresh file, then a fresh link, each renamed over file.txt and
#             left there for 0 or 0.3 ms at random: best at the later open
#             of an X-Sendfile path by the web server.
# It ends itself after two minutes at the latest.
start_swapper() {
  setpriv --reuid=nobody --regid="$(id -g nobody)" --clear-groups perl -e '
    my ($dir, $secret, $how) = @ARGV;
    alarm 120;
    my ($file, $link) = ("$dir/file.txt", "$dir/.l");
    sub fresh {
      open(my $f, ">", "$dir/.f") or die "create: $!";
      print $f "public\n";
      close($f) or die "write: $!";
      rename("$dir/.f", $file) or die "rename: $!";
    }
    sub linked {
      unlink($link);
      symlink($secret, $link) or die "symlink: $!";
      rename($link, $file) or die "rename: $!";
    }
    sub pause { select(undef, undef, undef, 0.0003) if rand() < 0.5; }
    fresh();
    if ($how eq "exchange") {
      unlink($link);
      symlink($secret, $link) or die "symlink: $!";
      my $nr = eval { require "syscall.ph"; &SYS_renameat2 };
      my $swap = sub { defined($nr) && syscall($nr, -100, $file, -100, $link, 2) == 0 };
      unless ($swap->()) {
        $swap = sub {
          rename($file, "$dir/.f") && rename($link, $file) && rename("$dir/.f", $link);
        };
      }
      for (;;) { $swap->() or die "swap: $!"; }
    }
    for (;;) { fresh(); pause(); linked(); pause(); }
  ' "$DIR" "$SECRET" "$1" &
  SWAPPER=$!
}

# race MODE HOW: REQUESTS downloads through one curl, one answer file each,
# against the swap HOW; counts the answers that leaked the secret, delivered
# the public file, or were refused with the sample's JSON error.
race() {
  local mode=$1 answers=$TMP/answers-$1 leaked=0 served=0 refused=0 other=0 f
  mkdir -p "$answers"
  start_swapper "$2"
  curl -s --max-time 120 --cookie "id=$sid" -o "$answers/#1" "$DOWNLOAD&try=[1-$REQUESTS]"
  kill -0 "$SWAPPER" 2>/dev/null || fail "$mode: the swapping loop stopped early"
  stop_swapper
  for f in "$answers"/*; do
    if grep -qF "$secret_text" "$f"; then
      leaked=$((leaked + 1))
    elif [ "$(cat "$f")" = public ]; then
      served=$((served + 1))
    elif grep -qF '"success":false' "$f"; then
      refused=$((refused + 1))
    else
      other=$((other + 1))
    fi
  done
  echo "$mode: $REQUESTS downloads: $leaked leaked the secret, $served served the file, $refused refused, $other other"
  [ "$leaked" -eq 0 ] || fail "$mode: $leaked of $REQUESTS answers carried the root-only file"
  [ $((leaked + served + refused + other)) -eq "$REQUESTS" ] || fail "$mode: answers missing"
  # Both states of the file were met, or the race was never run.
  [ "$served" -gt 0 ] && [ "$refused" -gt 0 ] || fail "$mode: the swap was not raced (served $served, refused $refused)"
}

race streamed exchange
echo 'xsendfile="yes"' >"$ROOT/etc/vela/webapi.conf"
race x-sendfile renew

srv_finish "no download leaked the root-only file ($URL)"
