#!/usr/bin/env bash
# Sets up the machine, then builds and runs the whole test suite in each
# configuration, in this order: plain (warnings are errors; also checks the
# installed package), asan (AddressSanitizer + UndefinedBehaviorSanitizer),
# tsan (ThreadSanitizer, for the worker thread and the transport's callback
# registries), clang (clang's thread-safety analysis checks the lock
# annotations, warnings are errors), then the ARM cross builds aarch64
# (Android's arm64-v8a) and armhf (armeabi-v7a), built with Debian's cross compilers and run under
# qemu-user. Any sanitizer report fails the run.
#
#   scripts/test.sh              every configuration
#   scripts/test.sh aarch64 ...  only the named ones (plain, asan, tsan, clang, aarch64, armhf)
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/common.sh"

configs=("$@")
[ ${#configs[@]} -eq 0 ] && configs=(plain asan tsan clang aarch64 armhf)
"$repo_root/scripts/setup.sh" "${configs[@]}"

export ASAN_OPTIONS="halt_on_error=1:abort_on_error=1:detect_leaks=1:strict_string_checks=1"
export UBSAN_OPTIONS="halt_on_error=1:print_stacktrace=1"
export TSAN_OPTIONS="halt_on_error=1:second_deadlock_stack=1"

# Death tests re-execute the test binary instead of forking a process that may
# run other threads, which ThreadSanitizer does not support. Under qemu-user a
# re-executed ARM binary cannot start (binfmt is neither needed nor assumed),
# so the cross configurations fork.
death_test_style() {
  if [ -n "$(cross_triple "$1")" ]; then echo fast; else echo threadsafe; fi
}


configure() {
  case "$1" in
    plain) configure_build plain -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON -DTESSARINE_BUILD_BENCHMARKS=ON ;;
    asan)  configure_build asan -DCMAKE_BUILD_TYPE=Debug -DTESSARINE_WERROR=ON \
             -DTESSARINE_SANITIZE=address,undefined -DTESSARINE_PACKAGE_TEST=OFF ;;
    tsan)  configure_build tsan -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON \
             -DTESSARINE_SANITIZE=thread -DTESSARINE_PACKAGE_TEST=OFF ;;
    clang) configure_build clang -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON \
             -DCMAKE_CXX_COMPILER=clang++ -DCMAKE_CXX_FLAGS=-Wthread-safety ;;
    # setup.sh installs only the target's SQLite runtime, without the
    # libsqlite3.so link, so the library is named here, as an Android app
    # names a prebuilt SQLite of its own.
    aarch64|armhf)
      local triple; triple="$(cross_triple "$1")"
      configure_build "$1" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON \
        -DCMAKE_TOOLCHAIN_FILE="$repo_root/cmake/toolchains/$triple.cmake" \
        -DSQLite3_LIBRARY="/usr/lib/$triple/libsqlite3.so.0" ;;
    *) echo "unknown configuration: $1" >&2; exit 2 ;;
  esac
}

for config in "${configs[@]}"; do
  echo "== $config: build"
  configure "$config"
  cmake --build "$build_root/$config"
  echo "== $config: test"
  GTEST_DEATH_TEST_STYLE="$(death_test_style "$config")" \
    ctest --test-dir "$build_root/$config" --output-on-failure -j2 --timeout 600
done
