#!/usr/bin/env bash
# Install the build tree into a prefix, move it, and build and run a host daemon against it:
# install_and_use.sh BUILD_DIRECTORY WORK_DIRECTORY CXX SANDBOX_LAUNCHER. Programs run only in the
# sandbox.
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
build=$1 work=$2 cxx=$3 launcher=$4

fail() { echo "FAILED: $1" >&2; exit 1; }
expect() { [ "$2" = "$3" ] || fail "$1: expected \"$3\", got \"$2\""; }
in_sandbox() { "$launcher" --bind "$work" "$@"; }

rm -rf "$work"
mkdir -p "$work"
cmake --install "$build" --prefix "$work/first" >"$work/install.log"
mv "$work/first" "$work/prefix"
prefix=$work/prefix

# One name contains the build type.
(cd "$prefix" && find . ! -type d | sed -E 's|^\./||; s|(Targets-)[a-z]+\.cmake|\1BUILD.cmake|') |
    LC_ALL=C sort | diff "$here/installed_files.txt" - || fail "the installed files are not those listed"

cmake -S "$here/consumer" -B "$work/consumer" -DCMAKE_CXX_COMPILER="$cxx" -DCMAKE_PREFIX_PATH="$prefix" \
    >"$work/configure.log"
cmake --build "$work/consumer" >"$work/build.log" || { cat "$work/build.log" >&2; exit 1; }
expect "the daemon built with CMake" "$(in_sandbox -- "$work/consumer/consumer")" true

export PKG_CONFIG_PATH=$prefix/lib/pkgconfig
expect "version in pkg-config" "$(pkg-config --modversion ternhadaemon)" 6.2
read -ra flags < <(pkg-config --cflags --libs ternhadaemon)
"$cxx" -std=c++17 "$here/consumer/main.cpp" -o "$work/plain" "${flags[@]}"
expect "the daemon built without CMake" \
    "$(in_sandbox --env "LD_LIBRARY_PATH=$prefix/lib" -- "$work/plain")" true

expect "ternhad --version" "$(in_sandbox -- "$prefix/sbin/ternhad" --version)" "ternhad 6.2"
expect "ternhactl --version" "$(in_sandbox -- "$prefix/sbin/ternhactl" --version)" "ternhactl 6.2"
in_sandbox -- "$prefix/sbin/ternha-firewall" --help | grep -q '^Usage: ternha-firewall' || fail "ternha-firewall --help"
