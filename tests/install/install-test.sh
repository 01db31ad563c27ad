#!/usr/bin/env bash
# install-test.sh - the packages on a fresh Debian 12 root, as an administrator installs them: apt-get
# installs them into a throw-away root made by debootstrap, where the test domain server and cache-kest
# run by hand (there is no systemd as process 1), and the real nsswitch.conf and the PAM stacks that
# pam-auth-update wrote are driven with getent, id, pamtester, passwd and chpasswd, for local accounts
# and a network account. Then the units are checked with systemd-analyze, and a purge must leave /etc
# as it was and nothing of the packages behind.
#   KEST_PACKAGE_DIR  the packages that test_package built and checked
#   KEST_BUILD_DIR    the build: the test domain server, and the cached base root under install-test/
# Exit status 77 (skipped, with the reason) when it cannot run here: not root, no debootstrap, or no
# reachable Debian mirror in the machine's apt sources.
set -euo pipefail
top=$(cd "$(dirname "$0")/../.." && pwd)
suite=bookworm
# Everything the packages depend on, in the cached base, so that installing them needs no download.
base_packages=dbus,libqt5core5a,libqt5dbus5,libqt5network5,pamtester

skip() {
    echo "SKIP: $*"
    exit 77
}
die() {
    echo "FAIL: $*"
    exit 1
}

