#!/usr/bin/env bash
# Compares the throughput of QSCreateSHA256Digest with coreutils' sha256sum on
# the same file, read from the page cache.
#   bench/compare_sha256.sh [BUILD_DIR]      (default: build; needs QS_BUILD_BENCH=ON)
#   QS_BENCH_SIZE_MIB=1024                   size of the file (default 1024)
#   QS_BENCH_RUNS=3                          timed runs of each, the best counts
set -euo pipefail
cd "$(dirname "$0")/.."
build="${1:-build}"
bench="$build/bin/bench_sha256"
size_mib="${QS_BENCH_SIZE_MIB:-1024}"
runs="${QS_BENCH_RUNS:-3}"
target_percent=90

if [[ ! -x "$bench" ]]; then
  echo "missing $bench: configure with -DQS_BUILD_BENCH=ON and build the target bench_sha256" >&2
  exit 2
fi

file="$(mktemp "${TMPDIR:-/tmp}/qs-sha256-compare.XXXXXX")"
trap 'rm -f "$file"' EXIT
head -c "$((size_mib * 1024 * 1024))" /dev/urandom >"$file"
cat "$file" >/dev/null  # into the page cache

# Same answer first: a fast wrong digest is worth nothing.
expected="$(sha256sum "$file" | cut -d' ' -f1)"

best_ns=""
for _ in $(seq "$runs"); do
  start="$(date +%s%N)"
  sha256sum "$file" >/dev/null
  elapsed="$(($(date +%s%N) - start))"
  if [[ -z "$best_ns" || "$elapsed" -lt "$best_ns" ]]; then best_ns="$elapsed"; fi
done
coreutils_mibs="$(awk -v b="$((size_mib * 1024 * 1024))" -v ns="$best_ns" 'BEGIN { printf "%.1f", b / (ns / 1e9) / 1048576 }')"

json="$(QS_BENCH_SHA256_FILE="$file" QS_BENCH_SHA256_EXPECTED="$expected" "$bench" --benchmark_repetitions="$runs" --benchmark_format=json 2>/dev/null)"
# The best repetition counts, as for sha256sum.
ours_bps="$(printf '%s\n' "$json" | grep '"bytes_per_second"' | sed 's/.*: *//; s/,$//' | sort -g | tail -1)"
ours_mibs="$(awk -v v="$ours_bps" 'BEGIN { printf "%.1f", v / 1048576 }')"
percent="$(awk -v a="$ours_mibs" -v b="$coreutils_mibs" 'BEGIN { printf "%.1f", 100 * a / b }')"

if printf '%s\n' "$json" | grep -q '"error_occurred": true'; then
  echo "QSCreateSHA256Digest failed or disagreed with sha256sum" >&2
  exit 1
fi

echo "file:                 ${size_mib} MiB (page cache)"
echo "sha256sum:            ${coreutils_mibs} MiB/s   digest ${expected}"
echo "QSCreateSHA256Digest: ${ours_mibs} MiB/s"
echo "ratio:                ${percent}% (target >= ${target_percent}%)"
awk -v p="$percent" -v t="$target_percent" 'BEGIN { exit !(p >= t) }'
