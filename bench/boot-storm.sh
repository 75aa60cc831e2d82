#!/usr/bin/env bash
# DHCP boot storm: one VM port sees CLIENTS DHCP clients (default 100,000),
# each with its own client identifier, ask for a lease at once; then the
# server acknowledges them all, in the order asked. Every request stays
# pending until its ACK, so the port holds CLIENTS pending requests at the
# peak. Times `swsec replay` of the capture through the enforcing port
# (median of 3 runs, wall clock) and checks that every ACK found its request
# (none dropped). Needs no root; not part of CI.
#
#   bash bench/boot-storm.sh [CLIENTS]
#   SWSEC_BUILD_DIR=/tmp/mine bash bench/boot-storm.sh   # a tree built elsewhere, used as it is
set -euo pipefail
cd "$(dirname "$0")/.."

clients=${1:-100000}
runs=3
[[ "$clients" =~ ^[1-9][0-9]*$ ]] || { echo "boot-storm: CLIENTS must be a positive number" >&2; exit 2; }
if [[ -n "${SWSEC_BUILD_DIR:-}" ]]; then
   build=$SWSEC_BUILD_DIR
else
   build=build/release
   bash scripts/build.sh release swsec >/dev/null
fi
tool=$build/tools/swsec
[[ -x "$tool" ]] || { echo "boot-storm: no $tool (build the swsec target there first)" >&2; exit 2; }

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

python3 - "$clients" "$work/storm.pcap" <<'PY'
import struct, sys
clients, out = int(sys.argv[1]), sys.argv[2]
vm = bytes([0x02, 0x00, 0x5e, 0xc0, 0x00, 0x01])
server = bytes([0x02, 0x00, 0x5e, 0xc0, 0x00, 0x99])
server_ip = bytes([192, 0, 2, 1])

def csum(data):
    total = sum(struct.unpack('>%dH' % (len(data) // 2), data))
    while total >> 16:
        total = (total & 0xffff) + (total >> 16)
    return ~total & 0xffff

def frame(src, dst, ip_src, ip_dst, sport, dport, dhcp):
    udp = struct.pack('>HHHH', sport, dport, 8 + len(dhcp), 0) + dhcp
    ip = struct.pack('>BBHHHBBH4s4s', 0x45, 0, 20 + len(udp), 0, 0, 64, 17, 0, ip_src, ip_dst)
    ip = ip[:10] + struct.pack('>H', csum(ip)) + ip[12:]
    return dst + src + b'\x08\x00' + ip + udp

def dhcp(op, xid, yiaddr, options):
    fixed = struct.pack('>BBBBIHH4s4s4s4s16s64s128s', op, 1, 6, 0, xid, 0, 0, bytes(4), yiaddr,
                        server_ip if op == 2 else bytes(4), bytes(4), vm + bytes(10), bytes(64), bytes(128))
    return fixed + b'\x63\x82\x53\x63' + options + b'\xff'

def client_id(i):
    return b'\x3d\x07\x00' + struct.pack('>I', i) + b'st'   # option 61, type 0, 6 bytes

def address(i):
    return bytes([10, 64 + (i >> 16), (i >> 8) & 0xff, i & 0xff])

with open(out, 'wb') as f:
    f.write(struct.pack('<IHHiIII', 0xa1b2c3d4, 2, 4, 0, 0, 65535, 1))
    def write(n, data):
        f.write(struct.pack('<IIII', 1700000000 + n // 1000000, n % 1000000, len(data), len(data)))
        f.write(data)
    for i in range(clients):
        request = dhcp(1, i + 1, bytes(4), b'\x35\x01\x03' + client_id(i) + b'\x32\x04' + address(i))
        write(i, frame(vm, b'\xff' * 6, bytes(4), b'\xff' * 4, 68, 67, request))
    for i in range(clients):
        ack = dhcp(2, i + 1, address(i), b'\x35\x01\x05\x36\x04' + server_ip + b'\x33\x04\x00\x00\x0e\x10')
        write(clients + i, frame(server, vm, server_ip, address(i), 67, 68, ack))
PY
frames=$((2 * clients))
echo "capture: $clients clients, $frames frames, $(stat -c %s "$work/storm.pcap") bytes"

times=()
for ((run = 1; run <= runs; ++run)); do
   start=$EPOCHREALTIME
   if ! "$tool" replay --vm-mac 02:00:5e:c0:00:01 --config examples/enforcing.json "$work/storm.pcap" \
         >"$work/replay.out" 2>"$work/replay.err"; then
      echo "boot-storm: the replay failed:" >&2
      cat "$work/replay.err" >&2
      exit 2
   fi
   end=$EPOCHREALTIME
   times+=("$(awk -v s="$start" -v e="$end" 'BEGIN { printf "%.3f", e - s }')")
done

# Every request passes, and every ACK matched its pending request.
passed=$(awk '$1 == "to-vm" || $1 == "from-vm" { n += $2 } END { print n + 0 }' "$work/replay.out")
if [[ "$passed" != "$frames" ]]; then
   echo "boot-storm: $passed of $frames frames passed (an ACK found no request?)" >&2
   grep -E '^(to-vm|from-vm)' "$work/replay.out" >&2
   exit 2
fi
median=$(printf '%s\n' "${times[@]}" | sort -n | sed -n 2p)
echo "runs (s): ${times[*]}"
awk -v c="$clients" -v m="$median" 'BEGIN {
   printf "boot storm of %d clients: median %.3f s, target < 1 s: %s\n", c, m, (m < 1) ? "met" : "MISSED"
}'
