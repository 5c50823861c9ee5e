#!/bin/sh
# Compiles every header given alone, as C++11 and later, with each compiler: public_headers.sh ROOT SCRATCH COMPILERS
# HEADERS... COMPILERS is one word, separated by commas; HEADERS are named as a user includes them.
set -eu
cd "$1"
scratch=$2
compilers=$(echo "$3" | tr , ' ')
shift 3

status=0
rm -rf "$scratch"
mkdir -p "$scratch"
for header in "$@"; do
  # Twice, which proves the guard.
  printf '#include "%s"\n#include "%s"\n' "$header" "$header" > "$scratch/$(echo "$header" | tr / _).cpp"
  case "$header" in
    gscl/gscl.h | gscl/export.h) ;;
    gscl/*) grep -q "\"$header\"" gscl/gscl.h || { echo "FAILED: gscl/gscl.h does not include $header"; status=1; } ;;
  esac
done

for cxx in $compilers; do
  for std in c++11 c++17 c++20; do
    "$cxx" -std=$std -fsyntax-only -Wall -Wextra -Wpedantic -Wshadow -Werror -I . -I platform/cu -I platform/kpl \
      "$scratch"/*.cpp || { echo "FAILED: $cxx -std=$std"; status=1; }
  done
done
echo "$# headers, as C++11, C++17 and C++20, with: $compilers"
exit $status
