#!/usr/bin/env bash
# Installs the Debian packages the build and the tests need, when missing.
# Run by every make target; does nothing on a machine that has them all.
# `install-deps.sh bench` adds the peers of the comparison benchmark.
set -euo pipefail
packages=(cmake make g++ libc-bin locales libgtest-dev libbenchmark-dev
  libcli11-dev nlohmann-json3-dev)
if [ "${1:-}" = bench ]; then
  packages+=(libsqlite3-dev liblmdb-dev)
fi
missing=()
for package in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$package" 2>/dev/null | grep -q "install ok installed" ||
    missing+=("$package")
done
if [ ${#missing[@]} -eq 0 ]; then
  exit 0
fi
echo "Installing missing packages: ${missing[*]}"
sudo_cmd=()
[ "$(id -u)" -eq 0 ] || sudo_cmd=(sudo)
"${sudo_cmd[@]}" apt-get update -qq
DEBIAN_FRONTEND=noninteractive "${sudo_cmd[@]}" apt-get install -y -qq "${missing[@]}"
