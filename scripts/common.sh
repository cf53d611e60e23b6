# Shared by scripts/test and scripts/demo: package installation and the build.
# shellcheck shell=bash

NQPM_ROOT=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)

# Debian packages the build, the tests and the demo need.
NQPM_PACKAGES=(
    cmake g++ make pkg-config git clang libclang-rt-dev
    googletest libgtest-dev libbenchmark-dev clang-format nlohmann-json3-dev
    iproute2 nftables procps
    stun-server stun-client
    libnl-route-3-dev libminiupnpc-dev miniupnpd
    sip-tester kamailio dnsmasq-base
    g++-mingw-w64-x86-64 mingw-w64-tools wine64 wine libwine-dev
)

as_root() {
    if [ "$(id -u)" -eq 0 ]; then
        "$@"
    elif command -v sudo >/dev/null 2>&1; then
        sudo "$@"
    else
        echo "need root for: $*" >&2
        return 1
    fi
}

# Installs only what is missing, so a second run touches nothing.
ensure_packages() {
    local missing=() p
    for p in "${NQPM_PACKAGES[@]}"; do
        if [ "$(dpkg-query -W -f='${Status}' "$p" 2>/dev/null)" != "install ok installed" ]; then
            missing+=("$p")
        fi
    done
    if [ ${#missing[@]} -eq 0 ]; then
        return 0
    fi
    echo "installing: ${missing[*]}"
    as_root env DEBIAN_FRONTEND=noninteractive apt-get update -q
    # The packaged daemons must not start as services: our tests run their own in namespaces.
    printf '#!/bin/sh\nexit 101\n' | as_root tee /usr/sbin/policy-rc.d >/dev/null
    as_root chmod +x /usr/sbin/policy-rc.d
    as_root env DEBIAN_FRONTEND=noninteractive apt-get install -y -q --no-install-recommends \
        "${missing[@]}"
    as_root rm -f /usr/sbin/policy-rc.d
}

# Whether the Windows cross build can run here: the -posix mingw-w64 compiler, widl and Wine.
have_windows_tools() {
    command -v x86_64-w64-mingw32-g++-posix >/dev/null 2>&1 &&
        command -v x86_64-w64-mingw32-widl >/dev/null 2>&1 && command -v wine >/dev/null 2>&1
}

# build_tree DIR [cmake options...]
build_tree() {
    local dir=$1
    shift
    cmake -S "$NQPM_ROOT" -B "$dir" "$@" >/dev/null
    cmake --build "$dir" -j "$(nproc)"
}
