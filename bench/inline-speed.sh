#!/usr/bin/env bash
# swsec inline's two data paths beside the plain bridge, in network
# namespaces this script makes and removes: 60-byte frames from a VM through
# one guarded port (enforcing, with a static binding for the sender so that
# every frame gets the full checks) to a receiver on the same bridge. Rounds
# interleave the bridge, the kernel data path and the user data path (the
# order turning each round, so that a busy spell of the shared machine falls
# on each alike); each reports frames per second at full speed and the loss,
# the loss at 0.8x the bridge's maximum of that round, CPU per frame (the
# sender's and swsec's, in whose contexts the forwarding runs), ping's round
# trip, a TCP transfer's throughput (iperf3) and the time a DHCP lease takes
# (udhcpc against dnsmasq). The medians of the ratios to the bridge of the
# same round are then held against the targets, each stated met or missed.
# Rounds run ABBA (bridge, kernel, user; then user, kernel, bridge).
# Not a test; needs root, iperf3, ping, dnsmasq and udhcpc (scripts/setup.sh).
#
#   bench/inline-speed.sh [SECONDS [ROUNDS]]     (default 5 a measurement, 3 rounds)
#
# SWSEC_BUILD_DIR=DIR uses a tree already built there instead of building
# build/release. The machine is shared: trust the ratios more than the rates.
set -uo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-5}
rounds=${2:-3}
[ "$(id -u)" -eq 0 ] || { echo "inline-speed: needs root" >&2; exit 2; }
for command in ip iperf3 ping dnsmasq udhcpc; do
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
  [ -s "$work/dnsmasq.pid" ] && kill -TERM "$(cat "$work/dnsmasq.pid")" 2>/dev/null
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
# A DHCP server beside the receiver, answering at once (no address probe).
ip netns exec "$dst" dnsmasq --conf-file=/dev/null --port=0 --interface=eth0 --bind-interfaces --no-ping \
  --dhcp-range=10.9.0.100,10.9.0.150,255.255.255.0,2m --dhcp-leasefile="$work/dnsmasq.leases" \
  --pid-file="$work/dnsmasq.pid" || { echo "inline-speed: dnsmasq did not start" >&2; exit 1; }
ip netns exec "$dst" iperf3 -s -D -I "$work/iperf3.pid" >/dev/null 2>&1
for _ in $(seq 20); do [ -s "$work/iperf3.pid" ] && break; sleep 0.1; done
[ -s "$work/iperf3.pid" ] && pids+=("$(cat "$work/iperf3.pid")")

rx() { ip netns exec "$dst" cat /sys/class/net/eth0/statistics/rx_packets; }
proc_cpu() { awk '{print $14+$15}' "/proc/$1/stat"; }         # utime + stime of a process
hz=$(getconf CLK_TCK)
now_us() { date +%s%6N; }

# blast RATE: prints "sent received seconds cpu_jiffies" (the sender's and swsec's)
blast() {
  local before_rx before_proc=0 out after_proc=0
  sleep 0.5
  before_rx=$(rx)
  [ -n "${inline_pid:-}" ] && before_proc=$(proc_cpu "$inline_pid")
  out=$(ip netns exec "$src" "$blaster" eth0 "$src_mac" "$dst_mac" 10.9.0.1 10.9.0.2 "$1" "$seconds")
  sleep 0.3   # frames still in flight
  [ -n "${inline_pid:-}" ] && after_proc=$(proc_cpu "$inline_pid")
  read -r sent secs _ cpu <<<"$out"
  echo "$sent $(( $(rx) - before_rx )) $secs $(awk -v c="$cpu" -v hz="$hz" 'BEGIN{printf "%.0f", c * hz}') $(( after_proc - before_proc ))"
}

# lease: the median of 5 DHCP exchanges (discover to ACK), in ms
lease() {
  local i start times=()
  for i in 1 2 3 4 5; do
    start=$(now_us)
    ip netns exec "$src" udhcpc -q -n -f -i eth0 -t 3 -T 1 -s /bin/true >/dev/null 2>&1 || { echo 9999; return; }
    times+=("$(( $(now_us) - start ))")
  done
  printf '%s\n' "${times[@]}" | sort -n | sed -n 3p | awk '{printf "%.2f", $1 / 1000}'
}

# measure NAME: one line to the results file: name fps loss paced_loss cpu_ns rtt_us tcp lease_ms
measure() {
  local name=$1 sent got secs busy_j proc_j psent pgot rtt tcp ms
  read -r sent got secs busy_j proc_j <<<"$(blast 0)"
  # The bridge sets the round's paced rate: 0.8x its own maximum.
  [ "$name" = bridge ] && paced=$(awk -v g="$got" -v t="$secs" 'BEGIN {printf "%.0f", 0.8 * g / t}')
  read -r psent pgot _ _ _ <<<"$(blast "$paced")"
  rtt=$(ip netns exec "$src" ping -q -c 500 -i 0.002 10.9.0.2 | sed -n 's|.*= [0-9.]*/\([0-9.]*\)/.*|\1|p')
  tcp=$(ip netns exec "$src" iperf3 -c 10.9.0.2 -t "$seconds" -f m 2>/dev/null | awk '/receiver/{print $(NF-2)}')
  ms=$(lease)
  awk -v n="$name" -v s="$sent" -v g="$got" -v t="$secs" -v b="$busy_j" -v p="$proc_j" -v hz="$hz" \
      -v ps="$psent" -v pg="$pgot" -v r="${rtt:-0}" -v tcp="${tcp:-0}" -v ms="$ms" -v round="$round" 'BEGIN {
    fps = g / t
    # The receiver also counts the odd frame of its own stack: no loss below 0.
    loss = 0; if (s > g) loss = 100 * (s - g) / s
    ploss = 0; if (ps > pg) ploss = 100 * (ps - pg) / ps
    cpu = 0; if (g > 0) cpu = 1e9 * (b + p) / hz / g
    printf "%-6d %-8s %12.0f %8.2f%% %10.2f%% %12.0f %9.1f us %10.0f %9.2f ms\n", round, n, fps, loss, ploss, cpu, r * 1000, tcp, ms
    print round, n, fps, loss, ploss, cpu, r * 1000, tcp, ms >> "'"$work/results"'"
  }'
}

