#!/usr/bin/env bash
# Regenerates the DHCP/ARP captures in this folder with real software.
#
# Run as root (network namespaces). Needs: iproute2, dnsmasq, isc-dhcp-client,
# udhcpc (busybox), tcpdump, tshark  (bash scripts/setup.sh --capture-tools).
#
#   bash tests/data/make-captures.sh [OUTDIR [SCENARIO...]]   (default: this folder, every scenario)
#
# SCENARIO: dhclient dhclient_nak udhcpc_no_clientid udhcpc_custom_clientid
# udhcpc_renew_nak arp bridge.
#
# Network: capture-lib.sh's, made fresh for every run and removed on exit,
# with srv0 192.0.2.1/24 running dnsmasq and vm0 (MAC set per scenario)
# running dhclient / udhcpc / arping / ping.
#
# Addresses are from 192.0.2.0/24 (documentation range) and exist only in these
# namespaces. IPv6 is disabled in all three so that router solicitations and
# MLD reports do not clutter the captures. Each capture keeps only DHCP, ARP
# and ICMP frames.
set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
. "$here/capture-lib.sh"
capture_start make-captures swcap "${1:-$here}" udhcpc busybox unshare
NS_VM2="$tag-vm2" NS_VM3="$tag-vm3"

SRV_IP=192.0.2.1
LEASE=2m        # dnsmasq's shortest lease
T1=10 T2=20     # renew quickly instead of after half the lease

# Drop anything that is neither DHCP, ARP nor ICMP (none expected with IPv6 off).
capture_filter='arp or (ip and (udp port 67 or udp port 68 or icmp))'
keep_filter='dhcp or arp or icmp'

# ---------------------------------------------------------------- network ---
make_network() {
  make_base_network v6off 02:00:5e:c0:00:fe
  ip -n "$NS_SRV" addr add "$SRV_IP/24" dev srv0
  ip -n "$NS_SRV" link set srv0 up
}

start_dnsmasq() {  # extra dnsmasq options
  run_dnsmasq "DHCP, IP range" --dhcp-range=192.0.2.100,192.0.2.150,255.255.255.0,$LEASE \
    --dhcp-option=58,$T1 --dhcp-option=59,$T2 --no-ping "$@"
}

set_vm_mac() {
  in_vm ip link set vm0 down
  in_vm ip addr flush dev vm0
  in_vm ip link set vm0 address "$1"
  in_vm ip link set vm0 up
  ip netns exec "$NS_VM" ip neigh flush dev vm0
  ip netns exec "$NS_SRV" ip neigh flush dev srv0
}

# ---------------------------------------------------------- client scripts ---
# Minimal hook scripts: configure the address, log the event. The distribution
# scripts would also rewrite /etc/resolv.conf of the machine.
cat > "$work/udhcpc.script" <<SCRIPT
#!/bin/sh
echo "\$1 \${ip:-}" >> "$work/events"
case "\$1" in
  deconfig) ip addr flush dev "\$interface" ;;
  bound|renew)
    ip -4 addr show dev "\$interface" | grep -q " \$ip/" || ip addr flush dev "\$interface"
    ip addr replace "\$ip/\${mask:-24}" dev "\$interface" ;;
esac
exit 0
SCRIPT
cat > "$work/dhclient.script" <<SCRIPT
#!/bin/sh
echo "\$reason \${new_ip_address:-}" >> "$work/events"
case "\$reason" in
  PREINIT) ip link set dev "\$interface" up ;;
  BOUND|RENEW|REBIND|REBOOT)
    [ "\${old_ip_address:-}" = "\$new_ip_address" ] || ip addr flush dev "\$interface"
    ip addr replace "\$new_ip_address/24" dev "\$interface" ;;
  EXPIRE|FAIL|RELEASE|STOP) ip addr flush dev "\$interface" ;;
esac
exit 0
SCRIPT
chmod +x "$work/udhcpc.script" "$work/dhclient.script"

