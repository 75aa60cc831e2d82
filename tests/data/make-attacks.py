#!/usr/bin/python3
"""Writes the crafted attack captures of this folder with scapy.

    /usr/bin/python3 tests/data/make-attacks.py [OUTDIR]

Deterministic: every address, transaction ID, IP ID and timestamp is fixed
below, so a rerun writes byte-identical files. The "example" capture also
reads dhclient-lease-renew-release.pcap (made by make-captures.sh) from this
folder.

Addresses (all in the documentation range 192.0.2.0/24):
  VM            02:00:5e:c0:00:10  192.0.2.110 (leased in the crafted exchanges)
  DHCP server   02:00:5e:c0:00:fe  192.0.2.1
  other host    02:00:5e:c0:00:20  192.0.2.20
  switch (BPDU) 02:00:5e:c0:00:fd
  foreign MAC   02:00:5e:c0:00:99  (a MAC the VM does not own)
"""
import os
import random
import struct
import sys

from scapy.all import (ARP, DHCP6_Advertise, DHCP6_Reply, DHCP6OptClientId,
                       DHCP6OptServerId, DUID_LL, ICMP, IP, IPv6, LLC, SNAP,
                       STP, TCP, UDP, Dot1AD, Dot1Q, Dot3, Ether, Raw, rdpcap,
                       wrpcap)

random.seed(20240101)  # nothing below draws from it; fixed in case it ever does

HERE = os.path.dirname(os.path.abspath(__file__))
OUT = os.path.abspath(sys.argv[1]) if len(sys.argv) > 1 else HERE
T0 = 1700000000.0  # 2023-11-14 22:13:20 UTC, start of every crafted capture

VM_MAC, VM_IP = "02:00:5e:c0:00:10", "192.0.2.110"
SRV_MAC, SRV_IP = "02:00:5e:c0:00:fe", "192.0.2.1"
HOST_MAC, HOST_IP = "02:00:5e:c0:00:20", "192.0.2.20"
SW_MAC = "02:00:5e:c0:00:fd"
FOREIGN_MAC = "02:00:5e:c0:00:99"
BCAST = "ff:ff:ff:ff:ff:ff"
LEASE = 120

DISCOVER, OFFER, REQUEST, DECLINE, ACK, NAK, RELEASE = 1, 2, 3, 4, 5, 6, 7
COOKIE = bytes([99, 130, 83, 99])


def mac_bytes(mac):
    return bytes(int(b, 16) for b in mac.split(":"))


def ip_bytes(ip):
    return bytes(int(b) for b in ip.split("."))


def dhcp(msgtype, xid, chaddr, *, op=None, ciaddr="0.0.0.0", yiaddr="0.0.0.0",
         siaddr="0.0.0.0", lease=None, server_id=None, requested=None,
         htype=1, hlen=6, cookie=COOKIE, end=True, cid=None):
    """A DHCP message (fixed header and options) as raw bytes."""
    if op is None:
        op = 2 if msgtype in (OFFER, ACK, NAK) else 1
    hdr = struct.pack("!BBBBIHH", op, htype, hlen, 0, xid, 0, 0)
    hdr += ip_bytes(ciaddr) + ip_bytes(yiaddr) + ip_bytes(siaddr) + ip_bytes("0.0.0.0")
    hdr += mac_bytes(chaddr).ljust(16, b"\0") + bytes(64) + bytes(128) + cookie
    opts = bytes([53, 1, msgtype])
    if server_id:
        opts += bytes([54, 4]) + ip_bytes(server_id)
    if requested:
        opts += bytes([50, 4]) + ip_bytes(requested)
    if cid:
        opts += bytes([61, len(cid)]) + cid
    if lease is not None:
        opts += bytes([51, 4]) + struct.pack("!I", lease)
        opts += bytes([1, 4]) + ip_bytes("255.255.255.0")
    if end:
        opts += bytes([255])
    return hdr + opts


class Capture:
    """Frames with fixed timestamps: T0 + offset."""

    def __init__(self, name):
        self.name, self.frames = name, []

    def add(self, offset, frame):
        frame.time = T0 + offset
        self.frames.append(frame)

    def write(self):
        path = os.path.join(OUT, self.name + ".pcap")
        wrpcap(path, self.frames, linktype=1)
        print(f"make-attacks: {self.name}: {len(self.frames)} frames")


