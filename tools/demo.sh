#!/usr/bin/env bash
# The main job, end to end on one machine with nothing prepared: builds what is needed, creates a
# sending and a receiving server (each under its own temporary S2S_ROOT), starts the receiver's
# rsync daemon on the loopback, creates two shares with a few thousand generated files (one of them
# encrypted, with a key file), runs `s2s sync`, changes and deletes files and syncs again, shows
# the receiver's status. Then it starts the sync service `s2sd` on the sender, gives it a scheduled
# task and a real-time task with `s2s task add`, lists them with their next runs, changes a file on
# the sender and waits for it to arrive on the receiver by itself. Last it stops the service,
# checks that both trees are identical and stops everything it started.
#
# The sending side reaches the receiver at the standard rsync port, so the demo runs in a private
# network namespace of its own, where that port is free whatever this machine runs; it also gets
# a private mount namespace, in which the SSH server that carries the encryption key sees a demo
# account (nothing on the machine itself is changed). Needs root, like the servers it stands for.
#
# Usage: bash tools/demo.sh
#   S2S_DEMO_KEEP=1 keeps the temporary directory; S2S_BUILD_DIR chooses the build directory
#   (default build).
# Exit status: 0 when both syncs succeeded, the real-time change arrived and the trees are
# identical, 1 otherwise.
set -euo pipefail
cd "$(dirname "$0")/.."
source tools/lib.sh
s2s_locate_build

if [ -z "${S2S_DEMO_INSIDE:-}" ]; then
  s2s_require_root demo "it starts an rsync daemon and an SSH server in private namespaces"
  bash tools/deps.sh
  echo "== building (incremental)"
  s2s_build s2s_cli s2s-receiver s2sd
  exec unshare --net --mount --propagation private -- env S2S_DEMO_INSIDE=1 bash "$0" "$@"
fi

user=demo
password=$(s2s_random_password)
ssh_port=2222
started=$(date +%s.%N)

s2s_stage s2s-demo
sshd_pid=
s2sd_pid=

cleanup() {
  local status=$?
  set +e
  if [ -n "$s2sd_pid" ]; then
    kill "$s2sd_pid" 2>/dev/null
    wait "$s2sd_pid" 2>/dev/null
  fi
  S2S_ROOT=$receiver "$bin/s2s-receiver" stop >/dev/null 2>&1
  if [ -n "$sshd_pid" ]; then
    kill "$sshd_pid" 2>/dev/null
    wait "$sshd_pid" 2>/dev/null
  fi
  if [ -n "${S2S_DEMO_KEEP:-}" ]; then
    echo "demo: kept $work"
  else
    rm -rf "$work"
  fi
  exit $status
}
trap cleanup EXIT
trap 'exit 130' INT TERM

# --- two servers ---------------------------------------------------------------------------------
make_host() {  # root serial
  s2s_make_host "$1" "$2"
  mkdir -p "$1/tmp/S2S" "$1/usr/vurn/etc/.encrypt"
  chmod 700 "$1/tmp/S2S"
}
make_host "$sender" "SN-DEMO-SENDER"
make_host "$receiver" "SN-DEMO-RECEIVER"
mkdir -p "$sender/keys" && chmod 700 "$sender/keys"
for side in sender receiver; do
  root=${!side}
  mkdir -p "$root/volume1/docs" "$root/volume1/vault"
  S2S_ROOT=$root "$bin/s2s" share add docs --path "$root/volume1/docs" >/dev/null
  S2S_ROOT=$root "$bin/s2s" share add vault --path "$root/volume1/vault" --encrypted \
    --key-len 32 --key-file "$root/keys/vault.key" >/dev/null
done
head -c 32 /dev/urandom >"$sender/keys/vault.key"
chmod 600 "$sender/keys/vault.key"

echo "== receiver: rsync daemon on 127.0.0.1:873 (private network)"
s2s_start_receiver "$receiver" "$user" "$password"

