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
    local name=$1
    shift
    if "$@"; then
        passed=$((passed + 1))
        echo "PASS: $name"
    else
        failed=$((failed + 1))
        echo "FAIL: $name"
    fi
}

cpack --config "$build/CPackConfig.cmake" -B "$work/out" >"$work/cpack.log" 2>&1 || { cat "$work/cpack.log"; exit 1; }
deb=$(ls "$work"/out/*.deb)
arch=$(dpkg --print-architecture)
multiarch=$(gcc -print-multiarch)
check "package file name" test "$(basename "$deb")" = "kest-iam_1.0.0_${arch}.deb"

dpkg-deb -c "$deb" | awk '{print $6}' | sed -e 's|^\./|/|' -e 's|/$||' | grep -v '^$' >"$work/files"
expected=(
    /etc/kest-iam.conf
    /usr/bin/cache-kest
    /usr/sbin/dbus-kest
    /usr/include/kest-iam/common.h
    /usr/include/kest-iam/cache-common.h
    /usr/include/kest-iam/paths.h
    "/usr/lib/$multiarch/libkest-iam.so"
    "/usr/lib/$multiarch/libkest-iam.so.1"
    "/usr/lib/$multiarch/pkgconfig/kest-iam.pc"
    /usr/lib/systemd/system/cache-kest.service
    /usr/lib/systemd/system/dbus-kest.service
    /usr/share/dbus-1/system-services/com.nimbal.kest.iam.service
    /usr/share/dbus-1/system.d/com.nimbal.kest.iam.conf
    /usr/share/kest
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
    for unit in cache-kest.service dbus-kest.service; do
        sed "s|^ExecStart=|ExecStart=$work/root|" "$work/root/usr/lib/systemd/system/$unit" >"$work/units/$unit"
    done
    verify_units() {
        systemd-analyze verify "$work/units/cache-kest.service" "$work/units/dbus-kest.service" >"$work/verify.log" 2>&1 \
            && ! grep -q . "$work/verify.log" || { cat "$work/verify.log"; return 1; }
    }
    check "systemd accepts the units" verify_units
else
    echo "SKIP: systemd-analyze is not installed"
fi

cat >"$work/bus.conf" <<CONF
<!DOCTYPE busconfig PUBLIC "-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig>
  <type>system</type>
  <listen>unix:path=$work/bus_socket</listen>
  <auth>EXTERNAL</auth>
  <include>$work/root/usr/share/dbus-1/system.d/com.nimbal.kest.iam.conf</include>
</busconfig>
CONF
policy_loads() {
    dbus-daemon --config-file="$work/bus.conf" --nofork --nopidfile --print-address=1 >"$work/address" 2>"$work/bus.log" &
    daemon_pid=$!
    for _ in $(seq 50); do
        grep -q unix: "$work/address" && kill -0 "$daemon_pid" 2>/dev/null && return 0
        kill -0 "$daemon_pid" 2>/dev/null || break
        sleep 0.1
    done
    cat "$work/bus.log"
    return 1
}
check "dbus-daemon loads the policy file" policy_loads

echo "$passed passed, $failed failed"
[ "$failed" -eq 0 ]
