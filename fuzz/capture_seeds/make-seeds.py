#!/usr/bin/env python3
"""Writes the capture fuzz target's hand-made seeds beside this script:
pcapng with direction flags in both byte orders, a block that claims more
than the file holds, timestamps that overflow or lie before 1970, and a
link type that is not Ethernet. The test captures are seeds too (fuzz.sh)."""
import os
import struct

HERE = os.path.dirname(os.path.abspath(__file__))
# A DHCPDISCOVER-sized Ethernet frame: enough for the reader, no meaning needed.
FRAME = bytes.fromhex("ffffffffffff02005ec000010800") + bytes(range(64)) * 4


def shb(e):
    return struct.pack(e + "IIIHHqI", 0x0A0D0D0A, 28, 0x1A2B3C4D, 1, 0, -1, 28)


def idb(e, link=1):
    return struct.pack(e + "IIHHII", 1, 20, link, 0, 262144, 20)


def epb(e, micros, flags, frame=FRAME, length=None):
    padded = frame + bytes(-len(frame) % 4)
    options = struct.pack(e + "HHI", 2, 4, flags) + struct.pack(e + "I", 0) if flags is not None else b""
    total = 32 + len(padded) + len(options)
    head = struct.pack(e + "IIIIIII", 6, length or total, 0, micros >> 32, micros & 0xFFFFFFFF, len(frame), len(frame))
    return head + padded + options + struct.pack(e + "I", total)


def spb(e, frame=FRAME):
    padded = frame + bytes(-len(frame) % 4)
    total = 16 + len(padded)
    return struct.pack(e + "III", 3, total, len(frame)) + padded + struct.pack(e + "I", total)


def pcap(link, records):
    out = struct.pack("<IHHiIII", 0xA1B2C3D4, 2, 4, 0, 0, 65535, link)
    for seconds, frame in records:
        out += struct.pack("<IIII", seconds, 0, len(frame), len(frame)) + frame
    return out


seeds = {
    "flags-le.pcapng": shb("<") + idb("<") + epb("<", 10**15, 1) + epb("<", 10**15 + 5, 2) + spb("<"),
    "flags-be.pcapng": shb(">") + idb(">") + epb(">", 10**15, 2) + epb(">", 10**15 + 5, None),
    "two-sections.pcapng": shb("<") + idb("<") + epb("<", 1, 1) + shb(">") + idb(">") + epb(">", 2, 2),
    "huge-block.pcapng": shb("<") + idb("<") + epb("<", 1, 2, FRAME[:156], 0xFFFFFFF0),
    "time-overflow.pcapng": shb("<") + idb("<") + epb("<", 1 << 62, 2) + epb("<", 5, 1),
    "before-1970.pcap": pcap(1, [(0xFFFFFFF0, FRAME), (3, FRAME)]),
    "link-type-4000.pcap": pcap(4000, [(1, FRAME)]),
}
for name, data in seeds.items():
    with open(os.path.join(HERE, name), "wb") as f:
        f.write(data)
