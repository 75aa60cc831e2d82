#!/usr/bin/env bash
# Replay speed: builds a capture of N frames (default 1,000,000) from the
# bundled example, one microsecond apart, and times `swsec replay` on it
# beside `tcpdump -r ... -w /dev/null` with an equivalent source filter.
set -euo pipefail
cd "$(dirname "$0")/.."

frames=${1:-1000000}
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

bash scripts/build.sh release swsec >/dev/null
python3 - "$frames" "$work/big.pcap" <<'PY'
import struct, sys
count, out = int(sys.argv[1]), sys.argv[2]
with open('examples/example-dhcp-then-spoof.pcap', 'rb') as f:
    data = f.read()
endian = '<' if data[:4] == b'\xd4\xc3\xb2\xa1' else '>'
frames, pos = [], 24
while pos + 16 <= len(data):
    _, _, incl, orig = struct.unpack(endian + 'IIII', data[pos:pos + 16])
    frames.append(data[pos + 16:pos + 16 + incl])
    pos += 16 + incl
with open(out, 'wb') as f:
    f.write(struct.pack('<IHHiIII', 0xa1b2c3d4, 2, 4, 0, 0, 65535, 1))
    for i in range(count):
        frame = frames[i % len(frames)]
        f.write(struct.pack('<IIII', 1700000000 + i // 1000000, i % 1000000, len(frame), len(frame)))
        f.write(frame)
PY
echo "capture: $frames frames, $(stat -c %s "$work/big.pcap") bytes"

seconds() {
   local TIMEFORMAT=%R
   { time "$@" >/dev/null 2>&1; } 2>&1
}
command -v tcpdump >/dev/null || { echo "replay-speed: tcpdump missing (bash scripts/setup.sh --capture-tools)" >&2; exit 2; }
replay=$(seconds build/release/tools/swsec replay --vm-mac 02:00:5e:c0:00:01 \
            --config examples/enforcing.json "$work/big.pcap")
dump=$(seconds tcpdump -r "$work/big.pcap" -w /dev/null \
            'not (ether src 02:00:5e:c0:00:01 and ip and not src host 192.0.2.101)')
awk -v n="$frames" -v r="$replay" -v d="$dump" 'BEGIN {
   printf "swsec replay: %.2f s, %.2f M frames/s\n", r, n / r / 1e6
   printf "tcpdump:      %.2f s, %.2f M frames/s\n", d, n / d / 1e6
   printf "replay / tcpdump speed: %.2f (target >= 1), replay >= 2 M frames/s: %s\n", d / r, (n / r >= 2e6) ? "met" : "MISSED"
}'
