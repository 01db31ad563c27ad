#!/usr/bin/env bash
# check-package.sh BUILD_DIR - builds the Debian package from BUILD_DIR and checks what it holds:
# the expected files and nothing outside them, the runtime dependencies, units that systemd
# accepts (where systemd-analyze is present) and a bus policy that dbus-daemon loads.
set -euo pipefail
build=$1
work=$(mktemp -d)
daemon_pid=
cleanup() {
    [ -n "$daemon_pid" ] && kill "$daemon_pid" 2>/dev/null || true
    rm -rf "$work"
}
trap cleanup EXIT

passed=0
failed=0
check() {
    if "${@:2}"; then passed=$((passed + 1)) && echo "PASS: $1"; else failed=$((failed + 1)) && echo "FAIL: $1"; fi
}

cpack --config "$build/CPackConfig.cmake" -B "$work/out" >"$work/cpack.log" 2>&1 || { cat "$work/cpack.log"; exit 1; }
deb=$(ls "$work"/out/*.deb)
arch=$(dpkg --print-architecture)
multiarch=$(gcc -print-multiarch)
check "package file name" test "$(basename "$deb")" = "kest-iam_1.0.0_${arch}.deb"

dpkg-deb -c "$deb" | awk '{print $6}' | sed -e 's|^\./|/|' -e 's|/$||' | grep -v '^$' >"$work/files"
expected=(/etc/kest-iam.conf /usr/bin/cache-kest /usr/sbin/dbus-kest /usr/share/kest
    /usr/include/kest-iam/{common,cache-common,paths}.h "/usr/lib/$multiarch/libkest-iam.so"
    "/usr/lib/$multiarch/libkest-iam.so.1" "/usr/lib/$multiarch/pkgconfig/kest-iam.pc"
    /usr/lib/systemd/system/{cache-kest,dbus-kest}.service
    /usr/share/dbus-1/system-services/com.nimbal.kest.iam.service /usr/share/dbus-1/system.d/com.nimbal.kest.iam.conf
    "/usr/lib/$multiarch/libnss_kest.so.2" "/usr/lib/$multiarch/security/pam_kest.so" /usr/share/pam-configs/kest
)
for file in "${expected[@]}"; do
    check "package holds $file" grep -qx -- "$file" "$work/files"
done

# Every entry is one of the files above, a directory on the way to one, or the library's real file.
outside() {
    local entry file
    while read -r entry; do
        [[ $entry == "/usr/lib/$multiarch/libkest-iam.so.1."* ]] && continue
        for file in "${expected[@]}"; do
            [[ $file == "$entry" || $file == "$entry"/* ]] && continue 2
        done
        echo "unexpected: $entry"
        return 1
    done <"$work/files"
}
check "nothing outside the listed paths" outside

depends=$(dpkg-deb -f "$deb" Depends)
for package in libqt5core5a libqt5network5 libqt5dbus5 dbus; do
    check "depends on $package" grep -q "$package" <<<"$depends"
done
check "settings file is a conffile" sh -c "dpkg-deb -I '$deb' conffiles | grep -qx /etc/kest-iam.conf"

dpkg-deb -x "$deb" "$work/root"
for key in enable ip port network-timeout domain entryption home protocol user auth group reset_password \
    server-cert public-key private-key length-limit buffer-limit member-count-limit cache_validity; do
    check "sample settings list $key" grep -q "^;$key=" "$work/root/etc/kest-iam.conf"
done
check "activation file names the unit" grep -qx "SystemdService=dbus-kest.service" \
    "$work/root/usr/share/dbus-1/system-services/com.nimbal.kest.iam.service"

if command -v systemd-analyze >/dev/null; then
    # Point the units at the unpacked programs so that systemd can check them here.
    mkdir -p "$work/units"
    for unit in cache-kest dbus-kest; do
        sed "s|^ExecStart=|ExecStart=$work/root|" "$work/root/usr/lib/systemd/system/$unit.service" >"$work/units/$unit.service"
    done
    verify_units() {
        systemd-analyze verify "$work"/units/*.service >"$work/verify.log" 2>&1 && ! grep -q . "$work/verify.log" \
            || { cat "$work/verify.log"; return 1; }
    }
    check "systemd accepts the units" verify_units
else
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

echo "$passed passed, $failed failed"
[ "$failed" -eq 0 ]