# guard DATAPATH: swsec inline on the sender's port (fail open: stopping puts it back on the bridge)
guard() {
  ip netns exec "$sw" "$swsec" inline --datapath "$1" --fail open --bridge br0 --port vm=srcp \
    --config "$work/port.json" --ctl "$work/ctl.sock" >>"$work/inline.log" 2>&1 &
  inline_pid=$!; pids+=("$inline_pid")
  for _ in $(seq 50); do "$swsec" ctl --ctl "$work/ctl.sock" ports >/dev/null 2>&1 && break; sleep 0.1; done
  "$swsec" ctl --ctl "$work/ctl.sock" ports --json 2>/dev/null | grep -q "\"datapath\": *\"$1\"" \
    || { echo "inline-speed: swsec inline did not start on the $1 data path" >&2; cat "$work/inline.log"; exit 1; }
}
unguard() {
  kill -TERM "$inline_pid"; wait "$inline_pid" 2>/dev/null
  inline_pid=
}

echo "inline-speed: $rounds rounds, $seconds s a measurement; 60-byte frames; lossless check at 0.8x the bridge's frames/s"
printf "%-6s %-8s %12s %9s %11s %12s %12s %10s %12s\n" round path frames/s loss "loss@0.8x" "ns CPU/frame" "ping rtt" "TCP Mb/s" "DHCP lease"
for round in $(seq "$rounds"); do
  # ABBA: bridge, kernel, user, then user, kernel, bridge. The bridge sets
  # the paced rate; a round that measures it last uses the round before's.
  if [ $((round % 2)) -eq 1 ]; then order="bridge kernel user"; else order="user kernel bridge"; fi
  for path in $order; do
    if [ "$path" = bridge ]; then
      measure bridge
      continue
    fi
    guard "$path"
    measure "$path"
    [ "$round" -eq "$rounds" ] && "$swsec" ctl --ctl "$work/ctl.sock" counters >"$work/counters.$path"
    unguard
  done
done
echo "-- counters of the last round"; cat "$work/counters.kernel" "$work/counters.user"
awk '
  function median(list, n,   i, j, t) {
    for (i = 1; i <= n; i++) for (j = i + 1; j <= n; j++) if (list[j] < list[i]) { t = list[i]; list[i] = list[j]; list[j] = t }
    return n % 2 ? list[(n + 1) / 2] : (list[n / 2] + list[n / 2 + 1]) / 2
  }
  { fps[$1, $2] = $3; ploss[$1, $2] = $5; cpu[$1, $2] = $6; rtt[$1, $2] = $7; tcp[$1, $2] = $8; ms[$1, $2] = $9; if ($1 > rounds) rounds = $1 }
  END {
    split("kernel user", paths, " ")
    for (k = 1; k <= 2; k++) {
      p = paths[k]
      for (r = 1; r <= rounds; r++) {
        f[r] = fps[r, p] / fps[r, "bridge"]; l[r] = ploss[r, p]; c[r] = cpu[r, p] / cpu[r, "bridge"]
        d[r] = rtt[r, p] - rtt[r, "bridge"]; t[r] = tcp[r, p] / tcp[r, "bridge"]; m[r] = ms[r, p] - ms[r, "bridge"]
      }
      F[p] = median(f, rounds); L[p] = median(l, rounds); C[p] = median(c, rounds)
      D[p] = median(d, rounds); T[p] = median(t, rounds); M[p] = median(m, rounds)
      printf "%-6s medians against the bridge: frames/s %.2f, loss at 0.8x %.2f%%, CPU/frame %.2fx, ping %+.1f us, TCP %.2f, DHCP lease %+.2f ms\n",
        p, F[p], L[p], C[p], D[p], T[p], M[p]
    }
    verdict("kernel frames/s >= 0.9x the bridge", F["kernel"] >= 0.9, sprintf("%.2f", F["kernel"]))
    verdict("kernel: no loss at 0.8x the bridge", L["kernel"] == 0, sprintf("%.2f%%", L["kernel"]))
    verdict("kernel TCP >= 0.9x the bridge", T["kernel"] >= 0.9, sprintf("%.2f", T["kernel"]))
    verdict("kernel ping at most 2 us more than the bridge", D["kernel"] <= 2, sprintf("%+.1f us", D["kernel"]))
    verdict("kernel DHCP lease within 5 ms of the bridge", M["kernel"] <= 5, sprintf("%+.2f ms", M["kernel"]))
    verdict("user DHCP lease within 5 ms of the bridge", M["user"] <= 5, sprintf("%+.2f ms", M["user"]))
    print "user path against the figures of before (frames/s 0.45-0.71, TCP 0.50-0.72): frames/s " sprintf("%.2f", F["user"]) ", TCP " sprintf("%.2f", T["user"])
  }
  function verdict(what, ok, figure) { printf "target %-48s %-6s (%s)\n", what, ok ? "met" : "MISSED", figure }
' "$work/results"
