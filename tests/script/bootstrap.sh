#!/usr/bin/env bash
# Test script/bootstrap with missing packages, privileges or index: bootstrap.sh BOOTSTRAP, in a
# sandbox. All programs are stubs.
set -uo pipefail
[ -e /.ternha-sandbox ] || { echo "bootstrap.sh: not in a sandbox" >&2; exit 99; }
bootstrap=$1

fail() { printf 'FAILED: %s\n%s\n' "$1" "$output" >&2; exit 1; }
stub() { # NAME SCRIPT
    printf '#!/bin/sh\n%s\n' "$2" >"/tmp/stubs/$1"
    chmod +x "/tmp/stubs/$1"
}
# bootstrap_as ID PURPOSE...: record output, exit code and calls of apt-get and dpkg.
bootstrap_as() {
    stub id "echo $1"
    : >/tmp/calls
    output=$(PATH=/tmp/stubs:$PATH "$bootstrap" "${@:2}" 2>&1)
    code=$?
    calls=$(cat /tmp/calls)
}
says() { grep -qF -- "$1" <<<"$output" || fail "does not say: $1"; }
calls() { grep -qE -- "$1" <<<"$calls" || fail "does not call: $1"; }

mkdir -p /tmp/stubs
stub dpkg 'case $1 in --print-architecture) echo amd64 ;; *) echo "dpkg $*" >>/tmp/calls ;; esac'
stub apt-get 'echo "apt-get $*" >>/tmp/calls; case "$*" in *update) exit 100 ;; esac'
stub apt-cache 'echo "$2 | 1.0 | here"'
stub sudo 'exit 1'

stub dpkg-query 'echo installed amd64'
bootstrap_as 1000 test
[ "$code$calls" = 0 ] || fail "it acts although all packages are installed"

stub dpkg-query 'exit 1'
bootstrap_as 1000 demo
[ "$code$calls" = 1 ] || fail "without privileges: exit code $code"
says "apt-get install --no-install-recommends bubblewrap cmake g++ "

# One library is installed only for the other architecture, one only for this one; the index is
# incomplete.
stub dpkg-query 'case $3 in
    libgtest-dev:armhf) exit 1 ;;
    libjsoncpp-dev | *:armhf) echo installed armhf ;;
    *) echo installed amd64 ;;
esac'
bootstrap_as 0 arm
[ "$code" = 0 ] || fail "exit code $code"
calls '^dpkg --add-architecture armhf$'
calls '^apt-get -q install -y --no-install-recommends libgtest-dev:armhf libjsoncpp-dev$'

stub dpkg-query 'exit 1'
stub apt-cache '[ "$2" = xz-utils ] || echo "$2 | 1.0 | here"'
bootstrap_as 0 demo
[ "$code" = 1 ] || fail "unknown package: exit code $code"
says "unknown package xz-utils, needed by script/bench, script/check-style, "
says ", script/test valgrind. All else works without it"
if grep -qF script/check-docs <<<"$output"; then fail "says that script/check-docs needs xz-utils"; fi
if grep -q ' install ' <<<"$calls"; then fail "installs without all packages"; fi

bootstrap_as 0 breakfast
[ "$code" = 2 ] || fail "unknown purpose: exit code $code"
