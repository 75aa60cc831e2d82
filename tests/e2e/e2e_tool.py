#!/usr/bin/python3
"""Traffic for the inline end-to-end test, run inside one of its namespaces.

  attack NAME IFACE VM_MAC VM_IP GATEWAY_IP   one attack frame from the guarded VM
  unsolicited-ack IFACE VM_MAC SERVER_IP      a DHCP ACK from the network that answers no request
  release IFACE CLIENT_IP SERVER_IP           a DHCP RELEASE of CLIENT_IP from IFACE's MAC (client
                                              ID 01+MAC, as udhcpc and dhclient send it)
  udp-listen PORT SECONDS LAST_SOURCE         prints the sources of the datagrams it gets, one a line,
                                              until one from LAST_SOURCE or SECONDS
  udp-send SRC_IP DST_IP DST_MAC PORT IFACE   one datagram from SRC_IP (spoofed when not ours)
  tcp-sink PORT                               takes one connection, prints the bytes received
  tcp-send HOST PORT BYTES                    sends BYTES bytes, exits 0 once all went
  junk SOCKET                                 junk and a stalled request to a control socket
  arp-flood IFACE VM_MAC VM_IP COUNT          COUNT ARP requests from the VM as fast as it can
  after-ack IFACE PORT SECONDS                waits for a DHCP ACK to IFACE's MAC and at once sends a
                                              datagram from the address it gives to the server's PORT
  runt IFACE DST_MAC                          one 20-byte frame (ethertype 0x88b5)
  runt-length IFACE SECONDS                   prints the length of the first 0x88b5 frame it gets
  vlan-arp IFACE VID SENDER_IP TARGET_IP      one ARP request tagged with VID (raw socket: no 802.1Q
                                              module needed)
  vlan-listen IFACE SENDER_IP SECONDS         prints the VLAN of the first ARP frame from SENDER_IP,
                                              from the tag in its bytes or in its metadata, or "none"
"""
import struct
import socket
import sys
import time


def scapy():
    import logging
    logging.getLogger("scapy.runtime").setLevel(logging.ERROR)
    import scapy.all as s
    s.conf.verb = 0
    return s


