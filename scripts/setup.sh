#!/usr/bin/env bash
# Installs the Debian packages that building, testing and benchmarking need, and
# nothing else. Idempotent: when everything is present it prints nothing and
# returns at once.
#
#   scripts/setup.sh [CONFIGURATION...]
#
# The clang configuration adds clang. A cross configuration named (aarch64,
# armhf) adds its cross compiler, qemu-user and, from Debian's multiarch
# packages for the target, the runtime libraries the tests load (C++ runtime,
# SQLite) and GoogleTest's static libraries. Only runtime packages are taken for the target: SQLite's and
# FlatBuffers' headers are the build machine's, which the cross compiler also
# reads, and the target's -dev packages would pull in a chain of packages that
# must match the build machine's versions one for one.
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/common.sh"

packages=(
  cmake ninja-build g++ ccache
  libsqlite3-dev
  libflatbuffers-dev flatbuffers-compiler
  libgtest-dev libgmock-dev
  libbenchmark-dev
)
foreign_archs=()
for config in "$@"; do
  if [ "$config" = clang ]; then packages+=(clang); fi
  arch="$(cross_debian_arch "$config")"
  [ -n "$arch" ] || continue
  foreign_archs+=("$arch")
  packages+=("g++-$(cross_triple "$config")" qemu-user
    "libstdc++6:$arch" "libsqlite3-0:$arch" "libgtest-dev:$arch" "libgmock-dev:$arch")
done

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
for arch in "${foreign_archs[@]}"; do
  dpkg --print-foreign-architectures | grep -qx "$arch" || $sudo dpkg --add-architecture "$arch"
done
# A mirror part-way through a sync can fail one architecture's index while the
# others are fine; the install below then says whether what it needs is there.
$sudo apt-get update -qq || echo "setup: some package indexes could not be updated" >&2
$sudo apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
