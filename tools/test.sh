#!/usr/bin/env bash
# Builds and runs the whole test suite twice: a normal build, then one under AddressSanitizer and
# UndefinedBehaviorSanitizer; then runs the fuzz targets for a bounded time. Builds are incremental.
set -euo pipefail
cd "$(dirname "$0")/.."
bash tools/deps.sh

jobs=$(nproc)
run_suite() {
  local dir=$1
  shift
  cmake -S . -B "$dir" -G Ninja -DS2S_WERROR=ON "$@" >/dev/null
  cmake --build "$dir" -j "$jobs"
  ctest --test-dir "$dir" --output-on-failure -j "$jobs" --timeout 900
}

echo "== build and test (release)"
run_suite build -DCMAKE_BUILD_TYPE=RelWithDebInfo
echo "== build and test (AddressSanitizer + UndefinedBehaviorSanitizer)"
ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
  run_suite build-asan -DCMAKE_BUILD_TYPE=Debug -DS2S_SANITIZE=ON -DS2S_BENCH=OFF
if [ -x fuzz/run.sh ]; then
  echo "== fuzz (bounded)"
  fuzz/run.sh
fi
