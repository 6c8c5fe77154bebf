#!/usr/bin/env bash
# Installs the Debian packages this project needs that the machine lacks.
set -euo pipefail
packages=(cmake ninja-build g++ clang libclang-rt-14-dev pkg-config sqlite3 libsqlite3-dev libplist-dev libplist-utils
  nlohmann-json3-dev libssl-dev libcli11-dev libgtest-dev libgmock-dev libbenchmark-dev
  libxml2-dev libnvme-dev libsystemd-dev faketime)
missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
  sudo=""
  [ "$(id -u)" -ne 0 ] && sudo=sudo
  echo "installing: ${missing[*]}"
  $sudo apt-get update -qq
  DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -qq --no-install-recommends "${missing[@]}"
fi