# The first plain (not security) mirror of $suite in the apt sources, one-line or deb822 form.
find_mirror() {
    local file
    for file in /etc/apt/sources.list /etc/apt/sources.list.d/*.list; do
        [ -f "$file" ] || continue
        sed -E 's/#.*//; s/\[[^]]*\]//' "$file" | awk -v suite="$suite" '$1 == "deb" && $3 == suite { print $2; exit }'
    done
    for file in /etc/apt/sources.list.d/*.sources; do
        [ -f "$file" ] || continue
        awk -v suite="$suite" 'BEGIN { RS = ""; FS = "\n" } {
            uri = ""; found = 0; deb = 0
            for (i = 1; i <= NF; i++) {
                if ($i ~ /^URIs:/) { split(substr($i, 6), uris, " "); uri = uris[1] }
                if ($i ~ /^Suites:/ && (" " substr($i, 8) " ") ~ (" " suite " ")) found = 1
                if ($i ~ /^Types:/ && $i ~ /[ \t]deb([ \t]|$)/) deb = 1
            }
            if (uri != "" && found && deb) { print uri; exit }
        }' "$file"
    done
}

if [ "${1:-}" != --inside ]; then
    [ "$(id -u)" -eq 0 ] || skip "needs root (debootstrap, chroot and mounts)"
    command -v debootstrap >/dev/null || skip "debootstrap is not installed"
    command -v unshare >/dev/null && command -v ip >/dev/null || skip "unshare or ip is missing"
    mirror=$(find_mirror | head -n 1)
    [ -n "$mirror" ] || skip "no $suite mirror in /etc/apt/sources.list or /etc/apt/sources.list.d"
    mirror=${mirror%/}
    wget -q -T 15 -t 2 -O /dev/null "$mirror/dists/$suite/Release" || skip "the Debian archive $mirror cannot be reached"
    [ -n "${KEST_PACKAGE_DIR:-}" ] && compgen -G "$KEST_PACKAGE_DIR/*.deb" >/dev/null \
        || die "no packages in KEST_PACKAGE_DIR (${KEST_PACKAGE_DIR:-unset}): run test_package first"
    build=${KEST_BUILD_DIR:?KEST_BUILD_DIR is not set}
    domain_server="$build/tools/test-domain-server/kest-test-domain-server"
    [ -x "$domain_server" ] || die "the test domain server is not built"

    started=$(date +%s)
    cache="$build/install-test"
    mkdir -p "$cache"
    base="$cache/$suite-$(echo "$mirror $base_packages" | sha1sum | cut -c1-12).tar"
    work=
    # Every mount of the test lives in a private mount namespace and goes with it; the rest is files.
    cleanup() { [ -z "$work" ] || rm -rf --one-file-system "$work"; }
    trap cleanup EXIT
    if [ ! -s "$base" ]; then
        echo "bootstrapping $suite from $mirror into $base"
        work=$(mktemp -d "$cache/bootstrap.XXXXXX")
        unshare --mount --propagation private debootstrap --variant=minbase --include="$base_packages" \
            "$suite" "$work/root" "$mirror" >"$work/debootstrap.log" 2>&1 \
            || { tail -n 30 "$work/debootstrap.log"; die "debootstrap failed"; }
        # No package lists, no downloaded files: the root only ever installs local packages.
        rm -rf "$work/root/var/cache/apt/archives/"*.deb "$work/root/var/lib/apt/lists/"*
        tar -C "$work/root" -cf "$base.part" . && mv "$base.part" "$base"
        rm -rf --one-file-system "$work"
        echo "base root made in $(($(date +%s) - started)) s"
    fi

    work=$(mktemp -d "$cache/run.XXXXXX")
    root="$work/root"
    mkdir "$root"
    tar -C "$root" -xf "$base"
    mkdir -p "$root/tmp/debs" "$root/opt/kest-test"
    cp "$KEST_PACKAGE_DIR"/*.deb "$root/tmp/debs/"
    cp "$domain_server" "$root/opt/kest-test/"
    "$top/tools/make-test-certs.sh" "$root/opt/kest-test/certs"
    # A new process id space, so that every process started in the root ends with the test, and a
    # network space of its own, so that its loopback ports meet no other test's.
    status=0
    unshare --mount --propagation private --pid --fork --net --mount-proc="$root/proc" \
        bash "$0" --inside "$work" || status=$?
    echo "install test: $(($(date +%s) - started)) s in all"
    exit "$status"
fi

# Inside the namespaces: process 1 of its own process space.
work=$2
root="$work/root"
mount --rbind /dev "$root/dev"
ip link set lo up

failed=0
check() { if "${@:2}"; then echo "PASS: $1"; else failed=$((failed + 1)) && echo "FAIL: $1"; fi; }
in_root() { env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin LC_ALL=C HOME=/root chroot "$root" "$@"; }
# start_in_root OUTPUT COMMAND...: in the background, as a process of its own ($! is the program).
start_in_root() { : >"$1"; (exec env -i PATH=/usr/sbin:/usr/bin:/sbin:/bin LC_ALL=C chroot "$root" "${@:2}" >"$1" 2>&1) & }
# succeeds INPUT COMMAND...: the command, run in the root with INPUT on standard input, ends with 0.
succeeds() { printf "$1" | in_root "${@:2}" >"$work/out" 2>&1 || { sed 's/^/    /' "$work/out"; return 1; }; }
fails() { ! printf "$1" | in_root "${@:2}" >"$work/out" 2>&1 || { sed 's/^/    /' "$work/out"; return 1; }; }
equals() { [ "$1" = "$2" ] || { echo "    got: $2"; return 1; }; }
output_is() { [ "$(in_root "${@:2}" 2>&1)" = "$1" ] || { echo "    got: $(in_root "${@:2}" 2>&1)"; return 1; }; }

# /etc as it stands: each entry's type, mode, owner and content. The shadow files' password and
# date fields are left out: the test itself changes the local passwords.
snapshot() {
    (cd "$root" && find etc -xdev -printf '%y %m %u:%g %p -> %l\n' | LC_ALL=C sort \
        && find etc -xdev -type f ! -name 'shadow*' -print0 | LC_ALL=C sort -z | xargs -0 sha256sum \
        && awk -F: '{ print FILENAME ": " $1 ":" $4 ":" $5 ":" $6 ":" $7 ":" $8 ":" $9 }' etc/shadow)
}

# A local user with the machine's own password, and root's, before the packages come.
in_root useradd -m -s /bin/bash carol
printf 'root:Root-pass-1\ncarol:Carol-pass-1\n' | in_root chpasswd
snapshot >"$work/etc.before"
# What the packages hold that the root does not have yet: none of it may stay after the purge.
for deb in "$root"/tmp/debs/*.deb; do dpkg-deb -c "$deb" | awk '{ print substr($6, 2) }' | sed 's|/$||'; done \
    | while read -r path; do [ -e "$root$path" ] || [ -L "$root$path" ] || echo "$path"; done >"$work/package-paths"
printf '%s\n' /usr/share/kest/machine.txt /run/cache-kest.pid /run/cache-kest.map /run/dbus-kest.pid >>"$work/package-paths"

check "apt-get install ./*.deb" succeeds "" sh -c 'cd /tmp/debs && apt-get install -y -q ./*.deb'
check "nsswitch.conf lists kest" grep -Eq '^passwd:.* kest' "$root/etc/nsswitch.conf"
# Local password changes keep their own stack: pam_unix first, without use_authtok, pam_kest after it.
password_stack() { grep -E '^password' "$root/etc/pam.d/common-password" | grep -o 'pam_.*' | sed 's/ *$//' | head -n 2 | paste -sd '|'; }
check "pam_unix comes first in the password stack, as before" \
    equals "pam_unix.so obscure yescrypt|pam_kest.so" "$(password_stack)"

echo "== local accounts"
check "carol: authenticate and account" succeeds 'Carol-pass-1\n' pamtester login carol authenticate acct_mgmt
check "carol: a wrong password is refused" fails 'guess\n' pamtester login carol authenticate
check "carol: credentials without a login first" succeeds "" pamtester common-auth carol setcred
check "carol: session" succeeds "" pamtester common-session carol open_session close_session
check "carol: passwd" succeeds 'Carol-pass-1\nTulip-harbour-73\nTulip-harbour-73\n' \
    chroot --userspec=carol:carol / passwd
check "carol: log in with the new password" succeeds 'Tulip-harbour-73\n' pamtester login carol authenticate
check "root: chpasswd for carol" succeeds 'carol:Quartz-meadow-58\n' chpasswd
check "carol: log in with the password root set" succeeds 'Quartz-meadow-58\n' pamtester login carol authenticate
check "root: authenticate and account" succeeds 'Root-pass-1\n' pamtester login root authenticate acct_mgmt
check "root: passwd" succeeds 'Saffron-delta-19\nSaffron-delta-19\n' passwd
check "root: log in with the new password" succeeds 'Saffron-delta-19\n' pamtester login root authenticate
check "root: chpasswd" succeeds 'root:Root-pass-3x\n' chpasswd
check "root: log in with the password chpasswd set" succeeds 'Root-pass-3x\n' pamtester login root authenticate

echo "== a network account"
cp "$top/tools/test-domain-server/alice.json" "$root/opt/kest-test/domain.json"
start_in_root "$work/domain.out" /opt/kest-test/kest-test-domain-server --address 127.0.0.2 --port 0 \
    --cert /opt/kest-test/certs/server.pem --key /opt/kest-test/certs/server.key --ca /opt/kest-test/certs/ca.pem \
    --data /opt/kest-test/domain.json
domain_pid=$!
wait_for() { local tries=100; until "$@"; do tries=$((tries - 1)) && [ "$tries" -gt 0 ] || return 1; sleep 0.1; done; }
wait_for grep -q "listening on" "$work/domain.out" || { cat "$work/domain.out"; exit 1; }
port=$(sed -n 's/.*listening on 127\.0\.0\.2:\([0-9]*\).*/\1/p' "$work/domain.out")
echo "kest-test-0001" >"$root/usr/share/kest/machine.txt"
cat >"$root/etc/kest-iam.conf" <<CONF
[main]
enable=true
ip=127.0.0.2
port=$port

