#!/usr/bin/env bash
# A local demonstration of kest-iam: the bundled test domain server, cache-kest and dbus-kest run in
# a temporary root on a private system bus, and a network account is looked up, logs in online and
# offline (also through getent, id and pamtester with the modules), is seen over D-Bus and changes
# its password. Touches nothing of the machine's own state.
#   tools/demo.sh                      build if needed, then run
#   KEST_BUILD_DIR=DIR tools/demo.sh   use the programs already built in DIR (CI)
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)

if [ -z "${KEST_BUILD_DIR:-}" ]; then
    . "$top/tools/deps.sh"
    kest_ensure_packages
    build="$top/build"
    echo "== building in $build"
    cmake -S "$top" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
    cmake --build "$build" --parallel "$(nproc)" --target cache-kest dbus-kest kest-test-domain-server kest-query \
        nss_kest pam_kest \
        | grep -v '^\[' || true
else
    build=$KEST_BUILD_DIR
fi
if [ "$(id -u)" -ne 0 ]; then
    echo "run as root: the daemons refuse to start otherwise" >&2
    exit 2
fi

cache_kest="$build/src/cache/cache-kest"
dbus_kest="$build/src/dbus-service/dbus-kest"
domain_server="$build/tools/test-domain-server/kest-test-domain-server"
query="$build/tools/kest-query/kest-query"
nss_module="$build/src/modules/libnss_kest.so.2"
pam_module="$build/src/modules/pam_kest.so"
# A sanitizer build's modules need the sanitizer's runtime in the programs that load them.
sanitizer=$(ldd "$nss_module" | awk '/libasan/ {print $3}')

work=$(mktemp -d /tmp/kest-demo.XXXXXX)
pids=()
cleanup() {
    local pid
    for pid in "${pids[@]}"; do
        kill "$pid" 2>/dev/null || true
    done
    wait 2>/dev/null || true
    rm -rf "$work"
}
trap cleanup EXIT
trap 'echo; echo "interrupted"; exit 130' INT TERM

failures=0
step() { printf '\n== %s\n' "$*"; }
show() { printf '   $ %s\n' "$*"; }
expect() { # expect DESCRIPTION EXPECTED ACTUAL
    if [ "$2" = "$3" ]; then
        printf '   ok: %s -> %s\n' "$1" "$3"
    else
        printf '   FAILED: %s: expected %s, got %s\n' "$1" "$2" "$3"
        failures=$((failures + 1))
    fi
}
expect_match() { # expect_match DESCRIPTION PATTERN ACTUAL
    if grep -qE -- "$2" <<<"$3"; then
        printf '   ok: %s -> %s\n' "$1" "$3"
    else
        printf '   FAILED: %s: expected /%s/, got %s\n' "$1" "$2" "$3"
        failures=$((failures + 1))
    fi
}
wait_for() { # wait_for SECONDS COMMAND...
    local tries=$(($1 * 10))
    shift
    while [ "$tries" -gt 0 ]; do
        "$@" && return 0
        sleep 0.1
        tries=$((tries - 1))
    done
    return 1
}

export KEST_IAM_ROOT="$work/root"
mkdir -p "$KEST_IAM_ROOT"/{etc,var/lib/libkest-iam,run,home,usr/share/kest}
echo "demo-machine-0001" >"$KEST_IAM_ROOT/usr/share/kest/machine.txt"
export PATH="$(dirname "$cache_kest"):$PATH"

