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
  libmosquitto-dev mosquitto mosquitto-clients
  # The networked sync tests' clustered broker: three nodes with MQTT listeners.
  nats-server
  openssl
  postgresql-15 libpq-dev
)
# The Java API and its checks (plain, asan and clang configurations): the JDK,
# JUnit and npm for the Kotlin compiler; Debian's host liblog for the Android
# log path (plain); clang and libc++ (clang). The cross configurations build
# the JNI libraries, for which the JDK's headers and javac suffice.
java_packages=(openjdk-17-jdk-headless junit4)
# A Node.js installed from elsewhere brings its own npm, which Debian's npm
# package would conflict with.
command -v npm >/dev/null || java_packages+=(npm)
for config in "${@:-plain}"; do
  case "$config" in
    plain) packages+=("${java_packages[@]}" android-liblog-dev) ;;
    asan) packages+=("${java_packages[@]}") ;;
    clang) packages+=("${java_packages[@]}" clang libc++-dev libc++abi-dev) ;;
    aarch64|armhf) packages+=(openjdk-17-jdk-headless) ;;
  esac
done
foreign_archs=()
for config in "$@"; do
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
# The Kotlin compiler (common.sh) comes from npm once npm is installed.
install_kotlin() {
  case " ${*:-plain} " in *" plain "*|*" asan "*|*" clang "*) ;; *) return 0 ;; esac
  [ -x "$kotlinc_path" ] && return 0
  echo "setup: installing kotlin-compiler $kotlin_version from npm"
  npm install --silent --no-audit --no-fund --prefix "$kotlin_prefix" "kotlin-compiler@$kotlin_version" >/dev/null
}
if [ ${#missing[@]} -eq 0 ]; then
  install_kotlin "$@"
  exit 0
fi

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
install_kotlin "$@"
