#!/usr/bin/env bash
# The main job. The web server does not exist yet: until it does, this builds
# the framework and runs the demonstration, which builds a request from a
# request JSON (a built-in sample, or the file given as argument, "-" for
# standard input) and prints what a handler would see.
set -euo pipefail
cd "$(dirname "$0")/.."
./scripts/install-deps.sh
./scripts/build.sh build
exec ./build/vela-demo "$@"
