#!/usr/bin/env bash
# check_install.sh BUILD_DIR THIS_DIR: install, then compile and run outside programs.
set -euo pipefail
trap 'echo "check_install.sh: failed at line $LINENO: $BASH_COMMAND" >&2' ERR
build=$1
here=$2
scratch=$(mktemp -d "${TMPDIR:-/tmp}/s2s-install.XXXXXX")
trap 'rm -rf "$scratch"' EXIT
prefix=$scratch/prefix
cmake --install "$build" --prefix "$prefix" >/dev/null
libdir=$(dirname "$(find "$prefix" -name 's2s.pc' | head -n 1)")/..
export PKG_CONFIG_PATH=$libdir/pkgconfig
export LD_LIBRARY_PATH=$libdir

# The service units are installed naming the programs of the prefix given at install time and,
# where systemd's analyzer exists, pass its check; the temporary directory has its tmpfiles entry.
for unit in s2sd.service s2s-receiver.service; do
  test -f "$prefix/lib/systemd/system/$unit"
  grep -q "^ExecStart=$prefix/bin/" "$prefix/lib/systemd/system/$unit"
  sed -E "s#=(/[^ ]*)/(s2sd|s2s-receiver)( |\$)#=$prefix/bin/\2\3#" \
    "$prefix/lib/systemd/system/$unit" >"$scratch/$unit"
done
grep -q '^d /tmp/S2S 0700 root root -$' "$prefix/lib/tmpfiles.d/s2s.conf"
if command -v systemd-analyze >/dev/null; then
  systemd-analyze verify "$scratch/s2sd.service" "$scratch/s2s-receiver.service"
fi

# The installed programs find the installed library by themselves (the receiver's hooks run
# from a daemon without any library search path), and the receiver's help is not an error.
env -u LD_LIBRARY_PATH "$prefix/bin/s2s-receiver" --help | grep -q '^usage: s2s-receiver'
for program in s2s s2s-receiver s2sd; do
  if env -u LD_LIBRARY_PATH ldd "$prefix/bin/$program" | grep -q 'not found'; then
    echo "check_install.sh: the installed $program cannot find its libraries" >&2
    exit 1
  fi
done

# Every public header compiles on its own; the C headers also compile as C.
for header in "$prefix"/include/*.h; do
  name=$(basename "$header")
  printf '#include "%s"\n' "$name" >"$scratch/one.cpp"
  g++ -std=c++17 -Wall -Wextra -Wpedantic -Werror -fsyntax-only $(pkg-config --cflags s2s) \
    "$scratch/one.cpp"
  if grep -q 'extern "C"' "$header"; then
    printf '#include "%s"\n' "$name" >"$scratch/one.c"
    gcc -std=c11 -Wall -Wextra -Wpedantic -Werror -fsyntax-only $(pkg-config --cflags s2s) \
      "$scratch/one.c"
  fi
done

# Through pkg-config.
g++ -std=c++17 -Wall -Wextra -Werror -o "$scratch/outside" "$here/outside_program.cpp" \
  $(pkg-config --cflags --libs s2s)
"$scratch/outside" >"$scratch/out.txt"
grep -q '^{"name": "demo", "shares": \["docs", "media"\]}$' "$scratch/out.txt"
grep -q '^Protocal error$' "$scratch/out.txt"
grep -q '\[NOTE\] outside.cpp(7): logged$' "$scratch/out.txt"

# Through the CMake package.
mkdir -p "$scratch/cmake-project"
cp "$here/outside_program.cpp" "$scratch/cmake-project/"
cat >"$scratch/cmake-project/CMakeLists.txt" <<'CMAKE'
cmake_minimum_required(VERSION 3.25)
project(outside CXX)
set(CMAKE_CXX_STANDARD 17)
find_package(s2s REQUIRED)
add_executable(outside outside_program.cpp)
target_link_libraries(outside PRIVATE s2s::s2s)
CMAKE
cmake -S "$scratch/cmake-project" -B "$scratch/cmake-build" -G Ninja \
  -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build "$scratch/cmake-build" >/dev/null
"$scratch/cmake-build/outside" >"$scratch/out2.txt"
grep -q '^Protocal error$' "$scratch/out2.txt"
echo "installed library usable from outside programs"
