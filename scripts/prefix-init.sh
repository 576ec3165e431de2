#!/bin/sh
# Creates the build's private Wine prefix (once) and registers the proxy/stub
# DLL, the server and the server list in it. Usage: prefix-init.sh BUILD_DIR
set -eu
BUILD_DIR=$(cd "$1" && pwd)
RUN="$BUILD_DIR/wine-run.sh"
export WINEPREFIX="$BUILD_DIR/wineprefix"

if [ ! -f "$WINEPREFIX/system.reg" ]; then
    echo "Creating Wine prefix $WINEPREFIX"
    WINEDEBUG=-all WINEDLLOVERRIDES="mscoree,mshtml=" wineboot -i >/dev/null 2>&1
    wineserver -w
fi

# One wineserver for the whole run (ended by prefix-stop.sh): a program that
# starts just as an idle wineserver leaves can be killed with it. It and the
# prefix's system processes (started with the first program) stay, so they
# are given no output to hold: a runner that captures the output of this
# script, or of a test, would wait for them.
wineserver -p </dev/null >/dev/null 2>&1 || true
"$RUN" cmd /c exit </dev/null >/dev/null 2>&1 || true
# A program start can fail on a loaded machine with Wine's "Application could
# not be started ... ShellExecuteEx failed"; a step is tried again before the
# setup gives up, and each step says whether it did its work.
retry() {
    tries=1
    until "$@"; do
        [ "$tries" -ge 3 ] && return 1
        echo "prefix-init: trying again: $*" >&2
        tries=$((tries + 1))
        sleep 2
    done
}
# An executable registers itself: its exit code does not say whether it did
# (the server's "RegServer" writes every record and then exits with the
# missing type library's failure; the server list registers only where no
# other server list is, with exit code 1 otherwise), so the record is read.
register() {
    "$RUN" "$BUILD_DIR/bin/$1" /RegServer || true
    "$RUN" reg query "HKCR\\CLSID\\$2\\LocalServer32" >/dev/null 2>&1
}

retry "$RUN" regsvr32 /s "$BUILD_DIR/bin/SkylarcOPCProxy.dll" || {
    echo "prefix-init: the proxy/stub did not register" >&2
    exit 1
}
retry register Local.exe '{5B1E7A20-4C3D-11d3-9A44-00A0C9E2B7F1}' || {
    echo "prefix-init: the server did not register" >&2
    exit 1
}
retry register SkylarcServerList.exe '{13486D51-4821-11D2-A494-3CB306C10000}' || {
    echo "prefix-init: the server list did not register" >&2
    exit 1
}
echo "Server, server list and proxy/stub registered in $WINEPREFIX"
