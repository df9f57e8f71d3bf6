#!/usr/bin/env bash
# The main job: installs what is missing, builds, and loads the module the
# way the host does, printing its method table.
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
"$root/scripts/install-deps.sh"
cmake -S "$root" -B "$root/build" -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$root/build" -j "$(nproc)" --target zark_module zark-module-info
"$root/build/bin/zark-module-info" "$root/build/modules/ZARK.Core.PortForwarding.so"
