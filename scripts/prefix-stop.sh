#!/bin/sh
# Ends every process of the build's private Wine prefix (and only those).
# Usage: prefix-stop.sh BUILD_DIR
set -eu
export WINEPREFIX="$(cd "$1" && pwd)/wineprefix"
[ -d "$WINEPREFIX" ] || exit 0
wineserver -k 2>/dev/null || true
wineserver -w 2>/dev/null || true
