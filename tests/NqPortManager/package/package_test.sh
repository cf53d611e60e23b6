#!/usr/bin/env bash
# The installed package as a client sees it: the build installed into a temporary prefix,
# examples/classify built against it with find_package and with pkg-config, both run against a
# stund of its own on loopback; then the module registered with the installed nqpm and a client
# that loads it through the client helper, which must unload it cleanly.
#   package_test.sh BUILD-DIR SOURCE-DIR
set -euo pipefail
build=$1
src=$(cd "$2" && pwd)
command -v stund >/dev/null || PATH=$PATH:/usr/sbin:/sbin
command -v stund >/dev/null || { echo "stund is not installed"; exit 77; }

tmp=$(mktemp -d)
stund_pid=
cleanup() {
    local status=$?
    if [ -n "$stund_pid" ]; then
        kill "$stund_pid" 2>/dev/null || true
        wait "$stund_pid" 2>/dev/null || true
    fi
    rm -rf "$tmp"
    exit "$status"
}
trap cleanup EXIT

prefix=$tmp/prefix
cmake --install "$build" --prefix "$prefix" >/dev/null
[ -f "$prefix/include/nqportmanager/NqPortManager.h" ] || { echo "headers not installed"; exit 1; }
[ -x "$prefix/bin/nqpm" ] || { echo "nqpm not installed"; exit 1; }

cmake -S "$src/examples/classify" -B "$tmp/with-cmake" -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build "$tmp/with-cmake" >/dev/null
libdir=$(dirname "$(find "$prefix" -name 'libNqPortManager.so' | head -1)")
export PKG_CONFIG_PATH=$libdir/pkgconfig
# shellcheck disable=SC2046
g++ -o "$tmp/with-pkg-config" "$src/examples/classify/main.cpp" $(pkg-config --cflags --libs nqportmanager)
mkdir "$tmp/unload"
cat >"$tmp/unload/CMakeLists.txt" <<EOF
cmake_minimum_required(VERSION 3.25)
project(unload_client LANGUAGES CXX)
set(CMAKE_CXX_STANDARD 20)
find_package(NqPortManager 0.1 REQUIRED)
add_executable(unload_client $src/tests/NqPortManager/package/unload_client.cpp)
target_link_libraries(unload_client PRIVATE NqPortManager::Client)
EOF
cmake -S "$tmp/unload" -B "$tmp/unload/build" -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build "$tmp/unload/build" >/dev/null
if readelf -d "$tmp/unload/build/unload_client" | grep -q 'libNqPortManager\.so'; then
    echo "the helper's client links the module itself"; exit 1
fi

# A loopback pair of addresses of this run's own, so that other tests' servers stay apart.
base=127.$(( $$ % 200 + 30 )).$(( RANDOM % 250 + 1 ))
stund -h "$base.1" -a "$base.2" -p 3478 -o 3479 >"$tmp/stund.log" 2>&1 &
stund_pid=$!
for _ in $(seq 50); do
    [ "$(ss -Hlun "src $base.1:3478" | wc -l)" -gt 0 ] && break
    sleep 0.1
done

for client in "$tmp/with-cmake/classify" "$tmp/with-pkg-config"; do
    out=$(LD_LIBRARY_PATH=$libdir "$client" "$base.1")
    echo "$out"
    grep -q '^state 2, ' <<<"$out" || { echo "$client: the discovery did not complete"; exit 1; }
done

export NQPM_REGISTRY=$tmp/registry.json
"$prefix/bin/nqpm" register >/dev/null
LD_LIBRARY_PATH=$libdir "$tmp/unload/build/unload_client" "$base.1"
