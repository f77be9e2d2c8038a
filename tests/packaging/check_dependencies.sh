#!/usr/bin/env bash
# Check the dependencies of the packages in DIRECTORY: check_dependencies.sh DIRECTORY ARCHITECTURE.
set -euo pipefail

fail() { echo "FAILED: $1" >&2; exit 1; }

depends() { # PACKAGE DEPENDENCY...: whatever the version
    local package=$1 all
    all=$(dpkg-deb -f "$directory/${package}"_*_"$architecture".deb Depends)
    shift
    for dependency in "$@"; do
        grep -qE "(^|, )$dependency( \(.*\))?(,|$)" <<<"$all" ||
            fail "$package does not depend on $dependency: $all"
    done
}

directory=$1 architecture=$2
depends libterncore6 libc6
depends libternhadaemon6 libterncore6 libc6 'libstdc\+\+6' 'libjsoncpp[0-9]+' iputils-ping net-tools procps xz-utils
# libsystemd: readiness and watchdog on every architecture.
depends ternhad libternhadaemon6 libc6 'libstdc\+\+6' 'libjsoncpp[0-9]+' libsystemd0
depends libternhadaemon-dev libternhadaemon6 libjsoncpp-dev

unit=$(dpkg-deb --fsys-tarfile "$directory"/ternhad_*_"$architecture".deb |
    tar --extract --to-stdout --wildcards '*/systemd/system/ternhad.service')
for line in Type=notify WatchdogSec=; do
    grep -q "^$line" <<<"$unit" || fail "ternhad.service has no $line"
done
