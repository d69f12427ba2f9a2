#!/usr/bin/env bash
# Installs the Debian packages the build needs, and nothing when all are there.
set -euo pipefail
packages=(cmake ninja-build g++ pkg-config libplist-dev libexpat1-dev libpng-dev libcairo2-dev libssl-dev libsqlite3-dev
          libcli11-dev libgtest-dev libgmock-dev libbenchmark-dev xfsprogs help2man python3 dpkg-dev file clang-14
          libclang-rt-14-dev)
missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
done
if ((${#missing[@]})); then
  echo "deps: installing ${missing[*]}"
  sudo_cmd=""
  [ "$(id -u)" -eq 0 ] || sudo_cmd="sudo"
  export DEBIAN_FRONTEND=noninteractive
  $sudo_cmd apt-get update -qq || true
  $sudo_cmd apt-get install -y -qq "${missing[@]}"
fi
