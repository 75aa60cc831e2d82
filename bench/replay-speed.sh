#!/usr/bin/env bash
# Replay speed: builds a capture of N frames (default 1,000,000), one
# microsecond apart, and times `swsec replay` on it
# end to end beside `tcpdump -r ... -w /dev/null` with an equivalent source
# filter. Each is timed 3 times and the best run counts, since the machine
# may be busy with other work. Needs no root; not part of CI (a timing on a
# shared machine is no pass or fail).
#
#   bash bench/replay-speed.sh [FRAMES] [example|data]
#
# The traffic: "example" (the default) repeats the bundled example, DHCP
# exchanges and spoofs, directions alternating every frame or two: the
# module's dearest frames in the shortest lists. "data" plays the example
# once, so that the VM has its binding, then mostly UDP from the VM's bound
# address in runs of 31, runs of 8 towards the VM and a spoofed source
# every 40 frames: what a busy port carries. (No ARP: the enforcing port
# allows 10 ARP frames a second, and these frames are a microsecond apart.)
#   SWSEC_BUILD_DIR=/tmp/mine bash bench/replay-speed.sh   # a tree built elsewhere, used as it is
set -euo pipefail
cd "$(dirname "$0")/.."

frames=${1:-1000000}
traffic=${2:-example}
runs=3
vm_mac=02:00:5e:c0:00:01
# The frames tcpdump keeps: all but IPv4 from the VM's MAC with another source address.
filter="not (ether src $vm_mac and ip and not src host 192.0.2.101)"

[[ "$frames" =~ ^[1-9][0-9]*$ ]] || { echo "replay-speed: FRAMES must be a positive number" >&2; exit 2; }
[[ "$traffic" == example || "$traffic" == data ]] || { echo "replay-speed: traffic is example or data" >&2; exit 2; }
command -v tcpdump >/dev/null || { echo "replay-speed: tcpdump missing (bash scripts/setup.sh --capture-tools)" >&2; exit 2; }
if [[ -n "${SWSEC_BUILD_DIR:-}" ]]; then
   build=$SWSEC_BUILD_DIR
else
   build=build/release
   bash scripts/build.sh release swsec >/dev/null
fi
tool=$build/tools/swsec
[[ -x "$tool" ]] || { echo "replay-speed: no $tool (build the swsec target there first)" >&2; exit 2; }

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

python3 - "$frames" "$work/big.pcap" "$traffic" <<'PY'
import struct, sys
count, out, traffic = int(sys.argv[1]), sys.argv[2], sys.argv[3]
with open('examples/example-dhcp-then-spoof.pcap', 'rb') as f:
    data = f.read()
endian = '<' if data[:4] == b'\xd4\xc3\xb2\xa1' else '>'
frames, pos = [], 24
while pos + 16 <= len(data):
    _, _, incl, orig = struct.unpack(endian + 'IIII', data[pos:pos + 16])
    frames.append(data[pos + 16:pos + 16 + incl])
    pos += 16 + incl
def udp(src_mac, dst_mac, src_ip, dst_ip):
    payload = bytes(64)
    udp_header = struct.pack('>HHHH', 5000, 5001, 8 + len(payload), 0)
    ip_header = struct.pack('>BBHHHBBH4s4s', 0x45, 0, 20 + len(udp_header) + len(payload), 0, 0, 64, 17, 0,
                            bytes(src_ip), bytes(dst_ip))
    return bytes(dst_mac) + bytes(src_mac) + b'\x08\x00' + ip_header + udp_header + payload

vm, peer = [0x02, 0x00, 0x5e, 0xc0, 0x00, 0x01], [0x02, 0x00, 0x5e, 0xc0, 0x00, 0x99]
vm_ip, peer_ip, spoof_ip = [192, 0, 2, 101], [192, 0, 2, 1], [192, 0, 2, 200]
cycle = ([udp(vm, peer, vm_ip, peer_ip)] * 31 + [udp(peer, vm, peer_ip, vm_ip)] * 8 +
         [udp(vm, peer, spoof_ip, peer_ip)])

def frame_at(i):
    if traffic == 'example' or i < len(frames):
        return frames[i % len(frames)]
    return cycle[(i - len(frames)) % len(cycle)]

with open(out, 'wb') as f:
    f.write(struct.pack('<IHHiIII', 0xa1b2c3d4, 2, 4, 0, 0, 65535, 1))
    for i in range(count):
        frame = frame_at(i)
        f.write(struct.pack('<IIII', 1700000000 + i // 1000000, i % 1000000, len(frame), len(frame)))
        f.write(frame)
PY
echo "capture: $frames frames ($traffic traffic), $(stat -c %s "$work/big.pcap") bytes"

# best_seconds NAME COMMAND...: runs COMMAND $runs times (output to
# $work/NAME.out and .err) and prints the fastest wall-clock time in seconds.
best_seconds() {
   local name=$1 best="" start end elapsed
   shift
   for ((run = 1; run <= runs; ++run)); do
      start=$EPOCHREALTIME
      if ! "$@" >"$work/$name.out" 2>"$work/$name.err"; then
         echo "replay-speed: $name failed:" >&2
         cat "$work/$name.err" >&2
         exit 2
      fi
      end=$EPOCHREALTIME
      elapsed=$(awk -v s="$start" -v e="$end" 'BEGIN { printf "%.6f", e - s }')
      if [[ -z "$best" ]] || awk -v a="$elapsed" -v b="$best" 'BEGIN { exit !(a < b) }'; then
         best=$elapsed
      fi
   done
   echo "$best"
}

replay=$(best_seconds replay "$tool" replay --vm-mac "$vm_mac" --config examples/enforcing.json "$work/big.pcap")
dump=$(best_seconds tcpdump tcpdump -r "$work/big.pcap" -w /dev/null "$filter")

# The replay must have judged every frame: its totals add up to the capture.
judged=$(awk '$1 == "to-vm" || $1 == "from-vm" { n += $2 + $3 } END { print n + 0 }' "$work/replay.out")
if [[ "$judged" != "$frames" ]]; then
   echo "replay-speed: the replay judged $judged frames of $frames" >&2
   exit 2
fi

awk -v n="$frames" -v r="$replay" -v d="$dump" -v runs="$runs" 'BEGIN {
   printf "best of %d runs each (wall clock)\n", runs
   printf "%-14s %10s %10s %12s\n", "", "frames", "seconds", "M frames/s"
   printf "%-14s %10d %10.3f %12.2f\n", "swsec replay", n, r, n / r / 1e6
   printf "%-14s %10d %10.3f %12.2f\n", "tcpdump", n, d, n / d / 1e6
   printf "replay speed:           %.2f M frames/s, target >= 2.00: %s\n", n / r / 1e6, (n / r >= 2e6) ? "met" : "MISSED"
   printf "replay / tcpdump speed: %.2f, target >= 1.00: %s\n", d / r, (d / r >= 1) ? "met" : "MISSED"
}'
