#!/usr/bin/env bash
# Installs the Debian packages that building and testing rkcache needs, and
# only those that are missing. Does nothing when everything is there.
set -euo pipefail

packages=(
  build-essential cmake ninja-build clang libclang-rt-14-dev pkg-config
  libboost-dev libboost-thread-dev libboost-system-dev libboost-date-time-dev libboost-locale-dev
  libgtest-dev libgmock-dev libbenchmark-dev
)

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$p")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  exit 0
fi

echo "Installing missing packages: ${missing[*]}"
sudo=""
if [ "$(id -u)" -ne 0 ]; then sudo="sudo"; fi
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update -q
$sudo apt-get install -y -q --no-install-recommends "${missing[@]}"
