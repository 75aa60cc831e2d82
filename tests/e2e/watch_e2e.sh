#!/usr/bin/env bash
# swsec inline with ports that come and go, in network namespaces this
# script makes and removes: a VM interface that joins the bridge under
# --watch is guarded within a second and its spoofs dropped, put back into
# the bridge it is taken out again, its MTU is followed, once it goes it is
# let go with its state kept by MAC and found again on a new interface;
# add-port and remove-port while another VM's ping flows lose none of it;
# the bridge deleted stops every port.
#
#   watch_e2e.sh SWSEC_BINARY [user|kernel]   (the data path; default user)
#
# Exit 0 passed, 1 failed, 77 skipped (the reason is printed).
set -uo pipefail
source "$(dirname "$0")/lib.sh" "$@"
datapath=${2:-user}
need ip scapy

e2e_diagnose() { echo "-- ports"; sw_ctl ports 2>&1; }
port() { sw_ctl ports --json | json "[p$2 for p in d if p['name']=='$1']"; }
now_ms() { echo $(($(date +%s%N) / 1000000)); }

step "namespaces: a bridge, a server, vm2 on a guarded port, vm1 and vm3 not yet on it"
netns sw srv vm1 vm2 vm3
bridge "$sw" br0
veth "$sw" srvp "$srv"; veth "$sw" vm2p "$vm2"; veth "$sw" vnet0 "$vm1"; veth "$sw" vm3p "$vm3"
enslave "$sw" br0 srvp vm2p
ip -n "$srv" addr add 192.0.2.1/24 dev eth0
ip -n "$vm2" addr add 192.0.2.2/24 dev eth0
vm1_mac=$(ip netns exec "$vm1" cat /sys/class/net/eth0/address)
tap_mac=$(ip netns exec "$sw" cat /sys/class/net/vnet0/address)
mkdir "$work/state"
echo '{}' >"$work/trusted.json"
inline_start --bridge br0 --port vm2=vm2p --port-config vm2="$work/trusted.json" \
  --watch 'vnet*' --config "$examples/enforcing.json" --state-dir "$work/state"

step "vm2 pings the server throughout; vm1 joins the bridge under --watch, vm3 is added and removed"
spawn ip netns exec "$vm2" ping -q -i 0.01 -c 500 -W 1 192.0.2.1 >"$work/ping.out" 2>&1
ping_pid=$spawned
sleep 0.5
joined=$(now_ms)
ip -n "$sw" link set vnet0 master br0
until [ "$(port vnet0 "['running']")" = "[True]" ]; do
  [ $(($(now_ms) - joined)) -lt 5000 ] || fail "vnet0 not guarded after it joined"
  sleep 0.05
done
took=$(($(now_ms) - joined))
echo "   vnet0 guarded ${took} ms after it joined"
[ "$took" -le 1000 ] || fail "vnet0 guarded after ${took} ms, more than 1 s"
sw_ctl add-port vm3=vm3p --config "$examples/enforcing.json" >/dev/null || fail "add-port refused"
[ "$(port vm3 "['running']")" = "[True]" ] || fail "vm3 not running after add-port"
out=$(sw_ctl add-port vm3=vm3p 2>&1) && fail "a second port named vm3 was accepted"
grep -q "exists" <<<"$out" || fail "the refusal does not say why: $out"
sleep 0.5
sw_ctl remove-port vm3 | grep -q "removed; its VM is cut off" || fail "remove-port did not report the VM cut off"
[ "$(port vm3 "")" = "[]" ] || fail "vm3 still listed after remove-port"
[ -z "$(master_of vm3p)" ] || fail "vm3p back on the bridge (fail closed)"
wait "$ping_pid"
grep -q " 0% packet loss" "$work/ping.out" || fail "vm2 lost frames meanwhile: $(cat "$work/ping.out")"

step "vm1's spoof is dropped and counted on its watched port"
counted() { sw_ctl counters --json | json "[p['drops']['ipSrcGuardDropCnt'] for p in d if p['port']=='vnet0'][0]"; }
before=$(counted)
ip netns exec "$vm1" "$python" "$tool" attack ip-spoof eth0 "$vm1_mac" 192.0.2.3 192.0.2.1
for _ in $(seq 25); do [ "$(counted)" -gt "$before" ] && break; sleep 0.2; done
[ "$(counted)" -gt "$before" ] || fail "the spoof from vm1 was not dropped"

if [ "$datapath" = user ]; then
  step "vnet0 put back into the bridge round the guard is taken out again"
  ip -n "$sw" link set vnet0 master br0
  for _ in $(seq 25); do [ -z "$(master_of vnet0)" ] && break; sleep 0.2; done
  [ -z "$(master_of vnet0)" ] || fail "vnet0 stays in the bridge"
fi
[ "$(port vnet0 "['running']")" = "[True]" ] || fail "vnet0 no longer guarded"

step "an MTU raised on the VM's interface is followed by its pair"
ip -n "$sw" link set vnet0 mtu 4000
end=$(port vnet0 "['bridgeEnd']" | tr -d "[]'")
for _ in $(seq 25); do [ "$(port vnet0 "['mtu']")" = "[4000]" ] && break; sleep 0.2; done
[ "$(ip -n "$sw" -j link show dev "$end" | json "d[0]['mtu']")" = 4000 ] || fail "$end did not follow the MTU"

step "vnet0 goes: let go, its state kept by MAC; back as vnet7 with that MAC, the state is found"
ip -n "$sw" link del vnet0
for _ in $(seq 25); do [ "$(port vnet0 "")" = "[]" ] && break; sleep 0.2; done
[ "$(port vnet0 "")" = "[]" ] || fail "vnet0 still listed after it went"
[ -s "$work/state/${tap_mac//:/-}.state" ] || fail "no state file named by the MAC: $(ls "$work/state")"
veth "$sw" vnet7 "$vm1" "$tap_mac"
ip -n "$sw" link set vnet7 master br0
for _ in $(seq 25); do [ "$(port vnet7 "['running']")" = "[True]" ] && break; sleep 0.2; done
grep -q "vnet7: state restored from .*${tap_mac//:/-}.state" "$work/inline.log" || fail "vnet7 did not get vnet0's state"

step "a watched port removed by request is not guarded again when its interface rejoins"
sw_ctl remove-port vnet7 >/dev/null || fail "remove-port vnet7 refused"
ip -n "$sw" link set vnet7 master br0
sleep 1
[ "$(port vnet7 "")" = "[]" ] || fail "vnet7 guarded again after remove-port"

step "the bridge deleted: every port stops and says why"
ip -n "$sw" link del br0
for _ in $(seq 25); do [ "$(port vm2 "['running']")" = "[False]" ] && break; sleep 0.2; done
port vm2 "['stopReason']" | grep -q "bridge br0 deleted" || fail "vm2 not stopped for the bridge: $(port vm2 "")"
kill -0 "$inline_pid" || fail "swsec inline died with the bridge"
echo "PASS"
