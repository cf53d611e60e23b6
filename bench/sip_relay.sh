#!/usr/bin/env bash
# SIP relay side by side in one network namespace of its own: sipp to sipp directly, through the
# local SIP proxy (`nqpm proxy`), and through Kamailio as a stateless forwarder with 2 and 4
# workers. OPTIONS -> 200 OK at rising call rates; a call fails when its answer does not arrive
# within 2 s (no retransmission), so a failed call is a lost datagram. Prints a Markdown table:
# calls answered and failed and the forwarder's CPU seconds per run, then the median round trip
# of single requests sent one at a time (bench/sip/rtt.py: sipp's clock counts milliseconds).
#
#   bench/sip_relay.sh [SECONDS_PER_RATE] [RATE...]
#
# Needs root, sipp, kamailio, stund and a built nqpm ($NQPM, default build-release/bin/nqpm).
set -euo pipefail

root=$(cd "$(dirname "$0")/.." && pwd)
nqpm=${NQPM:-$root/build-release/bin/nqpm}
[ -x "$nqpm" ] || { echo "build first: $nqpm is missing" >&2; exit 1; }
[ "$(id -u)" -eq 0 ] || { echo "needs root (network namespace)" >&2; exit 1; }
seconds=${1:-4}
shift || true
rates=("$@")
[ ${#rates[@]} -gt 0 ] || rates=(1000 2000 4000 6000 8000 10000 12000 14000)

ns=nqpmbench$$
work=$(mktemp -d /tmp/nqpm-sip-bench.XXXXXX)
addr=10.77.0.1
pids=()

cleanup() {
    local p
    for p in "${pids[@]}"; do kill -TERM "$p" 2>/dev/null || true; done
    for p in "${pids[@]}"; do wait "$p" 2>/dev/null || true; done
    ip netns del "$ns" 2>/dev/null || true
    rm -rf "$work"
}
trap cleanup EXIT

nsx() { ip netns exec "$ns" "$@"; }

# A host of its own: loopback and a veth pair whose both ends stay inside, with a default route
# that leads nowhere, so the port manager finds a usable address and nothing leaves the namespace.
ip netns add "$ns"
ip -n "$ns" link set lo up
ip -n "$ns" link add v0 type veth peer name v1
ip -n "$ns" addr add "$addr/24" dev v0
ip -n "$ns" addr add 10.77.0.2/24 dev v0
ip -n "$ns" link set v0 up
ip -n "$ns" link set v1 up
ip -n "$ns" route add default via 10.77.0.254 dev v0

# CPU seconds (user + system) of a process and its children threads/processes so far.
cpu_of() {
    local total=0 p t
    for p in "$@"; do
        t=$(awk '{print $14 + $15}' "/proc/$p/stat" 2>/dev/null || echo 0)
        total=$((total + t))
    done
    echo "scale=2; $total / $(getconf CLK_TCK)" | bc
}

uas=$(nsx sipp -sf "$root/bench/sip/options_uas.xml" -i "$addr" -p 5070 -nostdin -bg 2>&1 |
    sed -n 's/.*PID=\[\([0-9]*\)\].*/\1/p' || true)
[ -n "$uas" ] || { echo "sipp answerer did not start" >&2; exit 1; }
pids+=("$uas")
ip netns exec "$ns" stund -h "$addr" -a 10.77.0.2 -p 3478 -o 3479 >/dev/null 2>&1 &
pids+=($!)

# run NAME TARGET PIDS...: one sipp caller per rate against TARGET.
run() {
    local name=$1 target=$2 r before after ok failed
    shift 2
    for r in "${rates[@]}"; do
        rm -f "$work"/options_uac_*_rtt.csv "$work"/stat.csv
        before=$(cpu_of "$@")
        (cd "$work" && nsx sipp -sf "$root/bench/sip/options_uac.xml" "$target" -i "$addr" \
            -p 5062 -r "$r" -m $((r * seconds)) -nostdin -trace_rtt -rtt_freq 1000000 \
            -trace_stat -stf "$work/stat.csv" -timeout $((seconds + 10))s >/dev/null 2>&1) || true
        after=$(cpu_of "$@")
        ok=$(awk -F';' 'NR==1{for(i=1;i<=NF;i++) h[$i]=i} END{print $h["SuccessfulCall(C)"]}' \
            "$work/stat.csv")
        failed=$(awk -F';' 'NR==1{for(i=1;i<=NF;i++) h[$i]=i} END{print $h["FailedCall(C)"]}' \
            "$work/stat.csv")
        printf '| %s | %d | %s | %s | %s |\n' "$name" "$r" "$ok" "$failed" \
            "$(echo "$after - $before" | bc)"
    done
}

# rtt NAME TARGET: the median round trip of single requests from the caller's port.
rtts=()
rtt() {
    rtts+=("| $1 | $(nsx python3 "$root/bench/sip/rtt.py" "$2" "$addr" 5062 2000 | sed 's/ / | /') |")
}

echo "| Path | Calls/s | Answered | Failed | Forwarder CPU (s) |"
echo "|---|---|---|---|---|"
run direct "$addr:5070"
rtt direct "$addr:5070"

# The local SIP proxy: a REGISTER first, so that it knows the client (the caller's port 5062).
ip netns exec "$ns" "$nqpm" proxy --internal "$addr" --stun "$addr" --no-upnp --sip-proxy "$addr:5070" \
    --media-proxy "$addr:5070" --address "$addr:5064" --json >"$work/nqpm.out" 2>&1 &
proxy=$!
pids+=("$proxy")
for _ in $(seq 100); do grep -q sender_endpoint "$work/nqpm.out" 2>/dev/null && break; sleep 0.2; done
sender=$(sed -n 's/.*"sender_endpoint":"\([^"]*\)".*/\1/p' "$work/nqpm.out")
[ -n "$sender" ] || { echo "nqpm proxy did not start: $(cat "$work/nqpm.out")" >&2; exit 1; }
nsx python3 -c "import socket, sys; socket.socket(socket.AF_INET, socket.SOCK_DGRAM).sendto(
    b'REGISTER sip:bench SIP/2.0\\r\\nVia: SIP/2.0/UDP $addr:5062;branch=z9hG4bKreg\\r\\n'
    b'Content-Length: 0\\r\\n\\r\\n', ('${sender%:*}', ${sender#*:}))"
run "nqpm proxy" "$sender" "$proxy"
rtt "nqpm proxy" "$sender"
kill -TERM "$proxy"; wait "$proxy" || true

for children in 2 4; do
    sed -e "s/@CHILDREN@/$children/" -e "s/@LISTEN@/$addr:5080/" -e "s/@HOST@/$addr/" \
        -e "s/@PORT@/5070/" "$root/bench/sip/forwarder.cfg.in" >"$work/kamailio.cfg"
    ip netns exec "$ns" kamailio -f "$work/kamailio.cfg" -DD -E -Y "$work" \
        >"$work/kamailio.log" 2>&1 &
    kam=$!
    pids+=("$kam")
    for _ in $(seq 100); do
        nsx ss -lun | grep -q "$addr:5080" && [ "$(pgrep -c -P "$kam")" -gt "$children" ] && break
        sleep 0.1
    done
    sleep 0.5
    run "kamailio $children workers" "$addr:5080" "$kam" $(pgrep -P "$kam" | tr '\n' ' ')
    rtt "kamailio $children workers" "$addr:5080"
    kill -TERM "$kam"; wait "$kam" || true
done

echo
echo "| Path | Median round trip (us) | Lost of 2000 |"
echo "|---|---|---|"
printf '%s\n' "${rtts[@]}"
