#!/usr/bin/python3
"""IPv6 traffic for the dual-stack end-to-end test, run inside one of its namespaces.

  attack NAME IFACE VM_LL ROUTER_LL ARG   one attack frame (or a burst) from the guarded VM
  udp-listen PORT SECONDS LAST_SOURCE     prints the sources of the datagrams it gets, one a
                                          line, until one from LAST_SOURCE or SECONDS
  udp-send SRC DST DST_MAC PORT IFACE     one datagram from SRC (spoofed when not ours)

Attacks (ARG: the address the attack names, where it needs one):
  ra, ra-behind-options, ra-in-first-fragment, dhcpv6-reply, na-router (ARG: the router's
  global address), ns-foreign-mac, dad-claim (ARG: the address claimed), claim-flood (ARG:
  how many addresses, claimed from 2001:db8:1::e:0 on, 4 a second)
"""
import sys
import time

from e2e_tool import udp_listen  # the udp-listen command, shared with the IPv4 test


def scapy():
    import logging
    logging.getLogger("scapy.runtime").setLevel(logging.ERROR)
    import scapy.all as s
    s.conf.verb = 0
    return s


def solicited(s, addr):
    tail = bytes(s.IPv6(dst=addr))[37:40]
    return "ff02::1:ff%02x:%02x%02x" % tuple(tail)


def group_mac(s, addr):
    return "33:33:" + ":".join(f"{b:02x}" for b in bytes(s.IPv6(dst=addr))[36:40])


def attack(name, iface, vm_ll, router_ll, arg):
    s = scapy()
    mac = s.get_if_hwaddr(iface)
    l2 = s.Ether(src=mac, dst="33:33:00:00:00:01")
    ra = s.ICMPv6ND_RA(routerlifetime=1800) / s.ICMPv6NDOptSrcLLAddr(lladdr=mac) / \
        s.ICMPv6NDOptPrefixInfo(prefix="2001:db8:66::", prefixlen=64)
    frames = []
    if name == "ra":
        frames = [l2 / s.IPv6(src=vm_ll, dst="ff02::1", hlim=255) / ra]
    elif name == "ra-behind-options":
        frames = [l2 / s.IPv6(src=vm_ll, dst="ff02::1", hlim=255) / s.IPv6ExtHdrHopByHop() /
                  s.IPv6ExtHdrDestOpt() / ra]
    elif name == "ra-in-first-fragment":
        # The destination-options header runs on into the second fragment with the RA.
        whole = bytes(s.IPv6(src=vm_ll, dst="ff02::1", hlim=255) /
                      s.IPv6ExtHdrDestOpt(options=[s.PadN(optdata=b"\0" * 60)]) / ra)[40:]
        for offset, more, chunk in ((0, 1, whole[:32]), (4, 0, whole[32:])):
            frames.append(l2 / s.IPv6(src=vm_ll, dst="ff02::1", hlim=255) /
                          s.IPv6ExtHdrFragment(nh=60, offset=offset, m=more, id=0x6601) / s.Raw(chunk))
    elif name == "dhcpv6-reply":
        duid = s.DUID_LL(lladdr=mac)
        frames = [l2 / s.IPv6(src=vm_ll, dst="ff02::1") / s.UDP(sport=547, dport=546) /
                  s.DHCP6_Reply(trid=0x6602) / s.DHCP6OptServerId(duid=duid) /
                  s.DHCP6OptClientId(duid=s.DUID_LL(lladdr="02:00:5e:c0:00:99"))]
    elif name == "na-router":
        frames = [l2 / s.IPv6(src=vm_ll, dst="ff02::1", hlim=255) / s.ICMPv6ND_NA(tgt=arg, R=1, S=0, O=1) /
                  s.ICMPv6NDOptDstLLAddr(lladdr=mac)]
    elif name == "ns-foreign-mac":
        frames = [s.Ether(src=mac, dst=group_mac(s, solicited(s, router_ll))) /
                  s.IPv6(src=vm_ll, dst=solicited(s, router_ll), hlim=255) / s.ICMPv6ND_NS(tgt=router_ll) /
                  s.ICMPv6NDOptSrcLLAddr(lladdr="02:00:5e:c0:00:99")]
    elif name in ("dad-claim", "claim-flood"):
        targets = [arg] if name == "dad-claim" else [f"2001:db8:1::e:{k:x}" for k in range(int(arg))]
        for k, target in enumerate(targets):
            group = solicited(s, target)
            s.sendp(s.Ether(src=mac, dst=group_mac(s, group)) / s.IPv6(src="::", dst=group, hlim=255) /
                    s.ICMPv6ND_NS(tgt=target), iface=iface)
            if k + 1 < len(targets):
                time.sleep(0.25)
        return
    else:
        sys.exit("unknown attack " + name)
    s.sendp(frames, iface=iface)


def udp_send(src, dst, dst_mac, port, iface):
    s = scapy()
    # Sent as a frame so that a source the VM does not own goes out as it is.
    s.sendp(s.Ether(src=s.get_if_hwaddr(iface), dst=dst_mac) / s.IPv6(src=src, dst=dst) /
            s.UDP(sport=4000, dport=port) / b"hello", iface=iface)


if __name__ == "__main__":
    command, args = sys.argv[1], sys.argv[2:]
    if command == "attack":
        attack(*args)
    elif command == "udp-listen":
        udp_listen(int(args[0]), float(args[1]), args[2])
    elif command == "udp-send":
        udp_send(args[0], args[1], args[2], int(args[3]), args[4])
    else:
        sys.exit(__doc__)