ip_id = 0x1000


def next_id():
    global ip_id
    ip_id += 1
    return ip_id


def from_vm_udp(src, dst, sport, dport, payload, mac=VM_MAC, dmac=BCAST, vlan=None):
    l2 = Ether(src=mac, dst=dmac)
    if vlan is not None:
        l2 = l2 / Dot1Q(vlan=vlan)
    return l2 / IP(src=src, dst=dst, id=next_id(), ttl=64) / UDP(sport=sport, dport=dport) / Raw(payload)


def to_vm_udp(dst_ip, payload, dmac=VM_MAC, vlan=None):
    l2 = Ether(src=SRV_MAC, dst=dmac)
    if vlan is not None:
        l2 = l2 / Dot1Q(vlan=vlan)
    return l2 / IP(src=SRV_IP, dst=dst_ip, id=next_id(), ttl=64) / UDP(sport=67, dport=68) / Raw(payload)


def bind_vm(cap, t, xid, vlan=None, cid=None):
    """REQUEST from the VM and the server's ACK: the VM holds VM_IP for LEASE s."""
    cap.add(t, from_vm_udp("0.0.0.0", "255.255.255.255", 68, 67,
                           dhcp(REQUEST, xid, VM_MAC, requested=VM_IP, server_id=SRV_IP, cid=cid), vlan=vlan))
    cap.add(t + 0.001, to_vm_udp(VM_IP, dhcp(ACK, xid, VM_MAC, yiaddr=VM_IP, lease=LEASE,
                                             server_id=SRV_IP), vlan=vlan))


def arp(op, hwsrc, psrc, hwdst, pdst, *, src=None, dst=BCAST):
    return Ether(src=src or hwsrc, dst=dst) / ARP(op=op, hwsrc=hwsrc, psrc=psrc, hwdst=hwdst, pdst=pdst)


def ip_spoof():
    c = Capture("attack-ip-spoof")
    bind_vm(c, 0.0, 0x5e000001)
    c.add(1.0, from_vm_udp(VM_IP, HOST_IP, 40000, 5353, b"legit", dmac=HOST_MAC))
    c.add(1.1, from_vm_udp("192.0.2.66", HOST_IP, 40000, 5353, b"spoofed-unused", dmac=HOST_MAC))
    c.add(1.2, Ether(src=VM_MAC, dst=HOST_MAC) / IP(src=HOST_IP, dst=SRV_IP, id=next_id()) / ICMP(id=7, seq=1))
    c.add(1.3, Ether(src=VM_MAC, dst=SRV_MAC) / IP(src="198.51.100.7", dst=SRV_IP, id=next_id()) / TCP(sport=40001, dport=80, flags="S", seq=1000))
    c.add(1.4, from_vm_udp("0.0.0.0", HOST_IP, 68, 53, b"zero-source", dmac=HOST_MAC))
    c.add(1.5, from_vm_udp(VM_IP, HOST_IP, 40000, 5353, b"foreign-mac", mac=FOREIGN_MAC, dmac=HOST_MAC))
    c.add(1.6, Ether(src=HOST_MAC, dst=VM_MAC) / IP(src="192.0.2.66", dst=VM_IP, id=next_id()) / ICMP(id=8, seq=1))
    c.add(1.7, Ether(src=VM_MAC, dst=HOST_MAC) / IP(src=VM_IP, dst=HOST_IP, id=next_id()) / ICMP(id=9, seq=1))
    c.write()


def arp_spoof():
    c = Capture("attack-arp-spoof")
    bind_vm(c, 0.0, 0x5e000002)
    c.add(1.0, arp(1, VM_MAC, VM_IP, "00:00:00:00:00:00", SRV_IP))                   # legit request
    c.add(1.1, arp(1, VM_MAC, HOST_IP, "00:00:00:00:00:00", HOST_IP))                # gratuitous request for another host's IP
    c.add(1.2, arp(2, VM_MAC, HOST_IP, BCAST, HOST_IP))                              # gratuitous reply for it
    c.add(1.3, arp(2, VM_MAC, SRV_IP, HOST_MAC, HOST_IP, dst=HOST_MAC))              # reply claiming the server's IP
    c.add(1.4, arp(2, FOREIGN_MAC, VM_IP, HOST_MAC, HOST_IP, src=VM_MAC, dst=HOST_MAC))  # sender MAC not the VM's
    c.add(1.5, arp(1, VM_MAC, "0.0.0.0", "00:00:00:00:00:00", HOST_IP))              # probe
    c.add(1.6, arp(2, HOST_MAC, SRV_IP, VM_MAC, VM_IP, dst=VM_MAC))                  # spoofed reply towards the VM
    c.write()


