#!/usr/bin/env bash
# Regenerates the IPv6 captures in this folder with real software.
#
# Run as root (network namespaces). Needs: iproute2, dnsmasq, isc-dhcp-client,
# iputils-ping, tcpdump, tshark  (bash scripts/setup.sh --capture-tools).
#
#   bash tests/data/make-captures6.sh [OUTDIR [SCENARIO...]]   (default: this folder, every scenario)
#
# SCENARIO: dhclient6 udhcpc6 slaac
#
# udhcpc6 is busybox's DHCPv6 client, which Debian's busybox leaves out: build
# it from Debian's busybox source (apt-get source busybox; make allnoconfig;
# set CONFIG_FEATURE_IPV6=y and CONFIG_UDHCPC6=y; make busybox) and name the
# binary in UDHCPC6 (default: udhcpc6 on the PATH). Without it that scenario
# is skipped.
#
# Network: capture-lib.sh's, made fresh for every run and removed on exit,
# with srv0 2001:db8:1::1/64 running dnsmasq (router advertisements, DHCPv6)
# and vm0 (MAC set per scenario) running dhclient -6 / the kernel's SLAAC.
#
# Addresses are from 2001:db8::/32 (documentation range) and exist only in
# these namespaces. The switch namespace has IPv6 off, so the bridge itself
# sends nothing. Each capture keeps only ICMPv6 and DHCPv6 frames.
set -euo pipefail

here=$(cd "$(dirname "$0")" && pwd)
. "$here/capture-lib.sh"
capture_start make-captures6 sw6cap "${1:-$here}" ping

SRV_IP=2001:db8:1::1
LEASE=2m        # dnsmasq's shortest lease: T1 (renewal) at 60 s

# tcpdump's filter cannot see ICMPv6 behind extension headers (MLD's
# hop-by-hop): tshark keeps every ICMPv6 and DHCPv6 frame.
capture_filter=ip6
keep_filter='icmpv6 or dhcpv6'

# An address of vm0 whose duplicate-address detection is over ($1: ip -6 addr filter words).
vm_addr() { in_vm ip -6 -o addr show dev vm0 "$@" | grep -v tentative | awk '{print $4}' | cut -d/ -f1 | head -n1; }
has_vm_addr() { [ -n "$(vm_addr "$@")" ]; }

# ---------------------------------------------------------------- network ---
make_network() {
  make_base_network v6on 02:00:5e:c0:00:fe mcast_snooping 0
  # The server's link is up before any capture: its own DAD and reports are not in them.
  ip netns exec "$NS_SRV" sysctl -qw net.ipv6.conf.all.forwarding=1 net.ipv6.conf.default.accept_dad=0 \
    net.ipv6.conf.all.accept_dad=0
  ip -n "$NS_SRV" addr add "$SRV_IP/64" dev srv0 nodad
  ip -n "$NS_SRV" link set srv0 up
  wait_for 5 sh -c "ip -n $NS_SRV -6 -o addr show dev srv0 scope link | grep -qv tentative"
}

# Each run of dnsmasq starts with no leases.
start_dnsmasq() {  # dnsmasq options of the scenario
  rm -f "$work/dnsmasq.leases"
  run_dnsmasq "router advertisement on" --enable-ra --ra-param=srv0,30,600 "$@"
}

# The VM's link comes up inside the capture, so its own duplicate-address
# detection of every address is in it.
vm_up() {  # MAC SYSCTL...
  local mac=$1; shift
  in_vm ip link set vm0 down
  in_vm ip link set vm0 address "$mac"
  in_vm sysctl -qw net.ipv6.conf.vm0.accept_dad=1 net.ipv6.conf.vm0.dad_transmits=1 \
    net.ipv6.conf.vm0.addr_gen_mode=0 "$@"
  in_vm ip link set vm0 up
  wait_for 10 has_vm_addr scope link
}

# Minimal dhclient hook script: configure the address, log the event (the
# distribution's script would also rewrite /etc/resolv.conf of the machine).
cat > "$work/dhclient6.script" <<SCRIPT
#!/bin/sh
echo "\$reason \${new_ip6_address:-}" >> "$work/events"
case "\$reason" in
  BOUND6|RENEW6|REBIND6|REBOOT6)
    ip -6 addr replace "\$new_ip6_address/128" dev "\$interface" valid_lft "\${new_max_life:-forever}" \
      preferred_lft "\${new_preferred_life:-forever}" ;;
  EXPIRE6|RELEASE6|STOP6)
    [ -z "\${old_ip6_address:-}" ] || ip -6 addr del "\$old_ip6_address/128" dev "\$interface" ;;
esac
exit 0
SCRIPT
cat > "$work/udhcpc6.script" <<SCRIPT
#!/bin/sh
echo "\$1 \${ipv6:-}" >> "$work/events"
case "\$1" in
  deconfig) ip -6 addr flush dev "\$interface" scope global ;;
  bound|renew) ip -6 addr replace "\$ipv6/128" dev "\$interface" ;;
esac
exit 0
SCRIPT
chmod +x "$work/dhclient6.script" "$work/udhcpc6.script"