# getent, id and pamtester with the modules, through the wrappers: the machine's own passwd, group
# and PAM files are neither read nor changed.
mkdir -p "$work/wrapped"
echo "root:x:0:0:root:/root:/bin/bash" >"$work/wrapped/passwd"
printf 'root:x:0:\nkest:x:10000:\n' >"$work/wrapped/group"
for type in auth account password session; do echo "$type required $pam_module"; done >"$work/wrapped/kest"
: >"$work/wrapped/other"
wrapped() { # wrapped WRAPPER COMMAND...
    env ASAN_OPTIONS=detect_leaks=0 LD_PRELOAD="${sanitizer:+$sanitizer }$1" ${sanitizer:+NSS_WRAPPER_DISABLE_DEEPBIND=1} \
        NSS_WRAPPER_PASSWD="$work/wrapped/passwd" NSS_WRAPPER_GROUP="$work/wrapped/group" \
        NSS_WRAPPER_MODULE_SO_PATH="$nss_module" NSS_WRAPPER_MODULE_FN_PREFIX=kest \
        PAM_WRAPPER=1 PAM_WRAPPER_SERVICE_DIR="$work/wrapped" "${@:2}" 2>&1
}
glibc_view() {
    show "getent passwd @alice"
    expect "getent" "@alice:x:10001:10000:Alice Liddell:/home/@alice:/bin/bash" \
        "$(wrapped libnss_wrapper.so getent passwd @alice)"
    show "id @alice"
    expect_match "id" "^uid=10001\(@alice\) gid=10000\(kest\)" "$(wrapped libnss_wrapper.so id @alice)"
    show "pamtester kest @alice authenticate"
    expect_match "PAM login" "successfully authenticated" \
        "$(echo alice-password | wrapped libpam_wrapper.so pamtester kest @alice authenticate)"
}

step "Certificates for the domain server and this machine"
"$top/tools/make-test-certs.sh" "$work/certs"
ls "$work/certs" | sed 's/^/   /'

step "A private system bus"
cat >"$work/bus.conf" <<CONF
<!DOCTYPE busconfig PUBLIC "-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN"
 "http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd">
<busconfig>
  <type>system</type>
  <listen>unix:path=$work/system_bus_socket</listen>
  <auth>EXTERNAL</auth>
  <policy context="default">
    <allow user="*"/>
    <allow own="*"/>
    <allow send_destination="*"/>
    <allow receive_sender="*"/>
  </policy>
  <include>$top/data/dbus/com.nimbal.kest.iam.conf</include>
</busconfig>
CONF
: >"$work/bus.address" # before the wait below reads it, as for domain.out
dbus-daemon --config-file="$work/bus.conf" --nofork --nopidfile --print-address=1 >"$work/bus.address" 2>/dev/null &
pids+=($!)
wait_for 5 grep -q unix: "$work/bus.address"
export DBUS_SYSTEM_BUS_ADDRESS=$(head -n 1 "$work/bus.address")
echo "   DBUS_SYSTEM_BUS_ADDRESS=$DBUS_SYSTEM_BUS_ADDRESS"

step "The test domain server on 127.0.0.2, with the network account alice"
cp "$top/tools/test-domain-server/alice.json" "$work/domain.json"
start_domain_server() {
    # Created here, so that the wait below never reads a file the server's shell has not opened yet.
    : >"$work/domain.out"
    "$domain_server" --address 127.0.0.2 --port "$1" --cert "$work/certs/server.pem" --key "$work/certs/server.key" \
        --ca "$work/certs/ca.pem" --data "$work/domain.json" >"$work/domain.out" 2>&1 &
    domain_pid=$!
    pids+=("$domain_pid")
    wait_for 10 grep -q "listening on" "$work/domain.out"
}
start_domain_server 0
port=$(sed -n 's/.*listening on 127\.0\.0\.2:\([0-9]*\).*/\1/p' "$work/domain.out")
echo "   listening on 127.0.0.2:$port"

cat >"$KEST_IAM_ROOT/etc/kest-iam.conf" <<CONF
[main]
enable=true
ip=127.0.0.2
port=$port
network-timeout=3

[url]
server-cert=$work/certs/ca.pem
public-key=$work/certs/client.pem
private-key=$work/certs/client.key

[offline_login]
enable=true
cache_validity=7

[pw_strength]
min_length=8
upper=true
number=true
CONF
show "cat \$KEST_IAM_ROOT/etc/kest-iam.conf"
sed 's/^/   | /' "$KEST_IAM_ROOT/etc/kest-iam.conf"

step "cache-kest, the cache daemon"
"$cache_kest" &
pids+=($!)
wait_for 10 test -s "$KEST_IAM_ROOT/run/cache-kest.pid"
printf '   pid file: %s\n' "$(tr '\n' ' ' <"$KEST_IAM_ROOT/run/cache-kest.pid")"

