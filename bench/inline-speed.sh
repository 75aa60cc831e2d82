#!/usr/bin/env bash
# swsec inline beside the plain bridge, in network namespaces this script
# makes and removes: 60-byte frames from a VM through one guarded port
# (enforcing, with a static binding for the sender so that every frame gets
# the full checks) to a receiver on the same bridge. Reports, for the plain
# bridge and through swsec: frames per second at full speed and the loss,
# the loss at a paced 200,000 frames/s, CPU per frame (of the sender and
# swsec, in whose contexts the kernel's forwarding mostly runs; and swsec's
# own, all and in user space), ping's round trip, and a TCP transfer's throughput (iperf3). Not a
# test; needs root, iperf3 and ping (scripts/setup.sh).
#
#   bench/inline-speed.sh [SECONDS]     (default 5 a measurement)
#
# SWSEC_BUILD_DIR=DIR uses a tree already built there instead of building
# build/release. The machine is shared: run it twice and compare.
set -uo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-5}
paced_rate=200000
[ "$(id -u)" -eq 0 ] || { echo "inline-speed: needs root" >&2; exit 2; }
for command in ip iperf3 ping; do
  command -v "$command" >/dev/null || { echo "inline-speed: $command missing (bash scripts/setup.sh)" >&2; exit 2; }
done
build=${SWSEC_BUILD_DIR:-build/release}
if [ -z "${SWSEC_BUILD_DIR:-}" ]; then
  bash scripts/build.sh release swsec swsec_frame_blaster >/dev/null || exit 1
fi
swsec=$(realpath "$build/tools/swsec")
blaster=$(realpath "$build/bench/swsec_frame_blaster")

tag="swb$$"; sw="${tag}sw"; src="${tag}src"; dst="${tag}dst"
work=$(mktemp -d /tmp/swsec-bench.XXXXXX)
pids=()
cleanup() {
  for pid in "${pids[@]}"; do kill -TERM "$pid" 2>/dev/null; done
  for pid in "${pids[@]}"; do
    for _ in $(seq 50); do kill -0 "$pid" 2>/dev/null || break; sleep 0.1; done
    kill -KILL "$pid" 2>/dev/null
  done
  for ns in "$src" "$dst" "$sw"; do ip netns del "$ns" 2>/dev/null; done
  rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 1' INT TERM

ip netns add "$sw"; ip netns add "$src"; ip netns add "$dst"
ip -n "$sw" link add br0 type bridge && ip -n "$sw" link set br0 up
ip -n "$sw" link add srcp type veth peer name eth0 netns "$src"
ip -n "$sw" link add dstp type veth peer name eth0 netns "$dst"
for link in srcp dstp; do ip -n "$sw" link set "$link" master br0; ip -n "$sw" link set "$link" up; done
for ns in "$src" "$dst"; do ip -n "$ns" link set lo up; ip -n "$ns" link set eth0 up; done
ip -n "$src" addr add 10.9.0.1/24 dev eth0
ip -n "$dst" addr add 10.9.0.2/24 dev eth0
src_mac=$(ip netns exec "$src" cat /sys/class/net/eth0/address)
dst_mac=$(ip netns exec "$dst" cat /sys/class/net/eth0/address)
# Neighbours known up front: no ARP in the measurements.
ip -n "$src" neigh replace 10.9.0.2 lladdr "$dst_mac" dev eth0 nud permanent
ip -n "$dst" neigh replace 10.9.0.1 lladdr "$src_mac" dev eth0 nud permanent
cat >"$work/port.json" <<JSON
{"features": ["bpdu-filter", "block-dhcp-server", "ip-discovery", "dai", "ip-source-guard"],
 "trusted": false, "portDbSize": 32, "arpRateLimit": 10, "errRateLimit": 5, "errRateLimitPeriod": 10,
 "static": [{"vlan": 0, "mac": "$src_mac", "ip": "10.9.0.1"}]}
JSON
ip netns exec "$dst" iperf3 -s -D -I "$work/iperf3.pid" >/dev/null 2>&1
for _ in $(seq 20); do [ -s "$work/iperf3.pid" ] && break; sleep 0.1; done
[ -s "$work/iperf3.pid" ] && pids+=("$(cat "$work/iperf3.pid")")

rx() { ip netns exec "$dst" cat /sys/class/net/eth0/statistics/rx_packets; }
proc_cpu() { awk '{print $14+$15}' "/proc/$1/stat"; }         # utime + stime of a process
proc_user() { awk '{print $14}' "/proc/$1/stat"; }               # utime alone: swsec's own work, not the kernel's
hz=$(getconf CLK_TCK)

# blast RATE: prints "sent received seconds sender_cpu_jiffies swsec_jiffies swsec_user_jiffies"
blast() {
  local before_rx before_proc=0 out after_proc=0 before_user=0 after_user=0
  sleep 0.5
  before_rx=$(rx)
  [ -n "${inline_pid:-}" ] && before_proc=$(proc_cpu "$inline_pid") && before_user=$(proc_user "$inline_pid")
  out=$(ip netns exec "$src" "$blaster" eth0 "$src_mac" "$dst_mac" 10.9.0.1 10.9.0.2 "$1" "$seconds")
  sleep 0.3   # frames still in flight
  [ -n "${inline_pid:-}" ] && after_proc=$(proc_cpu "$inline_pid") && after_user=$(proc_user "$inline_pid")
  read -r sent secs _ cpu <<<"$out"
  echo "$sent $(( $(rx) - before_rx )) $secs $(awk -v c="$cpu" -v hz="$hz" 'BEGIN{printf "%.0f", c * hz}') $(( after_proc - before_proc )) $(( after_user - before_user ))"
}

measure() {
  local name=$1
  read -r sent got secs busy_j proc_j user_j <<<"$(blast 0)"
  read -r psent pgot _ _ _ _ <<<"$(blast $paced_rate)"
  local rtt tcp
  rtt=$(ip netns exec "$src" ping -q -c 500 -i 0.002 10.9.0.2 | sed -n 's|.*= [0-9.]*/\([0-9.]*\)/.*|\1|p')
  tcp=$(ip netns exec "$src" iperf3 -c 10.9.0.2 -t "$seconds" -f m 2>/dev/null | awk '/receiver/{print $(NF-2)}')
  awk -v n="$name" -v s="$sent" -v g="$got" -v t="$secs" -v b="$busy_j" -v p="$proc_j" -v u="$user_j" -v hz="$hz" \
      -v ps="$psent" -v pg="$pgot" -v r="$rtt" -v tcp="$tcp" 'BEGIN {
    fps = g / t
    loss = 0; if (s > 0) loss = 100 * (s - g) / s
    ploss = 0; if (ps > 0) ploss = 100 * (ps - pg) / ps
    cpu = 0; if (g > 0) cpu = 1e9 * (b + p) / hz / g
    own = "-"; if (p > 0 && g > 0) own = sprintf("%.0f/%.0f", 1e9 * p / hz / g, 1e9 * u / hz / g)
    printf "%-12s %12.0f %8.2f%% %10.2f%% %12.0f %12s %9.1f us %10.0f\n", n, fps, loss, ploss, cpu, own, r * 1000, tcp
    print fps, loss, ploss, cpu, r, tcp > "/dev/stderr"
  }'
}

