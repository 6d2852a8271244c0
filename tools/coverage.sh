#!/usr/bin/env bash
# Line coverage of the library and the tools by the test suite: a separate build with gcc's
# --coverage in build-cov, the whole suite run once, then gcovr's summary over everything the
# project builds except the tests, the benchmarks and the fuzz targets.
#
# Usage: bash tools/coverage.sh        (S2S_COV_DIR chooses the build directory)
# Prints gcovr's table and a last line "lines: NN.N%".
set -euo pipefail
cd "$(dirname "$0")/.."
bash tools/deps.sh
dir=${S2S_COV_DIR:-build-cov}
cmake -S . -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=Debug -DS2S_BENCH=OFF \
  -DCMAKE_C_FLAGS=--coverage -DCMAKE_CXX_FLAGS=--coverage \
  -DCMAKE_EXE_LINKER_FLAGS=--coverage -DCMAKE_SHARED_LINKER_FLAGS=--coverage >/dev/null
cmake --build "$dir" -j "$(nproc)"
find "$dir" -name '*.gcda' -delete
ctest --test-dir "$dir" -j "$(nproc)" --timeout 900 >"$dir/ctest.log" 2>&1 ||
  echo "coverage: some tests failed (see $dir/ctest.log); the figure still counts what ran" >&2
gcovr -r . "$dir" --exclude 'tests/' --exclude 'bench/' --exclude 'fuzz/' --exclude "$dir/" \
  --gcov-ignore-parse-errors -j "$(nproc)" --print-summary | tail -n 4
