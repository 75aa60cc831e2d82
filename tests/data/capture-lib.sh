# shellcheck shell=bash
# What the capture scripts beside this file share, sourced by them after
# `set -euo pipefail`: the checks and the work directory, clean-up on every
# way out, the base network, dnsmasq, tcpdump and the client event log.
#
# The base network (made by make_base_network, removed on exit):
#
#   ns SRV: srv0 (its addresses are the script's), dnsmasq
#      |  veth
#   ns SW:  bridge br0 = sw-srv + sw-vm    <- tcpdump -i sw-vm (the VM's port)
#      |  veth
#   ns VM:  vm0
#
# The script sets before calling capture_start:
#   capture_filter  tcpdump's filter of the frames captured
#   keep_filter     tshark's display filter of the frames kept in the capture

# capture_start PROGRAM TAG OUTDIR TOOL...: checks that this runs as root and
# that the tools are there, then sets out (OUTDIR, made if missing), work (a
# fresh directory), NS_SW, NS_SRV, NS_VM and the traps that remove every
# namespace and process made here.
capture_start() {
  prog=$1 tag="$2$$"
  local dir=$3; shift 3
  [ "$(id -u)" -eq 0 ] || { echo "$prog: run as root" >&2; exit 1; }
  for tool in ip dnsmasq dhclient tcpdump tshark "$@"; do
    command -v "$tool" >/dev/null || { echo "$prog: missing $tool (bash scripts/setup.sh --capture-tools)" >&2; exit 1; }
  done
  out=$(mkdir -p "$dir" && cd "$dir" && pwd)
  NS_SW="$tag-sw" NS_SRV="$tag-srv" NS_VM="$tag-vm"
  namespaces=()
  work=$(mktemp -d "/tmp/$tag.XXXXXX")
  pids=()
  started=$(date +%s)
  trap cleanup EXIT
  trap 'exit 130' INT TERM
}

log() { printf '%s: %s\n' "$prog" "$*" >&2; }

capture_done() { log "done in $(( $(date +%s) - started )) s; captures in $out"; }

# Processes first, then the namespaces, the last made first.
cleanup() {
  local rc=$?
  set +e
  for pid in "${pids[@]}"; do kill "$pid" 2>/dev/null; done
  for pid in "${pids[@]}"; do wait "$pid" 2>/dev/null; done
  for ((i = ${#namespaces[@]} - 1; i >= 0; i--)); do
    ip netns pids "${namespaces[i]}" 2>/dev/null | xargs -r kill 2>/dev/null
    ip netns del "${namespaces[i]}" 2>/dev/null
  done
  rm -rf "$work"
  [ $rc -eq 0 ] || log "failed (exit $rc); namespaces and processes removed"
  exit $rc
}

# wait_for SECONDS COMMAND...: polls COMMAND every 0.2 s until it succeeds.
wait_for() {
  local limit=$(( $1 * 5 )); shift
  for ((i = 0; i < limit; i++)); do "$@" && return 0; sleep 0.2; done
  log "timed out waiting for: $*"; return 1
}

in_vm() { ip netns exec "$NS_VM" "$@"; }

# ---------------------------------------------------------------- network ---
# add_netns NS [v6off]: a namespace with its loopback up, removed on exit;
# with v6off, IPv6 is off in it from the start.
add_netns() {
  namespaces+=("$1")
  ip netns add "$1"
  [ "${2:-}" != v6off ] || ip netns exec "$1" sysctl -qw net.ipv6.conf.all.disable_ipv6=1 net.ipv6.conf.default.disable_ipv6=1
  ip -n "$1" link set lo up
}

# make_base_network v6off|v6on MAC BRIDGE_OPTION...: the network drawn at
# the top, IPv6 off in SW (the bridge sends nothing) and, with v6off, in SRV
# and VM too; srv0 gets MAC and stays down, vm0 is left to the scenarios.
make_base_network() {
  local v6=$1 mac=$2; shift 2
  add_netns "$NS_SW" v6off
  add_netns "$NS_SRV" "$v6"
  add_netns "$NS_VM" "$v6"
  ip -n "$NS_SW" link add br0 type bridge stp_state 0 forward_delay 0 "$@"
  ip -n "$NS_SW" link add sw-srv type veth peer name srv0 netns "$NS_SRV"
  ip -n "$NS_SW" link add sw-vm type veth peer name vm0 netns "$NS_VM"
  ip -n "$NS_SW" link set sw-srv master br0
  ip -n "$NS_SW" link set sw-vm master br0
  for l in br0 sw-srv sw-vm; do ip -n "$NS_SW" link set "$l" up; done
  ip -n "$NS_SRV" link set srv0 address "$mac"
}

# ---------------------------------------------------------------- dnsmasq ---
dnsmasq_pid=""
# run_dnsmasq READY OPTION...: dnsmasq on srv0, logging to the work
# directory; returns once its log says READY.
run_dnsmasq() {
  local ready=$1; shift
  ip netns exec "$NS_SRV" dnsmasq --keep-in-foreground --conf-file=/dev/null \
    --user=root --group=root --port=0 --interface=srv0 --bind-interfaces \
    --dhcp-authoritative --log-dhcp \
    --dhcp-leasefile="$work/dnsmasq.leases" --pid-file="$work/dnsmasq.pid" \
    --log-facility="$work/dnsmasq.log" "$@" &
  dnsmasq_pid=$!; pids+=("$dnsmasq_pid")
  wait_for 5 grep -qs "$ready" "$work/dnsmasq.log"
}
stop_dnsmasq() {
  kill "$dnsmasq_pid"; wait "$dnsmasq_pid" 2>/dev/null || true
  : > "$work/dnsmasq.log"
}

# ---------------------------------------------------------------- capture ---
cap_pid=""
start_capture() {  # NAME [PORT: sw-vm]
  cap_name=$1
  ip netns exec "$NS_SW" tcpdump -i "${2:-sw-vm}" -s 0 -U --immediate-mode -Z root \
    -w "$work/$1.raw.pcap" "${capture_filter:?}" \
    2>"$work/$1.tcpdump.log" &
  cap_pid=$!; pids+=("$cap_pid")
  wait_for 5 grep -qs "listening on" "$work/$1.tcpdump.log"
}
stop_capture() {
  sleep 0.5
  kill -INT "$cap_pid"; wait "$cap_pid" 2>/dev/null || true
  tshark -r "$work/$cap_name.raw.pcap" -Y "${keep_filter:?}" -w "$out/$cap_name.pcap" -F pcap 2>/dev/null
  log "$cap_name: $(tshark -r "$out/$cap_name.pcap" 2>/dev/null | wc -l) frames"
}

# ----------------------------------------------------------------- events ---
# The clients' hook scripts append "EVENT ADDRESS" lines to $work/events.
events_count() { grep -c "^$1" "$work/events" 2>/dev/null || true; }
has_events() { [ "$(events_count "$1")" -ge "$2" ]; }
