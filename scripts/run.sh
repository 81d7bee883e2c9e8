#!/usr/bin/env bash
# Sets up the machine, builds the library and runs the main program: the sync
# demo, in which devices sync through the reference server. Arguments go to
# the demo (scripts/run.sh --help).
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/common.sh"
"$repo_root/scripts/setup.sh"

configure_build plain -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON
cmake --build "$build_root/plain" --target sync_demo
"$build_root/plain/examples/sync_demo" "$@"