def attack(name, iface, vm_mac, vm_ip, gateway_ip):
    s = scapy()
    if name == "ip-spoof":
        frame = s.Ether(src=vm_mac, dst="ff:ff:ff:ff:ff:ff") / s.IP(src="192.0.2.66", dst=gateway_ip) / s.UDP(
            sport=4000, dport=9999) / b"spoof"
    elif name == "arp-gateway":
        frame = s.Ether(src=vm_mac, dst="ff:ff:ff:ff:ff:ff") / s.ARP(
            op=2, hwsrc=vm_mac, psrc=gateway_ip, hwdst="ff:ff:ff:ff:ff:ff", pdst=gateway_ip)
    elif name == "rogue-offer":
        frame = (s.Ether(src=vm_mac, dst="ff:ff:ff:ff:ff:ff") / s.IP(src=vm_ip, dst="255.255.255.255") /
                 s.UDP(sport=67, dport=68) /
                 s.BOOTP(op=2, yiaddr="192.0.2.99", siaddr=vm_ip, chaddr=bytes.fromhex("02aabbccddee"), xid=0x1234) /
                 s.DHCP(options=[("message-type", "offer"), ("server_id", vm_ip), ("lease_time", 600), "end"]))
    elif name == "bpdu":
        frame = s.Dot3(src=vm_mac, dst="01:80:c2:00:00:00") / s.LLC(dsap=0x42, ssap=0x42, ctrl=3) / s.STP(
            rootid=0, rootmac=vm_mac, bridgeid=0, bridgemac=vm_mac)
    elif name in ("arp-two-8021q", "arp-8021ad-8021q"):
        # ARP claiming the gateway behind a tag inside the port's VLAN (the outer one).
        outer = s.Ether(src=vm_mac, dst="ff:ff:ff:ff:ff:ff", type=0x8100 if name == "arp-two-8021q" else 0x88a8)
        frame = outer / s.Dot1Q(vlan=0, type=0x8100) / s.Dot1Q(vlan=0) / s.ARP(
            op=2, hwsrc=vm_mac, psrc=gateway_ip, hwdst="ff:ff:ff:ff:ff:ff", pdst=gateway_ip)
    elif name == "ip-8021ad":
        frame = s.Ether(src=vm_mac, dst="ff:ff:ff:ff:ff:ff", type=0x88a8) / s.Dot1Q(vlan=0) / s.IP(
            src="192.0.2.68", dst=gateway_ip) / s.UDP(sport=4000, dport=9999) / b"802.1ad spoof"
    elif name == "llc-snap-ip":
        frame = s.Dot3(src=vm_mac, dst="ff:ff:ff:ff:ff:ff") / s.LLC(dsap=0xaa, ssap=0xaa, ctrl=3) / s.SNAP(
            OUI=0, code=0x0800) / s.IP(src="192.0.2.69", dst=gateway_ip) / s.UDP(sport=4000, dport=9999)
    elif name == "rarp":
        frame = s.Ether(src=vm_mac, dst="ff:ff:ff:ff:ff:ff", type=0x8035) / s.ARP(
            op=3, hwsrc=vm_mac, psrc=gateway_ip, hwdst=vm_mac, pdst=gateway_ip)
    elif name == "tagged-own":
        # The VM's own address behind a tag of its own: passes where the port allows tagged frames.
        frame = s.Ether(src=vm_mac, dst="ff:ff:ff:ff:ff:ff") / s.Dot1Q(vlan=0) / s.Dot1Q(vlan=5) / s.IP(
            src=vm_ip, dst=gateway_ip) / s.UDP(sport=4000, dport=9999) / b"tagged"
    elif name == "vlan-spoof":
        frame = s.Ether(src=vm_mac, dst="ff:ff:ff:ff:ff:ff") / s.Dot1Q(vlan=100) / s.IP(
            src="192.0.2.67", dst=gateway_ip) / s.UDP(sport=4000, dport=9999) / b"tagged spoof"
    else:
        sys.exit("unknown attack " + name)
    s.sendp(frame, iface=iface)


def unsolicited_ack(iface, vm_mac, server_ip):
    s = scapy()
    server_mac = s.get_if_hwaddr(iface)
    frame = (s.Ether(src=server_mac, dst=vm_mac) / s.IP(src=server_ip, dst="255.255.255.255") /
             s.UDP(sport=67, dport=68) /
             s.BOOTP(op=2, yiaddr="192.0.2.77", siaddr=server_ip, chaddr=bytes.fromhex(vm_mac.replace(":", "")),
                     xid=0x0badf00d) /
             s.DHCP(options=[("message-type", "ack"), ("server_id", server_ip), ("lease_time", 600),
                             ("subnet_mask", "255.255.255.0"), "end"]))
    s.sendp(frame, iface=iface)


def release(iface, client_ip, server_ip):
    # Made by hand, not with scapy: sent at once, within the second the test needs.
    mac = mac_of(iface)
    options = (b"\x63\x82\x53\x63" + b"\x35\x01\x07" + b"\x36\x04" + socket.inet_aton(server_ip) +
               b"\x3d\x07\x01" + mac + b"\xff")
    bootp = (b"\x01\x01\x06\x00" + (0x5e1ea5e).to_bytes(4, "big") + b"\x00" * 4 + socket.inet_aton(client_ip) +
             b"\x00" * 12 + mac + b"\x00" * 10 + b"\x00" * 192 + options)
    udp = (68).to_bytes(2, "big") + (67).to_bytes(2, "big") + (8 + len(bootp)).to_bytes(2, "big") + b"\x00\x00" + bootp
    header = bytearray(b"\x45\x00" + (20 + len(udp)).to_bytes(2, "big") + b"\x00\x00\x40\x00\x40\x11\x00\x00" +
                       socket.inet_aton(client_ip) + socket.inet_aton(server_ip))
    header[10:12] = ipv4_checksum(bytes(header))
    raw_socket(iface).send(b"\xff" * 6 + mac + b"\x08\x00" + bytes(header) + udp)