# --- the SSH server that carries encryption keys -------------------------------------------------
# Keys always travel over SSH. The SSH server sees a demo account (an alias of root with the demo
# password) through copies of the account files mounted in this private mount namespace; the
# remote rsync reads the receiver's daemon configuration below the receiver's root, which the
# sender learns from S2S_REMOTE_ROOT (a real server keeps it at its fixed path).
start_sshd() {
  local ssh_dir=$work/ssh
  mkdir -p "$ssh_dir" /run/sshd
  chmod 700 "$ssh_dir"
  ssh-keygen -q -t ed25519 -N '' -f "$ssh_dir/host_key"
  # ssh records the server's key in the home directory: root's home is moved into the demo's.
  mkdir -p "$ssh_dir/home"
  sed "s|^root:\([^:]*\):0:0:\([^:]*\):[^:]*:|root:\1:0:0:\2:$ssh_dir/home:|" /etc/passwd \
    >"$ssh_dir/passwd"
  cp /etc/shadow "$ssh_dir/shadow"
  echo "$user:x:0:0:s2s demo:$ssh_dir/home:/bin/bash" >>"$ssh_dir/passwd"
  echo "$user:$(openssl passwd -6 -stdin <<<"$password"):19000:0:99999:7:::" >>"$ssh_dir/shadow"
  chmod 600 "$ssh_dir/shadow"
  mount --bind "$ssh_dir/passwd" /etc/passwd
  mount --bind "$ssh_dir/shadow" /etc/shadow
  cat >"$ssh_dir/sshd_config" <<EOF
Port $ssh_port
ListenAddress 127.0.0.1
HostKey $ssh_dir/host_key
PidFile $ssh_dir/sshd.pid
PermitRootLogin yes
PasswordAuthentication yes
KbdInteractiveAuthentication no
UsePAM no
PubkeyAuthentication no
StrictModes no
LogLevel ERROR
EOF
  /usr/sbin/sshd -D -e -f "$ssh_dir/sshd_config" 2>>"$ssh_dir/sshd.log" &
  sshd_pid=$!
  for _ in $(seq 1 100); do
    (exec 3<>/dev/tcp/127.0.0.1/$ssh_port) 2>/dev/null && return 0
    sleep 0.05
  done
  echo "demo: the SSH server did not start: $(cat "$ssh_dir/sshd.log")" >&2
  return 1
}
echo "== receiver: SSH server on 127.0.0.1:$ssh_port for encryption keys"
start_sshd

# --- shares with generated files -----------------------------------------------------------------
# A few thousand small files of varied sizes in nested folders; the encrypted share's files stand
# for its ciphertext directory, which is what the sync copies.
generate() {  # dir folders files-per-folder
  local dir=$1 folders=$2 per=$3 i size
  for ((i = 0; i < folders; i++)); do
    mkdir -p "$dir/folder$((i % 8))/set$i"
    size=$((512 + (i * 977) % 7680))
    head -c $((size * per)) /dev/urandom | split -b "$size" -a 3 - "$dir/folder$((i % 8))/set$i/file_"
  done
}
generate "$sender/volume1/docs" 40 60
generate "$sender/volume1/@vault@" 20 50
echo "fixed name with spaces" >"$sender/volume1/docs/read me.txt"
echo "== sender: shares"
S2S_ROOT=$sender "$bin/s2s" share list

task=$work/task.json
cat >"$task" <<EOF
{
  "id": 1,
  "name": "demo",
  "share_list": ["docs", "vault"],
  "server_ip": "127.0.0.1",
  "user": "$user",
  "ssh_port": $ssh_port,
  "schedule_mode": 2,
  "week_schd": "0111110",
  "schedule_begin_hour": 1,
  "schedule_begin_min": 30
}
EOF
password_file=$work/password
s2s_password_file "$password_file" "$password"