echo "inline-speed: $seconds s a measurement; 60-byte frames, lossless check at $paced_rate frames/s"
printf "%-12s %12s %9s %11s %12s %12s %12s %10s\n" "" "frames/s" "loss" "loss@200k" "ns CPU/frame" "swsec/user ns" "ping rtt" "TCP Mb/s"
measure "bridge" 2>"$work/bridge.txt"
ip netns exec "$sw" "$swsec" inline --bridge br0 --port vm=srcp --config "$work/port.json" \
  --ctl "$work/ctl.sock" >"$work/inline.log" 2>&1 &
inline_pid=$!; pids+=("$inline_pid")
for _ in $(seq 50); do "$swsec" ctl --ctl "$work/ctl.sock" ports >/dev/null 2>&1 && break; sleep 0.1; done
"$swsec" ctl --ctl "$work/ctl.sock" ports >/dev/null 2>&1 || { echo "inline-speed: swsec inline did not start" >&2; cat "$work/inline.log"; exit 1; }
measure "swsec inline" 2>"$work/inline.txt"
"$swsec" ctl --ctl "$work/ctl.sock" counters
read -r bfps _ _ bcpu brtt btcp <"$work/bridge.txt"
read -r ifps _ _ icpu irtt itcp <"$work/inline.txt"
awk -v bf="$bfps" -v f="$ifps" -v bc="$bcpu" -v c="$icpu" -v br="$brtt" -v r="$irtt" -v bt="$btcp" -v t="$itcp" 'BEGIN {
  printf "ratios: frames/s %.2f of the bridge, CPU/frame %.2fx, ping +%.1f us, TCP %.2f of the bridge (target: within 2x)\n",
    f / bf, c / bc, (r - br) * 1000, t / bt }'
