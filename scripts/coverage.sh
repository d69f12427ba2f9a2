#!/usr/bin/env bash
# Line coverage of the code (not of the tests) reached by the test suites.
#   scripts/coverage.sh                 every suite
#   scripts/coverage.sh FileManager     one folder of tests/ (its ctest label)
# Builds with --coverage in build-cov/, runs the tests one at a time (the
# counters of concurrent processes would race), and writes build-cov/coverage.info
# (lcov format) with a summary per source file.
set -euo pipefail
cd "$(dirname "$0")/.."
root=$PWD
scripts/deps.sh
if ! command -v lcov >/dev/null; then
  sudo_cmd=""
  [ "$(id -u)" -eq 0 ] || sudo_cmd="sudo"
  DEBIAN_FRONTEND=noninteractive $sudo_cmd apt-get install -y -qq lcov
fi
dir=build-cov
label="${1:-}"
cmake -S . -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=Debug -DCMAKE_CXX_FLAGS=--coverage \
  -DCMAKE_EXE_LINKER_FLAGS=--coverage -DCMAKE_SHARED_LINKER_FLAGS=--coverage -DCMAKE_MODULE_LINKER_FLAGS=--coverage
cmake --build "$dir" -j "${QS_JOBS:-$(nproc)}"
find "$dir" -name '*.gcda' -delete
ctest --test-dir "$dir" --output-on-failure -j 1 --timeout 600 ${label:+-L "^${label}\$"}
# Sources are compiled from the build directory (ccache may make their names
# relative to it), so that is the base for resolving them.
lcov --quiet --capture --directory "$dir" --base-directory "$root/$dir" --output-file "$dir/all.info" \
  --ignore-errors gcov,source
lcov --quiet --extract "$dir/all.info" "$root/Platform/*" "$root/Shared/*" "$root/AppMigrator/*" "$root/Host/*" \
  "$root/Tools/*" --output-file "$dir/coverage.info"
lcov --list "$dir/coverage.info"
