#!/usr/bin/env bash
# NAT lab out of network namespaces:
#
#   NAME-cli  eth0 --- lan  NAME-nat  wan --- eth0  NAME-srv (stund on lo)
#
# Usage:
#   natlab.sh up   NAME BEHAVIOUR [--loss PCT] [--upnp]
#   natlab.sh down NAME
#   natlab.sh info NAME
#   natlab.sh behaviours
#
# Environment: NATLAB_UDP_TIMEOUT (seconds, default 120) is the idle lifetime
# of every NAT mapping / firewall pinhole in the box.
# Exit codes: 0 ok, 1 failure, 2 bad usage.
set -Eeuo pipefail

readonly STUN1=203.0.113.1
readonly STUN2=203.0.113.2
readonly SRV_ADDR=198.51.100.1
readonly WAN_ADDR=198.51.100.254
# NAT kinds put the client in a private range ...
readonly PRIV_CLI=10.99.0.2 PRIV_GW=10.99.0.1
# ... firewall kinds give it a routed documentation address of its own.
readonly PUB_CLI=192.0.2.2 PUB_GW=192.0.2.1
readonly BEHAVIOURS=(open full-cone-firewall symmetric-firewall full-cone-nat
    restricted-cone-nat port-restricted-cone-nat symmetric-nat blocked)
readonly STATE_ROOT=/tmp
readonly LOCK_FILE=/tmp/natlab.lock

PROG=${0##*/}

die() { echo "$PROG: $*" >&2; exit 1; }

usage() {
    cat >&2 <<EOF
usage: $PROG up   NAME BEHAVIOUR [--loss PCT] [--upnp]
       $PROG down NAME
       $PROG info NAME
       $PROG behaviours
NAME: 1-6 chars of [a-z0-9]; BEHAVIOUR: one of '$PROG behaviours'
EOF
    exit 2
}

need_root() {
    [[ $(id -u) == 0 ]] || die "must run as root (creates network namespaces)"
}

check_name() {
    [[ $1 =~ ^[a-z0-9]{1,6}$ ]] || { echo "$PROG: bad NAME '$1'" >&2; usage; }
}

is_behaviour() {
    local b
    for b in "${BEHAVIOURS[@]}"; do [[ $b == "$1" ]] && return 0; done
    return 1
}

is_nat_kind() {
    case $1 in open|full-cone-firewall|symmetric-firewall) return 1 ;; esac
    return 0
}

state_dir() { echo "$STATE_ROOT/natlab.$1"; }
ns_exists() { [[ -e /run/netns/$1 ]]; }
nsx() { local ns=$1; shift; ip netns exec "$ns" "$@"; }

# Serialise up/down: concurrent 'ip netns add' on a fresh /run/netns races.
take_lock() {
    exec 9>"$LOCK_FILE"
    flock -w 120 9 || die "timed out waiting for $LOCK_FILE"
}

# Start time guards against killing a recycled pid.
proc_start() { awk '{print $22}' "/proc/$1/stat" 2>/dev/null || true; }

