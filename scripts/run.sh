#!/usr/bin/env bash
# Sets up the machine, builds the library and runs the main program.
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/common.sh"
"$repo_root/scripts/setup.sh"

configure_build plain -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON
cmake --build "$build_root/plain" --target open_store
"$build_root/plain/examples/open_store" "$@"
