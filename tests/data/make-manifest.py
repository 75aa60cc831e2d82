#!/usr/bin/python3
"""Writes MANIFEST.md and manifest.json for the captures of this folder.

    /usr/bin/python3 tests/data/make-manifest.py

For every capture it lists the frames (tshark's one-line summary) and works out
what a correct port must do with them, by running a small reference model of
the port's per-frame rules over the frames in order, under two port
configurations:

  learning   features 0x04 (IP discovery), trusted port            (the default)
  enforcing  features 0x1f (BPDU filter, DHCP server block, IP discovery,
             ARP inspection, IP source guard), untrusted port,
             arpRateLimit 10, errRateLimit 5, errRateLimitPeriod 10

Times: the port's clock is the capture's time; each capture starts 0.5 s after
the port was configured, so the rate limiters' first interval opens with the
first counted frame. VLAN: untagged frames are VLAN 0, 802.1Q-tagged frames
carry their VID. Ageing: the port timer ticks every 10 s from the port's
creation, the port's uptime then 1000 s; a pending request (60 s), a lease or
a learned ARP entry (180 s, renewed by the VM's traffic on a trusted port)
goes at the first tick past its expiry second, and the error-rate-limit state
ends at the first tick past its period (the lifetimes capture shows each).
"""
import ipaddress
import json
import os
import struct
import subprocess

HERE = os.path.dirname(os.path.abspath(__file__))

SRV = {"serverMac": "02:00:5e:c0:00:fe", "serverIp": "192.0.2.1"}
FOREIGN_MAC = "02:00:5e:c0:00:99"