def udp_listen(port, seconds, last_source):
    # IPv4 or IPv6, as the last source awaited is written.
    ipv6 = ":" in last_source
    sock = socket.socket(socket.AF_INET6 if ipv6 else socket.AF_INET, socket.SOCK_DGRAM)
    sock.bind(("::" if ipv6 else "0.0.0.0", port))
    deadline = time.monotonic() + seconds
    print("listening", flush=True)
    while True:
        left = deadline - time.monotonic()
        if left <= 0:
            return
        sock.settimeout(left)
        try:
            _, address = sock.recvfrom(2048)
        except socket.timeout:
            return
        print(address[0], flush=True)
        if address[0] == last_source:
            return


def udp_send(src_ip, dst_ip, dst_mac, port, iface):
    s = scapy()
    mac = s.get_if_hwaddr(iface)
    # Sent as a frame so that a source the VM does not own goes out as it is.
    frame = s.Ether(src=mac, dst=dst_mac) / s.IP(src=src_ip, dst=dst_ip) / s.UDP(
        sport=4000, dport=port) / b"hello"
    s.sendp(frame, iface=iface)


def tcp_sink(port):
    server = socket.socket()
    server.setsockopt(socket.SOL_SOCKET, socket.SO_REUSEADDR, 1)
    server.bind(("0.0.0.0", port))
    server.listen(1)
    server.settimeout(60)
    connection, _ = server.accept()
    total = 0
    while True:
        chunk = connection.recv(1 << 16)
        if not chunk:
            break
        total += len(chunk)
    print(total, flush=True)


def tcp_send(host, port, count):
    connection = socket.create_connection((host, port), timeout=30)
    block = b"x" * (1 << 16)
    left = count
    while left > 0:
        connection.sendall(block[:min(left, len(block))])
        left -= min(left, len(block))
    connection.shutdown(socket.SHUT_WR)
    connection.recv(1)
    connection.close()


def junk(path):
    """Junk gets an error; a request left half way is cut off; neither stalls others."""
    bad = socket.socket(socket.AF_UNIX)
    bad.connect(path)
    bad.sendall(b"this is not json\n")
    bad.settimeout(5)
    reply = bad.recv(4096)
    if b'"ok":false' not in reply:
        sys.exit("junk got: %r" % reply)
    stalled = socket.socket(socket.AF_UNIX)
    stalled.connect(path)
    stalled.sendall(b'{"command": "po')
    good = socket.socket(socket.AF_UNIX)
    good.connect(path)
    good.sendall(b'{"command": "ports"}\n')
    good.settimeout(5)
    reply = good.recv(65536)
    if b'"ok":true' not in reply:
        sys.exit("a good request behind a stalled one got: %r" % reply)
    print("ok")


def raw_socket(iface):
    sock = socket.socket(socket.AF_PACKET, socket.SOCK_RAW, socket.htons(0x0003))
    sock.bind((iface, 0))
    return sock


def mac_of(iface):
    with open("/sys/class/net/%s/address" % iface) as f:
        return bytes.fromhex(f.read().strip().replace(":", ""))


def arp_flood(iface, vm_mac, vm_ip, count):
    sock = raw_socket(iface)
    mac = bytes.fromhex(vm_mac.replace(":", ""))
    frame = (b"\xff" * 6 + mac + b"\x08\x06" + bytes.fromhex("0001080006040001") + mac + socket.inet_aton(vm_ip) +
             b"\x00" * 6 + socket.inet_aton("192.0.2.1") + b"\x00" * 18)
    for _ in range(count):
        sock.send(frame)


def ipv4_checksum(header):
    total = sum(int.from_bytes(header[i:i + 2], "big") for i in range(0, len(header), 2))
    while total >> 16:
        total = (total & 0xffff) + (total >> 16)
    return (~total & 0xffff).to_bytes(2, "big")