def arp_flood():
    c = Capture("attack-arp-flood")
    bind_vm(c, 0.0, 0x5e000003)
    for k in range(50):  # 50 requests from the VM in 0.98 s
        c.add(2.0 + 0.02 * k, arp(1, VM_MAC, VM_IP, "00:00:00:00:00:00", f"192.0.2.{k + 1}"))
    for k in range(8):   # then other frames of the VM, still within the error state
        c.add(3.5 + 0.05 * k, Ether(src=VM_MAC, dst=SRV_MAC) / IP(src=VM_IP, dst=SRV_IP, id=next_id()) / ICMP(id=10, seq=k))
    for k in range(15):  # 15 requests to the VM in 0.7 s
        c.add(5.0 + 0.05 * k, arp(1, SRV_MAC, SRV_IP, "00:00:00:00:00:00", VM_IP))
    c.add(5.8, Ether(src=SRV_MAC, dst=VM_MAC) / IP(src=SRV_IP, dst=VM_IP, id=next_id()) / ICMP(type=0, id=10, seq=0))
    c.write()


def rogue_dhcp_server():
    c = Capture("attack-rogue-dhcp-server")
    c.add(0.0, from_vm_udp(VM_IP, "255.255.255.255", 67, 68,
                           dhcp(OFFER, 0x0badc0de, HOST_MAC, yiaddr="192.0.2.200", server_id=VM_IP, lease=LEASE)))
    c.add(0.1, from_vm_udp(VM_IP, "255.255.255.255", 67, 68,
                           dhcp(ACK, 0x0badc0de, HOST_MAC, yiaddr="192.0.2.200", server_id=VM_IP, lease=LEASE)))
    vm_ll, host_ll = "fe80::5eff:fec0:10", "fe80::5eff:fec0:20"
    duid_srv = DUID_LL(lladdr=VM_MAC)
    duid_cli = DUID_LL(lladdr=HOST_MAC)
    c.add(0.2, Ether(src=VM_MAC, dst="33:33:00:00:00:01") / IPv6(src=vm_ll, dst="ff02::1") /
          UDP(sport=547, dport=546) / DHCP6_Advertise(trid=0x123456) /
          DHCP6OptClientId(duid=duid_cli) / DHCP6OptServerId(duid=duid_srv))
    c.add(0.3, Ether(src=VM_MAC, dst=HOST_MAC) / IPv6(src=vm_ll, dst=host_ll) /
          UDP(sport=547, dport=546) / DHCP6_Reply(trid=0x123456) /
          DHCP6OptClientId(duid=duid_cli) / DHCP6OptServerId(duid=duid_srv))
    c.add(0.4, to_vm_udp("255.255.255.255", dhcp(OFFER, 0x5e000004, VM_MAC, yiaddr=VM_IP,
                                                 server_id=SRV_IP, lease=LEASE), dmac=BCAST))
    c.write()


def bpdu():
    c = Capture("attack-bpdu")
    stp = STP(rootid=32768, rootmac=VM_MAC, bridgeid=32768, bridgemac=VM_MAC, portid=0x8001)
    c.add(0.0, Dot3(src=VM_MAC, dst="01:80:c2:00:00:00") / LLC(dsap=0x42, ssap=0x42, ctrl=3) / stp)
    c.add(0.1, Dot3(src=VM_MAC, dst="01:00:0c:cc:cc:cd") / LLC(dsap=0xaa, ssap=0xaa, ctrl=3) /
          SNAP(OUI=0x00000c, code=0x010b) / stp)
    stp_sw = STP(rootid=32768, rootmac=SW_MAC, bridgeid=32768, bridgemac=SW_MAC, portid=0x8002)
    c.add(0.2, Dot3(src=SW_MAC, dst="01:80:c2:00:00:00") / LLC(dsap=0x42, ssap=0x42, ctrl=3) / stp_sw)
    c.add(0.3, Dot3(src=SW_MAC, dst="01:00:0c:cc:cc:cd") / LLC(dsap=0xaa, ssap=0xaa, ctrl=3) /
          SNAP(OUI=0x00000c, code=0x010b) / stp_sw)
    c.add(0.4, arp(1, VM_MAC, "0.0.0.0", "00:00:00:00:00:00", VM_IP))  # an ordinary frame that passes
    c.write()