# ------------------------------------------------------------- scenarios ---
# dhclient -6 (DUID-LL) against dnsmasq's stateful DHCPv6 with router
# advertisements (managed flag, on-link prefix without autonomous flag, so
# no SLAAC): Solicit..Reply, the leased address' DAD, a ping to the server,
# the renewal at T1 (60 s), then `dhclient -6 -r` (Release, Reply).
scenario_dhclient6() {
  local name=dhclient6-lease-renew-release mac=02:00:5e:c0:00:31
  : > "$work/events"
  start_dnsmasq --dhcp-range=2001:db8:1::100,2001:db8:1::1ff,64,$LEASE
  start_capture $name
  vm_up $mac net.ipv6.conf.vm0.use_tempaddr=0 net.ipv6.conf.vm0.autoconf=1
  ip netns exec "$NS_VM" dhclient -6 -d -v -D LL -cf /dev/null -sf "$work/dhclient6.script" \
      -lf "$work/dhclient6.leases" -pf "$work/dhclient6.pid" vm0 2>"$work/$name.client.log" &
  local cpid=$!; pids+=("$cpid")
  wait_for 20 has_events BOUND6 1
  local leased; leased=$(awk '/^BOUND6/ {print $2; exit}' "$work/events")
  wait_for 5 has_vm_addr to "$leased/128"
  in_vm ping -c 1 -W 1 -I "$leased" $SRV_IP >/dev/null
  wait_for 90 has_events RENEW6 1
  ip netns exec "$NS_VM" dhclient -6 -r -v -D LL -cf /dev/null -sf "$work/dhclient6.script" \
      -lf "$work/dhclient6.leases" -pf "$work/dhclient6.pid" vm0 2>>"$work/$name.client.log"
  wait "$cpid" 2>/dev/null || true
  stop_capture; stop_dnsmasq
  in_vm ip link set vm0 down
}

# busybox udhcpc6 (1.35, DUID-LL from the MAC) against the same server:
# Solicit..Reply, the leased address' DAD, a ping, a renewal (SIGUSR1), a
# release (SIGUSR2).
scenario_udhcpc6() {
  local name=udhcpc6-lease-renew-release mac=02:00:5e:c0:00:33 udhcpc6=${UDHCPC6:-udhcpc6}
  if ! command -v "$udhcpc6" >/dev/null; then
    log "$name: skipped, no udhcpc6 (see the top of this script)"; return 0
  fi
  : > "$work/events"
  start_dnsmasq --dhcp-range=2001:db8:1::100,2001:db8:1::1ff,64,$LEASE
  start_capture $name
  vm_up $mac net.ipv6.conf.vm0.use_tempaddr=0 net.ipv6.conf.vm0.autoconf=1
  in_vm "$udhcpc6" -f -i vm0 -s "$work/udhcpc6.script" -p "$work/udhcpc6.pid" -t 5 -T 1 \
      2>"$work/$name.client.log" &
  local cpid=$!; pids+=("$cpid")
  wait_for 20 has_events bound 1
  local leased; leased=$(awk '/^bound/ {print $2; exit}' "$work/events")
  wait_for 5 has_vm_addr to "$leased/128"
  in_vm ping -c 1 -W 1 -I "$leased" $SRV_IP >/dev/null
  kill -USR1 "$(cat "$work/udhcpc6.pid")"
  wait_for 20 has_events renew 1
  sleep 0.5
  kill -USR2 "$(cat "$work/udhcpc6.pid")"
  wait_for 10 has_events deconfig 2
  kill "$(cat "$work/udhcpc6.pid")"; wait "$cpid" 2>/dev/null || true
  stop_capture; stop_dnsmasq
  in_vm ip link set vm0 down
}

# The kernel's own SLAAC with privacy addresses (use_tempaddr 2): dnsmasq
# advertises 2001:db8:1::/64 for autoconfiguration only (ra-only); the VM
# detects duplicates of its link-local, stable (EUI-64) and temporary
# addresses, pings the server from the temporary one (preferred) and the
# stable one.
scenario_slaac() {
  local name=slaac-privacy-dad mac=02:00:5e:c0:00:32
  start_dnsmasq --dhcp-range=2001:db8:1::,ra-only,64,$LEASE
  start_capture $name
  vm_up $mac net.ipv6.conf.vm0.use_tempaddr=2 net.ipv6.conf.vm0.autoconf=1 net.ipv6.conf.vm0.accept_ra=1
  wait_for 20 has_vm_addr scope global temporary
  wait_for 10 has_vm_addr scope global mngtmpaddr
  in_vm ping -c 1 -W 1 -I "$(vm_addr scope global temporary)" $SRV_IP >/dev/null
  in_vm ping -c 1 -W 1 -I "$(vm_addr scope global mngtmpaddr)" $SRV_IP >/dev/null
  stop_capture; stop_dnsmasq
  in_vm ip link set vm0 down
}

make_network
scenarios=("${@:2}")
[ ${#scenarios[@]} -ne 0 ] || scenarios=(dhclient6 udhcpc6 slaac)
for scenario in "${scenarios[@]}"; do
  case $scenario in
    dhclient6|udhcpc6|slaac) "scenario_$scenario" ;;
    *) log "unknown scenario $scenario"; exit 2 ;;
  esac
done
capture_done
