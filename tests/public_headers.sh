#!/bin/sh
# Compiles every header given alone, as C++11 and later, and those outside gscl/ as C, too, with each compiler:
# public_headers.sh ROOT SCRATCH COMPILERS HEADERS... COMPILERS is one word, separated by commas; HEADERS are named as
# a user includes them.
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
  use=$scratch/$(echo "$header" | tr / _)
  printf '#include "%s"\n#include "%s"\n' "$header" "$header" > "$use.cpp"
  case "$header" in
    gscl/gscl.h | gscl/export.h) ;;
    gscl/*) grep -q "\"$header\"" gscl/gscl.h || { echo "FAILED: gscl/gscl.h does not include $header"; status=1; } ;;
    *) cp "$use.cpp" "$use.c" ;;
  esac
done

compile() {
  "$@" -fsyntax-only -Wall -Wextra -Wpedantic -Wshadow -Werror -I . -I platform/cu -I platform/kpl ||
    { echo "FAILED: $1 $2"; status=1; }
}
for cxx in $compilers; do
  for std in c++11 c++17 c++20; do compile "$cxx" -std=$std "$scratch"/*.cpp; done
  for std in c99 c17; do
    for header in "$scratch"/*.c; do compile "$cxx" -std=$std -x c -Wstrict-prototypes "$header"; done
  done
done
echo "$# headers, as C++11, C++17 and C++20, those outside gscl/ as C99 and C17, with: $compilers"
exit $status
