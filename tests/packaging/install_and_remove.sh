#!/usr/bin/env bash
# Install the packages of DIRECTORY, run the daemon and remove them: install_and_remove.sh DIRECTORY
# ARCHITECTURE, in a sandbox with the machine's /var/lib/dpkg.
set -euo pipefail
[ -e /.ternha-sandbox ] || { echo "install_and_remove.sh: not in a sandbox" >&2; exit 99; }
packages=$1 architecture=$2

fail() { echo "FAILED: $1" >&2; exit 1; }
expect() { [ "$2" = "$3" ] || fail "$1: expected \"$3\", got \"$2\""; }

eventually() { # LIMIT_IN_SECONDS COMMAND...
    local end=$((SECONDS + $1))
    shift
    until "$@" >/dev/null 2>&1; do
        [ "$SECONDS" -lt "$end" ] || return 1
        read -r -t 0.05 <> <(:) || true
    done
}

# The machine's programs are read-only: an overlay takes changes. A lower layer has missing
# libraries of the other architecture. The sandbox of an ordinary user may not change directories of
# the machine's root: the upper layer has its own.
layers=/run/layers
sysroot=
[ "$architecture" = "$(dpkg --print-architecture)" ] || sysroot=$("${0%/*}/../../script/debian-root" sysroot)
attributes=
# In a user namespace an overlay may only set user attributes.
grep -q 4294967295 /proc/self/uid_map || attributes=,userxattr
changed=$(for package in "$packages"/*_"$architecture".deb; do dpkg-deb --contents "$package"; done |
    sed -n 's|^d.* \./|/|p' | sort -u)
for directory in $changed; do
    directory=$(realpath --canonicalize-missing "$directory")
    below=${directory#/usr/}
    [[ $directory != /usr/*/* ]] || [ ! -d "$directory" ] || mkdir -p "$layers/${below%%/*}/upper/${below#*/}"
done
for directory in /usr/*; do
    if [ ! -d "$directory" ] || [ -L "$directory" ]; then
        continue
    fi
    layer=$layers/${directory#/usr/}
    mkdir -p "$layer/upper" "$layer/work"
    lower=$directory
    [ -z "$sysroot" ] || [ ! -d "$sysroot$directory" ] || lower=$directory:$sysroot$directory
    mount -t overlay overlay -o "lowerdir=$lower,upperdir=$layer/upper,workdir=$layer/work$attributes" "$directory"
done

# Files that differ from the machine's, without directories. Not those on other file systems, such
# as the build tree.
changes() {
    {
        find /etc /var /tmp /run -xdev \( -path /var/lib/dpkg -o -path "$layers" -o -path /run/dpkg \) -prune -o -print
        find "$layers" -path '*/upper/*' ! -type d
    } | sort
}

# Dependencies are checked against the machine; triggers are skipped to save time.
# Without the locks, which an ordinary user cannot read.
mkdir /run/dpkg
tar -c -C /var/lib/dpkg --exclude=./lock --exclude=./lock-frontend --exclude=./triggers/Lock . | tar -x --no-same-owner -C /run/dpkg
mkdir -p /var/lib/systemd
# Programs that packages of another architecture depend on are those of the machine.
options=()
[ "$architecture" = "$(dpkg --print-architecture)" ] || options=(--force-depends)
in_dpkg() { dpkg "${options[@]}" --admindir=/run/dpkg --log=/run/dpkg/log --no-triggers "$@" >/run/dpkg/output 2>&1 ||
    { cat /run/dpkg/output >&2; fail "dpkg $1"; }; }

installed=({ternhad,libternhadaemon-dev,libternhadaemon6,libterncore6}:"$architecture")
before=$(changes)
in_dpkg --install "$packages"/*_"$architecture".deb
expect "ternhad --version" "$(ternhad --version)" "ternhad 6.2"
# It requires the kernel's /proc, which a sandbox has elsewhere.
unshare --mount sh -c 'mount --rbind /.kernel/proc /proc && exec systemd-tmpfiles --create ternha.conf'
expect "mode of /var/log/ha" "$(stat -c '%a %U' /var/log/ha)" "700 root"
expect "mode of /tmp/ha" "$(stat -c '%a %U' /tmp/ha)" "700 root"
for file in /lib/systemd/system/ternhad.service /usr/lib/tmpfiles.d/ternha.conf /usr/sbin/ternha-firewall \
    /usr/share/man/man5/ternhad.conf.5.gz /usr/share/man/man8/ternha{d,ctl,-firewall}.8.gz; do
    [ -f "$file" ] || fail "$file is not installed"
done
expect "completion" "$(bash -c '. /usr/share/bash-completion/completions/ternhactl; complete -p ternhactl')" \
    "complete -F _ternhactl ternhactl"

# Nothing starts after the installation: addresses are missing.
exit_code=0
ternhad --config /etc/ternha/ternhad.conf >/run/dpkg/output 2>&1 || exit_code=$?
expect "exit code without addresses" "$exit_code" 2

sed -i 's/^#local-ip.*/local-ip = 127.0.0.1/; s/^#remote-ip.*/remote-ip = 127.0.0.2/; s/^#interface.*/interface = lo/' \
    /etc/ternha/ternhad.conf
ternha-firewall | grep -q 'iifname "lo" ip saddr 127.0.0.2 ip daddr 127.0.0.1 ' || fail "ternha-firewall"
ternhad --config /etc/ternha/ternhad.conf &
daemon=$!
eventually 20 ternhactl status || fail "the daemon does not answer"
expect "peer that nobody plays" "$(ternhactl status --json | grep -c '"isRemoteAlive":false')" 1
kill -TERM "$daemon"
wait "$daemon" || fail "the daemon ended with $?"
grep -q 'Started on 127.0.0.1, peer 127.0.0.2$' /var/log/ha/ha.daemon.log || fail "no log"

in_dpkg --install "$packages"/*_"$architecture".deb
grep -q '^local-ip = 127.0.0.1$' /etc/ternha/ternhad.conf || fail "the configuration did not survive an upgrade"

in_dpkg --remove "${installed[@]}"
[ -f /etc/ternha/ternhad.conf ] || fail "the configuration did not survive a removal"
[ -d /var/log/ha ] || fail "the logs did not survive a removal"
in_dpkg --purge "${installed[@]}"
rm -r /run/ternha # by hand what the service manager does, the lock included
diff <(echo "$before") <(changes) || fail "something is left behind"
