#!/usr/bin/env bash
# The main job: builds what is needed and shows what is built (the end-to-end demo comes with the
# command-line tool).
set -euo pipefail
cd "$(dirname "$0")/.."
bash tools/deps.sh
cmake -S . -B build -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build build -j "$(nproc)"
echo "built: $(ls build/libs2s.so* | tr '\n' ' ')"
