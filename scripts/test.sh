#!/usr/bin/env bash
# Sets up the machine, then builds and runs the whole test suite in each
# configuration, in this order: plain (warnings are errors; also checks the
# installed package), asan (AddressSanitizer + UndefinedBehaviorSanitizer) and
# tsan (ThreadSanitizer, for the worker thread and the transport's callback
# registries). Any sanitizer report fails the run.
#
#   scripts/test.sh            every configuration
#   scripts/test.sh tsan ...   only the named ones (plain, asan, tsan)
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/common.sh"
"$repo_root/scripts/setup.sh"

export ASAN_OPTIONS="halt_on_error=1:abort_on_error=1:detect_leaks=1:strict_string_checks=1"
export UBSAN_OPTIONS="halt_on_error=1:print_stacktrace=1"
export TSAN_OPTIONS="halt_on_error=1:second_deadlock_stack=1"
# Death tests re-execute the test binary instead of forking a process that may
# run other threads, which ThreadSanitizer does not support.
export GTEST_DEATH_TEST_STYLE=threadsafe

configure() {
  case "$1" in
    plain) configure_build plain -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON -DTESSARINE_BUILD_BENCHMARKS=ON ;;
    asan)  configure_build asan -DCMAKE_BUILD_TYPE=Debug -DTESSARINE_WERROR=ON \
             -DTESSARINE_SANITIZE=address,undefined -DTESSARINE_PACKAGE_TEST=OFF ;;
    tsan)  configure_build tsan -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON \
             -DTESSARINE_SANITIZE=thread -DTESSARINE_PACKAGE_TEST=OFF ;;
    *) echo "unknown configuration: $1" >&2; exit 2 ;;
  esac
}

configs=("$@")
[ ${#configs[@]} -eq 0 ] && configs=(plain asan tsan)
for config in "${configs[@]}"; do
  echo "== $config: build"
  configure "$config"
  cmake --build "$build_root/$config"
  echo "== $config: test"
  ctest --test-dir "$build_root/$config" --output-on-failure -j2 --timeout 600
done
