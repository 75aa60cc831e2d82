# Set-up and clean-up shared by the end-to-end scripts, sourced after
# `set -uo pipefail` with the script's arguments:
#
#   source "$(dirname "$0")/lib.sh" "$@"
#
# It reads SWSEC_BINARY from $1 and sets swsec, here, tool, examples, python,
# work (a fresh directory) and ctl (the control socket's path in it), and skips
# (exit 77) unless run as root. On exit, whatever the outcome, it stops every
# PID in pids (TERM, then KILL after 5 s) and every PID written to a *.pid file
# in work, removes every namespace netns made, newest first, and the work
# directory. Only the PIDs the script started are touched.
#
# A script may define e2e_diagnose to print more when a check fails.

swsec=$(realpath "${1:?usage: $(basename "$0") SWSEC_BINARY}")
here=$(cd "$(dirname "$0")" && pwd)
tool="$here/e2e_tool.py"
examples="$here/../../examples"
python=/usr/bin/python3
tag="sw$(basename "$0" .sh | cut -c1)$$"
pids=()
namespaces=()

skip() { echo "SKIP: $*"; exit 77; }
[ "$(id -u)" -eq 0 ] || skip "needs root for network namespaces"

work=$(mktemp -d "/tmp/swsec-$(basename "$0" .sh).XXXXXX")
ctl="$work/ctl.sock"

