#!/usr/bin/env bash
# swsec inline end to end on a dual-stack network, in network namespaces this
# script makes and removes: a bridge with two guarded VMs and a server
# (dnsmasq: DHCP, router advertisements, stateful DHCPv6) on it, both ports
# under examples/dual-stack.json. vm1 gets its IPv4 lease and its DHCPv6
# address (dhclient -6), vm2 its SLAAC addresses with privacy extensions (the
# kernel's own, with duplicate-address detection); each becomes a binding and
# their traffic passes. Then IPv6 attacks from vm1 are dropped and counted:
# router advertisements (plain, behind extension headers, in a first fragment
# without its chain), a DHCPv6 Reply, a neighbour advertisement claiming the
# router, a solicitation with a foreign link-layer address, a spoofed source,
# a duplicate-address claim of vm2's address, a flood of claims past the
# port's binding limit. Everything is checked through `swsec ctl --json`.
#
#   dual_stack_e2e.sh SWSEC_BINARY [kernel|user]   (the data path, kernel by default)
#
# Exit 0 passed, 1 failed, 77 skipped (not root, or a tool or kernel
# feature missing; the reason is printed). Every process started is stopped
# by its PID, every namespace removed, also on failure.
set -uo pipefail
source "$(dirname "$0")/lib.sh" "$@"
datapath=${2:-kernel}
need ip dnsmasq dhclient ping scapy
traffic="$here/ipv6_traffic.py"
config=${SWSEC_E2E_CONFIG:-$examples/dual-stack.json}
router=2001:db8:1::1

e2e_diagnose() {
  echo "-- counters"; sw_ctl counters --json 2>&1 | head -60
  echo "-- bindings"; sw_ctl bindings --json 2>&1 | head -40
  echo "-- vm1"; ip -n "$vm1" -6 addr show dev eth0
  echo "-- vm2"; ip -n "$vm2" -6 addr show dev eth0
}
counter() { sw_ctl counters --json | json "[p for p in d if p['port']=='$1'][0]$2"; }
# bound PORT ADDRESS: the method of PORT's binding of ADDRESS, if any.
bound() { sw_ctl bindings "$1" --json | json "' '.join(b['method'] for b in d if b['ip']=='$2')"; }
export -f counter bound
# addr6 NS SELECTOR...: NS's first IPv6 address of eth0 matching `ip addr show` selectors, once usable.
addr6() { ip -n "$1" -6 -o addr show dev eth0 "${@:2}" | grep -v tentative | awk '{print $4}' | cut -d/ -f1 | head -n1; }
has_addr6() { [ -n "$(addr6 "$@")" ]; }

# ---------------------------------------------------------------- set-up
step "namespaces, bridge, server (DHCP, router advertisements, DHCPv6), VMs"
netns sw srv vm1 vm2
in_ns "$sw" sysctl -qw net.ipv6.conf.all.disable_ipv6=1 net.ipv6.conf.default.disable_ipv6=1
bridge "$sw" br0
ip -n "$sw" link set br0 type bridge mcast_snooping 0
for vm in "$vm1" "$vm2"; do
  # The VMs' links come up once their ports are guarded, so that their own
  # duplicate-address detection goes through swsec.
  in_ns "$vm" sysctl -qw net.ipv6.conf.default.accept_dad=1 net.ipv6.conf.default.dad_transmits=1
