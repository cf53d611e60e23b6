#!/usr/bin/env bash
# Classification side by side: for every behaviour of the NAT lab, the Debian classic client
# (`stun`, package stun-client) and `nqpm classify` run against the same stund, one after the
# other in the same lab. Prints a Markdown table per run: each verdict and its seconds, and our
# seconds against the floor that the test sequence implies (the time-outs it must wait out).
#
#   bench/classify.sh [--loss PCT]...   (default: a clean run and a run with 10% loss)
#
# Needs root and a built tree (build/bin/nqpm). A verdict counts as correct only if it names the
# lab's behaviour.
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
lab=$root/tools/lab/natlab.sh
nqpm=$root/build/bin/nqpm
[ -x "$nqpm" ] || { echo "build first: $nqpm is missing" >&2; exit 1; }
[ "$(id -u)" -eq 0 ] || { echo "needs root (network namespaces)" >&2; exit 1; }

losses=()
while [ $# -gt 0 ]; do
    case $1 in
        --loss) losses+=("$2"); shift 2 ;;
        *) echo "usage: $0 [--loss PCT]..." >&2; exit 2 ;;
    esac
done
[ ${#losses[@]} -gt 0 ] || losses=(0 10)

# behaviour | our expected result | the classic client's return code for it | floor (s):
# the waits of the server choice (a plain test) and of the sequence, 4.7 s per unanswered test
# and 9.5 s for an unanswered response-address test.
cases=(
    "open|STUN_RESULT_OPEN|1|0"
    "full-cone-firewall|STUN_RESULT_FULL_CONE_FIREWALL|-|9.5"
    "symmetric-firewall|STUN_RESULT_SYMMETRIC_FIREWALL|11|4.7"
    "full-cone-nat|STUN_RESULT_FULL_CONE_NAT|19|0"
    "restricted-cone-nat|STUN_RESULT_RESTRICTED_CONE_NAT|21|4.7"
    "port-restricted-cone-nat|STUN_RESULT_PORT_RESTRICTED_CONE_NAT|23|9.4"
    "symmetric-nat|STUN_RESULT_SYMMETRIC_NAT|24|0"
    "blocked|STUN_RESULT_BLOCKED|28|9.4"
)

name=bench$$
name=${name:0:6}
trap '"$lab" down "$name" >/dev/null 2>&1 || true' EXIT

now_ms() { echo $(( $(date +%s%N) / 1000000 )); }
secs() { awk -v ms="$1" 'BEGIN { printf "%.2f", ms / 1000 }'; }

for loss in "${losses[@]}"; do
    echo
    echo "### Loss ${loss}%"
    echo
    echo "| behaviour | stun verdict | ok | stun s | nqpm verdict | ok | nqpm s | floor s | nqpm - floor s |"
    echo "|---|---|---|---|---|---|---|---|---|"
    for c in "${cases[@]}"; do
        IFS='|' read -r behaviour expected code floor <<<"$c"
        opts=()
        [ "$loss" != 0 ] && opts=(--loss "$loss")
        "$lab" up "$name" "$behaviour" "${opts[@]}" >/dev/null
        eval "$("$lab" info "$name")"

        t0=$(now_ms)
        set +e
        verdict=$(ip netns exec "$CLIENT_NS" stun "$STUN1" -i "$CLIENT_ADDR" 2>&1 |
                  sed -n 's/^Primary: //p' | tr -d '\t')
        rc=${PIPESTATUS[0]}
        set -e
        t1=$(now_ms)
        theirs_ok=no
        [ "$code" != - ] && [ "$rc" = "$code" ] && theirs_ok=yes

        t2=$(now_ms)
        json=$(ip netns exec "$CLIENT_NS" "$nqpm" classify --stun "$STUN1" \
               --local "$CLIENT_ADDR" --json)
        t3=$(now_ms)
        ours=$(sed -n 's/.*"result":"\([A-Z_]*\)".*/\1/p' <<<"$json")
        ours_ok=no
        [ "$ours" = "$expected" ] && ours_ok=yes
        ours_ms=$((t3 - t2))
        over=$(awk -v ms="$ours_ms" -v f="$floor" 'BEGIN { printf "%+.2f", ms / 1000 - f }')
        echo "| $behaviour | ${verdict:-none} (rc $rc) | $theirs_ok | $(secs $((t1 - t0))) |" \
             "${ours#STUN_RESULT_} | $ours_ok | $(secs "$ours_ms") | $floor | $over |"
        "$lab" down "$name" >/dev/null
    done
done
