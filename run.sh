#!/bin/sh
# The main job: set up what is missing, build, register, then show the server
# at work on the simulated default Cadro network through the opc client: the
# registered servers, one branch of the address space, and a few seconds of
# live changes of waveform members. It ends by itself.
set -eu
ROOT=$(cd "$(dirname "$0")" && pwd)
BUILD_DIR=${BUILD_DIR:-$ROOT/build}
export BUILD_DIR
"$ROOT/scripts/setup.sh"

opc() {
    "$BUILD_DIR/wine-run.sh" "$BUILD_DIR/bin/opc.exe" "$@"
}
# Shows each command line as typed, then runs it.
show() {
    printf '\n$ opc'
    printf " '%s'" "$@"
    printf '\n'
    opc "$@"
}
demo() {
    show servers
    show browse '\\.\proc1\Waveform'
    show subscribe '\\.\proc1\Waveform.sine' '\\.\proc1\Waveform.square' '\\.\proc1\Waveform.ramp' \
        --rate 500 --duration 6
    # Each command starts a server of its own; the network node keeps the
    # written value for the next one.
    show write '\\.\proc1\Setpoints.temperature' 22.5
    show read '\\.\proc1\Setpoints.temperature'
}
status=0
demo || status=$?
"$ROOT/scripts/prefix-stop.sh" "$BUILD_DIR"
exit $status
