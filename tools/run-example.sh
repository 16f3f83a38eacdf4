#!/usr/bin/env bash
# Installs what is missing, builds the library and runs its example on the bundled sample.
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
bash "$root/tools/install-deps.sh"
cmake -S "$root" -B "$root/build" -DCMAKE_BUILD_TYPE=RelWithDebInfo
cmake --build "$root/build" -j "$(nproc 2>/dev/null || echo 2)" --target silvan-filelist
"$root/build/tools/silvan-filelist" "$root/samples/filelist.txt"