# Reads a top-level number from a JSON summary (the tool prints one key per line).
field() { sed -n "s/^  \"$2\": \([0-9.]*\),\{0,1\}$/\1/p" "$1"; }

run_sync() {  # label
  echo "== $1: s2s sync --task task.json --password-file password"
  local status=0
  S2S_ROOT=$sender S2S_REMOTE_ROOT=$receiver "$bin/s2s" sync --task "$task" \
    --password-file "$password_file" --json >"$work/$1.json" || status=$?
  if [ "$status" -ne 0 ]; then
    echo "demo: $1 failed with exit code $status" >&2
    cat "$work/$1.json" >&2
  fi
  return $status
}

sync_status=0
run_sync first-sync || sync_status=1

echo "== changing the sender: 60 files changed, 25 added, 40 deleted, one folder removed"
docs=$sender/volume1/docs
mapfile -t files < <(find "$docs" -type f -name 'file_*' | sort)
for ((i = 0; i < 60; i++)); do head -c 2048 /dev/urandom >"${files[$((i * 37 % ${#files[@]}))]}"; done
for ((i = 0; i < 40; i++)); do rm -f "${files[$((i * 53 % ${#files[@]} + 1))]}"; done
rm -rf "$docs/folder3/set11"
mkdir -p "$docs/new folder"
for ((i = 0; i < 25; i++)); do head -c $((100 * i + 1)) /dev/urandom >"$docs/new folder/added_$i"; done
head -c 4096 /dev/urandom >"$sender/volume1/@vault@/folder1/set1/file_aaa"

run_sync second-sync || sync_status=1

echo "== next run of the task (its schedule)"
"$bin/s2s" next-run --task "$task"

echo "== receiver: s2s-receiver status"
S2S_ROOT=$receiver "$bin/s2s-receiver" status

# --- the sync service ----------------------------------------------------------------------------
# s2sd runs in the foreground (as under systemd), in the background of this script, its log in a
# file that is shown when something goes wrong. Real-time changes are gathered for one second
# instead of the default five, so that the demo stays quick.
s2sd_log=$work/s2sd.log
service_failed() {  # message
  echo "demo: $1; the service's log:" >&2
  sed 's/^/  /' "$s2sd_log" >&2
  return 1
}
start_s2sd() {
  S2S_ROOT=$sender "$bin/s2sd" --delay 1 >"$s2sd_log" 2>&1 &
  s2sd_pid=$!
  local i
  for ((i = 0; i < 200; i++)); do  # at most 10 s
    if ! kill -0 "$s2sd_pid" 2>/dev/null; then
      wait "$s2sd_pid" || true
      s2sd_pid=
      service_failed "s2sd did not start"
      return 1
    fi
    [ -S "$sender/run/s2s/s2sd.sock" ] && return 0
    sleep 0.05
  done
  service_failed "s2sd did not open its control socket within 10 s"
}
stop_s2sd() {
  local pid=$s2sd_pid status=0
  s2sd_pid=
  kill -TERM "$pid" 2>/dev/null || true
  wait "$pid" || status=$?
  if [ "$status" -ne 0 ]; then
    service_failed "s2sd ended with exit code $status"
  fi
}
s2s_task() { S2S_ROOT=$sender "$bin/s2s" task "$@"; }

# Waits until no task of the service is queued or running, for at most $1 seconds.
wait_idle() {  # seconds
  local deadline=$((SECONDS + $1))
  while ((SECONDS < deadline)); do
    if ! s2s_task status --json | grep -Eq '"state": *"(queued|running)"'; then
      return 0
    fi
    sleep 0.1
  done
  service_failed "the service's runs did not end within $1 s"
}

