#!/bin/sh
# Runs a test program in a sandbox as an ordinary user, whose rights end at a user namespace.
# Arguments: launcher, test program, arguments of the test program.
set -eu

launcher=$1
program=$2
shift 2

if [ "$(id -u)" -ne 0 ]; then
    exec "$launcher" --bind "$(dirname "$launcher")" --bind "$(dirname "$program")" -- "$program" "$@"
fi

# The build tree may lie where only root gets to.
directory=$(mktemp -d)
trap 'rm -rf "$directory"' EXIT
chmod 755 "$directory"
cp "$launcher" "$program" "$directory"
launcher=$directory/$(basename "$launcher")
program=$directory/$(basename "$program")
cd "$directory"
setpriv --reuid 65534 --regid 65534 --clear-groups "$launcher" --bind "$directory" -- "$program" "$@"
