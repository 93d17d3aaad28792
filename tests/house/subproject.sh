#!/bin/sh
# Builds a project that has this one below it, on a machine that has nothing but a compiler: subproject.sh ROOT BUILD
set -eu
root=$1 build=$2
nothing="-DCMAKE_DISABLE_FIND_PACKAGE_PkgConfig=ON -DCMAKE_DISABLE_FIND_PACKAGE_GTest=ON
         -DCMAKE_DISABLE_FIND_PACKAGE_Python3=ON -DCMAKE_DISABLE_FIND_PACKAGE_benchmark=ON"
fail() { echo "$*" >&2; exit 1; }

rm -rf "$build"
PKG_CONFIG_LIBDIR=/nonexistent cmake -G Ninja -S "$root/tests/house/parent" -B "$build" -DVXREPORTING="$root" \
  -DCMAKE_CXX_COMPILER=g++ -DCMAKE_CXX_COMPILER_LAUNCHER="$(command -v ccache || true)" \
  -DCMAKE_EXPORT_COMPILE_COMMANDS=ON --no-warn-unused-cli $nothing
cmake --build "$build" -- --quiet
"$build/parent"

flags=$(grep '"command".*parent\.cpp' "$build/compile_commands.json")
case $flags in *-Werror* | *-Wall* | *-Wextra* | *-fsanitize* | *-DVX_*) fail "a flag leaked: $flags" ;; esac
grep -q -e -Werror "$build/compile_commands.json" && fail "warnings are errors below somebody else's project"
ctest --test-dir "$build" -N | grep -q '^Total Tests: 0' || fail "its parent got tests"
find "$build" -name 'vxreport*' -type f -perm /111 | grep . && fail "its parent got programs"
echo "no flag leaked, nothing but the client library was built"

# A release needs neither the test nor the benchmark library.
cd "$root"
cmake --preset release -B "$build/release" -DCMAKE_DISABLE_FIND_PACKAGE_GTest=ON \
  -DCMAKE_DISABLE_FIND_PACKAGE_benchmark=ON --no-warn-unused-cli >/dev/null
