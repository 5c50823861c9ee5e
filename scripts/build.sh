#!/bin/bash
# build.sh PRESET [TARGET...]: installs what is missing, configures and builds.
. "$(dirname "$0")/common.sh"
scripts/dependencies.sh build
build "$@"