done
in_ns "$vm1" sysctl -qw net.ipv6.conf.default.autoconf=0
in_ns "$vm2" sysctl -qw net.ipv6.conf.default.autoconf=1 net.ipv6.conf.default.use_tempaddr=2
in_ns "$srv" sysctl -qw net.ipv6.conf.all.forwarding=1 net.ipv6.conf.default.accept_dad=0
veth "$sw" vm1p "$vm1"; veth "$sw" vm2p "$vm2"; veth "$sw" srvp "$srv"
ip -n "$vm1" link set eth0 down; ip -n "$vm2" link set eth0 down
enslave "$sw" br0 vm1p vm2p srvp
vm1_mac=$(in_ns "$vm1" cat /sys/class/net/eth0/address)
srv_mac=$(in_ns "$srv" cat /sys/class/net/eth0/address)
ip -n "$srv" addr add $router/64 dev eth0 nodad
dhcp_server "$srv"
in_ns "$srv" dnsmasq --conf-file=/dev/null --port=0 --interface=eth0 --bind-interfaces --enable-ra \
  --ra-param=eth0,10,600 --dhcp-range=2001:db8:1::100,2001:db8:1::1ff,slaac,64,2m \
  --dhcp-leasefile="$work/dnsmasq6.leases" --pid-file="$work/dnsmasq6.pid" \
  --log-facility="$work/dnsmasq6.log" --log-dhcp || fail "dnsmasq (IPv6) did not start"
dhcp_client_scripts
cat >"$work/dhclient6-script" <<'SCRIPT'
#!/bin/sh
case "$reason" in
  BOUND6|RENEW6|REBIND6|REBOOT6) ip -6 addr replace "$new_ip6_address/128" dev "$interface" ;;
  EXPIRE6|RELEASE6|STOP6) [ -n "$old_ip6_address" ] && ip -6 addr del "$old_ip6_address/128" dev "$interface" ;;
esac
exit 0
SCRIPT
chmod +x "$work/dhclient6-script"

step "swsec inline guards vm1 and vm2 with $(basename "$config")"
state="$work/state"
mkdir "$state"
start_inline() { inline_start --bridge br0 --port vm1=vm1p --port vm2=vm2p --config "$config" --state-dir "$state"; }
start_inline
sw_ctl ports --json | json "all(p['datapath']=='$datapath' for p in d)" | grep -qx True \
  || fail "not every port on the $datapath data path: $(sw_ctl ports --json)"
ip -n "$vm1" link set eth0 up; ip -n "$vm2" link set eth0 up

# ---------------------------------------------------------------- addresses
step "vm1: IPv4 lease and DHCPv6 address; vm2: SLAAC stable and temporary addresses"
dhclient_lease "$vm1" || fail "dhclient got no IPv4 lease through swsec"
vm1_ip=$(ipv4_of "$vm1")
wait_for 10 has_addr6 "$vm1" scope link || fail "vm1's link-local address never became usable"
vm1_ll=$(addr6 "$vm1" scope link)
timeout 30 ip netns exec "$vm1" dhclient -6 -1 -D LL -pf "$work/dhclient6.pid" -lf "$work/dhclient6.leases" \
  -sf "$work/dhclient6-script" eth0 || fail "dhclient -6 got no address through swsec"
wait_for 10 has_addr6 "$vm1" scope global || fail "vm1's DHCPv6 address failed its DAD: $(ip -n "$vm1" -6 addr)"
vm1_ip6=$(addr6 "$vm1" scope global)
wait_for 20 has_addr6 "$vm2" scope global temporary || fail "vm2 made no temporary address"
wait_for 10 has_addr6 "$vm2" scope global mngtmpaddr || fail "vm2 made no stable address"
vm2_temp=$(addr6 "$vm2" scope global temporary)
vm2_stable=$(addr6 "$vm2" scope global mngtmpaddr)
vm2_ll=$(addr6 "$vm2" scope link)
echo "   vm1 $vm1_mac $vm1_ip $vm1_ll $vm1_ip6; vm2 $vm2_ll $vm2_stable $vm2_temp"

step "each address is a binding of its port: DHCPv6, or first come first served"
wait_for 5 bash -c "bound vm1 $vm1_ip6 | grep -qx DHCPv6" || fail "vm1's DHCPv6 address not bound: $(sw_ctl bindings vm1 --json)"
bound vm1 "$vm1_ip" | grep -qx "DHCP Snooping" || fail "vm1's IPv4 lease not bound"
for a in "$vm1_ll"; do bound vm1 "$a" | grep -qx "First come first served" || fail "vm1's $a not bound"; done
for a in "$vm2_ll" "$vm2_stable" "$vm2_temp"; do
  bound vm2 "$a" | grep -qx "First come first served" || fail "vm2's $a not bound: $(sw_ctl bindings vm2 --json)"
