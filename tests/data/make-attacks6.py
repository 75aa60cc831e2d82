#!/usr/bin/python3
"""Writes the crafted IPv6 attack captures of this folder with scapy.

    /usr/bin/python3 tests/data/make-attacks6.py [OUTDIR]

Deterministic: every address, transaction ID, fragment ID and timestamp is
fixed below, so a rerun writes byte-identical files.

Every capture starts with the VM getting its addresses the ordinary way:
duplicate-address detection of its link-local address (first come, first
served), then a DHCPv6 Request and the server's Reply for 2001:db8:1::110,
then the detection of that address. The attacks follow.

Addresses (all in the documentation range 2001:db8::/32):
  VM            02:00:5e:c0:00:10  fe80::5eff:fec0:10, 2001:db8:1::110 (DHCPv6)
  router        02:00:5e:c0:00:fe  fe80::5eff:fec0:fe, 2001:db8:1::1 (DHCPv6 server too)
  other host    02:00:5e:c0:00:20  fe80::5eff:fec0:20, 2001:db8:1::20
  foreign MAC   02:00:5e:c0:00:99  (a MAC the VM does not own)
"""
import os
import sys

from scapy.all import (DHCP6_Advertise, DHCP6_Reconf, DHCP6_RelayReply, DHCP6_Reply, DHCP6_Request,
                       DHCP6_Solicit, DHCP6OptClientId, DHCP6OptIA_NA, DHCP6OptIAAddress, DHCP6OptServerId,
                       DUID_LL, ICMPv6EchoRequest, ICMPv6MLDMultAddrRec, ICMPv6MLReport2, ICMPv6ND_NA,
                       ICMPv6ND_NS, ICMPv6ND_RA, ICMPv6ND_Redirect, ICMPv6ND_RS, ICMPv6NDOptDstLLAddr,
                       ICMPv6NDOptPrefixInfo, ICMPv6NDOptSrcLLAddr, IPv6, IPv6ExtHdrDestOpt,
                       IPv6ExtHdrFragment, IPv6ExtHdrHopByHop, PadN, RouterAlert, UDP, Dot1Q, Ether, Raw,
                       wrpcap)

HERE = os.path.dirname(os.path.abspath(__file__))
OUT = os.path.abspath(sys.argv[1]) if len(sys.argv) > 1 else HERE
T0 = 1700000000.0  # 2023-11-14 22:13:20 UTC, start of every crafted capture

VM_MAC, VM_LL, VM_IP = "02:00:5e:c0:00:10", "fe80::5eff:fec0:10", "2001:db8:1::110"
GW_MAC, GW_LL, GW_IP = "02:00:5e:c0:00:fe", "fe80::5eff:fec0:fe", "2001:db8:1::1"
HOST_MAC, HOST_IP = "02:00:5e:c0:00:20", "2001:db8:1::20"
FOREIGN_MAC = "02:00:5e:c0:00:99"
ALL_NODES, ALL_ROUTERS, ALL_DHCP = "ff02::1", "ff02::2", "ff02::1:2"
VALID, PREFERRED = 120, 60


def mcast_mac(addr):
    """The Ethernet group address of an IPv6 multicast address."""
    tail = bytes(IPv6(dst=addr))[36:40]
    return "33:33:" + ":".join(f"{b:02x}" for b in tail)


def solicited_node(addr):
    tail = bytes(IPv6(dst=addr))[37:40]
    return "ff02::1:ff%02x:%02x%02x" % tuple(tail)


class Capture:
    """Frames with fixed timestamps: T0 + offset."""

    def __init__(self, name):
        self.name, self.frames = name, []

    def add(self, offset, frame):
        frame.time = T0 + offset
        self.frames.append(frame)

    def write(self):
        wrpcap(os.path.join(OUT, self.name + ".pcap"), self.frames, linktype=1)
        print(f"make-attacks6: {self.name}: {len(self.frames)} frames")


def from_vm(src, dst, upper, mac=VM_MAC, dmac=None, vlan=None):
    l2 = Ether(src=mac, dst=dmac or (mcast_mac(dst) if dst.startswith("ff") else GW_MAC))
    if vlan is not None:
        l2 = l2 / Dot1Q(vlan=vlan)
    return l2 / IPv6(src=src, dst=dst, hlim=255 if upper.name.startswith("ICMPv6 N") else 64) / upper


