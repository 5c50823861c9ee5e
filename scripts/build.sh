#!/bin/bash
# build.sh PRESET [TARGET...]: installs what is missing, configures and builds.
# build.sh product: the same for no more than what is installed, and the examples, in the folder of the preset release.
. "$(dirname "$0")/common.sh"
if [ "$1" = product ]; then
  scripts/dependencies.sh product
  build_product
else
  scripts/dependencies.sh build
  build "$@"
fi
