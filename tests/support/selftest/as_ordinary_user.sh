#!/bin/sh
# Run a test program in a sandbox as an unprivileged user:
# as_ordinary_user.sh SANDBOX PROGRAM ARGUMENT...
set -eu

sandbox=$1 program=$2
shift 2
# Copies: the build tree may be accessible only to root.
directory=$(mktemp -d)
trap 'rm -rf "$directory"' EXIT
chmod 755 "$directory"
cp "$sandbox" "$directory/sandbox"
cp "$program" "$directory/program"
cd "$directory"
set -- "$directory/sandbox" --bind "$directory" -- "$directory/program" "$@"
[ "$(id -u)" -ne 0 ] || set -- setpriv --reuid 65534 --regid 65534 --clear-groups "$@"
"$@"
