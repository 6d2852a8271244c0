#!/usr/bin/env bash
# Installs the Debian packages the build, the tests, the demo and the coverage report need, only when one is missing.
set -euo pipefail
packages=(
  build-essential cmake ninja-build g++ pkg-config clang clang-format libclang-rt-14-dev
  libgtest-dev libgmock-dev libbenchmark-dev libssl-dev openssl libboost-dev libmsgpack-cxx-dev
  rsync openssh-server openssh-client sshpass procps iproute2 util-linux nlohmann-json3-dev libcli11-dev tzdata
  libsqlite3-dev ccache
  gcovr python3
)
missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if ((${#missing[@]})); then
  echo "installing: ${missing[*]}"
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq --no-install-recommends "${missing[@]}"
fi
