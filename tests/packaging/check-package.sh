#!/usr/bin/env bash
# check-package.sh - builds the Debian packages from a copy of the source tree and checks them: each
# package's files and dependencies, lintian, units that systemd accepts, a bus policy that dbus-daemon
# loads, and libnss-kest's nsswitch.conf edits on sample copies.
set -euo pipefail
top=$(cd "$(dirname "$0")/../.." && pwd)
work=$(mktemp -d)
daemon_pid=
cleanup() {
    [ -n "$daemon_pid" ] && kill "$daemon_pid" 2>/dev/null || true
    rm -rf "$work"
}
trap cleanup EXIT

failed=0
check() { if "${@:2}"; then echo "PASS: $1"; else failed=$((failed + 1)) && echo "FAIL: $1"; fi; }

# dpkg-buildpackage writes into the tree and its parent: build from a copy.
mkdir "$work/src"
git -C "$top" ls-files -z --cached --others --exclude-standard \
    | tar -C "$top" --null --ignore-failed-read -T - -cf - 2>/dev/null | tar -C "$work/src" -xf -
(cd "$work/src" && DEB_BUILD_OPTIONS=noautodbgsym dpkg-buildpackage -us -uc -b -J"$(nproc)") >"$work/build.log" 2>&1 \
    || { tail -n 40 "$work/build.log"; exit 1; }

version=$(dpkg-parsechangelog -l "$top/debian/changelog" -S Version)
arch=$(dpkg --print-architecture)
ma=$(dpkg-architecture -q DEB_HOST_MULTIARCH)
declare -A files=(
    [kest-iam]="/etc/kest-iam.conf /lib/systemd/system/cache-kest.service /lib/systemd/system/dbus-kest.service
        /usr/bin/cache-kest /usr/sbin/dbus-kest /usr/share/dbus-1/system-services/com.nimbal.kest.iam.service
        /usr/share/dbus-1/system.d/com.nimbal.kest.iam.conf /usr/share/kest /usr/share/man/man5/kest-iam.conf.5.gz
        /usr/share/man/man8/cache-kest.8.gz /usr/share/man/man8/dbus-kest.8.gz /var/lib/libkest-iam
        /usr/share/doc/kest-iam/README.md.gz /usr/share/doc/kest-iam/enrolment.md"
    [libkest-iam1]="/usr/lib/$ma/libkest-iam.so.1 /usr/lib/$ma/libkest-iam.so.1.0.0"
    [libkest-iam-dev]="/usr/include/kest-iam/cache-common.h /usr/include/kest-iam/common.h
        /usr/include/kest-iam/paths.h /usr/lib/$ma/libkest-iam.so /usr/lib/$ma/pkgconfig/kest-iam.pc"
    [libnss-kest]="/usr/lib/$ma/libnss_kest.so.2 /usr/lib/libnss-kest/kest-nsswitch
        /usr/share/man/man8/libnss_kest.8.gz"
    [libpam-kest]="/usr/lib/$ma/security/pam_kest.so /usr/share/pam-configs/kest /usr/share/pam-configs/kest-password
        /usr/share/man/man8/pam_kest.8.gz"
)
# Patterns, separated by ";", that must (or, after "!", must not) match a package's Depends.
declare -A depends=(
    [kest-iam]="libqt5core5a;libqt5network5;libqt5dbus5;dbus-system-bus"
    [libkest-iam1]="libc6;!libqt5"
    [libkest-iam-dev]="^libkest-iam1 (= $version)"
    [libnss-kest]="kest-iam (= $version);!libqt5"
    [libpam-kest]="kest-iam (= $version);libpam0g;libpam-runtime;!libqt5"
)

# Files, links and empty directories: every entry that is not the directory of another one. Sorted
# bytewise, a directory ("/a/") comes right before its contents: a leaf when the next entry is not inside.
same_files() {
    diff <(printf '%s\n' $2 "/usr/share/doc/$1/changelog.gz" "/usr/share/doc/$1/copyright" | LC_ALL=C sort) \
        <(dpkg-deb -c "$3" | awk '{ print substr($6, 2) }' | LC_ALL=C sort \
            | awk 'NR > 1 && (last !~ /\/$/ || index($0, last) != 1) { print last } { last = $0 } END { print last }' \
            | sed 's|/$||' | LC_ALL=C sort)
}
depends_match() {
    local field pattern
    field=$(dpkg-deb -f "$1" Depends)
    for pattern in "${@:2}"; do
        if grep -q -- "${pattern#!}" <<<"$field"; then [[ $pattern != !* ]]; else [[ $pattern == !* ]]; fi \
            || { echo "Depends: $field"; return 1; }
    done
}
debs=()
for package in kest-iam libkest-iam1 libkest-iam-dev libnss-kest libpam-kest; do
    deb="$work/${package}_${version}_$arch.deb"
    debs+=("$deb")
    check "$package holds exactly its files" same_files "$package" "${files[$package]}" "$deb"
    IFS=';' read -ra patterns <<<"${depends[$package]}"
    check "$package dependencies" depends_match "$deb" "${patterns[@]}"
