#!/usr/bin/env bash
# Sets up the machine, then builds and runs the whole test suite in each
# configuration: plain (warnings are errors; also checks the installed
# package), AddressSanitizer + UndefinedBehaviorSanitizer. Any sanitizer
# report fails the run.
#
#   scripts/test.sh            every configuration
#   scripts/test.sh asan ...   only the named ones (plain, asan)
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/common.sh"
"$repo_root/scripts/setup.sh"

export ASAN_OPTIONS="halt_on_error=1:abort_on_error=1:detect_leaks=1:strict_string_checks=1"
export UBSAN_OPTIONS="halt_on_error=1:print_stacktrace=1"

configure() {
  case "$1" in
    plain) configure_build plain -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON ;;
    asan)  configure_build asan -DCMAKE_BUILD_TYPE=Debug -DTESSARINE_WERROR=ON \
             -DTESSARINE_SANITIZE=address,undefined -DTESSARINE_PACKAGE_TEST=OFF ;;
    *) echo "unknown configuration: $1" >&2; exit 2 ;;
  esac
}

configs=("$@")
[ ${#configs[@]} -eq 0 ] && configs=(plain asan)
for config in "${configs[@]}"; do
  echo "== $config: build"
  configure "$config"
  cmake --build "$build_root/$config"
  echo "== $config: test"
  ctest --test-dir "$build_root/$config" --output-on-failure -j2 --timeout 600
done