[url]
server-cert=/opt/kest-test/certs/ca.pem
public-key=/opt/kest-test/certs/client.pem
private-key=/opt/kest-test/certs/client.key

[offline_login]
enable=true
cache_validity=7
CONF
start_in_root "$work/cache-kest.out" /usr/bin/cache-kest
cache_pid=$!
check "cache-kest writes its pid file" wait_for test -s "$root/run/cache-kest.pid"
check "getent passwd @alice" output_is "@alice:x:10001:10000:Alice Liddell:/home/@alice:/bin/bash" getent passwd @alice
check "id @alice" output_is "uid=10001(@alice) gid=10000(kest) groups=10000(kest),7(lp)" id @alice
check "@alice: authenticate and account" succeeds 'alice-password\n' pamtester login @alice authenticate acct_mgmt
check "@alice: a wrong password is refused" fails 'guess\n' pamtester login @alice authenticate
check "@alice: session" succeeds "" pamtester common-session @alice open_session close_session
check "@alice: password change" succeeds 'alice-password\nNew-alice-pw-5\nNew-alice-pw-5\n' pamtester passwd @alice chauthtok
check "@alice: log in with the new password" succeeds 'New-alice-pw-5\n' pamtester login @alice authenticate
kill "$domain_pid" 2>/dev/null || true
wait "$domain_pid" 2>/dev/null || true
check "@alice offline: look-up" output_is "@alice:x:10001:10000:Alice Liddell:/home/@alice:/bin/bash" getent passwd @alice
check "@alice offline: log in" succeeds 'New-alice-pw-5\n' pamtester login @alice authenticate acct_mgmt
check "@alice offline: a wrong password is refused" fails 'alice-password\n' pamtester login @alice authenticate
stops_cleanly() { kill "$1" 2>/dev/null && wait "$1" || { sed 's/^/    /' "$2"; return 1; }; }
check "cache-kest stops cleanly" stops_cleanly "$cache_pid" "$work/cache-kest.out"

