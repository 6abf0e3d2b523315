#!/usr/bin/env bash
# Line coverage of the production code by the whole test suite.
#
#   scripts/coverage.sh [BUILD_DIR]     (default: build-cov)
#
# Builds with gcov instrumentation, runs every CTest test, and prints lcov's
# summary of the production sources (tests, fuzz targets, benchmarks and
# system headers left out). The HTML report goes to BUILD_DIR/coverage/.
# Needs lcov (installed here when missing, on Debian).
set -euo pipefail
cd "$(dirname "$0")/.."
src=$(pwd)
dir="${1:-build-cov}"

if ! command -v lcov >/dev/null; then
  apt-get install -y --no-install-recommends lcov >/dev/null
fi

./scripts/build.sh "$dir" -DCMAKE_BUILD_TYPE=Debug -DVELA_COVERAGE=ON
find "$dir" -name '*.gcda' -delete
(cd "$dir" && ctest -j"$(nproc)" --output-on-failure) || echo "coverage: some tests failed; the figures below count what ran" >&2

info="$dir/coverage.info"
lcov --quiet --capture --directory "$dir" --base-directory "$src" --output-file "$info.all" \
  --ignore-errors mismatch,negative 2>/dev/null ||
  lcov --quiet --capture --directory "$dir" --base-directory "$src" --output-file "$info.all"
lcov --quiet --extract "$info.all" "$src/*" --output-file "$info.src"
lcov --quiet --remove "$info.src" "$src/tests/*" "$src/fuzz/*" "$src/bench/*" "$src/$dir/*" \
  --output-file "$info"
genhtml --quiet --output-directory "$dir/coverage" "$info" >/dev/null 2>&1 || true
lcov --summary "$info"
