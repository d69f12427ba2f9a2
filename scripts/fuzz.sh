#!/usr/bin/env bash
# Builds the libFuzzer targets of the untrusted-file readers (property lists,
# the migration marker, Info.plist) with clang and the address and
# undefined-behaviour sanitizers in build-fuzz/, and runs each for SECONDS
# (default 30) from a seed corpus made here.
#   scripts/fuzz.sh [SECONDS]          the bounded run of scripts/test.sh
#   scripts/fuzz.sh 3600               a longer run by hand; the corpus grows in build-fuzz/corpus
# A crash, leak, hang (a single input over 10 s) or sanitizer report fails the
# run; the offending input is left in build-fuzz/artifacts/. Prints how many
# inputs each target tried.
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-30}
dir=build-fuzz
CC=clang-14 CXX=clang++-14 cmake -S . -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DQS_SANITIZE=address,undefined -DQS_BUILD_TESTS=OFF -DQS_BUILD_FUZZ=ON >/dev/null
targets=(property_list_reader marker_reader info_plist_reader)
cmake --build "$dir" -j "${QS_JOBS:-2}" --target "${targets[@]/#/fuzz_}"

# Seeds: XML and binary forms of a marker, an Info.plist and a map.
mkdir -p "$dir/corpus" "$dir/artifacts"
python3 - "$dir/corpus" <<'PY'
import plistlib, sys, os
out = sys.argv[1]
c = "/tmp/qs-fuzz/private/var/mobile/Applications/C"
docs = {
  "marker": {"ContainerPath": c, "BundlePath": c + "/A.app", "BundleIdentifier": "com.example.a",
             "ContainerType": "App", "SecondBundlePath": c + "/Staging/Payload/T.vpnplugin"},
  "info": {"RkBundleIdentifier": "com.example.a", "RkBundleVersion": "1.2.3", "RkBundleExecutable": "A",
           "RkApplicationGroups": ["group.a", "group.b"], "RkNoDataContainer": False, "RkBundleIconFile": "Icon.png"},
  "map": {"GroupContainers": {"group.a": {"Container": "/private/var/mobile/Library/AppGroups/X"}},
          "User": {"com.example.a": {"Container": c}}, "n": [1, -1, 2**64 - 1, 1.5, b"\x00\x01", True]},
}
for name, doc in docs.items():
  for fmt, suffix in ((plistlib.FMT_XML, "xml"), (plistlib.FMT_BINARY, "bin")):
    with open(os.path.join(out, f"{name}.{suffix}"), "wb") as f: plistlib.dump(doc, f, fmt=fmt)
PY

export ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1
total=0
for target in "${targets[@]}"; do
  mkdir -p "$dir/corpus/$target"
  cp -n "$dir"/corpus/*.xml "$dir"/corpus/*.bin "$dir/corpus/$target/" 2>/dev/null || true
  log="$dir/artifacts/$target.log"
  "$dir/bin/fuzz_$target" "$dir/corpus/$target" -max_total_time="$seconds" -timeout=10 -rss_limit_mb=2048 \
    -max_len=65536 -print_final_stats=1 -artifact_prefix="$dir/artifacts/$target-" >"$log" 2>&1 || {
    echo "fuzz: $target failed; see $log"; tail -30 "$log"; exit 1; }
  runs=$(sed -n 's/^stat::number_of_executed_units: *\([0-9]*\)/\1/p' "$log")
  echo "fuzz: $target: $runs inputs, no crash, no hang"
  total=$((total + runs))
done
echo "fuzz: $total inputs in all"
