# Shared by the scripts beside it: stop at the first error, work from the top of the tree, use ccache where it is.
set -euo pipefail
cd "$(dirname "${BASH_SOURCE[0]}")/.."

jobs=$(nproc)
if command -v ccache >/dev/null; then
  export CMAKE_C_COMPILER_LAUNCHER=${CMAKE_C_COMPILER_LAUNCHER-ccache}
  export CMAKE_CXX_COMPILER_LAUNCHER=${CMAKE_CXX_COMPILER_LAUNCHER-ccache}
  export CCACHE_SLOPPINESS=${CCACHE_SLOPPINESS-pch_defines,time_macros}
fi

# The thread sanitizer of older compilers cannot cope with strongly randomised addresses. Run a command without
# the randomisation where that is allowed, and as it is where it is not.
fixed_addresses() {
  if setarch -R true 2>/dev/null; then setarch -R "$@"; else "$@"; fi
}

# configure PRESET [OPTION...]: always, since what was missing last time may be there now.
configure() {
  local said
  said=$(cmake --preset "$@" 2>&1) || { echo "$said"; return 1; }
}

# build PRESET [TARGET...]
build() {
  local preset=$1
  shift
  configure "$preset" || return
  fixed_addresses cmake --build --preset "$preset" -j "$jobs" ${1:+--target "$@"}
}

# build_product: needs nothing that only tests and benchmarks need, but where the folder has them they stay.
build_product() {
  local without=(-DZN_BUILD_TESTS=OFF -DZN_BUILD_BENCH=OFF)
  if grep -qs bin/tests/ build/release/build.ninja; then without=(); fi
  configure release ${without[@]+"${without[@]}"} || return
  cmake --build --preset release -j "$jobs" --target product
}
