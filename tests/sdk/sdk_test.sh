#!/bin/sh
# Installs the build into a temporary prefix and builds and tests the
# handler template against that installed tree, once through the CMake
# package and once through pkg-config; checks on the way that the library,
# headers, programs, web-API directory and deploy files were installed, and
# (as root) that the installed velarun serves the template's API.
#
#   sdk_test.sh <build dir> <source dir> <cmake> <ctest>
#
# Exit status 77 (skipped) when pkg-config or a C++ compiler is missing.
set -eu
build=$1 source=$2 cmake=$3 ctest=$4
template=$source/sdk/handler-template

command -v pkg-config >/dev/null 2>&1 || { echo "SKIP: no pkg-config"; exit 77; }
command -v "${CXX:-c++}" >/dev/null 2>&1 || { echo "SKIP: no C++ compiler"; exit 77; }

tmp=$(mktemp -d "${TMPDIR:-/tmp}/vela-sdk.XXXXXX")
trap 'rm -rf "$tmp"' EXIT
prefix=$tmp/prefix

fail() { echo "FAILED: $*" >&2; exit 1; }

"$cmake" --install "$build" --prefix "$prefix" >"$tmp/install.log" 2>&1 || { cat "$tmp/install.log"; fail "install"; }
# Nothing outside the prefix.
if grep -v "^-- Install configuration" "$tmp/install.log" | grep -v "$prefix/" | grep -q "^-- "; then
  grep -v "$prefix/" "$tmp/install.log"
  fail "installed outside the prefix"
fi

# The layout, relative to the prefix. The library directory is lib/, or
# lib/<triplet> when the build was configured for the prefix /usr.
lib=$(find "$prefix/lib" -name libwebapi-TARN5.so | head -n 1)
[ -n "$lib" ] || fail "no libwebapi-TARN5.so under $prefix/lib"
libdir=$(dirname "$lib")
if command -v readelf >/dev/null 2>&1; then
  readelf -d "$lib" | grep -q 'SONAME.*\[libwebapi-TARN5.so\]' || fail "SONAME of $lib"
fi
for f in include/webapi/APIRequest.h include/webapi/APITable.h include/vela/export.h \
         libexec/vela/velascgi libexec/vela/velafcgi sbin/velaadm sbin/velaapi bin/velarun \
         vela/velaman/webapi/lib.def vela/velaman/webapi/VELA.Sample.lib \
         vela/velaman/webapi/sample/libvela-sample.so vela/velaman/webapi/auth/libvela-auth.so \
         lib/sharing/permission_lib/sample-share.so \
         share/vela/lighttpd.conf.in share/vela/entry-cgi.conf.in share/vela/pam/vela-webapi \
         share/vela/www/login.html share/vela/www/vela.js share/vela/errors/vela-error-404.html \
         "${libdir#$prefix/}/pkgconfig/vela-webapi.pc" "${libdir#$prefix/}/cmake/VelaWebAPI/VelaWebAPIConfig.cmake"; do
  [ -e "$prefix/$f" ] || fail "not installed: $f"
done
# Every public header, and nothing else of the sources.
headers_src=$(cd "$source/include" && find webapi vela -name '*.h' | sort)
headers_dst=$(cd "$prefix/include" && find . -type f | sed 's|^\./||' | sort)
[ "$headers_src" = "$headers_dst" ] || fail "installed headers differ from include/"

# The template, through the CMake package, found in the prefix only.
"$cmake" -S "$template" -B "$tmp/b" -DCMAKE_PREFIX_PATH="$prefix" \
  -DCMAKE_FIND_USE_PACKAGE_REGISTRY=OFF >"$tmp/b.log" 2>&1 || { cat "$tmp/b.log"; fail "configure (CMake package)"; }
grep -qx "VelaWebAPI_DIR:PATH=$libdir/cmake/VelaWebAPI" "$tmp/b/CMakeCache.txt" || fail "package not from the prefix"
"$cmake" --build "$tmp/b" >>"$tmp/b.log" 2>&1 || { cat "$tmp/b.log"; fail "build (CMake package)"; }
"$ctest" --test-dir "$tmp/b" --output-on-failure || fail "template tests (CMake package)"

# The installed dispatcher serves the template's API from its description
# and library (its calls switch identity, so as root only).
if [ "$(id -u)" -eq 0 ]; then
  root=$tmp/root
  mkdir -p "$root/usr/vela/velaman/webapi"
  cp "$prefix/vela/velaman/webapi/lib.def" "$root/usr/vela/velaman/webapi/"
  got=$(printf '%s' '{"getParam": {"api": "VELA.Greet", "version": 1, "method": "greet", "name": "ann", "port": 8080}}' |
    LD_LIBRARY_PATH="$libdir" VELA_ROOT="$root" "$prefix/bin/velarun" -C "$tmp/b/webapi") || fail "velarun: $got"
  [ "$got" = '{"data":{"hello":"ann","port":8080,"user":""},"httpd_restart":false,"success":true}' ] ||
    fail "velarun answered $got"
else
  echo "not root: the call through the installed velarun is left out"
fi

# The same through pkg-config.
PKG_CONFIG_PATH="$libdir/pkgconfig${PKG_CONFIG_PATH:+:$PKG_CONFIG_PATH}"
export PKG_CONFIG_PATH
[ "$(pkg-config --variable=includedir vela-webapi)" = "$prefix/include" ] || fail "includedir of vela-webapi.pc"
"$cmake" -S "$template" -B "$tmp/p" -DGREET_USE_PKGCONFIG=ON >"$tmp/p.log" 2>&1 || { cat "$tmp/p.log"; fail "configure (pkg-config)"; }
"$cmake" --build "$tmp/p" >>"$tmp/p.log" 2>&1 || { cat "$tmp/p.log"; fail "build (pkg-config)"; }
"$ctest" --test-dir "$tmp/p" --output-on-failure || fail "template tests (pkg-config)"
echo "SDK installed in a prefix, template built and tested"
