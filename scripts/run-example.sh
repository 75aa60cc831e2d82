#!/usr/bin/env bash
# Sets everything up, builds the tools and runs the main job: a real DHCP
# lease followed by spoofing, replayed through an untrusted port with IP
# source guard and ARP inspection. Extra arguments go to `swsec replay`
# (-v for one line per dropped frame, --json for the JSON document).
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/setup.sh
bash scripts/build.sh release swsec >/dev/null
exec build/release/tools/swsec replay --vm-mac 02:00:5e:c0:00:01 --config examples/enforcing.json -v \
   "$@" examples/example-dhcp-then-spoof.pcap
