#!/usr/bin/env bash
# Benchmark: `s2s sync` against a plain `rsync -a --delete` of the same generated tree to the same
# rsync daemon (s2s-receiver's): a full copy into an empty share, a run with nothing changed, and a
# run after 1% of the files were rewritten (new content of the same size; the same files for both
# tools in a round, other files in the next round). Both tools run side by side in every round
# (the order alternates), the targets are emptied between rounds, and the medians are compared,
# so that a busy machine skews both alike. The page cache is written back and dropped before every
# timed run, so each run reads the tree from the disk. Prints the times and the ratios
# s2s / rsync, how much of s2s's time went to other steps than the copy (server test, pairing,
# source check, share start and finish, status beacon), and the machine's load.
#
# Usage: bash bench/sync_vs_rsync.sh            (needs root: private network namespace)
#   S2S_BENCH_FILES   number of files (default 5000)
#   S2S_BENCH_MB      total size in MiB (default 1024)
#   S2S_BENCH_ROUNDS  rounds of full, no-change and 1%-changed runs of both tools (default 6)
#   S2S_BENCH_CHANGED percent of the files rewritten before the changed runs (default 1)
#   S2S_BUILD_DIR     build directory holding bin/s2s and bin/s2s-receiver (default build)
set -euo pipefail
cd "$(dirname "$0")/.."
source tools/lib.sh
s2s_locate_build

s2s_bench_isolate "$@"

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

# Every run starts with the page cache written back and dropped, so that neither tool pays for the
# other's writeback nor reads what the other left in memory.
can_drop=1
if ! (echo 3 >/proc/sys/vm/drop_caches) 2>/dev/null; then
  can_drop=0
  echo "bench: /proc/sys/vm/drop_caches is not writable: the page cache is only written back" \
    "before each run, and the tree may be read from memory" >&2
fi
settle() {
  sync
  if ((can_drop)); then
    echo 3 >/proc/sys/vm/drop_caches
  fi
}
run_s2s() {  # label
  local start end
  settle
  start=$(now)
  S2S_ROOT=$sender "$bin/s2s" sync --server-ip 127.0.0.1 --user "$user" --share data \
    --password-file "$password_file" --name bench --json --quiet >"$work/$1.json"
  end=$(now)
  awk -v a="$start" -v b="$end" 'BEGIN { printf "%.3f", b - a }'
}
run_rsync() {
  local start end
  settle
  start=$(now)
  RSYNC_PASSWORD=$password rsync -a --delete "$sender/volume1/data/" \
    "rsync://$user@127.0.0.1/plain/"
  end=$(now)
  awk -v a="$start" -v b="$end" 'BEGIN { printf "%.3f", b - a }'
}

rounds=${S2S_BENCH_ROUNDS:-6}
percent=${S2S_BENCH_CHANGED:-1}
size=$((megabytes * 1048576 / files))
mapfile -t tree < <(cd "$sender/volume1/data" && find . -type f | sort)
if ! [[ $percent =~ ^[0-9]+$ ]] || ((percent < 1 || percent > 100)); then
  echo "bench: S2S_BENCH_CHANGED must be a whole percent from 1 to 100" >&2
  exit 1
fi
step=$((100 / percent))
# Rewrites every step-th file of the tree, starting at the round's offset, with new content of the
# same size: both tools then see the same files with a new time and new bytes.
change_files() {  # round
  local i
  for ((i = $1 % step; i < ${#tree[@]}; i += step)); do
    head -c "$size" /dev/urandom >"$sender/volume1/data/${tree[i]}"
  done
}
same_tree() {  # target
  if ! diff -rq "$sender/volume1/data" "$1" >/dev/null; then
    echo "bench: the copy in $1 differs from the source" >&2
    exit 1
  fi
}

declare -a rsync_full s2s_full rsync_same s2s_same rsync_part s2s_part
declare -a copy_full copy_same copy_part
for ((r = 0; r < rounds; r++)); do
  if ((r > 0)); then
    find "$receiver/volume1/data" "$receiver/volume1/plain" -mindepth 1 -delete
  fi
  if ((r % 2 == 0)); then
    rsync_full[r]=$(run_rsync)
    s2s_full[r]=$(run_s2s full)
    rsync_same[r]=$(run_rsync)
    s2s_same[r]=$(run_s2s same)
    change_files "$r"
    rsync_part[r]=$(run_rsync)
    s2s_part[r]=$(run_s2s part)
  else
    s2s_full[r]=$(run_s2s full)
    rsync_full[r]=$(run_rsync)
    s2s_same[r]=$(run_s2s same)
    rsync_same[r]=$(run_rsync)
    change_files "$r"
    s2s_part[r]=$(run_s2s part)
    rsync_part[r]=$(run_rsync)
  fi
  copy_full[r]=$(field "$work/full.json" copy_seconds)
  copy_same[r]=$(field "$work/same.json" copy_seconds)
  copy_part[r]=$(field "$work/part.json" copy_seconds)
  same_tree "$receiver/volume1/data"
  same_tree "$receiver/volume1/plain"
  echo "round $((r + 1)): full s2s ${s2s_full[r]}s rsync ${rsync_full[r]}s;" \
    "no change s2s ${s2s_same[r]}s rsync ${rsync_same[r]}s;" \
    "$percent% changed s2s ${s2s_part[r]}s rsync ${rsync_part[r]}s"
done
median() { printf '%s\n' "$@" | sort -g | awk '{ v[NR] = $1 } END {
  printf "%.3f", NR % 2 ? v[(NR + 1) / 2] : (v[NR / 2] + v[NR / 2 + 1]) / 2 }'; }

report() {  # label s2s rsync copy
  awk -v l="$1" -v s="$2" -v r="$3" -v c="$4" 'BEGIN {
    printf "%-11s s2s %8.3fs  rsync %8.3fs  ratio %5.2f  (s2s copy %.3fs, other steps %.3fs)\n",
      l, s, r, s / r, c, s - c }'
}
echo "tree: $files files, $megabytes MiB; rsync $(rsync --version | awk 'NR == 1 { print $3 }');" \
  "medians of $rounds rounds; page cache $( ((can_drop)) && echo dropped || echo written back)" \
  "before each run; load average at the end $(cut -d' ' -f1-3 /proc/loadavg)"
report "full" "$(median "${s2s_full[@]}")" "$(median "${rsync_full[@]}")" \
  "$(median "${copy_full[@]}")"
report "no change" "$(median "${s2s_same[@]}")" "$(median "${rsync_same[@]}")" \
  "$(median "${copy_same[@]}")"
report "$percent% changed" "$(median "${s2s_part[@]}")" "$(median "${rsync_part[@]}")" \
  "$(median "${copy_part[@]}")"
for label in full same part; do
  echo "steps (s), last round, $label: $(sed -n '/^  "steps"/,/}/p' "$work/$label.json" | tr -d ' \n')"
done
