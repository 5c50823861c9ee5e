#!/bin/bash
# install.sh SOURCE_FOLDER BUILD_FOLDER CMAKE: an installed tree works where it is put. Installs, moves the tree, and
# builds and runs a small program against it, by the CMake package and by pkg-config.
set -euo pipefail
source=$1 build=$2 cmake=$3
folder=$(mktemp -d)
trap 'rm -rf "$folder"' EXIT
export GSD_ENDPOINT=embedded:
expected='installed: WYX_JOIN approved, 1 member'

"$cmake" --install "$build" --prefix "$folder/first" >/dev/null
mv "$folder/first" "$folder/moved"

"$cmake" -S "$source/tests/doors/consumer" -B "$folder/by-cmake" -DCMAKE_PREFIX_PATH="$folder/moved" >/dev/null
"$cmake" --build "$folder/by-cmake" >/dev/null
[ "$("$folder/by-cmake/consumer")" = "$expected" ]

libraries=$(dirname "$(find "$folder/moved" -name libzn_gscl.so)")
export PKG_CONFIG_PATH=$libraries/pkgconfig
# The oldest standard that the headers promise.
c++ -std=c++11 "$source/tests/doors/consumer/consumer.cpp" -o "$folder/by-pkg-config" \
  $(pkg-config --cflags --libs zn_gscl) -Wl,-rpath,"$libraries"
[ "$("$folder/by-pkg-config")" = "$expected" ]

daemon=$(find "$folder/moved" -name gsd -type f)
"$daemon" --version | grep -qx 'gsd [0-9.]*'