def to_vm(src, dst, upper, mac=GW_MAC):
    return Ether(src=mac, dst=mcast_mac(dst) if dst.startswith("ff") else VM_MAC) / IPv6(src=src, dst=dst) / upper


def dad(target, mac=VM_MAC):
    """A duplicate-address-detection solicitation: from no address, no link-layer option."""
    return Ether(src=mac, dst=mcast_mac(solicited_node(target))) / \
        IPv6(src="::", dst=solicited_node(target), hlim=255) / ICMPv6ND_NS(tgt=target)


def duid(mac):
    return DUID_LL(lladdr=mac)


def ia(addr, valid=VALID, preferred=PREFERRED):
    return DHCP6OptIA_NA(iaid=1, T1=0, T2=0, ianaopts=[DHCP6OptIAAddress(addr=addr, preflft=preferred,
                                                                        validlft=valid)])


def bind_vm(c, t, trid):
    """The VM's link-local by DAD, 2001:db8:1::110 by DHCPv6 (Request, Reply), its DAD."""
    c.add(t, dad(VM_LL))
    c.add(t + 1.0, from_vm(VM_LL, ALL_DHCP, UDP(sport=546, dport=547) / DHCP6_Request(trid=trid) /
                           DHCP6OptClientId(duid=duid(VM_MAC)) / DHCP6OptServerId(duid=duid(GW_MAC)) /
                           ia(VM_IP, 0, 0)))
    c.add(t + 1.001, to_vm(GW_LL, VM_LL, UDP(sport=547, dport=546) / DHCP6_Reply(trid=trid) /
                           DHCP6OptClientId(duid=duid(VM_MAC)) / DHCP6OptServerId(duid=duid(GW_MAC)) / ia(VM_IP)))
    c.add(t + 1.1, dad(VM_IP))


def router_adv(lladdr=VM_MAC):
    return ICMPv6ND_RA(routerlifetime=1800) / ICMPv6NDOptSrcLLAddr(lladdr=lladdr) / \
        ICMPv6NDOptPrefixInfo(prefix="2001:db8:66::", prefixlen=64)


def first_fragment_without_chain(src, dst, upper, frag_id, mac=VM_MAC):
    """The packet split after 32 bytes of a 64-byte destination-options header:
    the first fragment ends inside the chain, the second holds its rest and `upper`."""
    whole = bytes(IPv6(src=src, dst=dst, hlim=255) / IPv6ExtHdrDestOpt(options=[PadN(optdata=b"\0" * 60)]) / upper)
    payload = whole[40:]
    l2 = Ether(src=mac, dst=mcast_mac(dst))
    first = l2 / IPv6(src=src, dst=dst, hlim=255) / IPv6ExtHdrFragment(nh=60, offset=0, m=1, id=frag_id) / \
        Raw(payload[:32])
    rest = l2 / IPv6(src=src, dst=dst, hlim=255) / IPv6ExtHdrFragment(nh=60, offset=4, m=0, id=frag_id) / \
        Raw(payload[32:])
    return first, rest


def ra_guard():
    c = Capture("attack6-ra-guard")
    bind_vm(c, 0.0, 0x6a0001)
    c.add(2.0, from_vm(VM_LL, ALL_NODES, router_adv()))
    c.add(2.1, from_vm(VM_LL, ALL_NODES, IPv6ExtHdrHopByHop() / IPv6ExtHdrDestOpt() / router_adv()))
    first, rest = first_fragment_without_chain(VM_LL, ALL_NODES, router_adv(), 0x66000001)
    c.add(2.2, first)
    c.add(2.201, rest)
    c.add(2.3, from_vm(VM_LL, ALL_NODES, IPv6ExtHdrFragment(offset=0, m=0, id=0x66000002) / router_adv()))
    c.add(2.4, from_vm(VM_LL, HOST_IP, ICMPv6ND_Redirect(tgt=VM_LL, dst=GW_IP), dmac=HOST_MAC))
    c.add(2.5, from_vm(VM_LL, ALL_ROUTERS, ICMPv6ND_RS() / ICMPv6NDOptSrcLLAddr(lladdr=VM_MAC)))
    c.add(2.501, to_vm(GW_LL, VM_LL, router_adv(GW_MAC)))
    c.write()