def unsolicited_ack():
    c = Capture("attack-unsolicited-ack")
    c.add(0.0, to_vm_udp(VM_IP, dhcp(ACK, 0x5e0000aa, VM_MAC, yiaddr=VM_IP, lease=LEASE, server_id=SRV_IP)))
    c.add(1.0, from_vm_udp("0.0.0.0", "255.255.255.255", 68, 67,
                           dhcp(REQUEST, 0x5e000005, VM_MAC, requested=VM_IP, server_id=SRV_IP)))
    c.add(1.001, to_vm_udp(VM_IP, dhcp(ACK, 0x5e0000bb, VM_MAC, yiaddr=VM_IP, lease=LEASE, server_id=SRV_IP)))
    c.add(1.002, to_vm_udp(VM_IP, dhcp(ACK, 0x5e000005, HOST_MAC, yiaddr=VM_IP, lease=LEASE, server_id=SRV_IP)))
    c.add(1.003, to_vm_udp(VM_IP, dhcp(ACK, 0x5e000005, VM_MAC, yiaddr=VM_IP, lease=LEASE, server_id=SRV_IP)))
    c.write()


def chaddr_mismatch():
    c = Capture("attack-chaddr-mismatch")
    c.add(0.0, from_vm_udp("0.0.0.0", "255.255.255.255", 68, 67,
                           dhcp(REQUEST, 0x5e000006, FOREIGN_MAC, requested="192.0.2.199", server_id=SRV_IP)))
    c.add(0.001, to_vm_udp("192.0.2.199", dhcp(ACK, 0x5e000006, FOREIGN_MAC, yiaddr="192.0.2.199",
                                               lease=LEASE, server_id=SRV_IP), dmac=FOREIGN_MAC))
    c.add(1.0, from_vm_udp("0.0.0.0", "255.255.255.255", 68, 67,
                           dhcp(DISCOVER, 0x5e000007, FOREIGN_MAC)))
    c.write()


def malformed_dhcp():
    c = Capture("attack-malformed-dhcp")
    good = dict(requested=VM_IP, server_id=SRV_IP)
    ack = dict(yiaddr=VM_IP, lease=LEASE, server_id=SRV_IP)
    bad_requests = [
        dhcp(REQUEST, 0x5e000011, VM_MAC, cookie=b"\x63\x82\x53\x64", **good),
        dhcp(REQUEST, 0x5e000012, VM_MAC, htype=6, **good),
        dhcp(REQUEST, 0x5e000013, VM_MAC, **good)[:239],           # UDP length 247
        dhcp(REQUEST, 0x5e000014, VM_MAC, end=False, **good),     # no end option
    ]
    t = 0.0
    for k, payload in enumerate(bad_requests):
        xid = 0x5e000011 + k
        c.add(t, from_vm_udp("0.0.0.0", "255.255.255.255", 68, 67, payload))
        c.add(t + 0.001, to_vm_udp(VM_IP, dhcp(ACK, xid, VM_MAC, **ack)))
        t += 1.0
    c.add(t, from_vm_udp("0.0.0.0", "255.255.255.255", 68, 67, dhcp(REQUEST, 0x5e000015, VM_MAC, **good)))
    c.add(t + 0.001, to_vm_udp(VM_IP, dhcp(ACK, 0x5e000015, VM_MAC, yiaddr=VM_IP, server_id=SRV_IP)))  # no lease time
    c.add(t + 0.002, to_vm_udp(VM_IP, dhcp(ACK, 0x5e000015, VM_MAC, **ack)))
    c.write()


