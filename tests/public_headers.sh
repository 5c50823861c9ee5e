#!/bin/sh
# Compiles every public header alone, as C++11 and later, with each compiler given: public_headers.sh ROOT SCRATCH CXX...
# A header is public unless its name ends in _internal.h or stands in the list of `internal` below.
set -eu
root=$1
scratch=$2
shift 2
internal=" gscl/trace.h gscl/GSConditionGuard.h "

rm -rf "$scratch"
mkdir -p "$scratch"
cd "$root"
headers=0
status=0
for header in gscl/*.h dae/*.h platform/cu/zn_cu.h platform/kpl/kpl.h; do
  case "$header" in *_internal.h | *'*'*) continue ;; esac
  case "$internal" in *" $header "*) continue ;; esac
  name=${header#platform/*/}
  # Twice, which proves the guard.
  printf '#include "%s"\n#include "%s"\n' "$name" "$name" > "$scratch/$(echo "$name" | tr / _).cpp"
  headers=$((headers + 1))
  case "$header" in
    gscl/gscl.h | gscl/export.h | dae/* | platform/*) ;;
    *) grep -q "\"$header\"" gscl/gscl.h || { echo "FAILED: gscl/gscl.h does not include $header"; status=1; } ;;
  esac
done

for cxx in "$@"; do
  for std in c++11 c++17 c++20; do
    "$cxx" -std=$std -fsyntax-only -Wall -Wextra -Wpedantic -Wshadow -Werror -I . -I platform/cu -I platform/kpl \
      "$scratch"/*.cpp || { echo "FAILED: $cxx -std=$std"; status=1; }
  done
done
echo "$headers headers, as C++11, C++17 and C++20, with: $*"
exit $status