done

step "a restart with --state-dir keeps the IPv6 bindings, their lifetimes counted on"
left() { sw_ctl bindings "$1" --json | json "[b['timeRemaining'] for b in d if b['ip']=='$2'][0]"; }
left_before=$(left vm1 "$vm1_ip6")
stopped_at=$SECONDS
inline_stop
[ "$inline_status" -eq 0 ] || fail "swsec inline exited $inline_status"
[ -s "$state/vm1.state6" ] || fail "no IPv6 state file for vm1: $(ls "$state")"
start_inline
bound vm1 "$vm1_ip6" | grep -qx DHCPv6 || fail "vm1's DHCPv6 binding lost: $(sw_ctl bindings vm1 --json)"
for a in "$vm1_ll" "$vm2_ll" "$vm2_stable" "$vm2_temp"; do
  [ -n "$(bound vm1 "$a")$(bound vm2 "$a")" ] || fail "the binding of $a lost over the restart"
done
left_after=$(left vm1 "$vm1_ip6")
elapsed=$((SECONDS - stopped_at))
[ "$left_after" -le "$left_before" ] && [ "$left_after" -ge $((left_before - elapsed - 2)) ] \
  || fail "lifetime $left_before s before a ${elapsed} s restart, $left_after s after"
echo "   vm1's DHCPv6 binding: $left_before s left before the restart, $left_after s after (${elapsed} s later)"

step "the VMs' own traffic passes, IPv4 and IPv6"
in_ns "$vm1" ping -c 2 -i 0.2 -W 2 192.0.2.1 >/dev/null || fail "vm1 cannot ping the server over IPv4"
in_ns "$vm1" ping -c 2 -i 0.2 -W 2 -I "$vm1_ip6" $router >/dev/null || fail "vm1 cannot ping the router from its DHCPv6 address"
in_ns "$vm2" ping -c 2 -i 0.2 -W 2 -I "$vm2_temp" $router >/dev/null || fail "vm2 cannot ping from its temporary address"
in_ns "$vm2" ping -c 2 -i 0.2 -W 2 -I "$vm2_stable" $router >/dev/null || fail "vm2 cannot ping from its stable address"
[ "$(counter vm1 "['frames']['from-vm']['dropped']")" = 0 ] || fail "vm1's own frames were dropped"
[ "$(counter vm2 "['frames']['from-vm']['dropped']")" = 0 ] || fail "vm2's own frames were dropped"

# ---------------------------------------------------------------- attacks
step "a spoofed IPv6 source does not reach the router; the VM's own does"
spawn ip netns exec "$srv" "$python" "$traffic" udp-listen 9999 20 "$vm1_ip6" >"$work/udp.out"
listen_pid=$spawned
wait_for 5 grep -q listening "$work/udp.out" || fail "UDP listener did not start"
in_ns "$vm1" "$python" "$traffic" udp-send 2001:db8:1::66 $router "$srv_mac" 9999 eth0
in_ns "$vm1" "$python" "$traffic" udp-send "$vm1_ip6" $router "$srv_mac" 9999 eth0
wait "$listen_pid"
grep -qx "$vm1_ip6" "$work/udp.out" || fail "the VM's own datagram did not arrive: $(cat "$work/udp.out")"
! grep -qx 2001:db8:1::66 "$work/udp.out" || fail "the spoofed datagram arrived"
[ "$(counter vm1 "['drops']['sourceGuardDropCnt']")" -ge 1 ] || fail "the spoofed source was not counted"
if [ "$datapath" = kernel ]; then
  [ "$(counter vm1 "['kernel']['IPv6 source guard']")" -ge 1 ] || fail "the spoofed source was not dropped in the kernel"
fi

