#!/usr/bin/env bash
# Installs what is missing, builds everything and runs every test.
#   scripts/test.sh                 default build in build/
#   QS_SANITIZE=address,undefined scripts/test.sh   sanitizer build in build-asan/
#   QS_SANITIZE=thread scripts/test.sh              sanitizer build in build-tsan/
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
sanitize="${QS_SANITIZE:-}"
case "$sanitize" in
  "") dir=build ;;
  thread) dir=build-tsan ;;
  *) dir=build-asan ;;
esac
jobs="${QS_JOBS:-$(nproc)}"
cmake -S . -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DQS_SANITIZE="$sanitize" -DQS_BUILD_BENCH=ON
cmake --build "$dir" -j "$jobs"
ctest --test-dir "$dir" --output-on-failure -j "$jobs" --timeout 600
# The untrusted-file readers under libFuzzer with the address and undefined
# sanitizers: a bounded run (40 s per target, three targets) in build-fuzz/.
if [ -z "$sanitize" ] && command -v clang++-14 >/dev/null; then
  scripts/fuzz.sh "${QS_FUZZ_SECONDS:-40}"
fi