step "The name-service module looks up @alice: the daemon fetches her from the domain server"
show "kest-query queryAccountName @alice"
expect "look-up of @alice" '{"pass":true}' "$("$query" queryAccountName @alice)"
expect "look-up of an unknown account" '{"pass":false}' "$("$query" queryAccountName @mallory)"
show "cat \$KEST_IAM_ROOT/var/lib/libkest-iam/groups.txt"
sed 's/^/   | /' "$KEST_IAM_ROOT/var/lib/libkest-iam/groups.txt"

step "@alice logs in while the domain server is reachable"
mkdir -p "$KEST_IAM_ROOT/home/@alice"
show "kest-query authenticatePassword @alice ********"
expect "online login" '{"pass":true}' "$("$query" authenticatePassword @alice alice-password)"
expect "home directory handed to @alice" "10001:10000" "$(stat -c %u:%g "$KEST_IAM_ROOT/home/@alice")"
show "cache-kest --show-cache 10001"
record=$("$cache_kest" --show-cache 10001)
sed 's/^/   | /' <<<"$record"
expect_match "cache record" "^account: @alice$" "$(grep account <<<"$record")"
glibc_view

step "The domain server goes away"
kill "$domain_pid"
wait "$domain_pid" 2>/dev/null || true
expect "look-up from the cache" '{"pass":true}' "$("$query" queryAccountName @alice)"
expect "offline login with the right password" '{"pass":true}' "$("$query" authenticatePassword @alice alice-password)"
expect "offline login with a wrong password" '{"pass":false}' "$("$query" authenticatePassword @alice guess)"
glibc_view

step "dbus-kest, the front service, on the private bus"
"$dbus_kest" &
dbus_pid=$!
pids+=("$dbus_pid")
wait_for 10 gdbus introspect --system --dest com.nimbal.kest.iam --object-path /com/nimbal/kest/iam >/dev/null 2>&1
call() {
    gdbus call --system --dest com.nimbal.kest.iam --object-path "$1" --method "$2" "${@:3}" 2>&1
}
show "gdbus call ... com.nimbal.kest.iam.GetUserIdList"
expect "cached network accounts" "([uint32 10001],)" "$(call /com/nimbal/kest/iam com.nimbal.kest.iam.GetUserIdList)"
show "gdbus call ... org.freedesktop.DBus.Properties.GetAll com.nimbal.kest.iam.user"
user=$(call /com/nimbal/kest/iam/user10001 org.freedesktop.DBus.Properties.GetAll com.nimbal.kest.iam.user)
echo "   | $user"
expect_match "per-user object" "'UserName': <'@alice'>" "$user"
show "gdbus call ... com.nimbal.kest.iam.GetUserGroups @alice"
expect_match "groups of @alice" "'lp'" "$(call /com/nimbal/kest/iam com.nimbal.kest.iam.GetUserGroups @alice)"
show "gdbus call ... com.nimbal.kest.iam.QueryPasswordConfig"
policy=$(call /com/nimbal/kest/iam com.nimbal.kest.iam.QueryPasswordConfig)
echo "   | $policy"
expect_match "password policy" '"min_length":8' "$policy"

step "The domain server is back; @alice changes her password through the desktop"
start_domain_server "$port"
# cache-kest answers from the cache until its once-a-second probe sees the server again.
sleep 1.5
show "gdbus call ... com.nimbal.kest.iam.ModifyUserPassword @alice ******** ********"
changed=$(call /com/nimbal/kest/iam com.nimbal.kest.iam.ModifyUserPassword @alice alice-password new-password)
echo "   | $changed"
expect_match "password change" '"code":0' "$changed"
expect "login with the new password" '{"pass":true}' "$("$query" authenticatePassword @alice new-password)"
expect "login with the old password" '{"pass":false}' "$("$query" authenticatePassword @alice alice-password)"

if [ "$failures" -ne 0 ]; then
    printf '\n%d step(s) did not behave.\n' "$failures"
    exit 1
fi
printf '\nEvery step behaved. Everything ran under %s and is removed now.\n' "$work"
