#!/bin/sh
# Runs the whole test suite N times in a row and prints each run's result and
# the tests that failed; --load runs a processor hog (one busy process per
# core) beside every run. The build must exist (./test.sh makes it).
#
#   scripts/repeat-tests.sh N [--load]
#
# Each run's full output goes to build/repeat-logs/run-K.log.
set -eu
ROOT=$(cd "$(dirname "$0")/.." && pwd)
BUILD_DIR=${BUILD_DIR:-$ROOT/build}
N=${1:?usage: repeat-tests.sh N [--load]}
LOAD=${2:-}
LOGS="$BUILD_DIR/repeat-logs"
mkdir -p "$LOGS"

hogs=""
stop_hogs() {
    for pid in $hogs; do kill "$pid" 2>/dev/null || true; done
    hogs=""
}
# Interrupted: the hogs, the run in progress and the prefix's processes go too.
run_pid=""
stop_all() {
    stop_hogs
    if [ -n "$run_pid" ]; then kill "$run_pid" 2>/dev/null || true; fi
    "$ROOT/scripts/prefix-stop.sh" "$BUILD_DIR" >/dev/null 2>&1 || true
}
trap stop_hogs EXIT
trap 'stop_all; exit 130' INT TERM

passed=0
failed=0
k=1
while [ "$k" -le "$N" ]; do
    if [ "$LOAD" = "--load" ]; then
        for _ in $(seq "$(nproc)"); do
            sh -c 'while :; do :; done' &
            hogs="$hogs $!"
        done
    fi
    start=$(date +%s)
    (cd "$BUILD_DIR" && exec ctest --output-on-failure -j 2) >"$LOGS/run-$k.log" 2>&1 &
    run_pid=$!
    if wait "$run_pid"; then
        result=passed
        passed=$((passed + 1))
    else
        result=FAILED
        failed=$((failed + 1))
    fi
    run_pid=""
    stop_hogs
    echo "run $k/$N${LOAD:+ (with load)}: $result in $(($(date +%s) - start)) s"
    if [ "$result" = FAILED ]; then
        sed -n '/The following tests FAILED/,$p' "$LOGS/run-$k.log" | sed 's/^/    /'
    fi
    k=$((k + 1))
done
echo "$N runs${LOAD:+ with load}: $passed passed, $failed failed"
[ "$failed" -eq 0 ]
