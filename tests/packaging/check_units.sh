#!/usr/bin/env bash
# Check the units of the packages in DIRECTORY for errors and exposure: check_units.sh DIRECTORY
# ARCHITECTURE, in a sandbox.
set -euo pipefail
[ -e /.ternha-sandbox ] || { echo "check_units.sh: not in a sandbox" >&2; exit 99; }

# With merged /usr: units may be under either name.
root=/tmp/root
mkdir -p "$root"/usr/{bin,lib}
ln -s usr/bin usr/lib "$root"
for package in "$1"/*_"$2".deb; do
    dpkg -x "$package" "$root"
done

# Only files of the system that the units name must exist.
cp -L /bin/{kill,sh} "$root/bin/"
cp /lib/systemd/system/{basic,sysinit,network,network-pre,local-fs,local-fs-pre,shutdown,umount,paths,sockets,slices,timers,swap}.target \
    "$root/lib/systemd/system/"
complaints=$(systemd-analyze verify --root="$root" --man=no --recursive-errors=no \
    "$root"/lib/systemd/system/ternha*.{service,timer} 2>&1) || { echo "$complaints" >&2; exit 1; }
[ -z "$complaints" ] || { echo "$complaints" >&2; exit 1; }

# The threshold is in tenths; above it the command fails.
for unit in ternhad ternha-firewall ternha-metrics; do
    systemd-analyze security --offline=true --threshold=40 --no-pager "$root/lib/systemd/system/$unit.service" |
        tail -n 1
done
