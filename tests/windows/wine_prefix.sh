#!/bin/sh
# The Wine prefix of the Windows tests: start makes it (once) and keeps one wineserver alive for
# the whole run; stop ends that server and every Wine process of the prefix. Wine's background
# processes get no standard handles of ours: CTest would otherwise wait on their pipes for ever.
set -eu
action=$1
export WINEPREFIX="$2" WINEDEBUG=-all DISPLAY=
wineserver=$3
case $action in
start)
    # The server first, so that wineboot and every test use this one.
    "$wineserver" -p </dev/null >/dev/null 2>&1 || true
    # Made once; on later runs wineboot only starts the prefix's services. Either way they start
    # here, detached, and not inside the first test with that test's pipes.
    if [ ! -d "$WINEPREFIX/drive_c/windows/system32" ]; then
        wineboot -i </dev/null >/dev/null 2>&1
    else
        wineboot </dev/null >/dev/null 2>&1
    fi
    [ -d "$WINEPREFIX/drive_c/windows/system32" ]
    ;;
stop)
    "$wineserver" -k </dev/null >/dev/null 2>&1 || true
    ;;
esac
