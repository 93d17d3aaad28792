#!/bin/sh
# Builds clients against what is installed, by the CMake package and by pkg-config alone: installed.sh ROOT BUILD FOLDER
set -eu
root=$1 build=$2 folder=$3
fail() { echo "$*" >&2; exit 1; }

rm -rf "$folder"
DESTDIR=$folder/root cmake --install "$build" >/dev/null
config=$(find "$folder/root" -name vxreportingConfig.cmake)
cmake -G Ninja -S "$root/tests/house/parent" -B "$folder/build" -Dvxreporting_DIR="$(dirname "$config")" \
  -DVXREPORTING="$root" -DVX_INSTALLED=ON -DCMAKE_CXX_COMPILER=g++ -DCMAKE_EXPORT_COMPILE_COMMANDS=ON --no-warn-unused-cli
cmake --build "$folder/build" -- --quiet
"$folder/build/parent"
flags=$(grep '"command".*parent\.cpp' "$folder/build/compile_commands.json")
case $flags in *-Werror* | *-Wall* | *-Wextra* | *-fsanitize* | *-DVX_* | *"$root "*) fail "a flag leaked: $flags" ;; esac

export PKG_CONFIG_SYSROOT_DIR="$folder/root" PKG_CONFIG_PATH
PKG_CONFIG_PATH=$(dirname "$(find "$folder/root" -name vxreporting-cpp.pc)")
g++ -std=c++20 -Wall -Wextra -Wpedantic -Werror "$folder/build/readme.cpp" $(pkg-config --cflags --libs vxreporting-cpp) -o "$folder/readme"
cc -std=c11 -Wall -Wextra -Wpedantic -Werror "$root/tests/client/c_client.c" $(pkg-config --cflags --libs vxreporting) \
  -o "$folder/c"
export LD_LIBRARY_PATH="$PKG_CONFIG_PATH/.."
ldd "$folder/readme" "$folder/c" | grep -v -e linux-vdso -e ld-linux -e 'lib\(c\|m\|stdc++\|gcc_s\|vxreporting\)\.so' -e ':$' && fail "it needs more than libc and libstdc++"
echo "all built, no flag came with it"