def dhcpv6_server():
    c = Capture("attack6-dhcpv6-server")
    bind_vm(c, 0.0, 0x6a0002)
    ids = DHCP6OptClientId(duid=duid(HOST_MAC)) / DHCP6OptServerId(duid=duid(VM_MAC))
    to_host = UDP(sport=547, dport=546)
    c.add(2.0, from_vm(VM_LL, ALL_NODES, to_host / DHCP6_Advertise(trid=0x6b0001) / ids / ia("2001:db8:66::20")))
    c.add(2.1, from_vm(VM_LL, "fe80::5eff:fec0:20", to_host / DHCP6_Reply(trid=0x6b0001) / ids /
                       ia("2001:db8:66::20"), dmac=HOST_MAC))
    c.add(2.2, from_vm(VM_LL, "fe80::5eff:fec0:20", to_host / DHCP6_Reconf(trid=0) / ids, dmac=HOST_MAC))
    c.add(2.3, from_vm(VM_LL, GW_LL, UDP(sport=547, dport=547) / DHCP6_RelayReply(linkaddr=GW_IP, peeraddr=HOST_IP)))
    c.add(2.4, from_vm(VM_LL, "fe80::5eff:fec0:20", IPv6ExtHdrDestOpt() / to_host / DHCP6_Reply(trid=0x6b0002) /
                       ids / ia("2001:db8:66::20"), dmac=HOST_MAC))
    c.add(2.5, from_vm(VM_LL, ALL_DHCP, UDP(sport=546, dport=547) / DHCP6_Solicit(trid=0x6a0003) /
                       DHCP6OptClientId(duid=duid(VM_MAC)) / ia("::", 0, 0)))
    c.write()


def nd_spoof():
    c = Capture("attack6-nd-spoof")
    bind_vm(c, 0.0, 0x6a0004)
    na = dict(R=0, S=0, O=1)
    c.add(2.0, from_vm(VM_LL, ALL_NODES, ICMPv6ND_NA(tgt=GW_LL, **na) / ICMPv6NDOptDstLLAddr(lladdr=VM_MAC)))
    c.add(2.1, from_vm(VM_IP, ALL_NODES, ICMPv6ND_NA(tgt=GW_IP, **na) / ICMPv6NDOptDstLLAddr(lladdr=VM_MAC)))
    c.add(2.2, from_vm(VM_LL, solicited_node(GW_LL), ICMPv6ND_NS(tgt=GW_LL) / ICMPv6NDOptSrcLLAddr(lladdr=FOREIGN_MAC)))
    c.add(2.3, from_vm("2001:db8:1::66", solicited_node(GW_IP), ICMPv6ND_NS(tgt=GW_IP) /
                       ICMPv6NDOptSrcLLAddr(lladdr=VM_MAC)))
    c.add(2.4, from_vm(VM_IP, solicited_node(HOST_IP), ICMPv6ND_NA(tgt=HOST_IP, **na) /
                       ICMPv6NDOptDstLLAddr(lladdr=VM_MAC)))
    c.add(2.5, from_vm(VM_LL, solicited_node(GW_LL), ICMPv6ND_NS(tgt=GW_LL) / ICMPv6NDOptSrcLLAddr(lladdr=VM_MAC)))
    c.add(2.501, to_vm(GW_LL, VM_LL, ICMPv6ND_NA(tgt=GW_LL, R=1, S=1, O=1) / ICMPv6NDOptDstLLAddr(lladdr=GW_MAC)))
    c.add(2.6, from_vm(VM_IP, ALL_NODES, ICMPv6ND_NA(tgt=VM_IP, **na) / ICMPv6NDOptDstLLAddr(lladdr=VM_MAC)))
    c.write()


def ip_spoof():
    c = Capture("attack6-ip-spoof")
    bind_vm(c, 0.0, 0x6a0005)
    udp = UDP(sport=40000, dport=40001) / Raw(b"payload")
    c.add(2.0, from_vm(VM_IP, HOST_IP, udp, dmac=HOST_MAC))
    c.add(2.1, from_vm("2001:db8:1::66", HOST_IP, udp, dmac=HOST_MAC))
    c.add(2.2, from_vm(GW_IP, HOST_IP, udp, dmac=HOST_MAC))
    c.add(2.3, from_vm("::", HOST_IP, udp, dmac=HOST_MAC))
    c.add(2.4, from_vm(VM_IP, HOST_IP, udp, mac=FOREIGN_MAC, dmac=HOST_MAC))
    c.add(2.5, from_vm(VM_IP, GW_IP, udp, vlan=100))
    c.add(2.6, from_vm(VM_LL, GW_LL, ICMPv6EchoRequest(id=0x66, seq=1)))
    c.add(2.7, Ether(src=VM_MAC, dst="33:33:00:00:00:16") /
          IPv6(src="::", dst="ff02::16", hlim=1) / IPv6ExtHdrHopByHop(options=[RouterAlert()]) /
          ICMPv6MLReport2(records=[ICMPv6MLDMultAddrRec(dst=solicited_node(VM_IP))]))
    c.add(2.8, to_vm("2001:db8:1::66", VM_IP, ICMPv6EchoRequest(id=0x67, seq=1), mac=HOST_MAC))
    c.write()


