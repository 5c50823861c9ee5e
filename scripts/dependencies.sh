#!/bin/bash
# dependencies.sh product|build|test|cluster|package: installs with apt whatever is missing of what is needed to build
# the libraries and programs, with the tests and benchmarks, to run the tests, to play several hosts, to make the .deb;
# silent when nothing is.
. "$(dirname "$0")/common.sh"
purpose=${1:-build}

wanted=(g++ cmake ninja-build pkg-config libevent-dev libflatbuffers-dev flatbuffers-compiler libcli11-dev
        libtoml11-dev nlohmann-json3-dev libspdlog-dev libsodium-dev libncurses-dev libcpg-dev libquorum-dev
        libvotequorum-dev libcfg-dev libcorosync-common-dev)
case $purpose in build | test) wanted+=(libgtest-dev libgmock-dev libbenchmark-dev libvterm-dev) ;; esac
case $purpose in cluster | test) wanted+=(corosync iproute2) ;; esac
# The sanitizer builds use clang. Where its runtimes are a package of their own they are wanted too, elsewhere
# (Ubuntu 22.04) they come with the compiler. The symbolizer of llvm makes the sanitizers' reports readable.
# abigail-tools compares the library's interface with its description, lintian looks through the package.
if [ "$purpose" = test ]; then wanted+=(clang llvm libclang-rt-dev abigail-tools lintian); fi
case $purpose in package | test) wanted+=(dpkg-dev file) ;; esac

if ! command -v dpkg-query >/dev/null; then
  echo "Not a Debian or Ubuntu: please see to it that you have the equivalents of: ${wanted[*]}" >&2
  exit 0
fi

is_installed() { dpkg-query -W -f='${Status}' "$1" 2>/dev/null | grep -q 'ok installed$'; }

missing=()
for package in "${wanted[@]}"; do
  is_installed "$package" || missing+=("$package")
done
[ ${#missing[@]} -gt 0 ] || exit 0

# A runtime that works is there, whatever package it came in.
sanitizers_work() { echo 'int main() {}' | clang++ -x c++ -fsanitize=address -o /dev/null - 2>/dev/null; }
if [ "${missing[*]}" = libclang-rt-dev ] && sanitizers_work; then exit 0; fi

as_root=()
if [ "$(id -u)" -ne 0 ]; then as_root=(sudo); fi

give_up() {
  echo "Could not install what is missing ($1). As root, please run:" >&2
  echo "  apt-get update && apt-get install -y ${missing[*]}" >&2
  exit 1
}

if [ ${#as_root[@]} -gt 0 ] && ! command -v sudo >/dev/null; then give_up "you are not root and there is no sudo"; fi

echo "Installing: ${missing[*]}"
"${as_root[@]}" apt-get update -q || give_up "apt-get update failed"
if ! apt-cache show libclang-rt-dev >/dev/null 2>&1; then
  known=()
  for package in "${missing[@]}"; do [ "$package" = libclang-rt-dev ] || known+=("$package"); done
  missing=(${known[@]+"${known[@]}"})
fi
[ ${#missing[@]} -gt 0 ] || exit 0
"${as_root[@]}" env DEBIAN_FRONTEND=noninteractive apt-get install -y -q --no-install-recommends "${missing[@]}" ||
  give_up "apt-get install failed"
