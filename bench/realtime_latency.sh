#!/usr/bin/env bash
# Benchmark: the real-time path of the sync service `s2sd` side by side with lsyncd, both set to the
# same delay and both pushing to the same receiver's rsync daemon (s2s-receiver's, in a private
# network namespace). Each watches its own copy of one generated tree of files:
#   1. start-up: the CPU time each spends until it watches the tree and its first full sync ended;
#   2. idle: the CPU time (utime + stime of the daemon's own process, from /proc) each spends
#      watching the tree while nothing changes;
#   3. latency: from a file written on the sender to the file complete (under its final name) on
#      the receiver, one change at a time (write, wait until it lands, wait until the tool is idle
#      again, next), the two tools alternating; p50 and p99;
#   4. a tree of many directories given to s2sd as a real-time share: whether every directory is
#      watched within this machine's fs.inotify.max_user_watches, or the message s2sd logs.
# Every wait is bounded in count and time; everything started is stopped at the end.
#
# Usage: bash bench/realtime_latency.sh          (needs root: private network namespace)
#   S2S_BENCH_FILES    files in the watched tree (default 100000)
#   S2S_BENCH_CHANGES  changes timed per tool (default 100)
#   S2S_BENCH_IDLE     seconds of idle watching (default 60)
#   S2S_BENCH_DELAY    seconds both tools gather changes before syncing (default 1)
#   S2S_BENCH_DIRS     directories of the watch-limit tree (default 100000; 0 skips it)
#   S2S_BENCH_WAIT     longest wait for one change to land, in seconds (default 60)
#   S2S_BUILD_DIR      build directory holding bin/s2s, bin/s2sd and bin/s2s-receiver (default build)
# Quick run: S2S_BENCH_FILES=5000 S2S_BENCH_CHANGES=10 S2S_BENCH_IDLE=5 S2S_BENCH_DIRS=2000
set -euo pipefail
cd "$(dirname "$0")/.."
source tools/lib.sh
s2s_locate_build

if [ -z "${S2S_BENCH_INSIDE:-}" ]; then
  s2s_require_root bench "the receiver's daemon gets a private network namespace"
  if ! command -v lsyncd >/dev/null; then
    echo "installing lsyncd"
    DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends lsyncd ||
      { apt-get update -qq && DEBIAN_FRONTEND=noninteractive apt-get install -y -qq \
        --no-install-recommends lsyncd; }
  fi
  s2s_build s2s_cli s2s-receiver s2sd >/dev/null
  exec unshare --net -- env S2S_BENCH_INSIDE=1 bash "$0" "$@"
fi

files=${S2S_BENCH_FILES:-100000}
changes=${S2S_BENCH_CHANGES:-100}
idle=${S2S_BENCH_IDLE:-60}
delay=${S2S_BENCH_DELAY:-1}
dirs=${S2S_BENCH_DIRS:-100000}
max_wait=${S2S_BENCH_WAIT:-60}
for value in "$files" "$changes" "$idle" "$delay" "$dirs" "$max_wait"; do
  case $value in '' | *[!0-9]*)
    echo "bench: the S2S_BENCH_* settings are whole numbers of files, seconds or changes" >&2
    exit 2
    ;;
  esac
done
((files > 0 && changes > 0 && max_wait > 0)) || { echo "bench: nothing to measure" >&2; exit 2; }

user=bench
password=$(s2s_random_password)
s2s_stage s2s-rtbench
s2sd_pid=
lsyncd_pid=