run_service() {
  echo "== sender: s2sd, the sync service (real-time changes gathered for 1 s)"
  start_s2sd || return 1
  echo "== s2s task add: the weekly task of task.json, and a real-time task for docs"
  local realtime_task=$work/realtime.json
  cat >"$realtime_task" <<EOF
{
  "name": "docs live",
  "share_list": ["docs"],
  "server_ip": "127.0.0.1",
  "user": "$user",
  "schedule_mode": 1
}
EOF
  s2s_task add --task "$task" --password-file "$password_file" || return 1
  s2s_task add --task "$realtime_task" --password-file "$password_file" || return 1
  echo "== s2s task list"
  s2s_task list || return 1
  # A real-time task gets one full run when it is added: it ends first, so that the change below
  # is seen on its own.
  wait_idle 120 || return 1

  echo "== changing a file on the sender; waiting for it on the receiver"
  local name="docs/new folder/live note.txt" i written arrived=
  written=$(date +%s.%N)
  date "+written on the sender at %T.%N" >"$sender/volume1/$name"
  for ((i = 0; i < 600; i++)); do  # at most 30 s
    if cmp -s "$sender/volume1/$name" "$receiver/volume1/$name"; then
      arrived=$(date +%s.%N)
      break
    fi
    sleep 0.05
  done
  if [ -z "$arrived" ]; then
    service_failed "the changed file did not arrive within 30 s"
    return 1
  fi
  awk -v a="$written" -v b="$arrived" -v n="$name" \
    'BEGIN { printf "arrived by itself: %s, %.2fs after it was written\n", n, b - a }'
  wait_idle 60 || return 1
  echo "== s2s task history"
  s2s_task history --count 3 || return 1
  echo "== stopping s2sd"
  stop_s2sd
}
realtime_status=0
run_service || realtime_status=1

# --- verification --------------------------------------------------------------------------------
# A manifest of every entry (type, path, size, mode, modification time) and a checksum of every
# file's content, on both sides.
manifest() {  # dir
  (cd "$1" && find . -printf '%y %p %s %m %T@\n' | LC_ALL=C sort &&
    find . -type f -print0 | LC_ALL=C sort -z | xargs -0 -r sha256sum)
}
verdict=identical
for pair in "docs:docs" "@vault@:@vault@"; do
  if ! diff <(manifest "$sender/volume1/${pair%%:*}") <(manifest "$receiver/volume1/${pair##*:}") \
    >"$work/diff.txt"; then
    verdict=different
    echo "demo: ${pair%%:*} differs:" >&2
    head -20 "$work/diff.txt" >&2
  fi
done
key_copy=$receiver/usr/vurn/etc/.encrypt/vault/vault.key
if ! cmp -s "$sender/keys/vault.key" "$key_copy"; then
  verdict=different
  echo "demo: the encryption key did not arrive at $key_copy" >&2
fi

# --- summary -------------------------------------------------------------------------------------
echo
echo "== summary"
for run in first-sync second-sync; do
  if [ -s "$work/$run.json" ]; then
    printf '%-12s %6s files  %8s bytes in the shares  %10s bytes read by rsync  %6.2fs  %s\n' \
      "$run" "$(field "$work/$run.json" files)" "$(field "$work/$run.json" bytes)" \
      "$(field "$work/$run.json" read_bytes)" "$(field "$work/$run.json" seconds)" \
      "$(sed -n 's/^  "result": "\(.*\)",$/\1/p' "$work/$run.json")"
  fi
done
printf 'trees        %s (docs, vault ciphertext, vault key)\n' "$verdict"
awk -v a="$started" -v b="$(date +%s.%N)" 'BEGIN { printf "demo time    %.1fs\n", b - a }'
if [ "$realtime_status" -eq 0 ]; then
  echo "s2sd         the real-time change arrived by itself; the service stopped cleanly"
else
  echo "s2sd         FAILED (see above)"
fi
if [ "$verdict" != identical ] || [ "$sync_status" -ne 0 ] || [ "$realtime_status" -ne 0 ]; then
  echo "verdict: FAILED"
  exit 1
fi
echo "verdict: OK (both syncs and the real-time run succeeded; the receiver's copy is identical)"
