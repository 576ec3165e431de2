#!/bin/sh
# The main job: set up what is missing, build, register, then run the demo
# client against the server out of process.
set -eu
ROOT=$(cd "$(dirname "$0")" && pwd)
BUILD_DIR=${BUILD_DIR:-$ROOT/build}
export BUILD_DIR
"$ROOT/scripts/setup.sh"
status=0
"$BUILD_DIR/wine-run.sh" "$BUILD_DIR/bin/opcdemo.exe" || status=$?
"$ROOT/scripts/prefix-stop.sh" "$BUILD_DIR"
exit $status
