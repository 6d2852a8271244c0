# shellcheck shell=bash
# Shared set-up of the scripts that stage a sending and a receiving server on this one machine
# (tools/demo.sh, bench/realtime_latency.sh, bench/sync_vs_rsync.sh, bench/many_senders.sh): where
# the programs are, the root check and the build, a server's root with its host file, the
# receiver's rsync daemon, a password file only its owner reads, and generated trees of files.
# Source it from the repository's top folder; it defines functions only, except the variables
# that s2s_locate_build and s2s_stage set.

# Sets repo (this folder), build (S2S_BUILD_DIR, default build) and bin (the programs).
s2s_locate_build() {
  repo=$(pwd)
  build=${S2S_BUILD_DIR:-build}
  case $build in /*) bin=$build/bin ;; *) bin=$repo/$build/bin ;; esac
}

# Ends the script unless it runs as root.
s2s_require_root() {  # script-name why
  if [ "$(id -u)" -ne 0 ]; then
    echo "$1: run as root ($2)" >&2
    exit 1
  fi
}

# Benchmarks against a receiver on this machine: builds the sender and the receiver, then runs
# the calling script again as root in a private network namespace (its daemon listens on port 873
# there); inside it, returns at once.
s2s_bench_isolate() {  # args of the script...
  [ -n "${S2S_BENCH_INSIDE:-}" ] && return 0
  s2s_require_root bench "the daemon gets a private network namespace"
  s2s_build s2s_cli s2s-receiver >/dev/null
  exec unshare --net -- env S2S_BENCH_INSIDE=1 bash "$0" "$@"
}

# Configures the build folder (quietly) and builds the given targets in it; with S2S_NO_BUILD
# set, the programs already there are used as they are (an installed tree, an earlier build).
s2s_build() {  # target...
  [ -n "${S2S_NO_BUILD:-}" ] && return 0
  cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
  cmake --build "$build" -j "$(nproc)" --target "$@"
}

# Brings the loopback of the private network up and makes the work folder /tmp/<name>.XXXXXX:
# sets work, and sender and receiver, the two servers' roots in it.
# shellcheck disable=SC2034  # sender and receiver are the sourcing script's
s2s_stage() {  # name
  ip link set lo up
  work=$(mktemp -d "/tmp/$1.XXXXXX")
  sender=$work/sender
  receiver=$work/receiver
}

# A random password of letters and digits.
s2s_random_password() {
  head -c 18 /dev/urandom | base64 | tr -d '/+='
}

# A server below `root` (its S2S_ROOT): the configuration folder, one volume, and the host file
# naming the serial number and the volume. The private temporary folder is made at first use.
s2s_make_host() {  # root serial
  mkdir -p "$1/etc/s2s" "$1/volume1"
  printf '[host]\n\tserial="%s"\n[volumes]\n\t%s="internal,directory"\n' "$2" "$1/volume1" \
    >"$1/etc/s2s/host.conf"
}

# Configures and starts the receiver's rsync daemon on 127.0.0.1:873 for `user`; the password
# travels on standard input only.
s2s_start_receiver() {  # root user password
  printf '%s\n' "$3" |
    S2S_ROOT=$1 "$bin/s2s-receiver" configure --user "$2" --port 873 --address 127.0.0.1
  S2S_ROOT=$1 "$bin/s2s-receiver" start
}

# Writes the password into a file that only its owner can read.
s2s_password_file() {  # file password
  (umask 077 && printf '%s\n' "$2" >"$1")
}

# Fills `dir` with `count` files of `size` random bytes, 250 to a folder (dir0, dir1, ...).
s2s_generate_files() {  # dir count size
  local d n per_dir=250
  for ((d = 0; d * per_dir < $2; d++)); do
    n=$(($2 - d * per_dir < per_dir ? $2 - d * per_dir : per_dir))
    mkdir -p "$1/dir$d"
    head -c $((n * $3)) /dev/urandom | split -b "$3" -a 3 - "$1/dir$d/f"
  done
}