kill_pids() {
    local p
    [[ $# -gt 0 ]] || return 0
    kill -TERM "$@" 2>/dev/null || true
    for _ in $(seq 30); do
        local alive=()
        for p in "$@"; do [[ -e /proc/$p ]] && alive+=("$p"); done
        [[ ${#alive[@]} -eq 0 ]] && return 0
        sleep 0.1
    done
    kill -KILL "${alive[@]}" 2>/dev/null || true
}

kill_pidfile() {
    local f=$1 pid start
    [[ -f $f ]] || return 0
    read -r pid start <"$f" || return 0
    [[ -n ${pid:-} && -n ${start:-} ]] || return 0
    [[ $(proc_start "$pid") == "$start" ]] && kill_pids "$pid"
    return 0
}

teardown() {
    local name=$1 dir ns
    dir=$(state_dir "$name")
    # Daemons by pid file first: they may have outlived their namespace name.
    kill_pidfile "$dir/stund.pid"
    kill_pidfile "$dir/miniupnpd.pid"
    # Only srv and nat run processes we started; cli belongs to the caller.
    for ns in "$name-srv" "$name-nat"; do
        ns_exists "$ns" || continue
        # shellcheck disable=SC2046
        kill_pids $(ip netns pids "$ns" 2>/dev/null)
    done
    for ns in "$name-cli" "$name-nat" "$name-srv"; do
        ns_exists "$ns" || continue
        ip netns del "$ns"
    done
    rm -rf "$dir"
}

# Background daemon in a namespace, detached from the caller's session;
# ip netns exec execs in place, so $! is the daemon itself.
spawn() {
    local ns=$1 log=$2 pidfile=$3; shift 3
    setsid ip netns exec "$ns" "$@" </dev/null >"$log" 2>&1 9>&- &
    local pid=$!
    echo "$pid $(proc_start "$pid")" >"$pidfile"
    SPAWNED=$pid
}

wait_udp_listen() {
    local ns=$1 pid=$2; shift 2
    local want _ missing
    # miniupnpd runs its own STUN check first, which may wait up to 3 s.
    for _ in $(seq 100); do
        missing=()
        local have
        have=$(nsx "$ns" ss -Hlun | awk '{print $4}')
        for want in "$@"; do
            grep -qxF "$want" <<<"$have" || missing+=("$want")
        done
        [[ ${#missing[@]} -eq 0 ]] && return 0
        [[ -e /proc/$pid ]] || break
        sleep 0.1
    done
    echo "$PROG: not listening: ${missing[*]}" >&2
    return 1
}

nft_ruleset() {
    local beh=$1 loss=$2 cli=$3 tmo=$4 upnp=$5
    local masq="" sets="" pre="" first="" fwd="" boxin="" lossrule=""
    local upfwd="" uppre="" uppost="" upchains=""

    if is_nat_kind "$beh"; then
        masq="oifname \"wan\" ip saddr $cli masquerade"
        # Unsolicited datagrams to the box's own address die silently, before
        # conntrack keeps them: a kept entry would make masquerade move the
        # client's port when it later sends to that same remote.
        boxin="iifname \"wan\" meta l4proto udp socket transparent 0 accept
        iifname \"wan\" meta l4proto udp drop"
    fi
    local stateful="ct state established,related accept
        iifname \"lan\" accept"
    local drop_in="iifname \"wan\" drop"

    case $beh in
    open)
        fwd="" ;;
    full-cone-firewall)
        sets="set eif { type ipv4_addr . inet_service; flags dynamic,timeout; timeout ${tmo}s; }"
        fwd="iifname \"lan\" ip saddr $cli meta l4proto udp update @eif { ip saddr . udp sport }
        $stateful
        iifname \"wan\" meta l4proto udp ip daddr . udp dport @eif accept
        $drop_in" ;;
    symmetric-firewall)
        fwd="$stateful
        $drop_in" ;;
    full-cone-nat)
        # Ports the client sent from; masquerade keeps them, so they are the
        # public ports too, and any remote is let back in.
        sets="set eim { type inet_service; flags dynamic,timeout; timeout ${tmo}s; }"
        pre="iifname \"wan\" ip daddr $WAN_ADDR udp dport @eim dnat ip to $cli"
        fwd="iifname \"lan\" ip saddr $cli meta l4proto udp update @eim { udp sport }
        $stateful
        iifname \"wan\" ip daddr $cli udp dport @eim accept
        $drop_in" ;;
    restricted-cone-nat)
        sets="set eim { type inet_service; flags dynamic,timeout; timeout ${tmo}s; }
    set adf { type inet_service . ipv4_addr; flags dynamic,timeout; timeout ${tmo}s; }"
        pre="iifname \"wan\" ip daddr $WAN_ADDR udp dport @eim dnat ip to $cli"
        fwd="iifname \"lan\" ip saddr $cli meta l4proto udp update @eim { udp sport } update @adf { udp sport . ip daddr }
        $stateful
        iifname \"wan\" ip daddr $cli udp dport . ip saddr @adf accept
        $drop_in" ;;
    port-restricted-cone-nat)
        fwd="$stateful
        $drop_in" ;;
    symmetric-nat)
        masq="$masq fully-random"
        fwd="$stateful
        $drop_in" ;;
    blocked)
        # Ahead of the UPnP jump: nothing UDP may cross, mapped or not.
        first="meta l4proto udp drop"
        fwd="$stateful
        $drop_in" ;;
    esac

    if ((loss == 100)); then
        lossrule="drop"
    elif ((loss > 0)); then
        lossrule="numgen random mod 100 < $loss drop"
    fi
    if [[ $upnp == 1 ]]; then
        # miniupnpd fills these chains; our hooks consult them first.
        upchains="chain upnp_fwd { }
    chain upnp_pre { }
    chain upnp_post { }"
        upfwd="iifname \"wan\" jump upnp_fwd"
        uppre="iifname \"wan\" jump upnp_pre"
        uppost="jump upnp_post"
    fi

    cat <<EOF
table inet natlab {
    $sets
    $upchains
    chain loss_fwd {
        type filter hook forward priority -10; policy accept;
        $lossrule
    }
    chain nat_pre {
        type nat hook prerouting priority dstnat; policy accept;
        $uppre
        $pre
    }
    chain filter_fwd {
        type filter hook forward priority filter; policy accept;
        $first
        $upfwd
        $fwd
    }
    chain filter_in {
        type filter hook input priority filter; policy accept;
        $boxin
    }
    chain nat_post {
        type nat hook postrouting priority srcnat; policy accept;
        $uppost
        $masq
    }
}
EOF
}

