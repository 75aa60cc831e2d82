#!/usr/bin/env bash
# Installs the Debian packages that swsec needs to build, test and run.
# Idempotent and quick when everything is already there. Works as root on a
# fresh Debian 12; as another user it needs sudo.
#
#   --capture-tools  also tcpdump and tshark, which regenerate the test
#                    captures (tests/data/); the tests themselves replay
#                    committed captures.
set -euo pipefail

packages=(
  # build
  cmake ninja-build g++ clang libclang-rt-14-dev binutils pkg-config
  # tests and benchmarks
  libgtest-dev libgmock-dev libbenchmark-dev
  # the swsec tool
  libcli11-dev nlohmann-json3-dev libpcap-dev
  # the kernel fast path: libbpf (its BPF program is built by clang)
  libbpf-dev
  # swsec inline and its end-to-end test: a real DHCP server (the binary
  # alone: no system service) and clients,
  # scapy's attacks, ping; iperf3 for the inline benchmark
  iproute2 dnsmasq-base isc-dhcp-client udhcpc python3-scapy iputils-ping iperf3
)
if [ "${1:-}" = "--capture-tools" ]; then
  packages+=(tcpdump tshark)
fi

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed"; then
    missing+=("$p")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  echo "setup: all ${#packages[@]} packages present"
  exit 0
fi

sudo=""
if [ "$(id -u)" -ne 0 ]; then
  if command -v sudo >/dev/null; then sudo="sudo"; else
    echo "setup: need root (or sudo) to install: ${missing[*]}" >&2; exit 1
  fi
fi

echo "setup: installing ${missing[*]}"
export DEBIAN_FRONTEND=noninteractive
$sudo apt-get update -qq
$sudo apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
echo "setup: done"
