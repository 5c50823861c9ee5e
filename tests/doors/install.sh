#!/bin/bash
# install.sh SOURCE_FOLDER BUILD_FOLDER CMAKE: an installed tree works where it is put. Installs, moves the tree, and
# builds and runs a small program against it, by the CMake package and by pkg-config.
set -euo pipefail
source=$1 build=$2 cmake=$3
folder=$(mktemp -d)
trap 'rm -rf "$folder"' EXIT
export GSD_ENDPOINT=embedded:
expected='installed: WYX_JOIN approved, 1 member'

said=$("$source/scripts/install.sh" "$build" "$folder/first" | tail -n 1)
mv "$folder/first" "$folder/moved"

"$cmake" -S "$source/tests/doors/consumer" -B "$folder/by-cmake" -DCMAKE_PREFIX_PATH="$folder/moved" >/dev/null
"$cmake" --build "$folder/by-cmake" >/dev/null
[ "$("$folder/by-cmake/consumer")" = "$expected" ]

eval "${said//"$folder/first"/"$folder/moved"}" # what is to be typed, says the install
# The oldest standard that the headers promise.
c++ -std=c++11 "$source/tests/doors/consumer/consumer.cpp" -o "$folder/by-pkg-config" \
  $(pkg-config --cflags --libs zn_gscl)
[ "$("$folder/by-pkg-config")" = "$expected" ]

daemon=$(find "$folder/moved" -name gsd -type f)
"$daemon" --version | grep -qx 'gsd [0-9.]*'