CAPTURES = [
    ("dhclient-lease-renew-release", "02:00:5e:c0:00:01", "real",
     "make-captures.sh: dhclient (isc-dhcp-client 4.4.3, Debian's default dhclient.conf, so no client "
     "identifier) against dnsmasq 2.90 (lease 120 s, T1 10 s, T2 20 s, dhcp-host pins 192.0.2.101); "
     "a ping to the server after the ACK, the renewal at T1, then `dhclient -r`."),
    ("dhclient-reboot-nak", "02:00:5e:c0:00:02", "real",
     "make-captures.sh: dhclient started with a remembered lease of 198.51.100.50 (another network); its "
     "INIT-REBOOT REQUEST is answered with DHCPNAK by the authoritative dnsmasq; the client starts over "
     "(DISCOVER..ACK for 192.0.2.102) and is then released."),
    ("udhcpc-no-clientid", "02:00:5e:c0:00:03", "real",
     "make-captures.sh: busybox 1.35 udhcpc -C -a (no client identifier, ARP check of the address): "
     "exchange for 192.0.2.104, renewal on SIGUSR1, release on SIGUSR2."),
    ("udhcpc-custom-clientid", "02:00:5e:c0:00:04", "real",
     "make-captures.sh: udhcpc -x 0x3d:ff00000001000100015ec00004 (client identifier type 255, "
     "IAID+DUID style, not the MAC): exchange for 192.0.2.105, renewal (SIGUSR1), release (SIGUSR2)."),
    ("udhcpc-renew-nak", "02:00:5e:c0:00:05", "real",
     "make-captures.sh: udhcpc with its default client identifier (01 + MAC) bound to 192.0.2.103; "
     "dnsmasq is restarted with the MAC pinned to 192.0.2.113, so the renewal (SIGUSR1) is answered "
     "with DHCPNAK ('wrong address'); the client starts over, gets .113, and is released."),
    ("arp-probe-announce", "02:00:5e:c0:00:06", "real",
     "make-captures.sh: VM with the static address 192.0.2.60 and no DHCP: busybox arping -D (probes), "
     "address configured, arping -U (gratuitous requests), arping -A (gratuitous replies), ping to "
     "the server (kernel ARP), the server's arping for the VM and the VM's kernel reply."),
    ("attack-ip-spoof", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: the VM is bound to 192.0.2.110 by a REQUEST/ACK, then sends IPv4 with its own and "
     "with spoofed source addresses (and once with a foreign source MAC)."),
    ("lifetimes", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: over 190 s, a pending DHCP request and its repeat, the lease of 60 s its answer "
     "gives, a renewal and its repeat answered too late, an ARP-learned binding renewed by traffic, and "
     "an ARP flood's error state, each ending at a tick of the port timer."),
    ("attack-arp-spoof", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: VM bound to 192.0.2.110, then ARP claiming other hosts' addresses."),
    ("attack-arp-flood", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: VM bound to 192.0.2.110; 50 ARP requests from the VM in 0.98 s, 8 ICMP frames "
     "from the VM 0.5 s later, 15 ARP requests to the VM in 0.7 s, one ICMP reply to the VM."),
    ("attack-rogue-dhcp-server", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: DHCPOFFER/DHCPACK sent by the VM (UDP 67->68) and DHCPv6 ADVERTISE/REPLY sent by "
     "the VM (UDP 547->546); last, a real server's OFFER to the VM."),
    ("attack-bpdu", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: STP (01:80:c2:00:00:00) and PVST+ (01:00:0c:cc:cc:cd) BPDUs from the VM and to "
     "the VM, then an ARP probe."),
    ("attack-unsolicited-ack", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: a DHCPACK to the VM with no request; a REQUEST; ACKs with a wrong xid, a wrong "
     "chaddr, and finally the matching one."),
    ("attack-chaddr-mismatch", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: a DHCPREQUEST from the VM whose chaddr is 02:00:5e:c0:00:99, the server's ACK "
     "for it, then a DISCOVER with the same chaddr."),
    ("attack-malformed-dhcp", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: REQUESTs with a bad cookie, htype 6, UDP length 247, no end option, each "
     "followed by an ACK for its xid; then a good REQUEST, an ACK without lease time, the good ACK."),
    ("attack-ip-fragments", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: a DHCPREQUEST from the VM split into a first (MF, offset 0) and a non-first "
     "(offset 128) IPv4 fragment, the matching ACK unfragmented, then an ACK to the VM in two fragments."),
    ("attack-vlan100", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: a DHCP exchange on 802.1Q VLAN 100, then ICMP and ARP from the VM on VLAN 100 and "
     "untagged."),
    ("attack-stacked-tags", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: VM bound to 192.0.2.110; ARP replies claiming the server's address inside "
     "802.1Q+802.1Q, 802.1ad+802.1Q and three tags; ICMP from a spoofed and from the leased address "
     "under one 802.1ad tag; the ARP reply cut to 41 bytes; a double-tagged ARP reply to the VM."),
    ("attack-policy-edges", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: VM bound to 192.0.2.110; UDP that only looks like a server's (a DHCPv6 server "
     "message to the VM, port 547 over IPv4 and 67 over IPv6 from the VM, port 68 from the VM); ARP from "
     "the VM with other hardware or protocol types or lengths; 11 ARP requests to the VM in 0.2 s, ICMP "
     "to it, 11 more in the next interval and one in a third; a gratuitous ARP reply and an ARP of "
     "operation 3 from the VM for addresses of their own."),
    ("attack-dhcp-client-edges", "02:00:5e:c0:00:10", "crafted",
     "make-attacks.py: VM bound to 192.0.2.110; a NAK that answers no request; a REQUEST and a DISCOVER "
     "on VLAN 5 with ACKs and a NAK for its xid; renewals ended by a DECLINE, a NAK and a DISCOVER, each "
     "followed by the renewal's ACK and a new binding; a binding made with client identifier 01aabb, a "
     "renewal and a RELEASE without the identifier, the renewal's ACK, the RELEASE with it; a new binding, "
     "a broadcast REQUEST with ciaddr set (rebinding), one without (selecting)."),
    ("example-dhcp-then-spoof", "02:00:5e:c0:00:01", "crafted",
     "make-attacks.py: dhclient-lease-renew-release.pcap without its DHCPRELEASE, then, 1 s after, "
     "ICMP from the leased address, spoofed IPv4 sources and ARP replies claiming the server's address."),
]
CAPTURES += [
    ("dhclient6-lease-renew-release", "02:00:5e:c0:00:31", "real",
     "make-captures6.sh: the VM's link comes up (MLD reports, DAD of its link-local address, a router "
     "solicitation); dhclient -6 -D LL (isc-dhcp-client 4.4.3) against dnsmasq 2.90's stateful DHCPv6 "
     "(lease 120 s, router advertisements with the managed flag, no autonomous prefix): Solicit..Reply, "
     "the DAD of the leased address, a ping to the server, the Renew at T1 (60 s), then `dhclient -6 -r`."),
    ("udhcpc6-lease-renew-release", "02:00:5e:c0:00:33", "real",
     "make-captures6.sh: busybox 1.35 udhcpc6 (built from Debian's source with CONFIG_UDHCPC6) against "
     "the same server: Solicit..Reply, the leased address' DAD, a ping to the server, a renewal "
     "(SIGUSR1: udhcpc6 sends it as a Request with the first exchange's transaction ID, unicast from "
     "the leased address), a release (SIGUSR2)."),
    ("slaac-privacy-dad", "02:00:5e:c0:00:32", "real",
     "make-captures6.sh: the kernel's own SLAAC (use_tempaddr 2, dad_transmits 1) from dnsmasq 2.90's "
     "router advertisements (ra-only, 2001:db8:1::/64): DAD of the link-local, stable (EUI-64) and "
     "temporary addresses, MLDv2 reports, then a ping to the server from the temporary and from the "
     "stable address."),
    ("attack6-ra-guard", "02:00:5e:c0:00:10", "crafted",
     "make-attacks6.py: the VM's link-local (DAD) and DHCPv6 address, then router advertisements from "
     "the VM: plain, behind hop-by-hop and destination-options headers, in a first fragment that ends "
     "inside its chain (and the fragment after it), as an atomic fragment; a redirect; last, a router "
     "solicitation from the VM and the router's advertisement to it."),
    ("attack6-dhcpv6-server", "02:00:5e:c0:00:10", "crafted",
     "make-attacks6.py: the VM's addresses, then DHCPv6 server messages sent by the VM: Advertise, "
     "Reply, Reconfigure, Relay-Reply, a Reply behind a destination-options header; last, the VM's "
     "own Solicit."),
    ("attack6-nd-spoof", "02:00:5e:c0:00:10", "crafted",
     "make-attacks6.py: the VM's addresses, then neighbour advertisements from the VM claiming the "
     "router's link-local and global addresses and another host's, a solicitation with a foreign "
     "link-layer address option, one from an address the VM does not hold; the VM's own solicitation "
     "for the router, the router's answer, the VM's advertisement of its own address."),
    ("attack6-ip-spoof", "02:00:5e:c0:00:10", "crafted",
     "make-attacks6.py: the VM's addresses, then UDP from its DHCPv6 address, from addresses it does not "
     "hold (another, the router's, the unspecified address), from its address with a foreign source "
     "MAC and on VLAN 100; an echo request from its link-local address, an MLDv2 report from the "
     "unspecified address, an echo request to the VM from a spoofed source."),
    ("attack6-unsolicited-reply", "02:00:5e:c0:00:10", "crafted",
     "make-attacks6.py: the VM's link-local address (DAD); a DHCPv6 Reply to the VM with no request "
     "pending; the VM's Request; Replies with another transaction ID, another client's DUID, on VLAN "
     "100, then the matching one, each for its own address; then UDP from each of those addresses."),
    ("attack6-address-flood", "02:00:5e:c0:00:10", "crafted",
     "make-attacks6.py: the VM's two addresses, then duplicate-address detection for 66 addresses, four "
     "a second (the port's default limit is 64 bindings), then UDP from the first addresses the VM held "
     "and from the claimed ones."),
    ("attack6-nd-flood", "02:00:5e:c0:00:10", "crafted",
     "make-attacks6.py: the VM's addresses, then 25 neighbour solicitations from its address in 0.48 s, "
     "then 8 UDP frames from it 1 s later."),
]
EXTRA_VM_SRC_MACS = {"attack-ip-spoof": [FOREIGN_MAC], "attack6-ip-spoof": [FOREIGN_MAC]}

# The two agents on an untrusted port, every feature of each (examples/dual-stack.json).
DUAL_STACK = {"name": "dual-stack", "featuresEnabled": 0x1F, "trusted": 0, "portDbSize": 32,
              "arpRateLimit": 10, "errRateLimit": 5, "errRateLimitPeriod": 10,
              "ipv6": {"featuresEnabled": 0x7F, "trusted": 0, "bindingLimit": 64, "ndRateLimit": 10,
                       "errRateLimit": 5, "errRateLimitPeriod": 10, "fcfsLifetime": 600}}

CONFIGS = [
    {"name": "learning", "featuresEnabled": 0x04, "trusted": 1, "portDbSize": 32,
     "arpRateLimit": 0, "errRateLimit": 0, "errRateLimitPeriod": 0},
    {"name": "enforcing", "featuresEnabled": 0x1F, "trusted": 0, "portDbSize": 32,
     "arpRateLimit": 10, "errRateLimit": 5, "errRateLimitPeriod": 10},
]
MSG = {1: "DHCPDISCOVER", 2: "DHCPOFFER", 3: "DHCPREQUEST", 4: "DHCPDECLINE", 5: "DHCPACK",
       6: "DHCPNAK", 7: "DHCPRELEASE", 8: "DHCPINFORM"}
BPDU_MACS = {"01:80:c2:00:00:00", "01:00:0c:cc:cc:cd"}
DHCPV6_MSG = {1: "DHCPv6 SOLICIT", 2: "DHCPv6 ADVERTISE", 3: "DHCPv6 REQUEST", 4: "DHCPv6 CONFIRM",
              5: "DHCPv6 RENEW", 6: "DHCPv6 REBIND", 7: "DHCPv6 REPLY", 8: "DHCPv6 RELEASE",
              9: "DHCPv6 DECLINE", 10: "DHCPv6 RECONFIGURE", 11: "DHCPv6 INFORMATION-REQUEST",
              12: "DHCPv6 RELAY-FORW", 13: "DHCPv6 RELAY-REPL"}
ICMPV6_KIND = {128: "ICMPv6 echo request", 129: "ICMPv6 echo reply", 131: "MLD report", 133: "RS", 134: "RA",
               135: "NS", 136: "NA", 137: "Redirect", 143: "MLDv2 report"}
TPIDS = {0x8100, 0x88A8, 0x9100}


def read_pcap(path):
    """(time, bytes) for every record of a classic little-endian pcap file."""
    data = open(path, "rb").read()
    magic = struct.unpack_from("<I", data, 0)[0]
    assert magic in (0xA1B2C3D4, 0xA1B23C4D), path
    nano = magic == 0xA1B23C4D
    off, out = 24, []
    while off + 16 <= len(data):
        sec, frac, incl, _ = struct.unpack_from("<IIII", data, off)
        out.append((sec + frac / (1e9 if nano else 1e6), data[off + 16: off + 16 + incl]))
        off += 16 + incl
    return out


def mac(b):
    return ":".join(f"{x:02x}" for x in b)


def ip(b):
    return ".".join(str(x) for x in b)


def parse(frame):
    """The fields the port's rules look at."""
    p = {"len": len(frame), "dst": mac(frame[0:6]), "src": mac(frame[6:12]), "vlan": 0, "tags": 0}
    etype, l3 = struct.unpack_from("!H", frame, 12)[0], 14
    if etype in TPIDS and len(frame) >= 18:  # the outer tag, any TPID, is the frame's VLAN
        p["vlan"] = struct.unpack_from("!H", frame, 14)[0] & 0xFFF
        etype, l3 = struct.unpack_from("!H", frame, 16)[0], 18
    frame = frame.ljust(l3 + 46, b"\0")  # judged padded to 60 bytes untagged, as a switch pads it
    while etype in TPIDS and p["tags"] < 4 and len(frame) >= l3 + 4:  # tags inside the VLAN
        p["tags"] += 1
        etype, l3 = struct.unpack_from("!H", frame, l3 + 2)[0], l3 + 4
    p["etype"], p["l3"] = etype, l3
    if etype == 0x0806 and len(frame) >= l3 + 28:
        a = frame[l3:l3 + 28]
        p["arp"] = {"ok": a[0:6] == bytes([0, 1, 8, 0, 6, 4]), "op": struct.unpack_from("!H", a, 6)[0],
                    "sha": mac(a[8:14]), "spa": ip(a[14:18]), "tpa": ip(a[24:28])}
    elif etype == 0x0800:
        ihl = (frame[l3] & 0xF) * 4
        fl = struct.unpack_from("!H", frame, l3 + 6)[0]
        p["ipv4"] = {"src": ip(frame[l3 + 12:l3 + 16]), "dst": ip(frame[l3 + 16:l3 + 20]),
                     "proto": frame[l3 + 9], "frag": bool(fl & 0x2000) or (fl & 0x1FFF) != 0,
                     "firstFrag": (fl & 0x1FFF) == 0}
        if frame[l3 + 9] == 17:
            l4 = l3 + ihl
            sp, dp, ulen = struct.unpack_from("!HHH", frame, l4)
            p["udp"] = {"sport": sp, "dport": dp, "len": ulen, "off": l4}
    elif etype == 0x86DD and frame[l3 + 6] == 17:
        l4 = l3 + 40
        sp, dp, ulen = struct.unpack_from("!HHH", frame, l4)
        p["ipv6"] = True
        p["udp"] = {"sport": sp, "dport": dp, "len": ulen, "off": l4}
    return p


def parse_dhcp(frame, udp):
    """The DHCP message of a UDP frame, or (None, why) when it is refused."""
    if udp["len"] < 248 or udp["off"] + udp["len"] > len(frame):
        return None, "Invalid frame len"
    h = udp["off"] + 8
    if h + 240 > len(frame):
        return None, "Can't access DHCP hdr"
    if frame[h + 1] != 1 or frame[h + 2] != 6:
        return None, f"Invalid htype/hlen: [{frame[h + 1]} {frame[h + 2]}]"
    if frame[h + 236:h + 240] != bytes([99, 130, 83, 99]):
        return None, "Invalid cookie"
    d = {"xid": struct.unpack_from("!I", frame, h + 4)[0], "ciaddr": ip(frame[h + 12:h + 16]),
         "yiaddr": ip(frame[h + 16:h + 20]), "siaddr": ip(frame[h + 20:h + 24]),
         "chaddr": mac(frame[h + 28:h + 34]), "type": None, "cid": b"", "lease": None}
    o = h + 240
    while o < len(frame):
        code = frame[o]
        if code == 0:
            o += 1
            continue
        if code == 255:
            if d["type"] is None:
                return None, "Invalid options: 1"
            if d["type"] == 5 and d["lease"] is None:
                return None, "No lease time option in DHCPACK"
            return d, None
        if o + 2 > len(frame) or o + 2 + frame[o + 1] > len(frame):
            return None, "Can't access DHCP option"
        val = frame[o + 2:o + 2 + frame[o + 1]]
        if code == 53:
            d["type"] = val[0]
        elif code == 61:
            d["cid"] = bytes(val)
        elif code == 51:
            d["lease"] = struct.unpack("!I", val)[0]
        o += 2 + frame[o + 1]
    return None, "Invalid options: 0"


def kind(p, frame):
    if p["dst"] in BPDU_MACS:
        return "STP BPDU" if p["dst"] == "01:80:c2:00:00:00" else "PVST+ BPDU"
    if "arp" in p:
        a = p["arp"]
        if a["op"] == 1:
            if a["spa"] == "0.0.0.0":
                return "ARP probe"
            return "ARP gratuitous request" if a["spa"] == a["tpa"] else "ARP request"
        return "ARP gratuitous reply" if a["spa"] == a["tpa"] else "ARP reply"
    if "ipv6" in p:
        u = p["udp"]
        return DHCPV6_MSG.get(frame[u["off"] + 8], "IPv6 UDP")
    if p["etype"] == 0x86DD:
        return ipv6_kind(frame, p)
    if "ipv4" in p:
        v = p["ipv4"]
        if v["frag"]:
            return "IPv4 fragment (first)" if v["firstFrag"] else "IPv4 fragment (non-first)"
        if "udp" in p and (p["udp"]["sport"] in (67, 68) or p["udp"]["dport"] in (67, 68)):
            d, why = parse_dhcp(frame, p["udp"])
            return MSG.get(d["type"], "DHCP") if d else f"DHCP malformed ({why})"
        return {1: "ICMP", 6: "TCP", 17: "UDP"}.get(v["proto"], "IPv4")
    return "other"


UPTIME_AT_START = 1000  # the host's uptime, in seconds, when the port is made half a second before frame 1
TICK_US = 10_000_000    # the port timer's period


def uptime(t):
    """Whole seconds of uptime at capture time t (seconds after frame 1)."""
    return (UPTIME_AT_START * 1_000_000 + 500_000 + round(t * 1e6)) // 1_000_000


class Limiter:
    def __init__(self, limit, now):
        self.limit, self.end, self.count = limit, now, 0

    def reached(self, now):
        if now > self.end:
            self.end, self.count = now + 1.0, 1
        else:
            self.count += 1
        return self.count > self.limit


class Port:
    """Reference model of one port's per-frame rules and its port database."""

    def __init__(self, cfg, t_start):
        self.cfg, self.vmis, self.reqs, self.events = cfg, [], [], []
        self.counters = {k: 0 for k in ("daiDropCnt", "txRateLimitDropCnt", "txRateLimitErrEntryCnt",
                                        "rxRateLimitDropCnt", "ipSrcGuardDropCnt", "dhcpSnoopingDropCnt",
                                        "taggedDropCnt")}
        self.tx = Limiter(cfg["arpRateLimit"], t_start)
        self.rx = Limiter(cfg["arpRateLimit"], t_start)
        self.err, self.err_end, self.ticks = False, 0, 0

    def age(self, idx, t):
        """The port timer's ticks due by capture time t, every 10 s from the port's creation: a
        binding or request is removed by the first tick past its expiry second, the error state
        ends at the first tick past its period. Removals show after the frame before idx."""
        f = self.cfg["featuresEnabled"]
        while (self.ticks + 1) * TICK_US - 500_000 <= round(t * 1e6):
            self.ticks += 1
            now = UPTIME_AT_START + self.ticks * TICK_US // 1_000_000
            if not f & 0x4:
                continue
            for v in [v for v in self.vmis if v["method"] != "Static" and v["expiry"] < now]:
                self.delete(v, idx - 1)
            self.reqs = [r for r in self.reqs if r["expiry"] >= now]
            if f & 0x8 and self.cfg["arpRateLimit"] and self.err and now > self.err_end:
                self.tx, self.err = Limiter(self.cfg["arpRateLimit"], self.ticks * 10 - 0.5), False

    def find(self, vlan, m, a):
        return next((v for v in self.vmis if (v["vlan"], v["mac"], v["ip"]) == (vlan, m, a)), None)

    def find_client(self, vlan, chaddr, cid):
        return next((v for v in self.vmis if v["vlan"] == vlan and v["method"] == "DHCP Snooping"
                     and same_client(v, chaddr, cid)), None)

    def delete(self, v, idx):
        self.vmis.remove(v)
        self.events.append({"index": idx, "event": "portdb.entry.removed", **key(v)})

    def add(self, v, idx):
        if self.find(v["vlan"], v["mac"], v["ip"]) or len(self.vmis) >= self.cfg["portDbSize"]:
            return
        self.vmis.append(v)
        self.events.append({"index": idx, "event": "portdb.entry.added", **key(v)})

    def judge(self, idx, t, frame, p, from_vm):
        """Returns None (pass) or the rule that drops the frame."""
        self.age(idx, t)
        f, c = self.cfg["featuresEnabled"], self.counters
        if from_vm and p["tags"]:
            c["taggedDropCnt"] += 1
            return "tagged frame from the VM inside its VLAN (taggedDropCnt)"
        is_arp = p["etype"] == 0x0806
        if f & 0x8:
            if self.cfg["arpRateLimit"]:
                if not from_vm and is_arp and self.rx.reached(t):
                    c["rxRateLimitDropCnt"] += 1
                    return "ARP rate limit, to the VM (rxRateLimitDropCnt)"
                if from_vm:
                    if self.err:
                        if self.tx.reached(t):
                            c["txRateLimitDropCnt"] += 1
                            return "error-rate-limit state (txRateLimitDropCnt)"
                    elif is_arp and self.tx.reached(t):
                        self.tx, self.err = Limiter(self.cfg["errRateLimit"], t), True
                        self.err_end = uptime(t) + self.cfg["errRateLimitPeriod"]
                        c["txRateLimitErrEntryCnt"] += 1
                        c["txRateLimitDropCnt"] += 1
                        return "ARP rate limit exceeded, port enters the error-rate-limit state"
            a = p.get("arp")
            if from_vm and is_arp and a and a["ok"] and a["spa"] != "0.0.0.0":
                if not self.find(p["vlan"], a["sha"], a["spa"]):
                    c["daiDropCnt"] += 1
                    return "ARP inspection: sender MAC/IP not bound on its VLAN (daiDropCnt)"
        if f & 0x1 and p["dst"] in BPDU_MACS:
            return "BPDU filter"
        u = p.get("udp")
        if f & 0x2 and from_vm and u and u["sport"] == (547 if "ipv6" in p else 67):
            return "DHCP server block: DHCPv6 server message" if "ipv6" in p else "DHCP server block"
        if f & 0x4:
            why = self.discover(idx, t, frame, p, from_vm)
            if why:
                return why
        v4 = p.get("ipv4")
        if f & 0x10 and from_vm and v4:
            if not (u and u["dport"] == 67) and not self.find(p["vlan"], p["src"], v4["src"]):
                c["ipSrcGuardDropCnt"] += 1
                return "IP source guard: source MAC/IP not bound on its VLAN (ipSrcGuardDropCnt)"
        return None

    def discover(self, idx, t, frame, p, from_vm):
        v4, u = p.get("ipv4"), p.get("udp")
        if v4 and u and not v4["frag"]:
            if from_vm and u["dport"] == 67:
                return self.client_dhcp(idx, t, frame, p)
            if not from_vm:
                return self.server_dhcp(idx, t, frame, p) if u["dport"] == 68 else None
        if not from_vm or not self.cfg["trusted"]:
            return None
        a = p.get("arp")
        if p["etype"] == 0x0806:
            if a and a["ok"] and a["spa"] != "0.0.0.0" and (a["op"] == 1 or (a["op"] == 2 and a["spa"] == a["tpa"])):
                v = self.find(p["vlan"], a["sha"], a["spa"])
                if not v:
                    self.add({"vlan": p["vlan"], "mac": a["sha"], "ip": a["spa"], "method": "ARP Snooping",
                              "leaseSeconds": 180, "expiry": uptime(t) + 180}, idx)
                elif v["method"] == "ARP Snooping":
                    v["expiry"] = uptime(t) + 180
        elif "ipv4" in p:
            # Traffic from a learned (not authoritative) binding renews it.
            v = self.find(p["vlan"], p["src"], p["ipv4"]["src"])
            if v and v["method"] == "ARP Snooping":
                v["expiry"] = uptime(t) + 180
        return None

    def client_dhcp(self, idx, t, frame, p):
        d, _ = parse_dhcp(frame, p["udp"])
        if not d:
            return None
        if not self.cfg["trusted"] and d["chaddr"] != p["src"]:
            self.counters["dhcpSnoopingDropCnt"] += 1
            return "DHCP from the VM with chaddr not its source MAC, untrusted port (dhcpSnoopingDropCnt)"
        vlan = p["vlan"]
        req = next((r for r in self.reqs if r["vlan"] == vlan and same_client(r, d["chaddr"], d["cid"])), None)
        if d["type"] in (1, 4, 7):
            if req:
                self.reqs.remove(req)
            v = self.find_client(vlan, d["chaddr"], d["cid"])
            if v:
                self.delete(v, idx)
        elif d["type"] == 3:
            if p["ipv4"]["dst"] == "255.255.255.255" and d["ciaddr"] == "0.0.0.0":
                v = self.find_client(vlan, d["chaddr"], d["cid"])
                if v:
                    self.delete(v, idx)
            if req:
                req["xid"] = d["xid"]
            else:
                self.reqs.append({"vlan": vlan, "xid": d["xid"], "chaddr": d["chaddr"], "cid": d["cid"],
                                  "expiry": uptime(t) + 60})
        return None

    def server_dhcp(self, idx, t, frame, p):
        d, _ = parse_dhcp(frame, p["udp"])
        if not d or d["type"] not in (5, 6):
            return None
        req = next((r for r in self.reqs if r["vlan"] == p["vlan"] and r["xid"] == d["xid"]
                    and r["chaddr"] == d["chaddr"]), None)
        if not req:
            return "DHCPACK answers no pending request of the port" if d["type"] == 5 else None
        v = self.find_client(req["vlan"], req["chaddr"], req["cid"])
        if d["type"] == 6:
            if v:
                self.delete(v, idx)
        elif not v:
            self.add({"vlan": req["vlan"], "mac": req["chaddr"], "ip": d["yiaddr"], "method": "DHCP Snooping",
                      "leaseSeconds": d["lease"], "chaddr": req["chaddr"], "cid": req["cid"],
                      "serverIp": d["siaddr"], "expiry": uptime(t) + d["lease"]}, idx)
        else:
            v["leaseSeconds"], v["expiry"] = d["lease"], uptime(t) + d["lease"]
            if v["ip"] != d["yiaddr"]:
                self.events.append({"index": idx, "event": "portdb.entry.removed", **key(v)})
                v["ip"] = d["yiaddr"]
                self.events.append({"index": idx, "event": "portdb.entry.added", **key(v)})
        self.reqs.remove(req)
        return None


def addr6(b):
    return str(ipaddress.IPv6Address(bytes(b)))


EXT_HEADERS = {0, 43, 44, 51, 60, 135, 139, 140}
UPPER_LEN = {6: 20, 17: 8, 58: 4}


def walk6(frame, l3):
    """The IPv6 header chain: (None, chain) or (why, None) for a chain that is refused."""
    if len(frame) < l3 + 40 or frame[l3] >> 4 != 6:
        return "malformed", None
    plen = 40 + struct.unpack_from("!H", frame, l3 + 4)[0]
    if l3 + plen > len(frame):
        return "malformed", None
    ip6 = frame[l3:l3 + plen]
    c = {"src": addr6(ip6[8:24]), "dst": addr6(ip6[24:40]), "frag": False, "later": False, "ip6": ip6}
    nxt, off, count = ip6[6], 40, 0
    while nxt in EXT_HEADERS:
        cut = "not in the first fragment" if c["frag"] else "malformed"
        if count == 8:
            return "over the limits", None
        if nxt == 0 and count:
            return "malformed", None
        if off + 2 > plen:
            return cut, None
        length = 8 if nxt == 44 else (ip6[off + 1] + 2) * 4 if nxt == 51 else (ip6[off + 1] + 1) * 8
        if off + length - 40 > 256:
            return "over the limits", None
        if off + length > plen:
            return cut, None
        count += 1
        if nxt == 44:
            if c["frag"]:
                return "malformed", None
            c["frag"] = True
            if struct.unpack_from("!H", ip6, off + 2)[0] & 0xFFF8:
                c.update(later=True, proto=ip6[off], off=off + length)
                return None, c
        nxt, off = ip6[off], off + length
    if off + UPPER_LEN.get(nxt, 0) > plen:
        return ("not in the first fragment" if c["frag"] else "malformed"), None
    c.update(proto=nxt, off=off)
    return None, c


def ipv6_kind(frame, p):
    why, c = walk6(frame, p["l3"])
    if why:
        return f"IPv6 ({why} header chain)"
    if c["later"]:
        return "IPv6 fragment (non-first)"
    ip6, off = c["ip6"], c["off"]
    behind = " in a fragment" if c["frag"] else " behind extension headers" if off > 40 else ""
    if c["proto"] == 58:
        k = ICMPV6_KIND.get(ip6[off], f"ICMPv6 type {ip6[off]}")
        if ip6[off] == 135 and c["src"] == "::":
            k = "NS (DAD)"
        return k + behind
    if c["proto"] == 17:
        sp, dp = struct.unpack_from("!HH", ip6, off)
        if 546 in (sp, dp) or 547 in (sp, dp):
            return DHCPV6_MSG.get(ip6[off + 8], "DHCPv6") + behind
        return "IPv6 UDP" + behind
    return f"IPv6 protocol {c['proto']}" + behind


def parse_dhcpv6(msg):
    """(type, xid, client DUID, [(address, valid lifetime)]) or None for a malformed message."""
    if len(msg) < 4 or msg[0] in (12, 13):
        return None
    typ, xid, cid, addrs = msg[0], int.from_bytes(msg[1:4], "big"), None, []

    def options(data):
        o = 0
        while o < len(data):
            if len(data) - o < 4:
                raise ValueError
            code, length = struct.unpack_from("!HH", data, o)
            if length > len(data) - o - 4:
                raise ValueError
            yield code, data[o + 4:o + 4 + length]
            o += 4 + length
    try:
        for code, val in options(msg[4:]):
            if code == 1:
                if len(val) > 130:
                    return None
                cid = bytes(val)
            elif code in (3, 4):
                head = 12 if code == 3 else 4
                if len(val) < head:
                    return None
                for sub, sval in options(val[head:]):
                    if sub == 5:
                        if len(sval) < 24:
                            return None
                        addrs.append((addr6(sval[0:16]), struct.unpack_from("!I", sval, 20)[0]))
    except ValueError:
        return None
    return typ, xid, cid, addrs


FHS_FIRST = "First come first served"
RULE_CHAIN = "IPv6 header chain malformed, too long or cut by a fragment"
RULE_SOURCE = "IPv6 source guard: source not bound on its VLAN"
RULE_ND = "ND inspection: an address or link-layer option not the VM's"


class Fhs:
    """Reference model of one port's IPv6 first-hop security: header chain, RA guard, DHCPv6
    guard, ND rate limit, ND inspection with first-come-first-served claims, DHCPv6 learning,
    source guard, in that order; frames from the VM are judged unless the port is trusted."""

    DROPS = ("headerChainDropCnt", "fragmentedNdDropCnt", "raGuardDropCnt", "dhcpv6GuardDropCnt",
             "sourceGuardDropCnt", "ndInspectionDropCnt", "claimRefusedDropCnt", "ndRateLimitDropCnt",
             "ndRateLimitErrEntryCnt", "bindingsEvictedCnt")

    def __init__(self, cfg, t_start):
        self.cfg, self.bindings, self.pending, self.events = cfg, [], [], []
        self.counters = {k: 0 for k in self.DROPS}
        self.nd = Limiter(cfg["ndRateLimit"], t_start)
        self.err = False

    def find(self, vlan, m, a):
        return next((b for b in self.bindings if (b["vlan"], b["mac"], b["ip"]) == (vlan, m, a)), None)

    def remove(self, b, idx):
        self.bindings.remove(b)
        self.events.append({"index": idx, "event": "fhs.binding.removed", **key(b)})

    def bind(self, idx, vlan, m, a, method, lifetime):
        b = self.find(vlan, m, a)
        if b:
            b.update(method=method, leaseSeconds=lifetime)
            return
        if len(self.bindings) >= self.cfg["bindingLimit"]:
            self.remove(self.bindings[0], idx)
            self.counters["bindingsEvictedCnt"] += 1
        b = {"vlan": vlan, "mac": m, "ip": a, "method": method, "leaseSeconds": lifetime}
        self.bindings.append(b)
        self.events.append({"index": idx, "event": "fhs.binding.added", **key(b)})

    def drop(self, counter, rule):
        self.counters[counter] += 1
        return f"{rule} ({counter})"

    def rate_limited(self, t, is_nd):
        """None, or the rule of a frame over the ND limit (counted)."""
        if self.err:
            if self.nd.reached(t):
                return self.drop("ndRateLimitDropCnt", "ND error-rate-limit state")
        elif is_nd and self.nd.reached(t):
            self.nd, self.err = Limiter(self.cfg["errRateLimit"], t), True
            self.counters["ndRateLimitErrEntryCnt"] += 1
            return self.drop("ndRateLimitDropCnt", "ND rate limit exceeded, port enters the error-rate-limit state")
        return None

    def judge(self, idx, t, frame, p, from_vm):
        f, enforce = self.cfg["featuresEnabled"], from_vm and not self.cfg["trusted"]
        limit = enforce and self.cfg["ndRateLimit"] and f & 0x40
        if p["etype"] != 0x86DD:
            return self.rate_limited(t, False) if limit else None
        why, c = walk6(frame, p["l3"])
        if why:
            return self.drop("headerChainDropCnt", RULE_CHAIN) if enforce and f & 0x01 else None
        ip6, icmp, learn = c["ip6"], None, None
        if not c["later"] and c["proto"] == 58:
            icmp = ip6[c["off"]]
            is_nd = 133 <= icmp <= 137
            if enforce and is_nd and c["frag"] and f & 0x01:
                return self.drop("fragmentedNdDropCnt", "fragmented ND or RA from the VM")
            if enforce and icmp in (134, 137) and f & 0x02:
                return self.drop("raGuardDropCnt", "RA guard: router advertisement or redirect from the VM")
            why = self.rate_limited(t, is_nd) if limit else None
            if why:
                return why
            if from_vm and icmp in (135, 136) and not c["frag"]:
                why = self.neighbor(idx, p, c, enforce)
                if why:
                    return why
        else:
            why = self.rate_limited(t, False) if limit else None
            if why:
                return why
            if not c["later"] and c["proto"] == 17:
                why, learn = self.udp(p, c, from_vm, enforce)
                if why:
                    return why
        if enforce and f & 0x20:
            if c["src"] == "::":
                if icmp not in (135, 131, 143, 133):
                    return self.drop("sourceGuardDropCnt", RULE_SOURCE)
            elif not self.find(p["vlan"], p["src"], c["src"]):
                return self.drop("sourceGuardDropCnt", RULE_SOURCE)
        # DHCPv6 learning only from a datagram that passed: a Release sent from
        # the address it gives back reaches the server.
        if learn:
            self.learn_dhcpv6(idx, p, c, from_vm)
        return None

    def neighbor(self, idx, p, c, enforce):
        f, ip6, off = self.cfg["featuresEnabled"], c["ip6"], c["off"]
        inspect = enforce and f & 0x40
        icmp = ip6[off:]
        if len(icmp) < 24:
            return self.drop("ndInspectionDropCnt", RULE_ND) if inspect else None
        typ, target = icmp[0], addr6(icmp[8:24])
        link_opt = 1 if typ == 135 else 2
        o = 24
        while o < len(icmp):
            olen = icmp[o + 1] * 8 if len(icmp) - o >= 2 else 0
            if olen == 0 or olen > len(icmp) - o:
                return self.drop("ndInspectionDropCnt", RULE_ND) if inspect else None
            if icmp[o] == link_opt and (olen < 8 or mac(icmp[o + 2:o + 8]) != p["src"]):
                return self.drop("ndInspectionDropCnt", RULE_ND) if inspect else None
            o += olen
        dad = typ == 135 and c["src"] == "::"
        if dad and f & 0x10:
            b = self.find(p["vlan"], p["src"], target)
            if b is None:
                self.bind(idx, p["vlan"], p["src"], target, FHS_FIRST, self.cfg["fcfsLifetime"])
        if not inspect:
            return None
        if not dad and not self.find(p["vlan"], p["src"], c["src"]):
            return self.drop("ndInspectionDropCnt", RULE_ND)
        if (dad or typ == 136) and not self.find(p["vlan"], p["src"], target):
            return self.drop("ndInspectionDropCnt", RULE_ND)
        return None

    def udp(self, p, c, from_vm, enforce):
        """The DHCPv6 guard: (drop reason or None, whether to learn once passed)."""
        f, ip6, off = self.cfg["featuresEnabled"], c["ip6"], c["off"]
        sp, dp = struct.unpack_from("!HH", ip6, off)
        if not (dp in (546, 547) or sp == 547) or off + 8 >= len(ip6):
            return None, False
        if enforce and f & 0x04 and ip6[off + 8] in (2, 7, 10, 13):
            return self.drop("dhcpv6GuardDropCnt", "DHCPv6 guard: server message from the VM"), False
        learnable = dp == 547 if from_vm else sp == 547 and dp == 546
        return None, bool(f & 0x08) and learnable and not c["frag"]

    def learn_dhcpv6(self, idx, p, c, from_vm):
        ip6, off = c["ip6"], c["off"]
        ulen = struct.unpack_from("!H", ip6, off + 4)[0]
        if ulen < 8 or ulen > len(ip6) - off:
            return None
        m = parse_dhcpv6(ip6[off + 8:off + ulen])
        if not m or m[2] is None:
            return None
        typ, xid, cid, addrs = m
        vlan = p["vlan"]
        if from_vm:
            if typ in (1, 3, 4, 5, 6):
                self.pending = [r for r in self.pending if (r["vlan"], r["cid"]) != (vlan, cid)]
                self.pending.append({"vlan": vlan, "xid": xid, "cid": cid, "mac": p["src"]})
            elif typ in (8, 9):
                for a, _ in addrs:
                    b = self.find(vlan, p["src"], a)
                    if b and b["method"] == "DHCPv6":
                        self.remove(b, idx)
            return None
        if typ != 7:
            return None
        r = next((r for r in self.pending if (r["vlan"], r["xid"], r["cid"]) == (vlan, xid, cid)), None)
        if not r:
            return None
        for a, valid in addrs:
            b = self.find(vlan, r["mac"], a)
            if valid == 0:
                if b and b["method"] != "Static":
                    self.remove(b, idx)
            else:
                self.bind(idx, vlan, r["mac"], a, "DHCPv6", valid)
        self.pending.remove(r)
        return None


def same_client(stored, chaddr, cid):
    if len(stored["cid"]) != len(cid):
        return False
    return stored["cid"] == cid if cid else stored["chaddr"] == chaddr


def key(v):
    return {"vlan": v["vlan"], "mac": v["mac"], "ip": v["ip"], "method": v["method"]}


def tshark_lines(path):
    out = subprocess.run(["tshark", "-r", path, "-o", "ip.defragment:FALSE", "-T", "fields",
                          "-e", "_ws.col.Info"], capture_output=True, text=True, check=True).stdout
    return [" ".join(line.split()) for line in out.splitlines()]


def dhcp_facts(records, vm_mac):
    """Addresses, lease and client identifiers as they appear in the DHCP messages."""
    facts = {"leases": [], "clientIds": set()}
    for _, frame in records:
        p = parse(frame)
        if "udp" not in p or "ipv4" not in p or p["ipv4"]["frag"]:
            continue
        if 67 not in (p["udp"]["sport"], p["udp"]["dport"]):
            continue
        d, _ = parse_dhcp(frame, p["udp"])
        if not d:
            continue
        if d["type"] == 5:
            facts["leases"].append({"ip": d["yiaddr"], "leaseSeconds": d["lease"], "xid": f"{d['xid']:#010x}"})
        if p["src"] == vm_mac:
            facts["clientIds"].add(d["cid"].hex() if d["cid"] else "")
    facts["clientIds"] = sorted(facts["clientIds"])
    return facts


def main():
    manifest, md = [], []
    for name, vm_mac, origin, how in CAPTURES:
        path = os.path.join(HERE, name + ".pcap")
        records = read_pcap(path)
        infos = tshark_lines(path)
        assert len(infos) == len(records), name
        t0 = records[0][0]
        vm_macs = {vm_mac, *EXTRA_VM_SRC_MACS.get(name, [])}
        frames = []
        for i, (t, frame) in enumerate(records, 1):
            p = parse(frame)
            frames.append({"index": i, "time": round(t - t0, 6), "fromVm": p["src"] in vm_macs,
                           "vlan": p["vlan"], "kind": kind(p, frame), "info": infos[i - 1]})
        results = []
        for cfg in CONFIGS:
            port = Port(cfg, -0.5)
            dropped = []
            for (t, frame), fr in zip(records, frames):
                why = port.judge(fr["index"], t - t0, frame, parse(frame), fr["fromVm"])
                if why:
                    dropped.append({"index": fr["index"], "rule": why})
            results.append({**cfg, "dropped": dropped, "events": port.events,
                            "bindings": [{**key(v), "leaseSeconds": v["leaseSeconds"]} for v in port.vmis],
                            "counters": {k: n for k, n in port.counters.items() if n},
                            "pendingRequests": [{"vlan": r["vlan"], "xid": f"{r['xid']:#010x}", "chaddr": r["chaddr"]}
                                                for r in port.reqs]})
        results.append(dual_stack(records, frames, t0))
        facts = dhcp_facts(records, vm_mac)
        entry = {"file": name + ".pcap", "origin": origin, "how": how, "vmMac": vm_mac,
                 "dhcp": {**SRV, **facts} if facts["leases"] or facts["clientIds"] else None,
                 "frames": frames,
                 "expected": {"bindings": results[0]["bindings"], "notes": NOTES.get(name, ""),
                              "configs": results}}
        manifest.append(entry)
        md.append(markdown(entry, os.path.getsize(path)))
    with open(os.path.join(HERE, "manifest.json"), "w") as f:
        json.dump(manifest, f, indent=1)
        f.write("\n")
    with open(os.path.join(HERE, "MANIFEST.md"), "w") as f:
        f.write(HEADER + "\n".join(md))
    print(f"make-manifest: {len(manifest)} captures")


def dual_stack(records, frames, t0):
    """Both agents on one port, the switch-security agent first: a frame it drops is not
    seen by the IPv6 agent."""
    cfg = DUAL_STACK
    v4, v6 = Port(cfg, -0.5), Fhs(cfg["ipv6"], -0.5)
    dropped, events = [], []
    for (t, frame), fr in zip(records, frames):
        p = parse(frame)
        why = v4.judge(fr["index"], t - t0, frame, p, fr["fromVm"]) or \
            v6.judge(fr["index"], t - t0, frame, p, fr["fromVm"])
        events += v4.events + v6.events
        v4.events, v6.events = [], []
        if why:
            dropped.append({"index": fr["index"], "rule": why})
    counters = {k: n for k, n in {**v4.counters, **v6.counters}.items() if n}
    return {**cfg, "dropped": dropped, "events": events,
            "bindings": [{**key(v), "leaseSeconds": v["leaseSeconds"]} for v in v4.vmis],
            "ipv6Bindings": [{**key(b), "lifetimeSeconds": b["leaseSeconds"]} for b in v6.bindings],
            "counters": counters,
            "pendingRequests": [{"vlan": r["vlan"], "xid": f"{r['xid']:#010x}", "chaddr": r["chaddr"]}
                                for r in v4.reqs]}


def markdown(e, size):
    lines = [f"## {e['file']}", "", f"{e['how']}", "",
             f"- VM MAC: {e['vmMac']}; {len(e['frames'])} frames, {size} bytes"]
    if e["dhcp"]:
        d = e["dhcp"]
        ids = ", ".join(x or "(none)" for x in d["clientIds"]) or "-"
        leases = "; ".join(f"{x['ip']} for {x['leaseSeconds']} s (xid {x['xid']})" for x in d["leases"]) or "-"
        lines.append(f"- DHCP server {d['serverIp']} ({d['serverMac']}); ACKs: {leases}; "
                     f"client identifiers sent by the VM: {ids}")
    lines += ["", "| # | t (s) | dir | VLAN | kind | tshark |", "|---|---|---|---|---|---|"]
    for fr in e["frames"]:
        info = fr["info"].replace("|", "\\|")
        lines.append(f"| {fr['index']} | {fr['time']:.6f} | {'from VM' if fr['fromVm'] else 'to VM'} | "
                     f"{fr['vlan']} | {fr['kind']} | {info} |")
    lines.append("")
    if e["expected"]["notes"]:
        lines += [e["expected"]["notes"], ""]
    for r in e["expected"]["configs"]:
        v6 = r.get("ipv6")
        lines.append(f"**{r['name']}** (features {r['featuresEnabled']:#04x}, "
                     f"{'trusted' if r['trusted'] else 'untrusted'}"
                     + (f", arpRateLimit {r['arpRateLimit']}, errRateLimit {r['errRateLimit']}" if r["arpRateLimit"] else "")
                     + (f"; IPv6 features {v6['featuresEnabled']:#04x}, ndRateLimit {v6['ndRateLimit']}, "
                        f"bindingLimit {v6['bindingLimit']}" if v6 else "")
                     + "):")
        lines.append("")
        drops = r["dropped"]
        if drops:
            groups = []
            for dr in drops:
                if groups and groups[-1][2] == dr["rule"] and groups[-1][1] == dr["index"] - 1:
                    groups[-1][1] = dr["index"]
                else:
                    groups.append([dr["index"], dr["index"], dr["rule"]])
            for a, b, rule in groups:
                lines.append(f"- drop {a if a == b else f'{a}-{b}'}: {rule}")
        else:
            lines.append("- every frame passes")
        for ev in r["events"]:
            lines.append(f"- frame {ev['index']}: {ev['event']} VLAN {ev['vlan']} {ev['mac']} {ev['ip']} ({ev['method']})")
        b = ", ".join(f"VLAN {x['vlan']} {x['mac']} {x['ip']} {x['method']} {x['leaseSeconds']} s"
                      for x in r["bindings"]) or "none"
        lines.append(f"- port database at the end: {b}")
        if "ipv6Bindings" in r:
            b = ", ".join(f"VLAN {x['vlan']} {x['mac']} {x['ip']} {x['method']} {x['lifetimeSeconds']} s"
                          for x in r["ipv6Bindings"]) or "none"
            lines.append(f"- IPv6 bindings at the end: {b}")
        if r["pendingRequests"]:
            lines.append("- pending requests at the end: " + ", ".join(
                f"VLAN {x['vlan']} xid {x['xid']} chaddr {x['chaddr']}" for x in r["pendingRequests"]))
        if r["counters"]:
            lines.append("- counters: " + ", ".join(f"{k} {n}" for k, n in r["counters"].items()))
        lines.append("")
    return "\n".join(lines)


NOTES = {
    "dhclient6-lease-renew-release":
        "Learning and enforcing judge only DHCPv6 server messages from the VM: every frame passes. "
        "Dual-stack: the link-local DAD binds fe80::5eff:fec0:31 first come first served; MLD reports "
        "from the unspecified address pass source guard; the Solicit and then the Request are pending "
        "(one slot per client DUID), the Reply matching the Request's transaction binds 2001:db8:1::1c6 "
        "for its valid lifetime (120 s); the Advertise binds nothing. The DAD of the leased address "
        "finds its own binding; the Renew's Reply only extends it; the Release removes it.",
    "udhcpc6-lease-renew-release":
        "udhcpc6 closes its socket between messages, so the VM answers the server's messages with ICMPv6 "
        "port unreachable (from a bound address: they pass). Dual-stack: the Reply to the Request binds "
        "2001:db8:1::147 (DHCPv6, 120 s); the renewal is a Request from the leased address with the same "
        "transaction ID, pending again, and its Reply (from the server's global address) only extends "
        "the binding. The Release, sent from the leased address, is judged by source guard while that "
        "address is still bound, passes, and only then removes the binding, so the server frees the "
        "lease (dhclient sends its Release from the link-local address instead).",
    "slaac-privacy-dad":
        "Dual-stack: each DAD solicitation from the unspecified address binds its target first come "
        "first served (link-local, stable and temporary address); every later frame of the VM is from "
        "one of them, so nothing is dropped. The VM's solicitation for the router (target not its own) "
        "is not a claim and passes ND inspection on its bound source.",
    "attack6-ra-guard":
        "Dual-stack: advertisements and the redirect from the VM are dropped by RA guard also behind "
        "hop-by-hop and destination-options headers; the first fragment whose chain runs into the next "
        "fragment is dropped by the header chain check, the fragment after it carries no header to "
        "judge and passes source guard; the atomic fragment holding a whole RA is dropped as "
        "fragmented ND. The VM's router solicitation and the router's advertisement to it pass.",
    "attack6-dhcpv6-server":
        "Enforcing and dual-stack: the IPv4 agent's DHCP server block drops UDP from port 547 right "
        "behind the IPv6 header (frames 5-8, including the Relay-Reply to port 547), so the IPv6 agent "
        "never sees them; the Reply behind a destination-options header escapes it and is dropped by "
        "the DHCPv6 guard. The VM's Solicit passes.",
    "attack6-nd-spoof":
        "Dual-stack: an advertisement passes only for a target bound to the VM (the router's "
        "addresses and the other host's are not); a link-layer address option must be the frame's "
        "source MAC; a solicitation's source must be bound. The VM's solicitation for the router and "
        "its advertisement of its own address pass; the router's answer to the VM passes.",
    "attack6-ip-spoof":
        "Dual-stack: source guard keys on VLAN, MAC and address: an address the VM does not hold, its "
        "own address with another MAC or on VLAN 100 are dropped; UDP from the unspecified address is "
        "dropped (only DAD, MLD reports and router solicitations may use it); the MLDv2 report passes. "
        "Frames to the VM are not judged.",
    "attack6-unsolicited-reply":
        "Dual-stack: a Reply binds only when it answers a pending client message of the port by VLAN, "
        "transaction ID and client DUID; the others pass to the VM (it ignores them) and bind nothing, "
        "so source guard drops the VM's UDP from their addresses; the matching Reply binds "
        "2001:db8:1::110, whose UDP passes.",
    "attack6-address-flood":
        "Dual-stack: every DAD claim binds (4 a second stays under the ND limit); from the 63rd claim on "
        "the port is at its 64 bindings and each new one evicts the oldest dynamic binding: the "
        "link-local, the DHCPv6 address, then the first two claims (bindingsEvictedCnt 4). UDP from "
        "those is then dropped by source guard; UDP from the third and the last claim passes.",
    "attack6-nd-flood":
        "Dual-stack: as for ARP, ND frames over 10 a second put the port in the error state (frame 15, "
        "the 11th in its second) and the limiter restarts with errRateLimit 5: frames 16-20 pass, 21-29 "
        "are dropped; in the next second 5 of the 8 UDP frames pass (every frame of the VM counts in "
        "the error state).",
    "dhclient-lease-renew-release":
        "dhclient sends no client identifier, so the binding is keyed by chaddr. The renewal is a unicast "
        "REQUEST with ciaddr set and the same xid as the first exchange: it becomes a pending request and "
        "its ACK only extends the lease (no event). The VM's ARP request for the server carries the leased "
        "address, which the database already holds by DHCP, so ARP snooping leaves it alone. The "
        "DHCPRELEASE removes the binding.",
    "dhclient-reboot-nak":
        "The INIT-REBOOT REQUEST (broadcast, ciaddr 0) is recorded as pending; the NAK (sent to the "
        "broadcast MAC and IP) matches it by xid and chaddr and removes it (there is no binding to "
        "delete). The DISCOVER clears nothing; the second REQUEST/ACK binds 192.0.2.102; the release "
        "removes it.",
    "udhcpc-no-clientid":
        "udhcpc -a sends an ARP probe (sender 0.0.0.0) for its address after every ACK, also after the "
        "renewal; probes pass inspection and teach nothing. The renewal reuses the xid of the first "
        "exchange.",
    "udhcpc-custom-clientid":
        "Every message of the VM carries the client identifier ff00000001000100015ec00004; the binding "
        "is keyed by it, and the renewal and release find it through it.",
    "udhcpc-renew-nak":
        "The renewal (unicast, ciaddr 192.0.2.103) is pending when the NAK arrives; the NAK matches it "
        "and removes the binding (removed event at the NAK). The new exchange binds 192.0.2.113 under "
        "the same client identifier 01+MAC.",
    "arp-probe-announce":
        "Learning: the probes (sender 0.0.0.0) teach nothing; the first gratuitous request creates an "
        "ARP Snooping entry (180 s), later gratuitous requests/replies and the kernel's request refresh "
        "it; the VM's ordinary reply to the server (last frame) teaches nothing by itself. Enforcing: "
        "an untrusted port learns nothing from ARP, so every ARP frame of the VM with a sender address "
        "fails inspection and its ICMP fails source guard; only the probes and the frames to the VM pass.",
    "attack-ip-spoof":
        "Frame 8 is sent by the VM with a MAC it does not own (02:00:5e:c0:00:99) and its leased address: "
        "it is from the VM (the port it arrives on), and source guard drops it because the key is "
        "VLAN+MAC+IP. The UDP frame from 0.0.0.0 to port 53 is not a DHCP client frame (only "
        "destination port 67 is exempt) and is dropped. ICMP to the VM from any address passes.",
    "attack-arp-spoof":
        "Learning (trusted): the gratuitous request claiming 192.0.2.20 is learned as an ARP Snooping "
        "entry of the VM, as the rule for trusted ports says; the gratuitous reply refreshes it; the "
        "reply claiming the server's address is not gratuitous and teaches nothing. Enforcing: every "
        "ARP from the VM whose sender MAC+IP is not bound is dropped, including the one whose sender "
        "MAC is not the frame's source MAC; the probe and the spoofed reply towards the VM pass.",
    "attack-arp-flood":
        "Enforcing: ARP frames 1-10 of the flood pass (frames 3-12); the 11th (frame 13) is over the "
        "limit of 10, the port enters the error-rate-limit state (txRateLimitErrEntryCnt 1) and the "
        "limiter restarts with errRateLimit 5, so frames 14-18 pass and 19-52 are dropped within that "
        "interval; of the 8 ICMP frames in the next interval 5 pass and 3 are dropped (every kind of "
        "frame counts in the error state). To the VM, the 11th to 15th ARP frame within one second "
        "are dropped (rxRateLimitDropCnt 5) and the ICMP reply is not counted.",
    "attack-rogue-dhcp-server":
        "The listed ACK is the rogue one sent by the VM (server id 192.0.2.110). Nothing is learned from "
        "server messages sent by the VM (IP discovery reads ACKs only towards the VM). Enforcing: the "
        "DHCP server block drops UDP source port 67 over IPv4 and 547 over IPv6 from the VM; the real "
        "server's OFFER to the VM passes.",
    "attack-bpdu":
        "IEEE 802.3 frames with LLC (STP) or LLC/SNAP (PVST+). The BPDU filter drops them in both "
        "directions; nothing else looks at them.",
    "lifetimes":
        "Ticks at 9.5 s, 19.5 s, ... read uptime 1010, 1020, ... The request of frame 1 (uptime 1000) "
        "is pending until 1060: the tick reading 1060 keeps it, and its repeat (frame 3, a new xid) "
        "keeps that lifetime, so frame 4 answers it and binds 192.0.2.110 until 1120. The tick reading "
        "1120 keeps the lease (frame 8 passes source guard), the one reading 1130 removes it (after "
        "frame 8). The renewal of frame 5 is pending until 1121, its repeat (frame 6) does not extend "
        "it, so the tick reading 1130 ends it and frame 9 answers nothing. Learning: frame 2 learns "
        "192.0.2.150 until 1181, frame 7 renews it to 1281, so it outlives the tick reading 1190. "
        "Enforcing: frame 20 enters the error state at 1140 until 1150; at 155 s every frame counts "
        "against errRateLimit 5 (frame 26 dropped); the tick reading 1160 ends it, so at 160 s the "
        "six ARP probes pass.",
    "attack-policy-edges":
        "Enforcing: the DHCP server block drops only UDP from the server port of the frame's own family "
        "sent by the VM, so all four UDP frames pass the IPv4 agent. ARP inspection reads only "
        "Ethernet/IPv4 ARP: the four other headers pass although their sender is not bound (and teach the "
        "learning port nothing). To the VM, ARP is limited per interval of one second opened by the "
        "first counted frame: the 11th of each burst is dropped (rxRateLimitDropCnt 2), the ICMP is not "
        "counted, and the last ARP opens a new interval. ARP snooping (learning) learns the gratuitous "
        "reply's address and nothing from operation 3; enforcing drops both by ARP inspection.",
    "attack-dhcp-client-edges":
        "A NAK that answers no request of the port (by VLAN, xid and chaddr) passes and changes nothing. "
        "VLANs are kept apart: the VLAN 5 REQUEST neither ends the VLAN 0 binding nor is answered by the "
        "untagged ACK (dropped), and the VLAN 5 DISCOVER ends its request, so the VLAN 5 ACK is dropped "
        "too. A DECLINE or DISCOVER from the VM, or a NAK answering the pending renewal, ends both the "
        "binding and the renewal: its ACK is dropped. A client with an identifier and one without are "
        "two clients: the RELEASE without it ends only the request made without it, whose ACK is then "
        "dropped; the RELEASE with it ends the binding. A broadcast REQUEST ends the binding at once only "
        "without ciaddr (a client selecting or rebooting), not while rebinding.",
    "attack-unsolicited-ack":
        "An ACK must match a pending request by VLAN, xid and chaddr: the ACK without any request, the "
        "one with another xid and the one with another chaddr are dropped in both configurations; the "
        "matching one binds. A dropped ACK does not consume the pending request.",
    "attack-chaddr-mismatch":
        "Learning (trusted): the request is accepted and the binding is made for the chaddr "
        "02:00:5e:c0:00:99 (the MAC of a binding comes from the request's chaddr, not from the frame's "
        "source); the DISCOVER with that chaddr removes it. Enforcing (untrusted): both client messages "
        "are dropped (dhcpSnoopingDropCnt 2) and, with no pending request, the ACK is dropped too.",
    "attack-malformed-dhcp":
        "A client message that does not parse passes and records nothing, so the ACK for its xid is "
        "dropped. The ACK without a lease time (frame 10) does not parse either: it passes, learns "
        "nothing and leaves the pending request in place, so the good ACK (frame 11) binds.",
    "attack-ip-fragments":
        "Fragments are never read as DHCP (more-fragments bit or offset set). The request therefore "
        "leaves no pending request and the unfragmented ACK for its xid is dropped; the fragmented ACK "
        "to the VM passes unread. Enforcing: the first fragment carries the UDP header with destination "
        "port 67 and passes source guard; the non-first fragment (source 0.0.0.0) does not (its bytes "
        "where a UDP header would be are zero) and is dropped.",
    "attack-vlan100":
        "Bindings are per VLAN: the DHCP binding is on VLAN 100. Enforcing: the untagged ICMP and ARP "
        "from the same MAC and address (VLAN 0) are dropped, the tagged ones pass. Learning: the "
        "untagged ARP request creates a separate ARP Snooping entry on VLAN 0.",
    "attack-stacked-tags":
        "The outer tag, whatever its TPID, is the frame's VLAN (here 0); a tag inside it from the VM "
        "is dropped before any feature looks (both settings: no port allows tagged frames), so ARP "
        "inside two or three tags cannot pass as something other than ARP. Under one 802.1ad tag the "
        "ICMP frames are plain VLAN 0 IPv4: enforcing drops the spoofed source and passes the leased "
        "one. The 41-byte ARP reply is judged padded to 60 bytes, so its sender fields are read and "
        "inspection drops it. Tagged frames to the VM pass.",
    "example-dhcp-then-spoof":
        "The README's example: a real dhclient lease (and renewal), then spoofing from the same VM. "
        "Enforcing: ICMP from the leased address passes; IPv4 from 192.0.2.66 and from the server's "
        "address is dropped by source guard; the ARP replies claiming 192.0.2.1 are dropped by "
        "inspection; the ARP request from the leased address passes. Learning (trusted): the "
        "gratuitous reply claiming 192.0.2.1 is learned as an ARP Snooping entry of the VM, which is "
        "what a trusted port does.",
}

HEADER = """# Test captures

Regenerate (as root, about a minute):

    bash scripts/setup.sh --capture-tools
    bash tests/data/make-captures.sh          # real clients and server in network namespaces
    bash tests/data/make-captures6.sh         # the same for IPv6 (about 80 s: a DHCPv6 renewal)
    /usr/bin/python3 tests/data/make-attacks.py  # crafted attacks and the combined example
    /usr/bin/python3 tests/data/make-attacks6.py # crafted IPv6 attacks
    /usr/bin/python3 tests/data/make-manifest.py # this file and manifest.json

Directions: every capture is taken on (or stands for) the VM's port; "from VM"
frames are the ones the VM sends (direction 2, transmit), "to VM" the ones
delivered to it (direction 1, receive). Untagged frames are VLAN 0; a tagged
frame's VLAN is the VID of its outer tag (TPID 0x8100, 0x88a8 or 0x9100), which
the port sees as metadata, as a virtual switch hands frames over; a frame from
the VM with a further tag is dropped first (taggedDropCnt). Frames shorter than
60 bytes are judged padded with zeros. Frame numbers start at 1, as in tshark.

The expectations below are computed by make-manifest.py from the frames with a
reference model of the port's rules: the checks run in the order ARP rate limit
and ARP inspection, BPDU filter, DHCP server block, IP discovery (DHCP
snooping, ARP snooping), IP source guard. Two port configurations:

- **learning**: features 0x04 (IP discovery alone), trusted port, the
  configuration every new port starts with. DHCP and ARP snooping learn;
  only DHCPACKs that answer no pending request are dropped.
- **enforcing**: features 0x1f (BPDU filter 0x1, DHCP server block 0x2,
  IP discovery 0x4, ARP inspection 0x8, IP source guard 0x10), untrusted
  port (required by inspection and source guard, and so no ARP learning),
  arpRateLimit 10, errRateLimit 5, errRateLimitPeriod 10.

The port's clock is the capture's clock (the port configured 0.5 s before the
first frame, at uptime 1000 s). The port timer ticks every 10 s from then: a
pending request (60 s), a lease, or an ARP entry (180 s, renewed by the VM's
traffic on a trusted port) goes at the first tick whose uptime second is past
its expiry, and the error-rate-limit state ends at the first tick past its
period; only the lifetimes capture lasts long enough for any of it.
DHCP bindings are keyed by VLAN, chaddr and client identifier (option 61) when
present, which is how a renewal, release or NAK finds the client's entry.

A third setting, **dual-stack** (examples/dual-stack.json), puts the
IPv6 first-hop security agent on the port beside the enforcing switch-security
agent, which judges each frame first (a frame it drops is not seen by the
second): IPv6 features 0x7f (header chain 0x01, RA guard 0x02, DHCPv6 guard
0x04, DHCPv6 snooping 0x08, first come first served 0x10, source guard 0x20,
ND inspection 0x40), untrusted, bindingLimit 64, ndRateLimit 10, errRateLimit
5, errRateLimitPeriod 10, first-come-first-served lifetime 600 s. Its model
judges in the order header chain, RA guard, DHCPv6 guard, ND rate limit, ND
inspection with duplicate-address-detection claims, DHCPv6 snooping, source
guard. IPv6 bindings are keyed by VLAN, MAC and address; a DHCPv6 Reply binds
when it matches a pending client message by VLAN, transaction ID and client
DUID. No IPv6 capture lasts long enough for a binding or a pending message
to age out.

"""

if __name__ == "__main__":
    main()
