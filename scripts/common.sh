# Shared by the build scripts: where builds go and how they are configured.
# Sourced, not run.
repo_root="$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)"
build_root="${TESSARINE_BUILD_ROOT:-$repo_root/build}"

# Compiler cache kept outside the checkout, so that a fresh clone on the same
# machine (a CI rerun) reuses earlier compilations.
export CCACHE_DIR="${CCACHE_DIR:-${XDG_CACHE_HOME:-$HOME/.cache}/tessarine/ccache}"
export CCACHE_MAXSIZE="${CCACHE_MAXSIZE:-5G}"

# configure_build NAME [cmake options...]: configures $build_root/NAME.
configure_build() {
  local name="$1"; shift
  local launcher=()
  command -v ccache >/dev/null && launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache)
  cmake -S "$repo_root" -B "$build_root/$name" -G Ninja -Wno-dev --log-level=WARNING \
    "${launcher[@]}" "$@" >/dev/null
}

# The cross configurations: aarch64 is Android's arm64-v8a ABI, armhf its
# armeabi-v7a. cross_triple CONFIG prints the GNU triple (also Debian's
# multiarch directory and the toolchain file's name, cmake/toolchains/), and
# cross_debian_arch CONFIG the Debian architecture; both print nothing for a
# native configuration.
cross_triple() {
  case "$1" in
    aarch64) echo aarch64-linux-gnu ;;
    armhf) echo arm-linux-gnueabihf ;;
  esac
}
cross_debian_arch() {
  case "$1" in
    aarch64) echo arm64 ;;
    armhf) echo armhf ;;
  esac
}

# The Kotlin compiler for the Kotlin check of the Java API: the npm registry's
# kotlin-compiler package (Debian's kotlin is too old for JDK 17), pinned,
# installed by setup.sh into the cache outside the checkout.
kotlin_version="2.4.20"
kotlin_prefix="${XDG_CACHE_HOME:-$HOME/.cache}/tessarine/kotlin-compiler-$kotlin_version"
kotlinc_path="$kotlin_prefix/node_modules/kotlin-compiler/bin/kotlinc"
