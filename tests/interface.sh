#!/bin/bash
# Holds the interface of a library, as its debug information has it (functions, classes with their layout and virtual
# functions, enumerations), against a saved description: interface.sh [--update] LIBRARY DESCRIPTION HEADER...
# Only what these headers declare counts. With --update it writes the description instead.
set -euo pipefail
update=
if [ "$1" = --update ]; then update=yes; shift; fi
library=$1 saved=$2
shift 2
command -v abidw >/dev/null && command -v abidiff >/dev/null ||
  { echo "skipped: there is no abidiff; scripts/dependencies.sh test installs it"; exit 77; }
folder=$(mktemp -d)
trap 'rm -rf "$folder"' EXIT

mkdir "$folder/headers"
cp "$@" "$folder/headers"
abidw --headers-dir "$folder/headers" --drop-private-types --exported-interfaces-only --drop-undefined-syms \
  --no-architecture --no-corpus-path --no-comp-dir-path --no-show-locs --no-elf-needed --no-write-default-sizes \
  --no-parameter-names --type-id-style hash --out-file "$folder/now.abi" "$library"
if [ -n "$update" ]; then
  gzip -9n <"$folder/now.abi" >"$saved"
  exit 0
fi
gzip -d <"$saved" >"$folder/saved.abi"
if abidiff --leaf-changes-only "$folder/saved.abi" "$folder/now.abi"; then exit 0; fi
echo "The interface changed. If it should have: make interface"
exit 1
