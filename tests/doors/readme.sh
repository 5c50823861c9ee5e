#!/bin/bash
# readme.sh SOURCE_FOLDER HELLO: the program in the README is examples/hello.cpp, and what the README says that it
# prints is what it prints.
set -euo pipefail
source=$1 hello=$2

# block N: the text of the N-th fenced block.
block() { awk -v n="$1" '/^```/ { if (inside) inside = 0; else { inside = 1; count++ } next } inside && count == n' "$source/README.md"; }

diff <(block 1) "$source/examples/hello.cpp" || { echo "README.md shows another program than examples/hello.cpp"; exit 1; }
diff <(block 2) <(GSD_ENDPOINT=embedded: "$hello") || { echo "README.md shows another output"; exit 1; }
