#!/usr/bin/env bash
# Benchmark: `s2s sync` against a plain `rsync -a --delete` of the same generated tree to the same
# rsync daemon (s2s-receiver's): a full copy into an empty share, then a run with nothing changed.
# Both tools run side by side in every round (the order alternates), the targets are emptied
# between rounds, and the medians are compared, so that a busy machine skews both alike. Prints
# the times and the ratios s2s / rsync, and how much of s2s's time went to its control commands
# (server test, pairing, share start and finish, status beacon).
#
# Usage: bash bench/sync_vs_rsync.sh            (needs root: private network namespace)
#   S2S_BENCH_FILES   number of files (default 5000)
#   S2S_BENCH_MB      total size in MiB (default 1024)
#   S2S_BENCH_ROUNDS  rounds of full + no-change runs of both tools (default 3)
#   S2S_BUILD_DIR     build directory holding bin/s2s and bin/s2s-receiver (default build)
set -euo pipefail
cd "$(dirname "$0")/.."
source tools/lib.sh
s2s_locate_build

if [ -z "${S2S_BENCH_INSIDE:-}" ]; then
  s2s_require_root bench "the daemon gets a private network namespace"
  s2s_build s2s_cli s2s-receiver >/dev/null
  exec unshare --net -- env S2S_BENCH_INSIDE=1 bash "$0" "$@"
fi

files=${S2S_BENCH_FILES:-5000}
megabytes=${S2S_BENCH_MB:-1024}
user=bench
password=$(s2s_random_password)
s2s_stage s2s-bench
cleanup() {
  S2S_ROOT=$receiver "$bin/s2s-receiver" stop >/dev/null 2>&1 || true
  rm -rf "$work"
}
trap cleanup EXIT

for root in "$sender" "$receiver"; do
  s2s_make_host "$root" "SN-BENCH-$(basename "$root")"
done
mkdir -p "$sender/volume1/data" "$receiver/volume1/data" "$receiver/volume1/plain"
S2S_ROOT=$sender "$bin/s2s" share add data --path "$sender/volume1/data" >/dev/null
S2S_ROOT=$receiver "$bin/s2s" share add data --path "$receiver/volume1/data" >/dev/null
S2S_ROOT=$receiver "$bin/s2s" share add plain --path "$receiver/volume1/plain" >/dev/null
s2s_start_receiver "$receiver" "$user" "$password"

echo "generating $files files, $megabytes MiB"
s2s_generate_files "$sender/volume1/data" "$files" $((megabytes * 1048576 / files))
sync

password_file=$work/password
s2s_password_file "$password_file" "$password"
now() { date +%s.%N; }
field() { sed -n "s/^  \"$2\": \([0-9.]*\),\{0,1\}$/\1/p" "$1"; }

# Every run starts with the page cache written back, so that neither tool pays for the other's
# writeback.
run_s2s() {  # label
  local start end
  sync
  start=$(now)
  S2S_ROOT=$sender "$bin/s2s" sync --server-ip 127.0.0.1 --user "$user" --share data \
    --password-file "$password_file" --name bench --json --quiet >"$work/$1.json"
  end=$(now)
  awk -v a="$start" -v b="$end" 'BEGIN { printf "%.3f", b - a }'
}
run_rsync() {
  local start end
  sync
  start=$(now)
  RSYNC_PASSWORD=$password rsync -a --delete "$sender/volume1/data/" \
    "rsync://$user@127.0.0.1/plain/"
  end=$(now)
  awk -v a="$start" -v b="$end" 'BEGIN { printf "%.3f", b - a }'
}

rounds=${S2S_BENCH_ROUNDS:-3}
declare -a rsync_full s2s_full rsync_same s2s_same copy_full copy_same
for ((r = 0; r < rounds; r++)); do
  if ((r > 0)); then
    find "$receiver/volume1/data" "$receiver/volume1/plain" -mindepth 1 -delete
    sync
  fi
  if ((r % 2 == 0)); then
    rsync_full[r]=$(run_rsync)
    s2s_full[r]=$(run_s2s full)
    rsync_same[r]=$(run_rsync)
    s2s_same[r]=$(run_s2s same)
  else
    s2s_full[r]=$(run_s2s full)
    rsync_full[r]=$(run_rsync)
    s2s_same[r]=$(run_s2s same)
    rsync_same[r]=$(run_rsync)
  fi
  copy_full[r]=$(field "$work/full.json" copy_seconds)
  copy_same[r]=$(field "$work/same.json" copy_seconds)
  if ! diff -rq "$sender/volume1/data" "$receiver/volume1/data" >/dev/null; then
    echo "bench: the s2s copy differs from the source" >&2
    exit 1
  fi
  echo "round $((r + 1)): full s2s ${s2s_full[r]}s rsync ${rsync_full[r]}s;" \
    "no change s2s ${s2s_same[r]}s rsync ${rsync_same[r]}s"
done
median() { printf '%s\n' "$@" | sort -g | awk '{ v[NR] = $1 } END {
  printf "%.3f", NR % 2 ? v[(NR + 1) / 2] : (v[NR / 2] + v[NR / 2 + 1]) / 2 }'; }

report() {  # label s2s rsync copy
  awk -v l="$1" -v s="$2" -v r="$3" -v c="$4" 'BEGIN {
    printf "%-10s s2s %8.3fs  rsync %8.3fs  ratio %5.2f  (s2s copy %.3fs, control commands %.3fs)\n",
      l, s, r, s / r, c, s - c }'
}
echo "tree: $files files, $megabytes MiB; rsync $(rsync --version | awk 'NR == 1 { print $3 }');" \
  "medians of $rounds rounds"
report "full" "$(median "${s2s_full[@]}")" "$(median "${rsync_full[@]}")" \
  "$(median "${copy_full[@]}")"
report "no change" "$(median "${s2s_same[@]}")" "$(median "${rsync_same[@]}")" \
  "$(median "${copy_same[@]}")"
echo "control steps (s), last round: full: $(sed -n '/^  "steps"/,/}/p' "$work/full.json" | tr -d ' \n')"
echo "                                no change: $(sed -n '/^  "steps"/,/}/p' "$work/same.json" | tr -d ' \n')"
