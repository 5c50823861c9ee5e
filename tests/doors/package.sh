#!/bin/bash
# package.sh BUILD_FOLDER CPACK: the Debian package has nothing that lintian calls an error or a warning, but for what
# its overrides explain.
set -euo pipefail
build=$1 cpack=$2
for program in dpkg-shlibdeps file lintian; do
  command -v $program >/dev/null && continue
  echo "skipped: there is no $program; scripts/dependencies.sh test installs it"
  exit 77
done
folder=$(mktemp -d)
trap 'rm -rf "$folder"' EXIT
(cd "$build" && "$cpack" -G DEB -B "$folder" >"$folder/said") || { cat "$folder/said"; exit 1; }
lintian --allow-root --fail-on error,warning --tag-display-limit 0 "$folder"/*.deb
