#!/usr/bin/env bash
# Installs the Debian packages that building, testing and benchmarking need, and
# nothing else. Idempotent: when everything is present it prints nothing and
# returns at once.
set -euo pipefail

packages=(
  cmake ninja-build g++ ccache
  libsqlite3-dev
  libflatbuffers-dev flatbuffers-compiler
  libgtest-dev libgmock-dev
  libbenchmark-dev
)

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed'; then
    missing+=("$p")
  fi
done
[ ${#missing[@]} -eq 0 ] && exit 0

echo "setup: installing ${missing[*]}"
sudo=""
[ "$(id -u)" -ne 0 ] && sudo="sudo"
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update -qq
$sudo apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
