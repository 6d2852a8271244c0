#!/usr/bin/env bash
# Benchmark: many sending servers into one receiver at once. Each sender has a root of its own
# (S2S_ROOT, its own serial number) and one share of small files; all of them run `s2s sync` into
# the same receiver at the same moment, once to copy everything and once more with nothing
# changed. Prints per round the wall time, the CPU time of the receiver (its rsync daemon and
# every connection and hook process the daemon waited for), the pairing-store updates and their
# rate, and the replacements of the store (writes, each with its two fsyncs) they took, both
# counted with inotify; and checks that every sync succeeded, every share arrived complete, and
# the store holds every client, share and task record whole.
#
# Usage: bash bench/many_senders.sh            (needs root: private network namespace)
#   S2S_BENCH_SENDERS   sending servers (default 32)
#   S2S_BENCH_FILES     files per share (default 200)
#   S2S_BENCH_KB        size of each file in KiB (default 4)
#   S2S_BUILD_DIR       build directory holding bin/s2s and bin/s2s-receiver (default build);
#                       with S2S_NO_BUILD=1 the programs found there are used as they are
set -euo pipefail
cd "$(dirname "$0")/.."
source tools/lib.sh
s2s_locate_build

s2s_bench_isolate "$@"

senders=${S2S_BENCH_SENDERS:-32}
files=${S2S_BENCH_FILES:-200}
kib=${S2S_BENCH_KB:-4}
user=bench
password=$(s2s_random_password)
s2s_stage s2s-many
watcher=
cleanup() {
  [ -n "$watcher" ] && kill "$watcher" 2>/dev/null
  S2S_ROOT=$receiver "$bin/s2s-receiver" stop >/dev/null 2>&1 || true
  rm -rf "$work"
}
trap cleanup EXIT

s2s_make_host "$receiver" "SN-MANY-RECEIVER"
for ((i = 0; i < senders; i++)); do
  name=$(printf 'share%02d' "$i")
  root=$work/sender$i
  s2s_make_host "$root" "SN-MANY-$(printf '%02d' "$i")"
  mkdir -p "$root/volume1/$name" "$receiver/volume1/$name"
  S2S_ROOT=$root "$bin/s2s" share add "$name" --path "$root/volume1/$name" >/dev/null
  S2S_ROOT=$receiver "$bin/s2s" share add "$name" --path "$receiver/volume1/$name" >/dev/null
  s2s_generate_files "$root/volume1/$name" "$files" $((kib * 1024))
done
# Every sender holds connections to the command module and its share module at once.
printf '%s\n' "$password" |
  S2S_ROOT=$receiver "$bin/s2s-receiver" configure --user "$user" --port 873 \
    --address 127.0.0.1 --max-connections $((senders * 2)) >/dev/null
S2S_ROOT=$receiver "$bin/s2s-receiver" start >/dev/null
sync
password_file=$work/password
s2s_password_file "$password_file" "$password"
store=$receiver/usr/vurn/etc/vurnS2S.info
daemon=$(cat "$receiver/var/run/rsyncd.pid")
ticks=$(getconf CLK_TCK)

# Counts the replacements of the store (a rename onto its name), and the updates handed to the
# receiver's batched writer (a request renamed into the queue beside the store), until it is
# ended; then prints "<replacements> <updates>" into the file named by its argument.
count_writes() {  # out-file
  exec python3 - "$(dirname "$store")" "$(basename "$store")" "$1" <<'EOF'
import ctypes, os, signal, struct, sys
libc = ctypes.CDLL(None, use_errno=True)
fd = libc.inotify_init1(0)
IN_MOVED_TO, IN_CREATE = 0x80, 0x100
folder, name, out = sys.argv[1], sys.argv[2], sys.argv[3]
queue = "." + name + ".queue"
def watch(path):
    wd = libc.inotify_add_watch(fd, path.encode(), IN_MOVED_TO | IN_CREATE)
    if wd < 0:
        sys.exit("inotify: " + os.strerror(ctypes.get_errno()))
    return wd
top = watch(folder)
queued = watch(os.path.join(folder, queue)) if os.path.isdir(os.path.join(folder, queue)) else -1
writes = updates = 0
def done(*_):
    with open(out, "w") as f:
        f.write("%d %d\n" % (writes, updates))
    sys.exit(0)
signal.signal(signal.SIGTERM, done)
open(out + ".ready", "w").close()
while True:
    data = os.read(fd, 65536)
    at = 0
    while at < len(data):
        wd, mask, _, size = struct.unpack_from("iIII", data, at)
        entry = data[at + 16:at + 16 + size].rstrip(b"\0").decode()
        at += 16 + size
        if wd == top and mask & IN_CREATE and entry == queue and queued < 0:
            queued = watch(os.path.join(folder, queue))
        elif wd == top and mask & IN_MOVED_TO and entry == name:
            writes += 1
        elif wd == queued and mask & IN_MOVED_TO and not entry.startswith("."):
            updates += 1
EOF
}
# CPU seconds of the receiver's daemon and the processes it has waited for.
receiver_cpu() {
  awk -v t="$ticks" '{ sub(/^.*\) /, ""); print ($12 + $13 + $14 + $15) / t }' "/proc/$daemon/stat"
}
now() { date +%s.%N; }