def after_ack(iface, port, seconds):
    sock = raw_socket(iface)
    sock.settimeout(seconds)
    mac = mac_of(iface)
    while True:
        frame = sock.recv(2048)
        ip = frame[14:]
        if frame[12:14] != b"\x08\x00" or ip[9] != 17:
            continue
        udp = ip[(ip[0] & 15) * 4:]
        bootp = udp[8:]
        if udp[0:4] != b"\x00\x43\x00\x44" or bootp[28:34] != mac or b"\x35\x01\x05" not in bootp[240:]:
            continue
        yiaddr = bootp[16:20]
        payload = b"first"
        header = bytearray(b"\x45\x00" + (28 + len(payload)).to_bytes(2, "big") + b"\x00\x00\x40\x00\x40\x11\x00\x00" +
                           yiaddr + ip[12:16])
        header[10:12] = ipv4_checksum(bytes(header))
        datagram = (4000).to_bytes(2, "big") + port.to_bytes(2, "big") + (8 + len(payload)).to_bytes(2, "big") + b"\x00\x00"
        sock.send(frame[6:12] + mac + b"\x08\x00" + bytes(header) + datagram + payload)
        print(socket.inet_ntoa(yiaddr))
        return


def runt(iface, dst_mac):
    raw_socket(iface).send(bytes.fromhex(dst_mac.replace(":", "")) + mac_of(iface) + b"\x88\xb5runt!!")


def runt_length(iface, seconds):
    sock = socket.socket(socket.AF_PACKET, socket.SOCK_RAW, socket.htons(0x88b5))
    sock.bind((iface, 0))
    sock.settimeout(seconds)
    print("listening", flush=True)
    print(len(sock.recv(2048)))


def vlan_arp(iface, vid, sender_ip, target_ip):
    mac = mac_of(iface)
    tag = b"\x81\x00" + int(vid).to_bytes(2, "big")
    arp = bytes.fromhex("0001080006040001") + mac + socket.inet_aton(sender_ip) + b"\x00" * 6 + socket.inet_aton(target_ip)
    raw_socket(iface).send(b"\xff" * 6 + mac + tag + b"\x08\x06" + arp + b"\x00" * 14)


def vlan_listen(iface, sender_ip, seconds):
    # A received tag usually arrives as metadata (PACKET_AUXDATA), not in the bytes.
    sol_packet, packet_auxdata, tp_status_vlan_valid = 263, 8, 0x10
    sock = raw_socket(iface)
    sock.setsockopt(sol_packet, packet_auxdata, 1)
    sock.settimeout(seconds)
    want = socket.inet_aton(sender_ip)
    print("listening", flush=True)
    while True:
        frame, ancillary, _, _ = sock.recvmsg(2048, socket.CMSG_SPACE(32))
        vid = None
        for level, kind, data in ancillary:
            if level == sol_packet and kind == packet_auxdata and len(data) >= 20:
                status, _, _, _, _, tci, _ = struct.unpack_from("=IIIHHHH", data)
                if status & tp_status_vlan_valid:
                    vid = tci & 0xfff
        body = frame[12:]
        if body[0:2] in (b"\x81\x00", b"\x88\xa8"):
            vid, body = int.from_bytes(body[2:4], "big") & 0xfff, body[4:]
        if body[0:2] == b"\x08\x06" and body[16:20] == want:
            print("none" if vid is None else vid)
            return


def main():
    command, args = sys.argv[1], sys.argv[2:]
    if command == "attack":
        attack(*args)
    elif command == "unsolicited-ack":
        unsolicited_ack(*args)
    elif command == "release":
        release(*args)
    elif command == "udp-listen":
        udp_listen(int(args[0]), float(args[1]), args[2])
    elif command == "udp-send":
        udp_send(args[0], args[1], args[2], int(args[3]), args[4])
    elif command == "tcp-sink":
        tcp_sink(int(args[0]))
    elif command == "tcp-send":
        tcp_send(args[0], int(args[1]), int(args[2]))
    elif command == "arp-flood":
        arp_flood(args[0], args[1], args[2], int(args[3]))
    elif command == "after-ack":
        after_ack(args[0], int(args[1]), float(args[2]))
    elif command == "runt":
        runt(args[0], args[1])
    elif command == "runt-length":
        runt_length(args[0], float(args[1]))
    elif command == "vlan-arp":
        vlan_arp(*args)
    elif command == "vlan-listen":
        vlan_listen(args[0], args[1], float(args[2]))
    elif command == "junk":
        junk(args[0])
    else:
        sys.exit(__doc__)


if __name__ == "__main__":
    main()