def unsolicited_reply():
    """DHCPv6 Replies to the VM that answer no request of it: none pending, another transaction,
    another client's DUID, another VLAN; then the matching one. Each offers an address."""
    c = Capture("attack6-unsolicited-reply")
    c.add(0.0, dad(VM_LL))
    server = DHCP6OptServerId(duid=duid(GW_MAC))

    def reply(trid, client_mac, addr, vlan=None):
        l2 = Ether(src=GW_MAC, dst=VM_MAC)
        if vlan is not None:
            l2 = l2 / Dot1Q(vlan=vlan)
        return l2 / IPv6(src=GW_LL, dst=VM_LL) / UDP(sport=547, dport=546) / DHCP6_Reply(trid=trid) / \
            DHCP6OptClientId(duid=duid(client_mac)) / server / ia(addr)
    c.add(1.0, reply(0x6c0001, VM_MAC, "2001:db8:1::61"))
    c.add(2.0, from_vm(VM_LL, ALL_DHCP, UDP(sport=546, dport=547) / DHCP6_Request(trid=0x6c0002) /
                       DHCP6OptClientId(duid=duid(VM_MAC)) / server / ia(VM_IP, 0, 0)))
    c.add(2.001, reply(0x6c0003, VM_MAC, "2001:db8:1::62"))
    c.add(2.002, reply(0x6c0002, HOST_MAC, "2001:db8:1::63"))
    c.add(2.003, reply(0x6c0002, VM_MAC, "2001:db8:1::64", vlan=100))
    c.add(2.004, reply(0x6c0002, VM_MAC, VM_IP))
    udp = UDP(sport=40000, dport=40001) / Raw(b"payload")
    for k, src in enumerate(["2001:db8:1::61", "2001:db8:1::62", "2001:db8:1::63", "2001:db8:1::64", VM_IP]):
        c.add(3.0 + 0.1 * k, from_vm(src, HOST_IP, udp, dmac=HOST_MAC))
    c.write()


def address_flood(limit=64):
    """Claims for limit+2 addresses, 4 a second (under any ND rate limit): with the two
    bindings of the VM's start the port holds limit+4, so its 4 oldest go."""
    c = Capture("attack6-address-flood")
    bind_vm(c, 0.0, 0x6a0006)
    claims = [f"2001:db8:1::f:{k:x}" for k in range(limit + 2)]
    for k, addr in enumerate(claims):
        c.add(2.0 + 0.25 * k, dad(addr))
    t = 2.0 + 0.25 * len(claims) + 1.0
    udp = UDP(sport=40000, dport=40001) / Raw(b"payload")
    for k, src in enumerate([VM_LL, VM_IP, claims[1], claims[2], claims[-1]]):
        c.add(t + 0.1 * k, from_vm(src, HOST_IP, udp, dmac=HOST_MAC))
    c.write()


def nd_flood():
    """25 solicitations from the VM's bound address in half a second, then other frames of the VM."""
    c = Capture("attack6-nd-flood")
    bind_vm(c, 0.0, 0x6a0007)
    for k in range(25):
        target = f"2001:db8:1::{k + 1:x}"
        c.add(3.0 + 0.02 * k, from_vm(VM_IP, solicited_node(target), ICMPv6ND_NS(tgt=target) /
                                      ICMPv6NDOptSrcLLAddr(lladdr=VM_MAC)))
    udp = UDP(sport=40000, dport=40001) / Raw(b"payload")
    for k in range(8):
        c.add(4.5 + 0.05 * k, from_vm(VM_IP, HOST_IP, udp, dmac=HOST_MAC))
    c.write()


if __name__ == "__main__":
    os.makedirs(OUT, exist_ok=True)
    for make in (ra_guard, dhcpv6_server, nd_spoof, ip_spoof, unsolicited_reply, address_flood, nd_flood):
        make()