# attack NAME COUNTER [ARG]: an attack from vm1, dropped, counted in COUNTER
# (or, with "", dropped by the IPv4 agent before the IPv6 one sees it).
attack() {
  local name=$1 counter=$2 dropped_before counted_before
  dropped_before=$(counter vm1 "['frames']['from-vm']['dropped']")
  counted_before=$([ -n "$counter" ] && counter vm1 "['drops']['$counter']" || echo 0)
  in_ns "$vm1" "$python" "$traffic" attack "$name" eth0 "$vm1_ll" "$router" "${3:-}"
  wait_for 5 bash -c "[ \$(counter vm1 \"['frames']['from-vm']['dropped']\") -gt $dropped_before ]" \
    || fail "$name was not dropped"
  if [ -n "$counter" ]; then
    wait_for 2 bash -c "[ \$(counter vm1 \"['drops']['$counter']\") -gt $counted_before ]" || fail "$name not counted in $counter"
  fi
  echo "   $name dropped${counter:+, $counter counted}"
}
step "IPv6 attacks from the guarded VM are dropped and counted"
attack ra raGuardDropCnt
attack ra-behind-options raGuardDropCnt
attack ra-in-first-fragment headerChainDropCnt
attack dhcpv6-reply ""
attack na-router ndInspectionDropCnt $router
attack ns-foreign-mac ndInspectionDropCnt
attack dad-claim claimRefusedDropCnt "$vm2_stable"
bound vm2 "$vm2_stable" | grep -qx "First come first served" || fail "the claim took vm2's binding"
bound vm1 "$vm2_stable" | grep -q . && fail "the refused claim was bound to vm1"
ip -n "$vm2" -6 route show default | grep -q "$vm1_ll" && fail "vm2 took vm1 as its router"
in_ns "$vm2" ping -c 1 -W 2 -I "$vm2_stable" $router >/dev/null || fail "vm2 lost its stable address to the claim"

step "a flood of claims past the binding limit evicts the port's oldest bindings"
limit=$(json "d['ipv6BindingLimit']" <"$config")
evicted_before=$(counter vm1 "['drops']['bindingsEvictedCnt']")
in_ns "$vm1" "$python" "$traffic" attack claim-flood eth0 "$vm1_ll" "$router" "$limit"
wait_for 5 bash -c "[ \$(counter vm1 \"['drops']['bindingsEvictedCnt']\") -ge $((evicted_before + 2)) ]" \
  || fail "no binding was evicted"
[ -z "$(bound vm1 "$vm1_ll")" ] || fail "the oldest binding (vm1's link-local) was kept"
bound vm1 2001:db8:1::e:$(printf %x $((limit - 1))) | grep -qx "First come first served" || fail "the last claim is not bound"
in_ns "$vm1" ping -c 1 -W 1 -I "$vm1_ip6" $router >/dev/null && fail "vm1's evicted DHCPv6 address still passes"
for a in "$vm2_ll" "$vm2_stable" "$vm2_temp"; do
  bound vm2 "$a" | grep -qx "First come first served" || fail "vm1's flood cost vm2 its $a"
done
in_ns "$vm2" ping -c 1 -W 2 -I "$vm2_temp" $router >/dev/null || fail "vm1's flood cut vm2 off"

step "ctl and metrics show the IPv6 counters; a stop leaves nothing"
sw_ctl metrics >"$work/metrics"
grep -qx 'swsec_module_drops_total{port="vm1",counter="raGuardDropCnt"} 2' "$work/metrics" \
  || fail "metrics: $(grep vm1 "$work/metrics")"
grep -qx 'swsec_ipv6_bindings{port="vm2",method="First come first served"} 3' "$work/metrics" \
  || fail "metrics: $(grep vm2 "$work/metrics")"
inline_stop
[ "$inline_status" -eq 0 ] || fail "swsec inline exited $inline_status"
grep -q "0 host violation" "$work/inline.log" || fail "host violations at stop"
[ -z "$(links | grep '^swsec')" ] || fail "links left: $(links | grep '^swsec')"
echo "PASS"
