#!/usr/bin/env bash
# Builds and runs the test suite: every test in a normal build; the tests of the areas that parse
# and hold memory (values, wire format, transport, platform records, stores, schedule, service
# messages) again under AddressSanitizer and UndefinedBehaviorSanitizer, where the server
# scenarios would cost minutes for little; then runs the fuzz targets for a bounded time
# (S2S_FUZZ_SECONDS, 30 by default). Builds are incremental. Each phase prints its duration.
set -euo pipefail
cd "$(dirname "$0")/.."
bash tools/deps.sh

jobs=$(nproc)
# Most tests wait on sockets and child processes, so twice as many run side by side as there
# are processors.
test_jobs=$((jobs * 2))
sanitized_areas="core;net;platform;host;sync;service;receiver"
# Stress tests that take a minute or more under the sanitizers (a million-node tree, many writer
# processes); they run in the normal build. A renamed one only makes the sanitizer pass slower.
too_slow_sanitized='^(PObjectDepth\.|PStreamTest\.MillionNested|PairingStoreStressTest\.)'

# With ccache a machine that keeps its cache between runs recompiles only what changed, in any
# clone (paths below the source tree are hashed relative to it).
launcher=()
if command -v ccache >/dev/null; then
  export CCACHE_BASEDIR=$PWD CCACHE_NOHASHDIR=1
  launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache)
fi

phase_start=$SECONDS
phase_end() {
  echo "== $1 took $((SECONDS - phase_start))s"
  phase_start=$SECONDS
}
# run_suite DIR EXCLUDE CMAKE-ARGS...: configure, build, and run the tests not matching EXCLUDE.
run_suite() {
  local dir=$1 exclude=$2
  shift 2
  cmake -S . -B "$dir" -G Ninja -DS2S_WERROR=ON "${launcher[@]}" "$@" >/dev/null
  cmake --build "$dir" -j "$jobs"
  phase_end "build of $dir"
  ctest --test-dir "$dir" --output-on-failure -j "$test_jobs" --timeout 900 \
    ${exclude:+-E "$exclude"}
  phase_end "tests of $dir"
}

echo "== build and test (release)"
run_suite build "" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DS2S_TEST_AREAS=
echo "== build and test (AddressSanitizer + UndefinedBehaviorSanitizer: ${sanitized_areas//;/, })"
ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
  run_suite build-asan "$too_slow_sanitized" -DCMAKE_BUILD_TYPE=Debug -DS2S_SANITIZE=ON \
  -DS2S_BENCH=OFF "-DS2S_TEST_AREAS=$sanitized_areas"
if [ -x fuzz/run.sh ]; then
  echo "== fuzz (bounded)"
  S2S_FUZZ_SECONDS=${S2S_FUZZ_SECONDS:-30} fuzz/run.sh
  phase_end "fuzz"
fi
