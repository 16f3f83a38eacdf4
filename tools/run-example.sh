#!/usr/bin/env bash
# The main job: installs what is missing, builds, makes a synthetic aerial block and runs the
# true-ortho workflow on it, printing where the outputs are and one line per scene.
set -euo pipefail
root=$(cd "$(dirname "$0")/.." && pwd)
jobs=$(nproc 2>/dev/null || echo 2)
bash "$root/tools/install-deps.sh"
cmake -S "$root" -B "$root/build" -DCMAKE_BUILD_TYPE=RelWithDebInfo
cmake --build "$root/build" -j "$jobs" --target silvan-make-sample silvan-ortho

work="$root/build/example"
# An aerial block: 3 strips of 4 nadir images, 1000 x 1000 pixels at 0.15 m.
if [[ ! -f "$work/block/master.txt" ]]; then
    "$root/build/tools/silvan-make-sample" "$work/block" --block 3x4 --quiet
fi
# The sample's heights are above the WGS 84 ellipsoid, as RPC heights are.
"$root/build/tools/silvan-ortho" "$work/block/master.txt" --out "$work/out" \
    --dem "$work/block/dsm.tif" --elevref ELLIPS --jobs "$jobs" --proc CPU:1
echo "outputs in $work/out (open mosaic.png, mosaic_source.png and the *_vis.png quicklooks)"
