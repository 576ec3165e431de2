#!/bin/sh
# One setup path for a fresh machine: packages, configure, build, a private
# Wine prefix under the build tree, and the server and proxy/stub registered
# in it. BUILD_DIR overrides the build tree (default: ./build).
set -eu
ROOT=$(cd "$(dirname "$0")/.." && pwd)
BUILD_DIR=${BUILD_DIR:-$ROOT/build}

"$ROOT/scripts/install-deps.sh"

cmake -S "$ROOT" -B "$BUILD_DIR" -DCMAKE_TOOLCHAIN_FILE="$ROOT/cmake/mingw-w64-x86_64.cmake" \
    -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build "$BUILD_DIR" -j "$(nproc)"

"$ROOT/scripts/prefix-init.sh" "$BUILD_DIR"