e2e_cleanup() {
  local pid file i
  for pid in "${pids[@]}"; do kill -TERM "$pid" 2>/dev/null; done
  for pid in "${pids[@]}"; do
    for _ in $(seq 50); do kill -0 "$pid" 2>/dev/null || break; sleep 0.1; done
    kill -KILL "$pid" 2>/dev/null
  done
  for file in "$work"/*.pid; do [ -f "$file" ] && kill -TERM "$(cat "$file")" 2>/dev/null; done
  for ((i = ${#namespaces[@]} - 1; i >= 0; i--)); do ip netns del "${namespaces[i]}" 2>/dev/null; done
  rm -rf "$work"
}
trap e2e_cleanup EXIT
trap 'exit 1' INT TERM

step() { echo "== $*"; }
fail() {
  echo "FAIL: $*"
  if declare -F e2e_diagnose >/dev/null; then e2e_diagnose; fi
  echo "-- swsec inline's log"; tail -n 40 "$work/inline.log" 2>/dev/null
  exit 1
}
# need COMMAND...: skip unless each is installed ("scapy" is the Python module).
need() {
  local command
  for command in "$@"; do
    if [ "$command" = scapy ]; then
      "$python" -c "import scapy.all" 2>/dev/null || skip "python3-scapy is not installed (scripts/setup.sh installs it)"
    else
      command -v "$command" >/dev/null || skip "$command is not installed (scripts/setup.sh installs it)"
    fi
  done
}
in_ns() { local ns=$1; shift; ip netns exec "$ns" "$@"; }
sw_ctl() { "$swsec" ctl --ctl "$ctl" "$@"; }
json() { "$python" -c "import json,sys; d=json.load(sys.stdin); print($1)"; }
# wait_for SECONDS COMMAND...: until the command succeeds, at most SECONDS.
wait_for() {
  local limit=$1; shift
  local deadline=$((SECONDS + limit))
  until "$@" >/dev/null 2>&1; do
    [ $SECONDS -lt $deadline ] || return 1
    sleep 0.2
  done
}
# spawn COMMAND...: run it in the background, its PID in spawned and in pids.
# Not through a subshell or in_ns, so that the PID is the command's own.
spawn() {
  "$@" &
  spawned=$!
  pids+=("$spawned")
}
# For the checks that wait_for runs in a new shell.
export swsec ctl python
export -f sw_ctl json

# netns NAME...: a namespace "$tag$NAME" each, its name in the variable NAME
# (netns sw vm1 sets $sw and $vm1), removed at exit. The first one made
# decides whether namespaces work here at all.
netns() {
  local name
  for name in "$@"; do
    printf -v "$name" '%s' "$tag$name"
    if ip netns add "$tag$name"; then
      namespaces+=("$tag$name")
    else
      [ ${#namespaces[@]} -gt 0 ] || skip "cannot make network namespaces"
      fail "cannot make namespace $tag$name"
    fi
  done
}
# bridge NS BRIDGE: a bridge, up.
bridge() {
  ip -n "$1" link add "$2" type bridge 2>/dev/null || skip "no bridge support in this kernel"
  ip -n "$1" link set "$2" up
}
# veth NS LINK PEER_NS [MAC]: LINK in NS, up, whose peer is eth0 in PEER_NS,
# up beside PEER_NS's loopback.
e2e_veths=0
veth() {
  if ! ip -n "$1" link add "$2" ${4:+address "$4"} type veth peer name eth0 netns "$3" 2>/dev/null; then
    [ $e2e_veths -gt 0 ] || skip "no veth support in this kernel"
    fail "cannot make $2"
  fi
  e2e_veths=$((e2e_veths + 1))
  ip -n "$1" link set "$2" up
  ip -n "$3" link set lo up
  ip -n "$3" link set eth0 up
}
# enslave NS BRIDGE LINK...: the links into the bridge.
enslave() {
  local ns=$1 bridge=$2 link; shift 2
  for link in "$@"; do ip -n "$ns" link set "$link" master "$bridge"; done
}
master_of() { ip -n "$sw" -j link show dev "$1" | json "d[0].get('master','')"; }
links() { ip -n "$sw" -o link show | awk -F': ' '{print $2}' | cut -d@ -f1; }

# dhcp_server NS: dnsmasq on NS's eth0 (192.0.2.1/24), leases of 2 minutes
# from 192.0.2.100-150; its log (with every DHCP message) in work/dnsmasq.log.
dhcp_server() {
  ip -n "$1" addr add 192.0.2.1/24 dev eth0
  in_ns "$1" dnsmasq --conf-file=/dev/null --port=0 --interface=eth0 --bind-interfaces \
    --dhcp-range=192.0.2.100,192.0.2.150,255.255.255.0,2m --dhcp-leasefile="$work/dnsmasq.leases" \
    --pid-file="$work/dnsmasq.pid" --log-facility="$work/dnsmasq.log" --log-dhcp \
    || fail "dnsmasq did not start"
}
# dhcp_client_scripts: work/dhclient-script and work/udhcpc-script, which
# touch nothing but their namespace's interface.
dhcp_client_scripts() {
  cat >"$work/dhclient-script" <<'SCRIPT'
#!/bin/sh
case "$reason" in
  PREINIT) ip link set "$interface" up ;;
  BOUND|RENEW|REBIND|REBOOT) ip addr replace "$new_ip_address/24" dev "$interface" ;;
  EXPIRE|FAIL|RELEASE|STOP) [ -n "$old_ip_address" ] && ip addr del "$old_ip_address/24" dev "$interface" ;;
esac
exit 0
SCRIPT
  cat >"$work/udhcpc-script" <<'SCRIPT'
#!/bin/sh
case "$1" in
  deconfig) ip addr flush dev "$interface" ;;
  bound|renew) ip addr replace "$ip/24" dev "$interface" ;;
esac
exit 0
SCRIPT
  chmod +x "$work/dhclient-script" "$work/udhcpc-script"
}
# dhclient_lease NS: dhclient's lease on NS's eth0 (its files in work).
dhclient_lease() {
  timeout 30 ip netns exec "$1" dhclient -4 -1 -pf "$work/dhclient.pid" -lf "$work/dhclient.leases" \
    -sf "$work/dhclient-script" eth0
}
dhclient_release() {
  in_ns "$1" dhclient -r -pf "$work/dhclient.pid" -lf "$work/dhclient.leases" -sf "$work/dhclient-script" eth0
}
# ipv4_of NS: the first IPv4 address of NS's eth0.
ipv4_of() { ip -n "$1" -j -4 addr show dev eth0 | json "d[0]['addr_info'][0]['local']"; }

# inline_start ARGUMENTS...: swsec inline in $sw on the control socket ctl
# (on the data path $datapath when the script set one),
# its output appended to work/inline.log, PID in inline_pid; fails unless
# its control socket answers within 30 s.
inline_start() {
  spawn ip netns exec "$sw" "$swsec" inline --ctl "$ctl" ${datapath:+--datapath "$datapath"} "$@" >>"$work/inline.log" 2>&1
  inline_pid=$spawned
  wait_for 30 sw_ctl ports || fail "swsec inline did not come up"
}
# inline_stop: SIGTERM, at most 15 s to exit; its status in inline_status.
inline_stop() {
  kill -TERM "$inline_pid"
  local deadline=$((SECONDS + 15))
  while kill -0 "$inline_pid" 2>/dev/null; do
    [ $SECONDS -lt $deadline ] || fail "swsec inline did not stop on SIGTERM"
    sleep 0.1
  done
  wait "$inline_pid"; inline_status=$?
}
