#!/bin/sh
# Builds everything and runs every test under Wine in the build's own prefix.
set -eu
ROOT=$(cd "$(dirname "$0")" && pwd)
BUILD_DIR=${BUILD_DIR:-$ROOT/build}
export BUILD_DIR
"$ROOT/scripts/setup.sh"
cd "$BUILD_DIR"
ctest --output-on-failure -j 2