# ------------------------------------------------------------- scenarios ---
# dhclient with Debian's default configuration (no client identifier, sends
# its host name, here "vm-dhclient" in its own UTS namespace): full exchange,
# a ping to the server (kernel ARP), a renewal at T1, a release.
scenario_dhclient() {
  local name=dhclient-lease-renew-release mac=02:00:5e:c0:00:01
  : > "$work/events"; set_vm_mac $mac
  start_dnsmasq --dhcp-host=$mac,192.0.2.101
  start_capture $name
  ip netns exec "$NS_VM" unshare --uts sh -c "hostname vm-dhclient; exec dhclient -4 -d -v \
      -cf /etc/dhcp/dhclient.conf -sf '$work/dhclient.script' \
      -lf '$work/dhclient.leases' -pf '$work/dhclient.pid' vm0" 2>"$work/$name.client.log" &
  local cpid=$!; pids+=("$cpid")
  wait_for 20 has_events BOUND 1
  in_vm busybox ping -s 16 -c 1 -W 1 $SRV_IP >/dev/null
  wait_for 30 has_events RENEW 1
  ip netns exec "$NS_VM" dhclient -4 -r -v -cf /etc/dhcp/dhclient.conf -sf "$work/dhclient.script" \
      -lf "$work/dhclient.leases" -pf "$work/dhclient.pid" vm0 2>>"$work/$name.client.log"
  wait "$cpid" 2>/dev/null || true
  stop_capture; stop_dnsmasq
}

# dhclient starts with a remembered lease of an address on another network:
# INIT-REBOOT REQUEST, the authoritative server answers DHCPNAK, the client
# starts over with DISCOVER and gets a lease; then a release.
scenario_dhclient_nak() {
  local name=dhclient-reboot-nak mac=02:00:5e:c0:00:02
  : > "$work/events"; set_vm_mac $mac
  cat > "$work/dhclient-nak.leases" <<LEASE
lease {
  interface "vm0";
  fixed-address 198.51.100.50;
  option subnet-mask 255.255.255.0;
  option dhcp-lease-time 120;
  option dhcp-message-type 5;
  option dhcp-server-identifier 198.51.100.1;
  renew 4 2037/01/01 00:00:00;
  rebind 4 2037/01/01 00:00:00;
  expire 4 2037/01/01 00:00:00;
}
LEASE
  start_dnsmasq --dhcp-host=$mac,192.0.2.102
  start_capture $name
  ip netns exec "$NS_VM" unshare --uts sh -c "hostname vm-dhclient; exec dhclient -4 -d -v \
      -cf /etc/dhcp/dhclient.conf -sf '$work/dhclient.script' \
      -lf '$work/dhclient-nak.leases' -pf '$work/dhclient.pid' vm0" 2>"$work/$name.client.log" &
  local cpid=$!; pids+=("$cpid")
  wait_for 30 has_events BOUND 1
  ip netns exec "$NS_VM" dhclient -4 -r -v -cf /etc/dhcp/dhclient.conf -sf "$work/dhclient.script" \
      -lf "$work/dhclient-nak.leases" -pf "$work/dhclient.pid" vm0 2>>"$work/$name.client.log"
  wait "$cpid" 2>/dev/null || true
  stop_capture; stop_dnsmasq
}

# udhcpc: full exchange, renewal (SIGUSR1), release (SIGUSR2). $3... are extra
# udhcpc options (client identifier choice, ARP validation).
scenario_udhcpc() {
  local name=$1 mac=$2 ip=$3; shift 3
  : > "$work/events"; set_vm_mac "$mac"
  start_dnsmasq --dhcp-host="$mac,$ip"
  start_capture "$name"
  in_vm udhcpc -f -i vm0 -s "$work/udhcpc.script" -p "$work/udhcpc.pid" -t 5 -T 1 -A 1 "$@" \
      2>"$work/$name.client.log" &
  local cpid=$!; pids+=("$cpid")
  wait_for 20 has_events bound 1
  sleep 0.5
  kill -USR1 "$(cat "$work/udhcpc.pid")"
  wait_for 20 has_events renew 1
  sleep 0.5
  kill -USR2 "$(cat "$work/udhcpc.pid")"
  wait_for 10 has_events deconfig 2
  kill "$(cat "$work/udhcpc.pid")"; wait "$cpid" 2>/dev/null || true
  stop_capture; stop_dnsmasq
}

