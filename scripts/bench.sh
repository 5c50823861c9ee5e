#!/bin/bash
# bench.sh BUILD_FOLDER: runs every benchmark; tables on standard output, JSON in BUILD_FOLDER/bench. Exit status 1
# when a benchmark itself failed; a bound that is missed is only reported.
. "$(dirname "$0")/common.sh"
bin=$1/bin/bench out=$1/bench
mkdir -p "$out"
status=0
for program in "$bin"/*; do
  name=$(basename "$program")
  echo "== $name"
  run=("$program")
  if [ "$name" = cluster ]; then run=(scripts/cluster_bench.sh "$1"); fi
  "${run[@]}" --benchmark_out="$out/$name.json" --benchmark_out_format=json || status=1
done
echo "JSON: $out"
exit $status
