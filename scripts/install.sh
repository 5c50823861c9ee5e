#!/bin/bash
# install.sh BUILD_FOLDER PREFIX: installs, below $DESTDIR where that is set, and sees to it that programs find the
# libraries, or says how they do.
. "$(dirname "$0")/common.sh"
build=$1 prefix=$2
cmake --install "$build" --prefix "$prefix"
[ -z "${DESTDIR:-}" ] || exit 0 # to be taken elsewhere

PATH=$PATH:/usr/sbin:/sbin # not everybody's has them
libraries=$(dirname "$(grep -m1 '/libzn_gscl\.so$' "$build/install_manifest.txt")")
searched() { ldconfig -v -N -X 2>/dev/null | sed -n 's|^\(/[^:]*\):.*|\1|p' | xargs realpath -q; }
if ! searched | grep -qxF "$(realpath "$libraries")"; then
  echo "$libraries is no folder of the system. For programs to be built and run with what is there, type:"
  echo "  export PKG_CONFIG_PATH=$libraries/pkgconfig CMAKE_PREFIX_PATH=$prefix LD_LIBRARY_PATH=$libraries"
elif ! ldconfig 2>/dev/null; then
  echo "For programs to find the libraries, type as root: ldconfig"
fi