# udhcpc (default client identifier 01+MAC) bound to .103; the server is then
# restarted with this MAC pinned to .113, so the renewal of .103 is answered
# with DHCPNAK and the client starts over and gets .113; then a release.
scenario_udhcpc_renew_nak() {
  local name=udhcpc-renew-nak mac=02:00:5e:c0:00:05
  : > "$work/events"; set_vm_mac $mac
  start_dnsmasq --dhcp-host=$mac,192.0.2.103
  start_capture $name
  in_vm udhcpc -f -i vm0 -s "$work/udhcpc.script" -p "$work/udhcpc.pid" -t 5 -T 1 -A 1 \
      2>"$work/$name.client.log" &
  local cpid=$!; pids+=("$cpid")
  wait_for 20 has_events bound 1
  stop_dnsmasq
  start_dnsmasq --dhcp-host=$mac,192.0.2.113
  kill -USR1 "$(cat "$work/udhcpc.pid")"
  wait_for 20 has_events bound 2
  sleep 0.5
  kill -USR2 "$(cat "$work/udhcpc.pid")"
  wait_for 10 has_events deconfig 3
  kill "$(cat "$work/udhcpc.pid")"; wait "$cpid" 2>/dev/null || true
  stop_capture; stop_dnsmasq
}

# ARP from a VM with a static address: a probe (sender 0.0.0.0), gratuitous
# requests (-U) and replies (-A), the kernel's ARP for the server and its
# reply (ping), the server asking for the VM and the VM's ordinary reply.
scenario_arp() {
  local name=arp-probe-announce mac=02:00:5e:c0:00:06 ip=192.0.2.60
  : > "$work/events"; set_vm_mac $mac
  start_capture $name
  in_vm busybox arping -D -c 2 -w 2 -I vm0 $ip >/dev/null || true
  in_vm ip addr add $ip/24 dev vm0
  in_vm busybox arping -U -c 2 -w 2 -I vm0 $ip >/dev/null || true
  in_vm busybox arping -A -c 2 -w 2 -I vm0 $ip >/dev/null || true
  in_vm busybox ping -s 16 -c 2 -i 0.5 -W 1 $SRV_IP >/dev/null
  ip netns exec "$NS_SRV" busybox arping -c 1 -w 1 -I srv0 $ip >/dev/null
  stop_capture
}

# Three VMs on one bridge, captured on the server's port, as a capture taken
# on a bridge holds them: each VM (vm0 in its own namespace, MACs :11, :12,
# :13) gets its lease from one dnsmasq (udhcpc, one after the other, .111 to
# .113) and pings the server; the broadcasts of each reach the others'
# ports too. `swsec replay --port` gives each VM its own port.
scenario_bridge() {
  local name=bridge-three-vms
  : > "$work/events"
  set_vm_mac 02:00:5e:c0:00:11
  local n=2
  for ns in "$NS_VM2" "$NS_VM3"; do
    add_netns "$ns" v6off
    ip -n "$NS_SW" link add "sw-vm$n" type veth peer name vm0 netns "$ns"
    ip -n "$NS_SW" link set "sw-vm$n" master br0
    ip -n "$NS_SW" link set "sw-vm$n" up
    ip -n "$ns" link set vm0 address "02:00:5e:c0:00:1$n"
    ip -n "$ns" link set vm0 up
    n=$((n + 1))
  done
  start_dnsmasq --dhcp-host=02:00:5e:c0:00:11,192.0.2.111 --dhcp-host=02:00:5e:c0:00:12,192.0.2.112 \
    --dhcp-host=02:00:5e:c0:00:13,192.0.2.113
  start_capture $name sw-srv
  local count=1
  for ns in "$NS_VM" "$NS_VM2" "$NS_VM3"; do
    ip netns exec "$ns" udhcpc -q -f -i vm0 -s "$work/udhcpc.script" -t 5 -T 1 -A 1 -C \
      2>"$work/$name.client$count.log"
    wait_for 10 has_events bound "$count"
    ip netns exec "$ns" busybox ping -s 16 -c 1 -W 1 $SRV_IP >/dev/null
    count=$((count + 1))
  done
  stop_capture; stop_dnsmasq
}

make_network
scenarios=("${@:2}")
[ ${#scenarios[@]} -ne 0 ] || scenarios=(dhclient dhclient_nak udhcpc_no_clientid udhcpc_custom_clientid
                                         udhcpc_renew_nak arp bridge)
for scenario in "${scenarios[@]}"; do
  case $scenario in
    udhcpc_no_clientid) scenario_udhcpc udhcpc-no-clientid 02:00:5e:c0:00:03 192.0.2.104 -C -a ;;
    udhcpc_custom_clientid)
      scenario_udhcpc udhcpc-custom-clientid 02:00:5e:c0:00:04 192.0.2.105 -x 0x3d:ff00000001000100015ec00004 ;;
    dhclient|dhclient_nak|udhcpc_renew_nak|arp|bridge) "scenario_$scenario" ;;
    *) log "unknown scenario $scenario"; exit 2 ;;
  esac
done
capture_done
