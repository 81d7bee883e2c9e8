#!/usr/bin/env bash
# Sets up the machine, then builds and runs the whole test suite in each
# configuration, in this order: plain (warnings are errors; also checks the
# installed package), asan (AddressSanitizer + UndefinedBehaviorSanitizer),
# tsan (ThreadSanitizer, for the worker thread and the transport's callback
# registries), clang (clang++ with libc++, as the Android NDK builds, and
# clang's thread-safety analysis checking the lock annotations), then the ARM
# cross builds aarch64 (Android's arm64-v8a) and armhf (armeabi-v7a), built
# with Debian's cross compilers and run under
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

# mosquitto_sysroot CONFIG: a folder under the build root holding the target's
# libmosquitto1 and the libraries it loads (libssl3, libcjson1), unpacked from
# Debian's packages, and the build machine's mosquitto.h (the same for every
# architecture); prints its path. They cannot be installed as multiarch
# packages: Debian wants one libssl3 version for both architectures, and the
# target's index may hold another one than the build machine has.
mosquitto_sysroot() {
  local arch triple dir downloads deb
  arch="$(cross_debian_arch "$1")"; triple="$(cross_triple "$1")"
  dir="$build_root/$1-mosquitto"
  if [ ! -e "$dir/usr/lib/$triple/libmosquitto.so.1" ]; then
    downloads="$(mktemp -d)"
    (cd "$downloads" && apt-get download -q "libmosquitto1:$arch" "libssl3:$arch" "libcjson1:$arch" >&2)
    for deb in "$downloads"/*.deb; do dpkg-deb -x "$deb" "$dir"; done
    rm -rf "$downloads"
    mkdir -p "$dir/include"
    cp /usr/include/mosquitto.h "$dir/include/"
  fi
  echo "$dir"
}

# The Java API is built on purpose where it is tested, so that a missing JDK
# fails the run rather than dropping the Java tests.
java_options=(-DTESSARINE_BUILD_JAVA=ON -DTESSARINE_KOTLIN_CHECK=ON "-DTESSARINE_KOTLINC=$kotlinc_path")

configure() {
  case "$1" in
    # MQTT is required natively, so that its tests can never be left out.
    plain) configure_build plain -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON -DTESSARINE_BUILD_BENCHMARKS=ON \
             -DTESSARINE_WITH_MQTT=ON -DTESSARINE_WITH_POSTGRES=ON "${java_options[@]}" -DTESSARINE_ANDROID_LOG_TEST=ON ;;
    # The stand-in for the Android NDK's c++_shared runtime: clang with
    # libc++, GoogleTest compiled from Debian's sources against it (Debian's
    # libraries are built for libstdc++, as are Google Benchmark's, so the
    # benchmarks are left out). The consumer-project checks build with the
    # default compiler and so are left out too. Its thread-safety analysis
    # checks the lock annotations; warnings are errors.
    clang) CC=clang CXX=clang++ configure_build clang -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON \
             "-DCMAKE_CXX_FLAGS=-stdlib=libc++ -Wthread-safety" -DCMAKE_EXE_LINKER_FLAGS=-stdlib=libc++ \
             -DCMAKE_SHARED_LINKER_FLAGS=-stdlib=libc++ -DTESSARINE_GTEST_SOURCE_DIR=/usr/src/googletest \
             -DTESSARINE_PACKAGE_TEST=OFF -DTESSARINE_WITH_MQTT=ON -DTESSARINE_WITH_POSTGRES=ON "${java_options[@]}" ;;
    asan)  configure_build asan -DCMAKE_BUILD_TYPE=Debug -DTESSARINE_WERROR=ON -DTESSARINE_WITH_MQTT=ON -DTESSARINE_WITH_POSTGRES=ON \
             -DTESSARINE_SANITIZE=address,undefined -DTESSARINE_PACKAGE_TEST=OFF "${java_options[@]}" ;;
    # The Java API is left out under ThreadSanitizer: the JVM is not
    # instrumented, so its synchronisation (monitors, the queues through
    # which a Java transport hands payloads between threads) is invisible to
    # it, and it reports those handoffs as races in the JNI code.
    tsan)  configure_build tsan -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON -DTESSARINE_WITH_MQTT=ON -DTESSARINE_WITH_POSTGRES=ON \
             -DTESSARINE_SANITIZE=thread -DTESSARINE_PACKAGE_TEST=OFF -DTESSARINE_BUILD_JAVA=OFF ;;
    # setup.sh installs only the target's SQLite runtime, without the
    # libsqlite3.so link, so the library is named here, as an Android app
    # names a prebuilt SQLite of its own. The JNI libraries are built as an
    # app would ship them (and checked for 16 KB pages on aarch64); their
    # tests need a JVM for the target, which the emulator does not have.
    # libmosquitto comes from mosquitto_sysroot (above): linked by full path,
    # its own libraries found through -rpath-link. The server's PostgreSQL
    # storage is left out (server/CMakeLists.txt says why): its tests run in
    # the native configurations, where it is required.
    aarch64|armhf)
      local triple sysroot; triple="$(cross_triple "$1")"; sysroot="$(mosquitto_sysroot "$1")"
      configure_build "$1" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON \
        -DCMAKE_TOOLCHAIN_FILE="$repo_root/cmake/toolchains/$triple.cmake" \
        -DSQLite3_LIBRARY="/usr/lib/$triple/libsqlite3.so.0" -DTESSARINE_BUILD_JAVA=ON \
        -DTESSARINE_WITH_MQTT=ON -DTESSARINE_WITH_POSTGRES=OFF -DTESSARINE_MOSQUITTO_INCLUDE_DIR="$sysroot/include" \
        -DTESSARINE_MOSQUITTO_LIBRARY="$sysroot/usr/lib/$triple/libmosquitto.so.1" \
        -DCMAKE_EXE_LINKER_FLAGS="-Wl,-rpath-link,$sysroot/usr/lib/$triple" \
        -DCMAKE_SHARED_LINKER_FLAGS="-Wl,-rpath-link,$sysroot/usr/lib/$triple" ;;
    *) echo "unknown configuration: $1" >&2; exit 2 ;;
  esac
}

for config in "${configs[@]}"; do
  echo "== $config: build"
  configure "$config"
  # Emulated programs (the tests, also when they are listed during the build)
  # find the target's libmosquitto and its libraries in the private folder;
  # QEMU_SET_ENV reaches only emulated programs.
  run_env=(GTEST_DEATH_TEST_STYLE="$(death_test_style "$config")")
  triple="$(cross_triple "$config")"
  [ -n "$triple" ] && run_env+=(QEMU_SET_ENV="LD_LIBRARY_PATH=$build_root/$config-mosquitto/usr/lib/$triple")
  env "${run_env[@]}" cmake --build "$build_root/$config"
  echo "== $config: test"
  env "${run_env[@]}" ctest --test-dir "$build_root/$config" --output-on-failure -j2 --timeout 600
done
