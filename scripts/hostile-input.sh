#!/usr/bin/env bash
# Hostile and corrupt input, one case at a time: each case makes a small
# device image, replaces one file (or path) by something an application or a
# bad disk could have put there, runs transvale under a timeout and checks
#   - the exit status and a log line the case expects,
#   - no hang (the timeout is a failure),
#   - nothing outside the device root changed (a sentinel tree is compared),
#   - no user file lost (every user file's digest is still somewhere under
#     the root, migrated, kept or recovered).
#   scripts/hostile-input.sh BUILD_DIR [CASE...]
# Prints one line per case and a summary; exits 1 when any case failed.
set -uo pipefail
build=${1:?usage: hostile-input.sh BUILD_DIR [CASE...]}
shift
bin="$build/bin"
limit=${QS_HOSTILE_TIMEOUT:-120}
work=$(mktemp -d "${TMPDIR:-/tmp}/qs-hostile.XXXXXX") && [[ -d "$work" ]] || { echo "hostile-input: no work directory" >&2; exit 1; }
trap 'rm -rf "$work"' EXIT

# --- helpers --------------------------------------------------------------------
apps() { find "$root/private/var/mobile/Applications" -mindepth 1 -maxdepth 1 -type d | sort; }
first_app_bundle() { find "$root/private/var/mobile/Applications" -mindepth 2 -maxdepth 2 -name '*.app' | sort | head -1; }
set_key() {  # set_key PLIST KEY STRING: replaces or adds a string entry of the root dictionary
  python3 - "$@" <<'PY'
import plistlib, sys
path, key, value = sys.argv[1:4]
with open(path, 'rb') as f: d = plistlib.load(f)
d[key] = value
with open(path, 'wb') as f: plistlib.dump(d, f)
PY
}
marker_for() {  # marker_for CONTAINER CONTAINERPATH BUNDLEPATH IDENTIFIER [SECOND]
  python3 - "$@" <<'PY'
import plistlib, sys
c, cp, bp, ident = sys.argv[1:5]
d = {"ContainerPath": cp, "BundlePath": bp, "BundleIdentifier": ident, "ContainerType": "App"}
if len(sys.argv) > 5: d["SecondBundlePath"] = sys.argv[5]
with open(c + "/com.vantrel.quill.set.container_migrator.plist", 'wb') as f: plistlib.dump(d, f)
PY
}
group_container() {  # group_container PATH: every group of the install map points at PATH
  refused_group=$1
  python3 - "$root/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist" "$1" <<'PY'
import plistlib, sys
path, target = sys.argv[1:3]
with open(path, 'rb') as f: d = plistlib.load(f)
for entry in d.get("GroupContainers", {}).values(): entry["Container"] = target
with open(path, 'wb') as f: plistlib.dump(d, f)
PY
}
journal_row() {  # journal_row KIND DESTINATION: a planted row of the registry's install journal
  # The registry makes its database on first use; a run on an empty root makes
  # one whose schema (tables and version, no rows) is copied into the image's.
  local empty="$work/empty-root"
  rm -rf "$empty" && mkdir -p "$empty"
  "$bin/transvale" --root "$empty" --progress never >/dev/null 2>&1
  mkdir -p "$root/private/var/db/appregistry"
  python3 - "$empty/private/var/db/appregistry/registry.sqlite" "$root/private/var/db/appregistry/registry.sqlite" \
      "$1" "$2" <<'PY'
import sqlite3, sys
made = sqlite3.connect(sys.argv[1])
db = sqlite3.connect(sys.argv[2])
for (sql,) in made.execute("SELECT sql FROM sqlite_master WHERE sql IS NOT NULL AND name NOT LIKE 'sqlite_%'"):
    db.execute(sql)
db.execute("PRAGMA user_version=%d" % made.execute("PRAGMA user_version").fetchone()[0])
db.execute("PRAGMA journal_mode=WAL")
db.execute("INSERT INTO install_journal(kind, source, destination) VALUES(?, '', ?)", (sys.argv[3], sys.argv[4]))
db.commit()
PY
  rm -rf "$empty"
}
sparse() { rm -rf "$1" && truncate -s 40G "$1"; }
fifo() { rm -rf "$1" && mkfifo "$1"; }