echo "== dbus-kest on the system bus"
# Stopped by SIGTERM it ends with 15 and leaves its pid file, which the purge must take along.
mkdir -p "$root/run/dbus"
check "the system bus starts" in_root dbus-daemon --system --fork
start_in_root "$work/dbus-kest.out" /usr/sbin/dbus-kest
dbus_kest_pid=$!
check "dbus-kest writes its pid file" wait_for test -s "$root/run/dbus-kest.pid"
kill "$dbus_kest_pid" 2>/dev/null || true
dbus_kest_status=0
wait "$dbus_kest_pid" || dbus_kest_status=$?
check "dbus-kest ends with 15 on SIGTERM" equals 15 "$dbus_kest_status"
kill "$(cat "$root/run/dbus/pid")" 2>/dev/null || true

echo "== the units"
mkdir "$work/units"
for unit in cache-kest dbus-kest; do
    sed "s|^ExecStart=|ExecStart=$root|" "$root/lib/systemd/system/$unit.service" >"$work/units/$unit.service"
done
verify_units() {
    MANPATH="$root/usr/share/man" systemd-analyze verify "$work"/units/*.service >"$work/verify.log" 2>&1 \
        && ! grep -q . "$work/verify.log" || { cat "$work/verify.log"; return 1; }
}
check "systemd-analyze verify" verify_units
# exposure UNIT LIMIT: systemd-analyze's overall exposure of the unit, at most LIMIT.
exposure() {
    local score
    score=$(systemd-analyze security --offline=true "$work/units/$1.service" 2>/dev/null \
        | sed -n 's/.*Overall exposure level for .*: \([0-9.]*\).*/\1/p')
    echo "    $1.service: exposure $score (at most $2)"
    [ -n "$score" ] && awk -v score="$score" -v limit="$2" 'BEGIN { exit !(score <= limit) }'
}
check "cache-kest.service exposure" exposure cache-kest 4.5
check "dbus-kest.service exposure" exposure dbus-kest 5.5

echo "== purge"
check "apt-get purge" succeeds "" apt-get purge -y -q kest-iam libkest-iam1 libkest-iam-dev libnss-kest libpam-kest
snapshot >"$work/etc.after"
check "/etc as before the install" diff "$work/etc.before" "$work/etc.after"
left_behind() {
    local path left=
    while read -r path; do
        if [ -e "$root$path" ] || [ -L "$root$path" ]; then left="$left $path"; fi
    done <"$work/package-paths"
    [ -z "$left" ] || { echo "    left behind:$left"; return 1; }
}
check "nothing of the packages left" left_behind

echo "$failed failed"
[ "$failed" -eq 0 ]
