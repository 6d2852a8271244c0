#!/usr/bin/env bash
# Builds every libFuzzer target (fuzz/<name>_fuzz.cpp) with clang under AddressSanitizer and
# UndefinedBehaviorSanitizer in build-fuzz, then runs each for a bounded share of the time budget
# (S2S_FUZZ_SECONDS, 60 by default), starting from its seed corpus in fuzz/corpus/<name>/.
# Any crash, sanitizer report, leak or hang fails the run; the input that caused it is kept in
# build-fuzz/artifacts/.
set -euo pipefail
cd "$(dirname "$0")/.."

dir=build-fuzz
budget=${S2S_FUZZ_SECONDS:-60}
jobs=$(nproc)

names=()
for source in fuzz/*_fuzz.cpp; do
  [ -e "$source" ] || continue
  name=$(basename "$source" .cpp)
  names+=("${name%_fuzz}")
done
if ((${#names[@]} == 0)); then
  echo "fuzz: no targets"
  exit 0
fi

launcher=()
if command -v ccache >/dev/null; then
  export CCACHE_BASEDIR=$PWD CCACHE_NOHASHDIR=1
  launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache)
fi
CC=clang CXX=clang++ cmake -S . -B "$dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DS2S_FUZZ=ON -DS2S_SANITIZE=ON -DS2S_TESTS=OFF -DS2S_BENCH=OFF "${launcher[@]}" >/dev/null
targets=()
for name in "${names[@]}"; do
  targets+=("fuzz_$name")
done
cmake --build "$dir" -j "$jobs" --target "${targets[@]}"

share=$((budget / ${#names[@]}))
((share > 0)) || share=1
mkdir -p "$dir/artifacts"
passed=0
for name in "${names[@]}"; do
  # The working corpus lives in the build tree: new inputs found here never touch the sources.
  work="$dir/corpus/$name"
  mkdir -p "$work"
  seeds=()
  [ -d "fuzz/corpus/$name" ] && seeds+=("fuzz/corpus/$name")
  echo "== fuzz_$name for ${share}s"
  ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
    "$dir/fuzz/fuzz_$name" -max_total_time="$share" -timeout=30 -rss_limit_mb=2048 \
    -max_len=65536 -print_final_stats=1 -artifact_prefix="$dir/artifacts/$name-" \
    "$work" "${seeds[@]}"
  passed=$((passed + 1))
done
echo "fuzz: $passed passed, 0 failed"