# --- the cases: name | expected exit status | a line the log must hold ------------
# Each mutate_<name> changes the fresh image under $root.
mutate_sparse_info_plist() { sparse "$(first_app_bundle)/Info.plist"; }
mutate_sparse_marker() { sparse "$(apps | head -1)/com.vantrel.quill.set.container_migrator.plist"; }
mutate_sparse_install_map() { sparse "$root/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist"; }
mutate_sparse_harbor_map() { sparse "$root/private/var/quilld/Library/Quillset/SafeHarbor.plist"; }
mutate_sparse_system_version() { sparse "$root/System/Library/CoreServices/SystemVersion.plist"; }
mutate_sparse_preferences() {
  mkdir -p "$root/private/var/quilld/Library/Preferences"
  sparse "$root/private/var/quilld/Library/Preferences/com.vantrel.quill.set.plist"
}
mutate_sparse_store_metadata() { sparse "$(dirname "$(first_app_bundle)")/VendraMetadata.plist"; }
mutate_fifo_icon() { fifo "$(first_app_bundle)/Icon.png"; }
mutate_fifo_named_icon() { set_key "$(first_app_bundle)/Info.plist" RkBundleIconFile Named.png && fifo "$(first_app_bundle)/Named.png"; }
mutate_link_to_fifo_icon() { local b; b=$(first_app_bundle); mkfifo "$b/pipe" && rm "$b/Icon.png" && ln -s pipe "$b/Icon.png"; }
mutate_device_icon() { local b; b=$(first_app_bundle); rm "$b/Icon.png" && ln -s /dev/zero "$b/Icon.png"; }
mutate_fifo_info_plist() { fifo "$(first_app_bundle)/Info.plist"; }
mutate_fifo_marker() { fifo "$(apps | head -1)/com.vantrel.quill.set.container_migrator.plist"; }
mutate_fifo_install_map() { fifo "$root/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist"; }
mutate_fifo_store_metadata() { fifo "$(dirname "$(first_app_bundle)")/VendraMetadata.plist"; }
mutate_garbage_info_plist() { head -c 300 /dev/urandom >"$(first_app_bundle)/Info.plist"; }
mutate_marker_container_root() { local c; c=$(apps | head -1); marker_for "$c" / "$c/X.app" com.example.planted; }
mutate_marker_container_empty() { local c; c=$(apps | head -1); marker_for "$c" "" "$c/X.app" com.example.planted; }
mutate_marker_container_other() {
  local c o; c=$(apps | head -1); o=$(apps | tail -1); marker_for "$c" "$o" "$o/X.app" com.example.planted
}
mutate_marker_bundle_builtin() {
  local c b; c=$(apps | head -1); b=$(find "$root/Applications" -maxdepth 1 -name '*.app' | head -1)
  marker_for "$c" "$c" "$b" com.example.planted
}
mutate_marker_second_outside() { local c; c=$(apps | head -1); marker_for "$c" "$c" "$c/A.app" com.example.p "$sentinel"; }
mutate_marker_names_builtin() {
  local c b id; c=$(apps | head -1); b=$(find "$root/Applications" -maxdepth 1 -name '*.app' | head -1)
  id=$(python3 -c 'import plistlib,sys; print(plistlib.load(open(sys.argv[1],"rb"))["RkBundleIdentifier"])' "$b/Info.plist")
  marker_for "$c" "$c" "$c/X.app" "$id"
}
mutate_group_root() { group_container /; }
mutate_group_device_root() { group_container "$root"; }
mutate_group_sentinel() { group_container "$sentinel"; }
mutate_group_old_applications() { group_container "$root/private/var/mobile/Applications"; }
mutate_group_builtin() { group_container "$(find "$root/Applications" -maxdepth 1 -name '*.app' | head -1)"; }
mutate_group_other_container() { group_container "$(apps | head -1)/Documents"; }
mutate_identifier_collision() {
  local a b; a=$(find "$root/private/var/mobile/Applications" -mindepth 2 -maxdepth 2 -name '*.app' | sort | head -1)
  b=$(find "$root/private/var/mobile/Applications" -mindepth 2 -maxdepth 2 -name '*.app' | sort | tail -1)
  cp "$a/Info.plist" "$b/Info.plist"
}
mutate_vpn_claims_app() {
  local a v id; a=$(first_app_bundle)
  for v in "$root"/private/var/mobile/Applications/*/*.vpnplugin; do  # a plug-in alone in its container
    compgen -G "$(dirname "$v")/*.app" >/dev/null || break
  done
  id=$(python3 -c 'import plistlib,sys; print(plistlib.load(open(sys.argv[1],"rb"))["RkBundleIdentifier"])' "$a/Info.plist")
  set_key "$v/Info.plist" RkBundleIdentifier "$id"
}
mutate_journal_remove_root() { journal_row remove /; }
mutate_journal_remove_sentinel() { journal_row remove "$sentinel"; }
mutate_journal_create_mobile() { journal_row create "$root/private/var/mobile"; }

cases=(
  "sparse_info_plist|0|Could not get identifier for bundle at"
  "sparse_marker|0|Failed to load migration marker file from"
  "sparse_install_map|0|Old install map not found"
  "sparse_harbor_map|0|Failed to load existing harbor map"
  "sparse_system_version|0|"
  "sparse_preferences|0|"
  "sparse_store_metadata|0|Failed to read"
  "fifo_icon|0|"
  "fifo_named_icon|0|"
  "link_to_fifo_icon|0|"
  "device_icon|0|"
  "fifo_info_plist|0|Could not get identifier for bundle at"
  "fifo_marker|0|Failed to load migration marker file from"
  "fifo_install_map|0|Old install map not found"
  "fifo_store_metadata|0|Failed to read"
  "garbage_info_plist|0|for recovery"
  "marker_container_root|0|is not the container it lies in"
  "marker_container_empty|0|is not the container it lies in"
  "marker_container_other|0|is not the container it lies in"
  "marker_bundle_builtin|0|does not lie inside its container"
  "marker_second_outside|0|does not lie inside its container"
  "marker_names_builtin|1|names the built-in application"
  "group_root|0|Not migrating group container"
  "group_device_root|0|Not migrating group container"
  "group_sentinel|0|Not migrating group container"
  "group_old_applications|0|Not migrating group container"
  "group_builtin|0|Not migrating group container"
  "group_other_container|0|Not migrating group container"
  "identifier_collision|1|another container of this run was already migrated as"
  "vpn_claims_app|1|another container of this run was already migrated as"
  "journal_remove_root|1|lies outside the registry's areas"
  "journal_remove_sentinel|1|lies outside the registry's areas"
  "journal_create_mobile|1|lies outside the registry's areas"
)

# Digests of the user's files (everything in the old containers but bundles,
# the harbors and the old group containers), of files under 1 MiB.
user_digests() {
  { find "$root/private/var/mobile/Applications" -type f -size -1024k -not -path '*.app/*' -not -path '*.vpnplugin/*' \
      -not -name 'com.vantrel.quill.set.container_migrator.plist' -not -name VendraMetadata.plist \
      -not -name WhereDidMyApplicationsGo.txt
    find "$root/private/var/mobile/Library/AppGroups" "$root/private/var/mobile/Library/SafeHarbors" -type f -size -1024k
  } 2>/dev/null | while read -r f; do sha256sum <"$f"; done | cut -d' ' -f1 | numbered
}
all_digests() { find "$root" -type f -size -1024k -print0 2>/dev/null | xargs -0 -r sha256sum | cut -d' ' -f1 | numbered; }
# Digests counted: the second file with one content is "<digest> 2", so a lost
# copy of a content that another file also holds still counts as lost.
numbered() { sort | awk '{ print $1 " " (++seen[$1]) }' | sort; }
snapshot() { (cd "$1" && find . -printf '%p %y %s %m\n' | sort && find . -type f -print0 | xargs -0 -r sha256sum | sort); }

failed=0 passed=0 hangs=0 lost_total=0 outside_total=0
only=("$@")
for entry in "${cases[@]}"; do
  IFS='|' read -r name expect line <<<"$entry"
  if ((${#only[@]})) && [[ ! " ${only[*]} " == *" $name "* ]]; then continue; fi
  dir="$work/$name" root="$work/$name/root" sentinel="$work/$name/outside"
  mkdir -p "$dir/tmp" "$sentinel/nested"
  echo "sentinel $name" >"$sentinel/keep.txt" && echo nested >"$sentinel/nested/deep.txt"
  "$bin/devicegen" create --root "$root" --apps 2 --vpn-only 1 --groups 1 --files-per-app 2 --harbors 1 \
    --seed 7 >/dev/null || { echo "FAIL $name: devicegen"; failed=$((failed + 1)); continue; }
  before=$(user_digests)
  outside_before=$(snapshot "$sentinel")
  refused_group=
  "mutate_$name" || { echo "FAIL $name: could not make the case"; failed=$((failed + 1)); continue; }
  # A group container the run refuses is neither measured nor planned: the
  # plan must not list it (measuring / would walk the whole machine).
  planned_refused=
  if [[ -n "$refused_group" ]]; then
    TMPDIR="$dir/tmp" timeout "$limit" "$bin/transvale" --root "$root" --plan --json >"$dir/plan.json" 2>/dev/null
    python3 - "$dir/plan.json" "$refused_group" <<'PY' || planned_refused=1
import json, sys
plan = json.load(open(sys.argv[1]))
def groups(node):
    if isinstance(node, dict):
        if "oldPath" in node and "identifier" in node and "destination" in node: yield node["oldPath"]
        for value in node.values(): yield from groups(value)
    elif isinstance(node, list):
        for value in node: yield from groups(value)
sys.exit(1 if sys.argv[2] in set(groups(plan)) else 0)
PY
  fi
  TMPDIR="$dir/tmp" timeout "$limit" "$bin/transvale" --root "$root" --log "$dir/log" --progress never \
    >"$dir/out" 2>&1 </dev/null
  status=$?
  problems=()
  [[ -n "$planned_refused" ]] && problems+=("the plan measures the refused group container $refused_group")
  if ((status == 124)); then problems+=("hang"); hangs=$((hangs + 1)); fi
  ((status > 128 && status != 124)) && problems+=("crashed with status $status")
  ((status != 124 && status <= 128 && status != expect)) && problems+=("exit $status, expected $expect")
  [[ -n "$line" ]] && ! grep -qF -- "$line" "$dir/log" && problems+=("no line \"$line\"")
  grep -qE 'AddressSanitizer|UndefinedBehaviorSanitizer|runtime error' "$dir/out" "$dir/log" 2>/dev/null &&
    problems+=("sanitizer report")
  if [[ "$(snapshot "$sentinel")" != "$outside_before" ]]; then
    problems+=("the tree outside the root changed"); outside_total=$((outside_total + 1))
  fi
  after=$(all_digests)
  lost=$(comm -23 <(sort <<<"$before") <(sort <<<"$after") | grep -c . || true)
  if ((lost > 0)); then problems+=("$lost user files lost"); lost_total=$((lost_total + lost)); fi
  if ((${#problems[@]})); then
    echo "FAIL $name: ${problems[*]} (log: $dir/log)"
    failed=$((failed + 1))
    [[ -n "${QS_HOSTILE_KEEP:-}" ]] && trap - EXIT
  else
    echo "ok   $name (exit $status)"
    passed=$((passed + 1))
  fi
  [[ -n "${QS_HOSTILE_KEEP:-}" ]] || rm -rf "$dir"
done
echo "hostile input: $((passed + failed)) cases, $passed passed, $failed failed; hangs $hangs, paths outside $outside_total, files lost $lost_total"
((failed == 0))
