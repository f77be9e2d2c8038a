#!/usr/bin/env bash
# Configures the package on machines where somebody else has taken the name /tmp/ha: foreign_buffer.sh POSTINST, in a
# sandbox.
set -euo pipefail
[ -e /.ternha-sandbox ] || { echo "foreign_buffer.sh: not in a sandbox" >&2; exit 99; }
postinst=$1

fail() { echo "FAILED: $1: $2" >&2; exit 1; }

# What each finds, and how the moved one is recognised.
another_users() {
    mkdir -m 0777 /tmp/ha
    echo mine >/tmp/ha/ha.daemon.log
    chown -R 1000 /tmp/ha 2>/dev/null || true # there may be no other one
}
is_another_users() { [ "$(cat "$1/ha.daemon.log")" = mine ]; }

a_link() { mkdir /tmp/target && ln -s /tmp/target /tmp/ha; }
is_a_link() { [ "$(readlink "$1")" = /tmp/target ] && rmdir /tmp/target; }

a_dangling_link() { ln -s /nowhere /tmp/ha; }
is_a_dangling_link() { [ "$(readlink "$1")" = /nowhere ]; }

a_file() { echo mine >/tmp/ha; }
is_a_file() { [ "$(cat "$1")" = mine ]; }

one_with_a_fifo() { mkdir -m 0700 /tmp/ha && mkfifo /tmp/ha/ha.daemon.log; }
is_one_with_a_fifo() { [ -p "$1/ha.daemon.log" ]; }

one_with_a_link() { mkdir -m 0700 /tmp/ha && echo kept >/tmp/secret && ln -s /tmp/secret /tmp/ha/ha.daemon.log; }
is_one_with_a_link() { [ -L "$1/ha.daemon.log" ] && [ "$(cat /tmp/secret)" = kept ]; }

for case in another_users a_link a_dangling_link a_file one_with_a_fifo one_with_a_link; do
    $case
    "$postinst" configure "" >/dev/null 2>&1 || fail "$case" "exit code $?"
    set -- /tmp/ha.foreign.*
    [[ $# -eq 1 && -d $1 ]] || fail "$case" "it was not moved aside"
    "is_$case" "$1/ha" || fail "$case" "it has changed"
    [ "$(stat -c %a "$1")" = 700 ] || fail "$case" "others can reach it"
    rm -r "$1"
    # What systemd-tmpfiles has made by then, if the machine has it, is ours.
    if [ -e /tmp/ha ] || [ -L /tmp/ha ]; then
        [ "$(stat -c '%F %u %a' /tmp/ha)" = "directory 0 700" ] || fail "$case" "a foreign one is still there"
        rmdir /tmp/ha
    fi
done

mkdir -m 0700 /tmp/ha
echo line >/tmp/ha/ha.daemon.log
mkdir /tmp/ha/others
"$postinst" configure "" >/dev/null 2>&1 || fail "our own" "exit code $?"
[[ $(cat /tmp/ha/ha.daemon.log) = line && -d /tmp/ha/others ]] || fail "our own" "it was not left alone"
! ls -d /tmp/ha.foreign.* 2>/dev/null || fail "our own" "something was moved"
