# deps.sh - sourced by the set-up scripts: installs the Debian packages the build and tests need.
kest_packages=(cmake ninja-build g++ make pkg-config qtbase5-dev qtbase5-dev-tools libpam0g-dev dbus-daemon libglib2.0-bin
    openssl git dpkg-dev debhelper lintian libnss-wrapper libpam-wrapper pamtester libsystemd-dev systemd debootstrap)

kest_ensure_packages() {
    local missing=()
    local package
    for package in "${kest_packages[@]}" "$@"; do
        dpkg-query -W -f='${Status}' "$package" 2>/dev/null | grep -q 'install ok installed' || missing+=("$package")
    done
    [ ${#missing[@]} -eq 0 ] && return 0
    if [ "$(id -u)" -ne 0 ]; then
        echo "missing packages: ${missing[*]} (run as root to install them)" >&2
        return 1
    fi
    echo "installing: ${missing[*]}"
    export DEBIAN_FRONTEND=noninteractive
    apt-get update -qq
    apt-get install -y -qq --no-install-recommends "${missing[@]}"
}