done

lintian_clean() {
    lintian --fail-on error,warning "${debs[@]}" >"$work/lintian.log" 2>&1 || { cat "$work/lintian.log"; return 1; }
}
check "lintian: no error, no warning" lintian_clean

dpkg-deb -x "$work/kest-iam_${version}_$arch.deb" "$work/root"
dpkg-deb -e "$work/kest-iam_${version}_$arch.deb" "$work/control"
check "settings file is the only conffile" test "$(cat "$work/control/conffiles")" = /etc/kest-iam.conf
# Enabled for the next boot; started only by the administrator.
units_enabled_not_started() {
    grep -q "helper enable 'cache-kest.service'" "$1" && grep -q "helper enable 'dbus-kest.service'" "$1" \
        && ! grep -q "deb-systemd-invoke start" "$1"
}
check "units enabled on installation, not started" units_enabled_not_started "$work/control/postinst"
# The units, pointed at the unpacked programs, with the manual pages of Documentation= among the unpacked ones.
verify_units() {
    sed -i "s|^ExecStart=|ExecStart=$work/root|" "$work"/root/lib/systemd/system/*.service
    MANPATH="$work/root/usr/share/man" systemd-analyze verify "$work"/root/lib/systemd/system/*.service \
        >"$work/verify.log" 2>&1 && ! grep -q . "$work/verify.log" || { cat "$work/verify.log"; return 1; }
}
if command -v systemd-analyze >/dev/null; then check "systemd accepts the units" verify_units; else
    echo "SKIP: systemd-analyze is not installed"
fi

printf '%s\n' '<busconfig><type>system</type><auth>EXTERNAL</auth>' "<listen>unix:path=$work/bus_socket</listen>" \
    "<include>$work/root/usr/share/dbus-1/system.d/com.nimbal.kest.iam.conf</include></busconfig>" >"$work/bus.conf"
# With --fork, dbus-daemon exits only once the bus is up, or fails on a policy it cannot load.
policy_loads() {
    local out
    out=$(dbus-daemon --config-file="$work/bus.conf" --fork --nopidfile --print-pid=1 --print-address=1) || return 1
    daemon_pid=$(grep -x '[0-9]*' <<<"$out")
    grep -q '^unix:' <<<"$out"
}
check "dbus-daemon loads the policy file" policy_loads

dpkg-deb -x "$work/libnss-kest_${version}_$arch.deb" "$work/root"
edit="$work/root/usr/lib/libnss-kest/kest-nsswitch"
# nss_edits SAMPLE ADDED REMOVED: installs (twice: a reinstall), then removes with the shipped script on a
# copy of SAMPLE, which must read as ADDED after each install and as REMOVED at the end.
nss_edits() {
    cp "$1" "$1.copy"
    "$edit" add "$1.copy" && cmp "$2" "$1.copy" && "$edit" add "$1.copy" && cmp "$2" "$1.copy" \
        && "$edit" remove "$1.copy" && cmp "$3" "$1.copy" || { diff "$1" "$1.copy"; return 1; }
}
mkdir "$work/nsswitch"
cd "$work/nsswitch"
printf '%s\n' '#passwd: files' $'passwd:\tcompat ldap\t# directory after the local files' \
    'group:  files [NOTFOUND=continue] sss kestrel' 'shadow: files ldap' 'initgroups: files' >others
printf '%s\n' '#passwd: files' $'passwd:\tcompat ldap kest\t# directory after the local files' \
    'group:  files [NOTFOUND=continue] sss kestrel kest' 'shadow: files ldap' 'initgroups: files' >others.added
printf '%s\n' 'passwd: files kest systemd # listed by hand' 'group:kest files' 'shadow: files kest' >listed
printf '%s\n' 'passwd: files systemd # listed by hand' 'group: files' 'shadow: files kest' >listed.removed
for sample in "others others.added others" "listed listed listed.removed"; do
    check "nsswitch.conf sample ${sample%% *}: install, reinstall and remove" nss_edits $sample
done

# The install test installs these very packages: kept for it, and only when they pass.
if [ "$failed" -eq 0 ] && [ -n "${KEST_PACKAGE_DIR:-}" ]; then
    rm -rf "$KEST_PACKAGE_DIR"
    mkdir -p "$KEST_PACKAGE_DIR"
    cp "${debs[@]}" "$KEST_PACKAGE_DIR/"
fi

echo "$failed failed"
[ "$failed" -eq 0 ]