stop_pid() {  # pid: SIGTERM, then at most 10 s before SIGKILL
  local pid=$1 i
  kill -TERM "$pid" 2>/dev/null || return 0
  for ((i = 0; i < 200; i++)); do
    kill -0 "$pid" 2>/dev/null || break
    sleep 0.05
  done
  kill -KILL "$pid" 2>/dev/null || true
  wait "$pid" 2>/dev/null || true
}
cleanup() {
  set +e
  [ -n "$s2sd_pid" ] && stop_pid "$s2sd_pid"
  [ -n "$lsyncd_pid" ] && stop_pid "$lsyncd_pid"
  S2S_ROOT=$receiver "$bin/s2s-receiver" stop >/dev/null 2>&1
  rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 130' INT TERM

fail() {  # message
  echo "bench: $1" >&2
  for log in "$work/s2sd.log" "$work/lsyncd.log"; do
    if [ -s "$log" ]; then
      echo "--- last lines of $(basename "$log")" >&2
      tail -20 "$log" >&2
    fi
  done
  exit 1
}

# --- two servers, one receiver daemon ------------------------------------------------------------
# s2sd syncs the share "live"; lsyncd mirrors the same tree from "mirror" into the receiver's share
# of that name; "dirs" is the tree of directories.
for root in "$sender" "$receiver"; do
  s2s_make_host "$root" "SN-RTBENCH-$(basename "$root")"
  for share in live mirror dirs; do
    mkdir -p "$root/volume1/$share"
    S2S_ROOT=$root "$bin/s2s" share add "$share" --path "$root/volume1/$share" >/dev/null
  done
done
s2s_start_receiver "$receiver" "$user" "$password"
password_file=$work/password
s2s_password_file "$password_file" "$password"

# The tree: 250 files of 1 KiB per folder. Both tools' copies on the receiver start identical to
# the source, so their first full syncs only compare.
echo "generating $files files of 1 KiB in $(((files + 249) / 250)) folders"
s2s_generate_files "$sender/volume1/live" "$files" 1024
folders=$(((files + 249) / 250))
cp -a "$sender/volume1/live/." "$sender/volume1/mirror/"
cp -a "$sender/volume1/live/." "$receiver/volume1/live/"
cp -a "$sender/volume1/live/." "$receiver/volume1/mirror/"
sync

ticks=$(getconf CLK_TCK)
# CPU seconds (utime + stime) of a process, from /proc; the command name may hold spaces.
cpu_of() {  # pid
  local stat
  stat=$(<"/proc/$1/stat")
  stat=${stat##*) }
  awk -v t="$ticks" '{ printf "%.2f", ($12 + $13) / t }' <<<"$stat"
}
s2s_task() { S2S_ROOT=$sender "$bin/s2s" task "$@"; }

# --- s2sd ----------------------------------------------------------------------------------------
S2S_ROOT=$sender "$bin/s2sd" --delay "$delay" --verbose >"$work/s2sd.log" 2>&1 &
s2sd_pid=$!
started=0
for ((i = 0; i < 200; i++)); do  # at most 10 s
  kill -0 "$s2sd_pid" 2>/dev/null || fail "s2sd did not start"
  if [ -S "$sender/run/s2s/s2sd.sock" ]; then
    started=1
    break
  fi
  sleep 0.05
done
((started)) || fail "s2sd did not open its control socket within 10 s"

realtime_task() {  # name share
  cat >"$work/$1.json" <<EOF
{"name": "$1", "share_list": ["$2"], "server_ip": "127.0.0.1", "user": "$user", "schedule_mode": 1}
EOF
  s2s_task add --task "$work/$1.json" --password-file "$password_file" --json >/dev/null ||
    fail "s2s task add $1 failed"
}
# True when s2sd has no run queued or going on.
s2sd_idle() { ! s2s_task status --json | grep -Eq '"state": *"(queued|running)"'; }
# True when lsyncd has no rsync going on (it runs one child per batch of changes).
lsyncd_idle() { ! pgrep -P "$lsyncd_pid" >/dev/null; }
wait_until() {  # seconds command...: polls every 20 ms
  local limit=$1 i
  shift
  for ((i = 0; i < limit * 50; i++)); do
    "$@" && return 0
    sleep 0.02
  done
  return 1
}

echo "starting s2sd (delay $delay s) and lsyncd (delay $delay s), each watching $files files"
realtime_task live live

# --- lsyncd, pushing to the same daemon with the same account ------------------------------------
cat >"$work/lsyncd.lua" <<EOF
settings {
  nodaemon = true,
  logfile = "$work/lsyncd.log",
  statusFile = "$work/lsyncd.status",
}
sync {
  default.rsync,
  source = "$sender/volume1/mirror/",
  target = "rsync://$user@127.0.0.1/mirror/",
  delay = $delay,
  rsync = {
    archive = true,
    _extra = { "--password-file=$password_file" },
  },
}
EOF
lsyncd "$work/lsyncd.lua" >>"$work/lsyncd.log" 2>&1 &
lsyncd_pid=$!

wait_until 600 grep -q "Startup of .* finished" "$work/lsyncd.log" ||
  fail "lsyncd did not finish its start-up sync within 600 s"
wait_until 600 s2sd_idle || fail "s2sd's first full sync did not end within 600 s"
wait_until 60 lsyncd_idle || fail "lsyncd stayed busy"
grep -q "run done" "$work/s2sd.log" || fail "s2sd's first full sync failed"

startup_s2sd=$(cpu_of "$s2sd_pid")
startup_lsyncd=$(cpu_of "$lsyncd_pid")
echo "start-up CPU: s2sd ${startup_s2sd}s, lsyncd ${startup_lsyncd}s; idle for $idle s"
sleep "$idle"  # the measurement window itself
idle_s2sd=$(awk -v a="$startup_s2sd" -v b="$(cpu_of "$s2sd_pid")" 'BEGIN { printf "%.2f", b - a }')
idle_lsyncd=$(awk -v a="$startup_lsyncd" -v b="$(cpu_of "$lsyncd_pid")" \
  'BEGIN { printf "%.2f", b - a }')

# --- latency -------------------------------------------------------------------------------------
# One change: a new 4 KiB file in one of the tree's folders; the clock stops when the receiver
# holds it under its final name (rsync writes into a temporary name and renames), with its size.
timed_change() {  # share idle-test index: prints milliseconds
  local share=$1 idle_test=$2 k=$3 rel start i
  rel="dir$((k * 7 % folders))/change_$k"
  start=$EPOCHREALTIME
  head -c 4096 /dev/urandom >"$sender/volume1/$share/$rel"
  for ((i = 0; i < max_wait * 200; i++)); do
    if [ -f "$receiver/volume1/$share/$rel" ] &&
      [ "$(stat -c %s "$receiver/volume1/$share/$rel")" = 4096 ]; then
      awk -v a="$start" -v b="$EPOCHREALTIME" 'BEGIN { printf "%.0f", (b - a) * 1000 }'
      wait_until 60 "$idle_test" || fail "$share: the tool stayed busy after change $k"
      return 0
    fi
    sleep 0.005
  done
  fail "$share: change $k did not arrive within $max_wait s"
}
echo "timing $changes changes per tool"
declare -a lat_s2sd lat_lsyncd
for ((k = 0; k < changes; k++)); do
  if ((k % 2 == 0)); then
    lat_s2sd[k]=$(timed_change live s2sd_idle "$k")
    lat_lsyncd[k]=$(timed_change mirror lsyncd_idle "$k")
  else
    lat_lsyncd[k]=$(timed_change mirror lsyncd_idle "$k")
    lat_s2sd[k]=$(timed_change live s2sd_idle "$k")
  fi
done
# Nearest-rank percentile of a list of numbers.
percentile() {  # p values...
  local p=$1
  shift
  printf '%s\n' "$@" | sort -n | awk -v p="$p" '{ v[NR] = $1 } END {
    r = int((p * NR + 99) / 100); if (r < 1) r = 1; printf "%d", v[r] }'
}

# --- a tree of directories -----------------------------------------------------------------------
limit=$(cat /proc/sys/fs/inotify/max_user_watches)
watch_line=
if ((dirs > 0)); then
  echo "creating $dirs directories and giving them to s2sd as a real-time share"
  top=$(((dirs + 999) / 1000))
  for ((t = 0; t < top; t++)); do
    n=$((dirs - t * 1000 < 1000 ? dirs - t * 1000 : 1000))
    mkdir -p "$sender/volume1/dirs/t$t"
    (cd "$sender/volume1/dirs/t$t" && seq -f 'd%g' 1 "$n" | xargs mkdir)
  done
  cp -a "$sender/volume1/dirs/." "$receiver/volume1/dirs/"
  before=$(grep -c "watching .* folders\|inotify watches" "$work/s2sd.log" || true)
  watch_start=$EPOCHREALTIME
  realtime_task dirs dirs
  new_watch_line() {
    (($(grep -c "watching .* folders\|inotify watches" "$work/s2sd.log" || true) > before))
  }
  wait_until 600 new_watch_line || fail "s2sd did not report its watches within 600 s"
  watch_seconds=$(awk -v a="$watch_start" -v b="$EPOCHREALTIME" 'BEGIN { printf "%.1f", b - a }')
  watch_line=$(grep "watching .* folders\|inotify watches" "$work/s2sd.log" | tail -n +$((before + 1)))
  inotify_watches=0
  for fd in /proc/"$s2sd_pid"/fdinfo/*; do
    count=$(grep -c '^inotify wd:' "$fd" 2>/dev/null || true)
    inotify_watches=$((inotify_watches + ${count:-0}))
  done
  wait_until 600 s2sd_idle || fail "s2sd's full sync of the directory tree did not end in 600 s"
fi

# --- report --------------------------------------------------------------------------------------
echo
echo "tree: $files files in $folders folders; delay $delay s for both; rsync" \
  "$(rsync --version | awk 'NR == 1 { print $3 }'), lsyncd $(lsyncd --version | awk '{ print $2 }')"
printf '%-8s %12s %12s %14s %14s\n' tool "p50 latency" "p99 latency" "start-up CPU" "idle CPU"
printf '%-8s %10sms %10sms %13ss %13ss\n' s2sd "$(percentile 50 "${lat_s2sd[@]}")" \
  "$(percentile 99 "${lat_s2sd[@]}")" "$startup_s2sd" "$idle_s2sd"
printf '%-8s %10sms %10sms %13ss %13ss\n' lsyncd "$(percentile 50 "${lat_lsyncd[@]}")" \
  "$(percentile 99 "${lat_lsyncd[@]}")" "$startup_lsyncd" "$idle_lsyncd"
echo "latency over $changes changes each; idle CPU over $idle s; start-up CPU: the daemon's own" \
  "process until its first full sync ended (its rsync children not counted)"
if ((dirs > 0)); then
  echo "directory tree: $dirs directories (+$((top + 1)) above them); max_user_watches $limit;" \
    "s2sd holds $inotify_watches inotify watches in all, $watch_seconds s after the task was added"
  sed 's/^.*service\.cpp([0-9]*): /s2sd: /' <<<"$watch_line"
fi