start_upnp() {
    local name=$1 dir=$2 ns=$3
    local conf="$dir/miniupnpd.conf"
    cat >"$conf" <<EOF
ext_ifname=wan
# miniupnpd refuses a documentation-range ext_ip, but takes one learnt by STUN.
ext_perform_stun=yes
ext_stun_host=$STUN1
ext_stun_port=3478
listening_ip=lan
http_port=0
enable_natpmp=yes
enable_upnp=yes
secure_mode=yes
ipv6_disable=yes
uuid=$(cat /proc/sys/kernel/random/uuid)
upnp_table_name=natlab
upnp_nat_table_name=natlab
upnp_forward_chain=upnp_fwd
upnp_nat_chain=upnp_pre
upnp_nat_postrouting_chain=upnp_post
lease_file=$dir/upnp.leases
allow 1024-65535 $PRIV_CLI/32 1024-65535
deny 0-65535 0.0.0.0/0 0-65535
EOF
    spawn "$ns" "$dir/miniupnpd.log" "$dir/miniupnpd.pid" \
        miniupnpd -d -f "$conf" -P "$dir/miniupnpd.pidfile"
    local pid=$SPAWNED
    wait_udp_listen "$ns" "$pid" "$PRIV_GW:5351" ||
        die "miniupnpd did not come up: $(tail -n 5 "$dir/miniupnpd.log" 2>/dev/null)"
}

