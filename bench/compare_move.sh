#!/usr/bin/env bash
# Moves of trees to another file system: QSFileManager::moveItemAtURL against
# `cp -a` + `rm -rf` (bench_file_layer_move), tmpfs to tmpfs and ext4 to
# tmpfs, for many small files, a few large ones and one large sparse file.
# Both sides run the same number of repetitions in a random interleaved
# order; the median of the repetitions counts. Prints a Markdown table and
# exits non-zero when QSFileManager is slower on any line.
#   bench/compare_move.sh [BUILD_DIR]     (default: build; needs QS_BUILD_BENCH=ON)
#   QS_BENCH_REPETITIONS=5                repetitions of each (5 iterations each)
# Runs as root: the second tmpfs is mounted by the benchmark.
set -euo pipefail
cd "$(dirname "$0")/.."
build="${1:-build}"
bench="$build/bin/bench_file_layer_move"
repetitions="${QS_BENCH_REPETITIONS:-5}"

if [[ ! -x "$bench" ]]; then
  echo "missing $bench: configure with -DQS_BUILD_BENCH=ON and build the target bench_file_layer_move" >&2
  exit 2
fi

csv="$("$bench" --benchmark_repetitions="$repetitions" --benchmark_enable_random_interleaving=true \
  --benchmark_report_aggregates_only=true --benchmark_format=csv 2>/dev/null)"
if printf '%s\n' "$csv" | grep -q 'true,"'; then
  echo "a benchmark failed:" >&2
  printf '%s\n' "$csv" >&2
  exit 1
fi

# Rows: "BM_<side>/route:R/shape:S/iterations:5/real_time_median",iterations,real_time,...
printf '%s\n' "$csv" | awk -F, '
  $1 ~ /_median"$/ {
    split($1, part, "/")
    side = part[1]; sub(/^"/, "", side)
    key = part[2] "/" part[3]
    time[side, key] = $3
    keys[key] = 1
  }
  END {
    route["route:0"] = "tmpfs to tmpfs"; route["route:1"] = "ext4 to tmpfs"
    shape["shape:0"] = "10 x 100 x 4 KiB"; shape["shape:1"] = "4 x 4 x 16 MiB"; shape["shape:2"] = "1 GiB, two 4 KiB extents"
    print "| Route | Tree | moveItemAtURL (ms) | cp -a + rm -rf (ms) | Ratio |"
    print "|---|---|---|---|---|"
    slower = 0
    for (r = 0; r <= 1; ++r) for (s = 0; s <= 2; ++s) {
      key = "route:" r "/shape:" s
      if (!(key in keys)) continue
      ours = time["BM_MoveItemAtURL", key]; theirs = time["BM_CoreutilsCpARmRf", key]
      ratio = ours / theirs
      if (ratio > 1.0) slower = 1
      printf "| %s | %s | %.1f | %.1f | %.2f |\n", route["route:" r], shape["shape:" s], ours, theirs, ratio
    }
    exit slower
  }'
