#!/bin/sh
# Holds the exported names of a library against a list: exports.sh LIBRARY LIST
# With --update as third argument it writes the list instead.
set -eu
export LC_ALL=C
names=$(nm -D --defined-only --demangle "$1" | sed -E 's/^[0-9a-f]+ [A-Za-z] //' | sort -u)
if [ "${3:-}" = --update ]; then
  printf '%s\n' "$names" > "$2"
  exit 0
fi
if printf '%s\n' "$names" | diff -u "$2" -; then exit 0; fi
echo "The exported names changed. If they should have: make interface"
exit 1
