#!/bin/sh
# nqpm.exe under Wine classifies against the native stund on 127.0.0.1 and 127.0.0.2: from a
# local 127.0.14.1, stund saw Wine's requests come from 127.0.0.1, which reads as a NAT.
# Usage: nqpm_classify.sh WINE_RUN NQPM_EXE. Exit 77 (skipped) when stund is not installed.
set -u
run=$1
nqpm=$2
command -v stund >/dev/null 2>&1 || exit 77
primary=127.0.0.1
secondary=127.0.0.2
log=$(mktemp)
stund -h $primary -a $secondary -p 3478 -o 3479 </dev/null >"$log" 2>&1 &
stund_pid=$!
trap 'kill $stund_pid 2>/dev/null; wait $stund_pid 2>/dev/null; rm -f "$log"' EXIT
sleep 0.5
out=$("$run" "$nqpm" classify --stun $primary --local $primary </dev/null 2>&1)
rc=$?
echo "$out"
[ $rc -eq 0 ] || exit 1
# From loopback the mapped address is the local one: no NAT in between.
echo "$out" | grep -q "STUN_RESULT_OPEN" || exit 1