round() {  # label
  local label=$1 start end cpu0 cpu1 failed=0 writes i
  rm -f "$work/writes" "$work/writes.ready"
  count_writes "$work/writes" </dev/null >/dev/null &
  watcher=$!
  while [ ! -e "$work/writes.ready" ]; do sleep 0.01; done
  cpu0=$(receiver_cpu)
  start=$(now)
  for ((i = 0; i < senders; i++)); do
    S2S_ROOT=$work/sender$i "$bin/s2s" sync --server-ip 127.0.0.1 --user "$user" \
      --share "$(printf 'share%02d' "$i")" --password-file "$password_file" --name "many$i" \
      --quiet >"$work/$label.$i.log" 2>&1 &
  done
  for ((i = 0; i < senders; i++)); do
    wait -n || failed=$((failed + 1))
  done
  end=$(now)
  cpu1=$(receiver_cpu)
  kill "$watcher"
  wait "$watcher" || true
  watcher=
  read -r writes updates <"$work/writes"
  # Without the batched writer (an earlier build) every update is one replacement.
  ((updates)) || updates=$writes
  awk -v l="$label" -v a="$start" -v b="$end" -v c0="$cpu0" -v c1="$cpu1" -v w="$writes" \
    -v u="$updates" -v f="$failed" -v n="$senders" 'BEGIN {
    printf "%-10s %2d of %d synced  wall %6.3fs  receiver CPU %6.3fs  store updates %4d (%.0f/s)" \
      " in %d writes\n", l, n - f, n, b - a, c1 - c0, u, u / (b - a), w }'
  if ((failed)); then
    grep -h . "$work/$label".*.log | sort | uniq -c | sort -rn | head -5 >&2
  fi
}

echo "$senders senders, $files files of $kib KiB each; rsync $(rsync --version |
  awk 'NR == 1 { print $3 }')"
round full
round "no change"

# Every share complete, and every client, share and task recorded whole.
bad=0
for ((i = 0; i < senders; i++)); do
  name=$(printf 'share%02d' "$i")
  serial=SN-MANY-$(printf '%02d' "$i")
  if ! diff -rq "$work/sender$i/volume1/$name" "$receiver/volume1/$name" >/dev/null; then
    echo "share $name is not complete on the receiver" >&2
    bad=$((bad + 1))
  fi
  for record in "CLIENTID_$serial" "SHARE_$name" "TASK_$serial/many$i"; do
    if ! grep -qxF "[$record]" "$store"; then
      echo "the store lost the record [$record]" >&2
      bad=$((bad + 1))
    fi
  done
  body=$(sed -n "/^\[SHARE_$name\]$/,/^\[/p" "$store")
  if ! grep -qxF "	CompleteID=\"$serial\"" <<<"$body" ||
    ! grep -qxF "	RunningID=\"$serial\"" <<<"$body" ||
    ! grep -qxF "	LastResult=\"complete\"" <<<"$body"; then
    echo "the record of share $name is not whole: $(tr '\n' ' ' <<<"$body")" >&2
    bad=$((bad + 1))
  fi
done
echo "check: $senders shares, $bad faults (lost or torn records, incomplete shares)"
((bad == 0))
