#!/usr/bin/env bash
# Builds the Debian package of a build tree with CPack and checks it: the
# programs, the plug-in, the manual pages and the manuals are where Debian
# puts them, and the package unpacked into a scratch root runs on its own
# (--version of each program, and a plan of a small device image with the
# plug-in found where the package installs it). Changes nothing outside a
# temporary directory, which it removes.
#   scripts/package-check.sh BUILD_DIR
set -euo pipefail
build="$(cd "${1:?usage: package-check.sh BUILD_DIR}" && pwd)"
work="$(mktemp -d "${TMPDIR:-/tmp}/qs-package.XXXXXX")"
trap 'rm -rf "$work"' EXIT
status=0
fail() {
  echo "package-check: $*" >&2
  status=1
}

if ! cpack --config "$build/CPackConfig.cmake" -B "$work/out" >"$work/cpack.log" 2>&1; then
  cat "$work/cpack.log" >&2
  fail "cpack failed"
  exit 1
fi
debs=("$work"/out/quillset_*.deb)
deb="${debs[0]}"
[ -f "$deb" ] || { fail "cpack made no quillset_*.deb"; exit 1; }
echo "package-check: $(basename "$deb"), $(stat -c %s "$deb") bytes"

# Contents: path and mode of every file. (No "grep -q" after a pipe: with
# pipefail, a writer cut off by its early exit would fail the check.)
dpkg-deb -c "$deb" | awk '{ sub(/^\./, "", $6); print $1, $6 }' >"$work/contents"
expect() {  # MODE PATH
  grep -qxF -- "$1 $2" "$work/contents" || fail "$2 is not in the package with mode $1"
}
for program in transvale devicegen appregistry; do
  expect -rwxr-xr-x "/usr/bin/$program"
  expect -rw-r--r-- "/usr/share/man/man1/$program.1.gz"
  expect -rw-r--r-- "/usr/share/doc/quillset/$program.md"
done
expect -rw-r--r-- /usr/lib/quillset/QSAppMigrator.so
# Nothing outside /usr, no build paths.
if grep -v ' /usr/' "$work/contents" >/dev/null; then fail "files outside /usr: $(grep -v ' /usr/' "$work/contents")"; fi
dpkg-deb -f "$deb" Depends | grep 'libsqlite3' >/dev/null || fail "Depends names no SQLite library: $(dpkg-deb -f "$deb" Depends)"

# The unpacked package runs from its own directories, without the build tree.
root="$work/root"
dpkg-deb -x "$deb" "$root"
unset LD_LIBRARY_PATH QS_SYSTEM_ROOT
for program in transvale devicegen appregistry; do
  version="$("$root/usr/bin/$program" --version 2>&1)" || fail "$program --version failed: $version"
  [[ "$version" =~ ^$program\ \(Quillset\)\ [0-9]+\.[0-9]+ ]] || fail "$program --version says: $version"
  if ldd "$root/usr/bin/$program" | grep -F "$build" >/dev/null; then fail "$program loads libraries from the build tree"; fi
  zcat "$root/usr/share/man/man1/$program.1.gz" | grep -i "^\.TH $program " >/dev/null ||
    fail "$program.1.gz is no manual page of $program"
done
image="$work/image"
export TMPDIR="$work"
"$root/usr/bin/devicegen" create --root "$image" --apps 2 --seed 1 >/dev/null || fail "devicegen create failed"
plan="$("$root/usr/bin/transvale" --root "$image" --plan 2>&1)" || fail "transvale --plan failed: $plan"
grep -q "placeholder then install" <<<"$plan" || fail "the plan shows no application: $plan"
"$root/usr/bin/transvale" --root "$image" --progress never >/dev/null || fail "transvale failed"
"$root/usr/bin/devicegen" verify --root "$image" >/dev/null || fail "devicegen verify failed after the migration"
"$root/usr/bin/appregistry" list --root "$image" >/dev/null || fail "appregistry list failed"

[ "$status" -eq 0 ] && echo "package-check: all checks passed"
exit "$status"