cmd_up() {
    [[ $# -ge 2 ]] || usage
    local name=$1 beh=$2 loss=0 upnp=0
    shift 2
    check_name "$name"
    is_behaviour "$beh" || { echo "$PROG: unknown BEHAVIOUR '$beh'" >&2; usage; }
    while [[ $# -gt 0 ]]; do
        case $1 in
        --loss)
            [[ $# -ge 2 && $2 =~ ^[0-9]{1,3}$ ]] || usage
            loss=$((10#$2)); shift 2
            ((loss <= 100)) || usage ;;
        --upnp) upnp=1; shift ;;
        *) usage ;;
        esac
    done
    local tmo=${NATLAB_UDP_TIMEOUT:-120}
    [[ $tmo =~ ^[1-9][0-9]{0,5}$ ]] || { echo "$PROG: bad NATLAB_UDP_TIMEOUT" >&2; usage; }
    need_root
    local c
    for c in ip nft stund ss flock setsid; do
        command -v "$c" >/dev/null || die "missing tool: $c"
    done
    if [[ $upnp == 1 ]]; then
        command -v miniupnpd >/dev/null || die "missing tool: miniupnpd"
        is_nat_kind "$beh" || { echo "$PROG: --upnp needs a NAT behaviour, not '$beh'" >&2; usage; }
    fi
    take_lock

    local srv="$name-srv" nat="$name-nat" clins="$name-cli" dir cli gw pub
    dir=$(state_dir "$name")
    if is_nat_kind "$beh"; then
        cli=$PRIV_CLI gw=$PRIV_GW pub=$WAN_ADDR
    else
        cli=$PUB_CLI gw=$PUB_GW pub=$PUB_CLI
    fi

    teardown "$name"
    UP_DONE=0
    # Any failure (ip exits 2 too) leaves nothing behind and reports 1.
    trap 'if [[ $UP_DONE != 1 ]]; then teardown "'"$name"'" >/dev/null 2>&1 || true; exit 1; fi' EXIT
    trap 'echo "$PROG: failed at line $LINENO: $BASH_COMMAND" >&2' ERR
    trap 'exit 1' INT TERM HUP
    mkdir -p "$dir"

    local ns
    for ns in "$srv" "$nat" "$clins"; do
        ip netns add "$ns"
        # IPv4 only: the client must own exactly one address.
        nsx "$ns" sysctl -qw net.ipv6.conf.all.disable_ipv6=1 \
            net.ipv6.conf.default.disable_ipv6=1
        ip -n "$ns" link set lo up
    done
    ip link add wan netns "$nat" type veth peer name eth0 netns "$srv"
    ip link add lan netns "$nat" type veth peer name eth0 netns "$clins"

    ip -n "$srv" addr add "$SRV_ADDR/24" dev eth0
    ip -n "$srv" addr add "$STUN1/32" dev lo
    ip -n "$srv" addr add "$STUN2/32" dev lo
    ip -n "$srv" link set eth0 up
    ip -n "$srv" route add default via "$WAN_ADDR"

    ip -n "$nat" addr add "$WAN_ADDR/24" dev wan
    ip -n "$nat" addr add "$gw/24" dev lan
    ip -n "$nat" link set wan up
    ip -n "$nat" link set lan up
    ip -n "$nat" route add 203.0.113.0/24 via "$SRV_ADDR"
    nsx "$nat" sysctl -qw net.ipv4.ip_forward=1

    ip -n "$clins" addr add "$cli/24" dev eth0
    ip -n "$clins" link set eth0 up
    ip -n "$clins" route add default via "$gw"

    nft_ruleset "$beh" "$loss" "$cli" "$tmo" "$upnp" >"$dir/ruleset.nft"
    nsx "$nat" nft -f "$dir/ruleset.nft"
    # One idle lifetime for conntrack (masquerade mappings, firewall state)
    # and the dynamic sets alike.
    nsx "$nat" sysctl -qw net.netfilter.nf_conntrack_udp_timeout="$tmo" \
        net.netfilter.nf_conntrack_udp_timeout_stream="$tmo"

    spawn "$srv" "$dir/stund.log" "$dir/stund.pid" \
        stund -h "$STUN1" -a "$STUN2" -p 3478 -o 3479
    # stund exits 0 even when a bind fails, so check all four sockets.
    wait_udp_listen "$srv" "$SPAWNED" "$STUN1:3478" "$STUN1:3479" \
        "$STUN2:3478" "$STUN2:3479" ||
        die "stund is not listening on all four sockets: $(tail -n 5 "$dir/stund.log" 2>/dev/null)"

    [[ $upnp == 1 ]] && start_upnp "$name" "$dir" "$nat"

    cat >"$dir/info" <<EOF
CLIENT_NS=$clins
NAT_NS=$nat
SERVER_NS=$srv
CLIENT_ADDR=$cli
PUBLIC_ADDR=$pub
STUN1=$STUN1
STUN2=$STUN2
BEHAVIOUR=$beh
GATEWAY_ADDR=$gw
LOSS=$loss
UPNP=$upnp
UDP_TIMEOUT=$tmo
EOF
    UP_DONE=1
}

cmd_down() {
    [[ $# -eq 1 ]] || usage
    check_name "$1"
    need_root
    take_lock
    trap '(($? == 0)) || exit 1' EXIT
    teardown "$1"
}

cmd_info() {
    [[ $# -eq 1 ]] || usage
    check_name "$1"
    need_root
    local f ns
    f="$(state_dir "$1")/info"
    [[ -f $f ]] || die "no lab named '$1'"
    for ns in "$1-srv" "$1-nat" "$1-cli"; do
        ns_exists "$ns" || die "lab '$1' is incomplete: namespace $ns is missing"
    done
    cat "$f"
}

main() {
    [[ $# -ge 1 ]] || usage
    local cmd=$1; shift
    case $cmd in
    up) cmd_up "$@" ;;
    down) cmd_down "$@" ;;
    info) cmd_info "$@" ;;
    behaviours) [[ $# -eq 0 ]] || usage; printf '%s\n' "${BEHAVIOURS[@]}" ;;
    *) usage ;;
    esac
}

main "$@"
