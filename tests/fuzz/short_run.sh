#!/bin/sh
# short_run.sh FUZZER CORPUS ARTIFACTS LENGTH: the same short run every time, from the saved corpus, cut after a
# minute; what it finds new is dropped, what crashes is kept in ARTIFACTS.
set -eu
found=$(mktemp -d)
trap 'rm -rf "$found"' EXIT
mkdir -p "$3"
"$1" -runs=20000 -max_total_time=60 -seed=1 -max_len="$4" -timeout=30 -verbosity=0 -print_final_stats=1 -artifact_prefix="$3/" "$found" "$2"
