#!/bin/bash
# test.sh PRESET...: builds and tests each preset, says its totals, and ends with the totals of all of them. Every
# preset is run, also after a failure, so that one run tells everything.
. "$(dirname "$0")/common.sh"
scripts/dependencies.sh test

# total ATTRIBUTE FILE: a number from the first test suite of a JUnit file.
total() { grep -m1 -o "$1=\"[0-9]*\"" "$2" | grep -o '[0-9]*'; }

passed=0 failed=0 skipped=0 broken=()
for preset in "$@"; do
  echo "== $preset"
  results=$PWD/build/$preset/tests.xml
  rm -f "$results"
  if ! build "$preset"; then broken+=("$preset does not build"); continue; fi
  fixed_addresses ctest --preset "$preset" -j "$jobs" --no-tests=error --output-junit "$results" ||
    broken+=("$preset has failures")
  if [ ! -f "$results" ]; then broken+=("$preset gave no results"); continue; fi
  f=$(total failures "$results")
  s=$(($(total skipped "$results") + $(total disabled "$results")))
  p=$(($(total tests "$results") - f - s))
  echo "$preset: $p passed, $f failed, $s skipped"
  passed=$((passed + p)) failed=$((failed + f)) skipped=$((skipped + s))
done

for line in ${broken[@]+"${broken[@]}"}; do echo "$line" >&2; done
# A build that does not compile is a failure that no test could count.
[ ${#broken[@]} -eq 0 ] || [ "$failed" -gt 0 ] || failed=${#broken[@]}
echo "$passed passed, $failed failed, $skipped skipped"
[ ${#broken[@]} -eq 0 ]
