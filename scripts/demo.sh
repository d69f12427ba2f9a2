#!/usr/bin/env bash
# The demonstration: builds everything, makes a device image of 200
# applications in the old layout, shows transvale's plan for it (which changes
# nothing), migrates it while showing progress, shows the outcome report,
# verifies every file against the image's manifest and prints a summary.
# Exits non-zero when any step fails.
#
#   scripts/demo.sh                 image under a fresh temporary directory
#   QS_DEMO_ROOT=DIR scripts/demo.sh   image in DIR (must not hold one yet)
#   QS_DEMO_APPS=N scripts/demo.sh     another number of applications
set -euo pipefail
cd "$(dirname "$0")/.."

apps="${QS_DEMO_APPS:-200}"
jobs="${QS_JOBS:-$(nproc)}"

step() { printf '\n== %s\n' "$*"; }
die() { printf 'demo: %s\n' "$*" >&2; exit 1; }

step "Dependencies"
scripts/deps.sh

step "Build (Release)"
build=build-demo
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Release -DQS_BUILD_TESTS=OFF >/dev/null
cmake --build "$build" -j "$jobs" --target transvale devicegen appregistry AppMigrator
bin="$build/bin"
for program in transvale devicegen appregistry; do
  [ -x "$bin/$program" ] || die "$bin/$program was not built"
done

root="${QS_DEMO_ROOT:-$(mktemp -d "${TMPDIR:-/tmp}/quillset-demo.XXXXXX")}"
mkdir -p "$root"
root="$(cd "$root" && pwd -P)"
image="$root/device"
export TMPDIR="$root/tmp"
mkdir -p "$TMPDIR"

groups=$((apps / 8 > 0 ? apps / 8 : 1))
vpn=$((apps / 20))
harbors=$((apps / 25))
placeholders=$((apps / 40))
older=$((apps / 50))

step "Device image: $apps applications"
"$bin/devicegen" create --root "$image" --apps "$apps" --vpn-only "$vpn" --groups "$groups" \
  --harbors "$harbors" --placeholders "$placeholders" --builtin-older "$older" --seed 2026

step "Plan (a dry run: nothing on disk changes)"
plan="$root/plan.txt"
"$bin/transvale" --root "$image" --plan > "$plan"
head -n 20 "$plan"
echo "  ... ($(wc -l < "$plan") lines in $plan)"
sed -n '/^Discarded for good/,$p' "$plan"
"$bin/transvale" --root "$image" --plan --json > "$root/plan.json"

step "Migration"
log="$root/transvale.log"
report="$root/report.json"
start=$(date +%s.%N)
set +e
"$bin/transvale" --root "$image" --log "$log" --progress always --report "$report"
status=$?
set -e
end=$(date +%s.%N)
seconds=$(awk -v s="$start" -v e="$end" 'BEGIN { printf "%.2f", e - s }')
if [ "$status" -ne 0 ]; then
  printf 'demo: transvale exited with %d; the last lines of %s:\n' "$status" "$log" >&2
  tail -n 20 "$log" >&2
  exit 1
fi

step "Outcome report ($report)"
sed -n '1,/"entries": \[/p' "$report" | head -n 20
if command -v python3 >/dev/null; then
  python3 - "$report" <<'PY'
import json, sys
report = json.load(open(sys.argv[1]))
for entry in report["entries"]:
    if entry["outcome"] != "migrated":
        print(f'  {entry["outcome"]:8} {entry["identifier"] or entry["path"]}: {entry["reason"]}')
PY
fi

step "Verification"
verify_output="$root/verify.txt"
if ! "$bin/devicegen" verify --root "$image" | tee "$verify_output"; then
  die "devicegen verify found problems (see above)"
fi

step "Summary"
# The run succeeded, so every container it started was migrated.
apps_migrated=$(grep -c 'QSAppMigrator: Migrating .* at .*\.app$' "$log" || true)
vpn_migrated=$(grep -c 'QSAppMigrator: Migrating .* at .*\.vpnplugin$' "$log" || true)
files=$(sed -n 's/^ *files: \([0-9]*\) (\([0-9]*\) bytes).*/\1/p' "$verify_output" | head -1)
bytes=$(sed -n 's/^ *files: \([0-9]*\) (\([0-9]*\) bytes).*/\2/p' "$verify_output" | head -1)
records=$("$bin/appregistry" list --root "$image" | sed -n 's/^\([0-9][0-9]*\) records\{0,1\}$/\1/p')
printf 'applications migrated:    %s (of %s in the image)\n' "$apps_migrated" "$apps"
printf 'VPN-only containers:      %s\n' "$vpn_migrated"
printf 'registry records now:     %s\n' "${records:-?}"
printf 'files moved:              %s\n' "${files:-?}"
printf 'bytes moved:              %s\n' "${bytes:-?}"
printf 'migration time:           %s s\n' "$seconds"
printf 'image:                    %s\n' "$image"
printf 'log:                      %s\n' "$log"
