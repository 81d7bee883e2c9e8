#!/usr/bin/env bash
# Sets up the machine, builds the library and runs the main program: the
# networked sync demo, in which a broker, tessarine-server and each device run
# as processes of their own (scripts/run.sh --help). With --in-process first,
# the same story runs inside one process against the reference server
# (sync_demo). Other arguments go to the demo.
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/common.sh"
"$repo_root/scripts/setup.sh"

configure_build plain -DCMAKE_BUILD_TYPE=RelWithDebInfo -DTESSARINE_WERROR=ON
if [ "${1:-}" = "--in-process" ]; then
  shift
  cmake --build "$build_root/plain" --target sync_demo
  exec "$build_root/plain/examples/sync_demo" "$@"
fi
cmake --build "$build_root/plain" --target network_demo
exec "$build_root/plain/examples/network_demo" "$@"