def ip_fragments():
    c = Capture("attack-ip-fragments")
    req = (UDP(sport=68, dport=67) /
           Raw(dhcp(REQUEST, 0x5e000021, VM_MAC, requested=VM_IP, server_id=SRV_IP)))
    req = UDP(bytes(req))  # fixes length and leaves the checksum to IP below
    whole = bytes(IP(src="0.0.0.0", dst="255.255.255.255", id=0x2001) / req)[20:]
    first, rest = whole[:128], whole[128:]
    c.add(0.0, Ether(src=VM_MAC, dst=BCAST) / IP(src="0.0.0.0", dst="255.255.255.255", id=0x2001,
                                                 flags="MF", frag=0, proto=17) / Raw(first))
    c.add(0.001, Ether(src=VM_MAC, dst=BCAST) / IP(src="0.0.0.0", dst="255.255.255.255", id=0x2001,
                                                   frag=128 // 8, proto=17) / Raw(rest))
    c.add(0.01, to_vm_udp(VM_IP, dhcp(ACK, 0x5e000021, VM_MAC, yiaddr=VM_IP, lease=LEASE, server_id=SRV_IP)))
    ack = bytes(IP(src=SRV_IP, dst=VM_IP, id=0x2002) / UDP(sport=67, dport=68) /
                Raw(dhcp(ACK, 0x5e000022, VM_MAC, yiaddr=VM_IP, lease=LEASE, server_id=SRV_IP)))[20:]
    c.add(1.0, Ether(src=SRV_MAC, dst=VM_MAC) / IP(src=SRV_IP, dst=VM_IP, id=0x2002, flags="MF",
                                                   frag=0, proto=17) / Raw(ack[:128]))
    c.add(1.001, Ether(src=SRV_MAC, dst=VM_MAC) / IP(src=SRV_IP, dst=VM_IP, id=0x2002,
                                                     frag=128 // 8, proto=17) / Raw(ack[128:]))
    c.write()


def vlan100():
    c = Capture("attack-vlan100")
    xid = 0x5e000031
    c.add(0.0, from_vm_udp("0.0.0.0", "255.255.255.255", 68, 67, dhcp(DISCOVER, xid, VM_MAC), vlan=100))
    c.add(0.001, to_vm_udp(VM_IP, dhcp(OFFER, xid, VM_MAC, yiaddr=VM_IP, lease=LEASE, server_id=SRV_IP), vlan=100))
    bind_vm(c, 0.01, xid, vlan=100)
    c.add(1.0, Ether(src=VM_MAC, dst=SRV_MAC) / Dot1Q(vlan=100) / IP(src=VM_IP, dst=SRV_IP, id=next_id()) / ICMP(id=11, seq=1))
    c.add(1.1, Ether(src=VM_MAC, dst=SRV_MAC) / Dot1Q(vlan=100) / IP(src="192.0.2.66", dst=SRV_IP, id=next_id()) / ICMP(id=11, seq=2))
    c.add(1.2, Ether(src=VM_MAC, dst=SRV_MAC) / IP(src=VM_IP, dst=SRV_IP, id=next_id()) / ICMP(id=11, seq=3))
    c.add(1.3, Ether(src=VM_MAC, dst=BCAST) / Dot1Q(vlan=100) / ARP(op=1, hwsrc=VM_MAC, psrc=VM_IP, pdst=SRV_IP))
    c.add(1.4, arp(1, VM_MAC, VM_IP, "00:00:00:00:00:00", SRV_IP))
    c.write()


def stacked_tags():
    """Spoofs wrapped in tags beyond the port's own VLAN, a runt cut inside its ARP header."""
    c = Capture("attack-stacked-tags")
    bind_vm(c, 0.0, 0x5e00000b)
    claim = ARP(op=2, hwsrc=VM_MAC, psrc=SRV_IP, hwdst=HOST_MAC, pdst=HOST_IP)
    c.add(1.0, Ether(src=VM_MAC, dst=HOST_MAC) / Dot1Q(vlan=0) / Dot1Q(vlan=0) / claim)
    c.add(1.1, Ether(src=VM_MAC, dst=HOST_MAC, type=0x88a8) / Dot1AD(vlan=0) / Dot1Q(vlan=0) / claim)
    c.add(1.2, Ether(src=VM_MAC, dst=HOST_MAC, type=0x88a8) / Dot1AD(vlan=0) / Dot1Q(vlan=0) / Dot1Q(vlan=0) / claim)
    c.add(1.3, Ether(src=VM_MAC, dst=SRV_MAC, type=0x88a8) / Dot1AD(vlan=0) /
          IP(src="192.0.2.66", dst=SRV_IP, id=next_id()) / ICMP(id=13, seq=1))
    c.add(1.4, Ether(src=VM_MAC, dst=SRV_MAC, type=0x88a8) / Dot1AD(vlan=0) /
          IP(src=VM_IP, dst=SRV_IP, id=next_id()) / ICMP(id=13, seq=2))
    c.add(1.5, Ether(bytes(Ether(src=VM_MAC, dst=HOST_MAC) / claim)[:41]))
    c.add(1.6, Ether(src=SRV_MAC, dst=VM_MAC) / Dot1Q(vlan=0) / Dot1Q(vlan=0) /
          ARP(op=2, hwsrc=SRV_MAC, psrc=SRV_IP, hwdst=VM_MAC, pdst=VM_IP))
    c.write()


def arp_raw(head, op=1, sha=HOST_MAC, spa=HOST_IP, tpa=SRV_IP):
    """An ARP frame from the VM whose fixed part (hardware and protocol types and lengths) is `head`."""
    body = head + struct.pack("!H", op) + mac_bytes(sha) + ip_bytes(spa) + bytes(6) + ip_bytes(tpa)
    return Ether(src=VM_MAC, dst=BCAST, type=0x0806) / Raw(body)


def policy_edges():
    """Frames each rule must leave alone, beside the ones it drops."""
    c = Capture("attack-policy-edges")
    bind_vm(c, 0.0, 0x5e000041)
    vm_ll, host_ll = "fe80::5eff:fec0:10", "fe80::5eff:fec0:20"
    c.add(1.0, Ether(src=HOST_MAC, dst=VM_MAC) / IPv6(src=host_ll, dst=vm_ll) / UDP(sport=547, dport=546) /
          DHCP6_Reply(trid=0x123457))                                                  # a v6 server message to the VM
    c.add(1.1, from_vm_udp(VM_IP, HOST_IP, 547, 546, b"v6-port-over-v4", dmac=HOST_MAC))
    c.add(1.2, Ether(src=VM_MAC, dst=HOST_MAC) / IPv6(src=vm_ll, dst=host_ll) / UDP(sport=67, dport=68) /
          Raw(b"v4-port-over-v6"))
    c.add(1.3, from_vm_udp(VM_IP, HOST_IP, 68, 5353, b"client-port", dmac=HOST_MAC))
    for k, head in enumerate((bytes([0, 6, 8, 0, 6, 4]), bytes([0, 1, 0x86, 0xdd, 6, 4]),
                              bytes([0, 1, 8, 0, 8, 4]), bytes([0, 1, 8, 0, 6, 16]))):
        c.add(2.0 + 0.1 * k, arp_raw(head))                                            # not Ethernet/IPv4: not inspected
    for k in range(11):  # 11 ARP requests to the VM within 0.2 s, then IPv4 to it, which is not counted
        c.add(3.0 + 0.02 * k, arp(1, SRV_MAC, SRV_IP, "00:00:00:00:00:00", VM_IP))
    for k in range(3):
        c.add(3.3 + 0.01 * k, Ether(src=SRV_MAC, dst=VM_MAC) / IP(src=SRV_IP, dst=VM_IP, id=next_id()) / ICMP(id=20, seq=k))
    for k in range(11):  # the next interval, opened 1.25 s after the first: 10 pass, the 11th does not
        c.add(4.25 + 0.09 * k, arp(1, SRV_MAC, SRV_IP, "00:00:00:00:00:00", VM_IP))
    c.add(5.3, arp(1, SRV_MAC, SRV_IP, "00:00:00:00:00:00", VM_IP))                   # a third interval
    c.add(6.0, arp(2, VM_MAC, "192.0.2.112", BCAST, "192.0.2.112"))                    # gratuitous reply: learned
    c.add(6.1, arp(3, VM_MAC, "192.0.2.113", BCAST, "192.0.2.113"))                    # another operation: not
    c.write()


def client_edges():
    """DHCP client messages that end bindings and pending requests, and the ones that must not."""
    c = Capture("attack-dhcp-client-edges")
    renew = lambda xid, **kw: from_vm_udp(VM_IP, SRV_IP, 68, 67, dhcp(REQUEST, xid, VM_MAC, ciaddr=VM_IP, **kw),
                                          dmac=SRV_MAC)
    ack = lambda xid, vlan=None: to_vm_udp(VM_IP, dhcp(ACK, xid, VM_MAC, yiaddr=VM_IP, lease=LEASE, server_id=SRV_IP),
                                           vlan=vlan)
    nak = lambda xid: to_vm_udp("255.255.255.255", dhcp(NAK, xid, VM_MAC, server_id=SRV_IP), dmac=BCAST)
    client = lambda t, xid, vlan=None, **kw: from_vm_udp("0.0.0.0", "255.255.255.255", 68, 67,
                                                         dhcp(t, xid, VM_MAC, **kw), vlan=vlan)
    bind_vm(c, 0.0, 0x5e000051)
    c.add(1.0, nak(0x5e0000ff))                                # answers no request: passes, changes nothing
    c.add(2.0, client(REQUEST, 0x5e000052, vlan=5))            # selecting on VLAN 5 ends nothing on VLAN 0
    c.add(2.1, ack(0x5e000052))                                # VLAN 0 has no such request: dropped
    c.add(2.2, nak(0x5e000052))
    c.add(2.3, client(DISCOVER, 0x5e000053, vlan=5))           # ends VLAN 5's request ...
    c.add(2.4, ack(0x5e000052, vlan=5))                        # ... so its ACK is dropped
    for t, xid, end in ((3.0, 0x5e000054, client(DECLINE, 0x5e000054, ciaddr=VM_IP)),
                        (5.0, 0x5e000056, nak(0x5e000056)),
                        (7.0, 0x5e000058, client(DISCOVER, 0x5e000058))):
        c.add(t, renew(xid))                                   # a pending renewal, then a message that ends
        c.add(t + 0.1, end)                                    # the binding and the request
        c.add(t + 0.2, ack(xid))
        bind_vm(c, t + 1.0, xid + 1)
    cid = bytes([1, 0xaa, 0xbb])
    c.add(9.0, client(RELEASE, 0x5e000060, ciaddr=VM_IP))      # ends the binding made without an identifier
    bind_vm(c, 10.0, 0x5e000061, cid=cid)
    c.add(11.0, renew(0x5e000062))                             # without the identifier: another client
    c.add(11.1, client(RELEASE, 0x5e000063, ciaddr=VM_IP))     # ends that one's request, not the binding
    c.add(11.2, ack(0x5e000062))
    c.add(12.0, client(RELEASE, 0x5e000064, ciaddr=VM_IP, cid=cid))
    bind_vm(c, 13.0, 0x5e000065)
    c.add(14.0, client(REQUEST, 0x5e000066, ciaddr=VM_IP))    # rebinding, broadcast: keeps the binding
    c.add(15.0, client(REQUEST, 0x5e000067))                   # selecting, broadcast without ciaddr: ends it
    c.write()


def example():
    """The real dhclient session (without its release) and then spoofing from the same VM."""
    real = rdpcap(os.path.join(HERE, "dhclient-lease-renew-release.pcap"))
    vm_mac, vm_ip = "02:00:5e:c0:00:01", "192.0.2.101"
    frames = [f for f in real if not (f.haslayer(UDP) and bytes(f[UDP].payload)[242:243] == b"\x07")]
    c = Capture("example-dhcp-then-spoof")
    c.frames = frames
    t = float(frames[-1].time) + 1.0
    spoofs = [
        Ether(src=vm_mac, dst=SRV_MAC) / IP(src=vm_ip, dst=SRV_IP, id=0x3001) / ICMP(id=12, seq=1),
        Ether(src=vm_mac, dst=SRV_MAC) / IP(src="192.0.2.66", dst=SRV_IP, id=0x3002) / ICMP(id=12, seq=2),
        Ether(src=vm_mac, dst=SRV_MAC) / IP(src=SRV_IP, dst=HOST_IP, id=0x3003) / UDP(sport=53, dport=40000) / Raw(b"spoof"),
        Ether(src=vm_mac, dst=BCAST) / ARP(op=2, hwsrc=vm_mac, psrc=SRV_IP, hwdst=BCAST, pdst=SRV_IP),
        Ether(src=vm_mac, dst=HOST_MAC) / ARP(op=2, hwsrc=vm_mac, psrc=SRV_IP, hwdst=HOST_MAC, pdst=HOST_IP),
        Ether(src=vm_mac, dst=BCAST) / ARP(op=1, hwsrc=vm_mac, psrc=vm_ip, pdst=SRV_IP),
    ]
    for k, f in enumerate(spoofs):
        f.time = t + 0.1 * k
        c.frames.append(f)
    path = os.path.join(OUT, c.name + ".pcap")
    wrpcap(path, c.frames, linktype=1)
    print(f"make-attacks: {c.name}: {len(c.frames)} frames")


def lifetimes():
    """Lifetimes against the port timer, which ticks every 10 s from the port's creation half a
    second before frame 1 (capture times 9.5, 19.5, ...; uptime 1000 s at creation, so a tick at
    capture time 10k - 0.5 reads uptime 1000 + 10k). Something whose lifetime ends at second E
    goes at the first tick reading more than E."""
    c = Capture("lifetimes")
    req = lambda t, xid, **kw: c.add(t, from_vm_udp("0.0.0.0", "255.255.255.255", 68, 67,
                                                    dhcp(REQUEST, xid, VM_MAC, **kw)))
    renew = lambda t, xid: c.add(t, from_vm_udp(VM_IP, SRV_IP, 68, 67, dhcp(REQUEST, xid, VM_MAC, ciaddr=VM_IP),
                                                dmac=SRV_MAC))
    ack = lambda t, xid: c.add(t, to_vm_udp(VM_IP, dhcp(ACK, xid, VM_MAC, yiaddr=VM_IP, lease=60, server_id=SRV_IP)))
    udp = lambda t, src: c.add(t, from_vm_udp(src, SRV_IP, 40000, 5353, b"traffic", dmac=SRV_MAC))
    # A request at uptime 1000 is pending until 1060: the tick reading 1060 keeps it, its repeat
    # (a new xid) keeps that lifetime, and the answer to the repeat binds VM_IP until 1120.
    req(0.0, 0x7a000001, requested=VM_IP, server_id=SRV_IP)
    c.add(1.0, arp(1, VM_MAC, "192.0.2.150", "00:00:00:00:00:00", SRV_IP))  # learned until 1181
    req(30.0, 0x7a000002, requested=VM_IP, server_id=SRV_IP)
    ack(60.0, 0x7a000002)
    # A renewal pending until 1121, repeated: the repeat does not extend it, so the tick
    # reading 1130 ends it and the answer at 130 s answers nothing.
    renew(61.0, 0x7a000003)
    renew(100.0, 0x7a000004)
    udp(100.5, "192.0.2.150")  # renews the ARP-learned binding of a trusted port to 1281
    udp(125.0, VM_IP)          # the tick reading 1120 kept the lease ending at 1120
    ack(130.0, 0x7a000004)
    # An ARP flood at uptime 1140: the error state lasts to 1150, so the tick reading 1150
    # keeps it and the one reading 1160 ends it.
    for k in range(11):
        c.add(140.0 + 0.01 * k, arp(1, VM_MAC, "192.0.2.151", "00:00:00:00:00:00", SRV_IP))
    for t in (155.0, 160.0):  # ARP probes: every one counts in the error state, none is inspected
        for k in range(6):
            c.add(t + 0.01 * k, arp(1, VM_MAC, "0.0.0.0", "00:00:00:00:00:00", f"192.0.2.{160 + k}"))
    udp(190.0, "192.0.2.150")  # after the tick reading 1190: the renewed binding is still there
    c.write()


if __name__ == "__main__":
    os.makedirs(OUT, exist_ok=True)
    for make in (ip_spoof, arp_spoof, arp_flood, rogue_dhcp_server, bpdu, unsolicited_ack,
                 chaddr_mismatch, malformed_dhcp, ip_fragments, vlan100, stacked_tags, policy_edges,
                 client_edges, example, lifetimes):
        make()
