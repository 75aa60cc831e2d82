/*
 * The kernel fast path's maps: the layouts of their keys, values and ring
 * buffer records, shared by the tc program and the user space that fills
 * and reads them. One copy, included by both sides.
 *
 * Map                 kind          key                    value
 * swsec_port          array (1)     u32 0                  struct swsec_fp_port
 * swsec_bindings      hash          struct swsec_fp_binding_key  struct swsec_fp_binding
 * swsec_bindings6     hash          struct swsec_fp_binding6_key struct swsec_fp_binding6
 * swsec_counters      per-CPU array u32 reason             u64 frames
 * swsec_punts         ring buffer   -                      struct swsec_fp_punt + frame bytes
 *
 * User space owns every value: the program only reads the port and the
 * bindings, and writes counters, punt records, the punt budget and an IPv6
 * binding's refresh_ns.
 */
#ifndef SWSEC_FASTPATH_H
#define SWSEC_FASTPATH_H

#include <linux/types.h>

#ifdef __cplusplus
#include <cstddef>
#define SWSEC_FP_STATIC_ASSERT static_assert
#else
#include <stddef.h>
#define SWSEC_FP_STATIC_ASSERT _Static_assert
#endif

/* Directions, as the module numbers them. */
#define SWSEC_FP_DIR_TO_VM 1u
#define SWSEC_FP_DIR_FROM_VM 2u

/* swsec_fp_port.flags */
#define SWSEC_FP_PORT_READY 0x1u     /* the maps mirror the module: decide; else punt every frame */
#define SWSEC_FP_PORT_TRUSTED 0x2u   /* the port's IP discovery is in trusted mode */
#define SWSEC_FP_PORT_ERR_STATE 0x4u /* the port is in the error-rate-limit state */
#define SWSEC_FP_PORT_OWN_QDISC 0x8u /* user space made the VM interface's clsact qdisc (the program ignores it) */
#define SWSEC_FP_PORT_FHS_TRUSTED 0x10u   /* the IPv6 agent's port is trusted (a router's) */
#define SWSEC_FP_PORT_ND_ERR_STATE 0x20u  /* the IPv6 agent is in its ND error state */

/*
 * A frame the module passed goes back where it was going through the
 * re-injection program, marked so that the guard lets it through once: a
 * VM's frames carry no mark (a tap or a veth from another namespace starts
 * them with none), and only a privileged socket can set one.
 */
#define SWSEC_FP_MARK_TO_VM 0x53570001u
#define SWSEC_FP_MARK_FROM_VM 0x53570002u

/* The ethertypes a port's frame guard lists at most (the module's). */
#define SWSEC_FP_MAX_ETHER_TYPES 8

/* The port's configuration and error state, as the module has them. */
struct swsec_fp_port {
   __u32 features; /* the module's featuresEnabled bits */
   __u32 flags;    /* SWSEC_FP_PORT_* */
   __u32 port_id;  /* the switch port ID, copied into punt records */
   __u32 vm_ifindex; /* where the re-injection program sends frames the module passed */
   __u32 arp_punts;  /* ARP frames, and frames in the error state, from the VM punted a second
                        at most, the rest dropped; 0: all */
   __u32 num_ether_types; /* 0: the VM may send every ethertype; else only the first these of: */
   __u16 ether_types[SWSEC_FP_MAX_ETHER_TYPES]; /* host order */
   __u32 fhs_features; /* the IPv6 agent's featuresEnabled bits; 0: no IPv6 agent, or none on */
   __u32 nd_punts;     /* ND frames, and frames in the ND error state, from the VM punted a second
                          at most, the rest dropped; 0: all */
};
SWSEC_FP_STATIC_ASSERT(sizeof(struct swsec_fp_port) == 48, "swsec_fp_port layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_port, fhs_features) == 40, "swsec_fp_port layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_port, nd_punts) == 44, "swsec_fp_port layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_port, num_ether_types) == 20, "swsec_fp_port layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_port, ether_types) == 24, "swsec_fp_port layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_port, flags) == 4, "swsec_fp_port layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_port, port_id) == 8, "swsec_fp_port layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_port, vm_ifindex) == 12, "swsec_fp_port layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_port, arp_punts) == 16, "swsec_fp_port layout");

/* The ARP, ND and error-state punts of the current second (swsec_arp_budget, array of 1). */
struct swsec_fp_arp_budget {
   __u64 second; /* bpf_ktime_get_ns() / 1e9 of the counts */
   __u32 punts;    /* against arp_punts */
   __u32 nd_punts; /* against nd_punts */
};
SWSEC_FP_STATIC_ASSERT(sizeof(struct swsec_fp_arp_budget) == 16, "swsec_fp_arp_budget layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_arp_budget, nd_punts) == 12, "swsec_fp_arp_budget layout");

/* The module's ARP (ND) rate limit times this, and at least the floor, is the punt budget. */
#define SWSEC_FP_ARP_PUNT_FACTOR 4u
#define SWSEC_FP_ARP_PUNT_FLOOR 1000u

/* Feature bits of `features` that the program reads (the module's values). */
#define SWSEC_FP_FEATURE_BPDU_FILTER 0x01u
#define SWSEC_FP_FEATURE_BLOCK_DHCP_SERVER 0x02u
#define SWSEC_FP_FEATURE_IP_DISCOVERY 0x04u
#define SWSEC_FP_FEATURE_DAI 0x08u
#define SWSEC_FP_FEATURE_IP_SOURCE_GUARD 0x10u

/* A binding's key: the module's VMI key (VLAN, MAC, IPv4 in network order). */
struct swsec_fp_binding_key {
   __u16 vlan;
   __u8 mac[6];
   __u32 ip;
};
SWSEC_FP_STATIC_ASSERT(sizeof(struct swsec_fp_binding_key) == 12, "swsec_fp_binding_key layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_binding_key, mac) == 2, "swsec_fp_binding_key layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_binding_key, ip) == 8, "swsec_fp_binding_key layout");

struct swsec_fp_binding {
   __u8 authoritative; /* learned by DHCP or static: its lifetime is not refreshed by traffic */
   __u8 reserved[3];
};
SWSEC_FP_STATIC_ASSERT(sizeof(struct swsec_fp_binding) == 4, "swsec_fp_binding layout");

/* The most bindings a port's map holds: the module's 32, and room for changes in flight. */
#define SWSEC_FP_MAX_BINDINGS 64

/* The IPv6 agent's feature bit that the program reads (the module's value). */
#define SWSEC_FP_FHS_SOURCE_GUARD 0x20u

/* An IPv6 binding's key: the IPv6 agent's (VLAN, MAC, IPv6 address in network order). */
struct swsec_fp_binding6_key {
   __u16 vlan;
   __u8 mac[6];
   __u8 addr[16];
};
SWSEC_FP_STATIC_ASSERT(sizeof(struct swsec_fp_binding6_key) == 24, "swsec_fp_binding6_key layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_binding6_key, mac) == 2, "swsec_fp_binding6_key layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_binding6_key, addr) == 8, "swsec_fp_binding6_key layout");

struct swsec_fp_binding6 {
   __u8 fcfs;          /* first come, first served: the VM's traffic from it renews its lifetime */
   __u8 reserved[7];
   __u64 refresh_ns;   /* the program's: bpf_ktime_get_ns() from which the next frame is punted to renew it */
};
SWSEC_FP_STATIC_ASSERT(sizeof(struct swsec_fp_binding6) == 16, "swsec_fp_binding6 layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_binding6, refresh_ns) == 8, "swsec_fp_binding6 layout");

/* The most IPv6 bindings a port's map holds: the module's most (1024), and room for changes in flight. */
#define SWSEC_FP_MAX_BINDINGS6 1088

/*
 * A first-come-first-served binding lives while the VM sends from it: the
 * module notes such a frame and, at its next 10 s tick, moves the expiry on.
 * One frame a binding in this interval is punted for that, and the rest
 * decided here, so a lifetime the module keeps lags the VM's traffic by at
 * most this (against a lifetime of minutes), and a busy source costs one
 * punt in five seconds instead of one a frame.
 */
#define SWSEC_FP_FCFS_REFRESH_NS 5000000000ull

/*
 * What the program did with a frame, one per-CPU counter each. A frame is
 * passed, dropped with its reason, or punted to user space (with why) for
 * the module to judge.
 */
#define SWSEC_FP_REASON_LIST(X)                                               \
   X(SWSEC_FP_PASSED, "passed from the VM")                                   \
   X(SWSEC_FP_PASSED_TO_VM, "passed to the VM")                               \
   X(SWSEC_FP_DROP_IP_SOURCE_GUARD, "IP source guard")                        \
   X(SWSEC_FP_PUNT_NOT_READY, "punted: not ready")                            \
   X(SWSEC_FP_PUNT_ARP, "punted: ARP")                                        \
   X(SWSEC_FP_PUNT_DHCP, "punted: DHCP")                                      \
   X(SWSEC_FP_PUNT_BPDU, "punted: BPDU")                                      \
   X(SWSEC_FP_PUNT_TAGGED, "punted: inner tag")                               \
   X(SWSEC_FP_PUNT_FRAGMENT, "punted: fragment")                              \
   X(SWSEC_FP_PUNT_UNPARSED, "punted: header not parsed")                     \
   X(SWSEC_FP_PUNT_ERR_STATE, "punted: error-rate-limit state")               \
   X(SWSEC_FP_PUNT_REFRESH, "punted: binding refresh")                        \
   X(SWSEC_FP_PUNT_ND, "punted: ND, RA, redirect or MLD")                    \
   X(SWSEC_FP_PUNT_DHCPV6, "punted: DHCPv6")                                  \
   X(SWSEC_FP_PUNT_IPV6_CHAIN, "punted: IPv6 extension header or fragment")  \
   X(SWSEC_FP_PUNT_LOST, "lost: punt ring full")                             \
   X(SWSEC_FP_DROP_ARP_BUDGET, "dropped: over the punt budget")              \
   X(SWSEC_FP_DROP_ETHER_TYPE, "dropped: ethertype not listed")              \
   X(SWSEC_FP_DROP_IPV6_SOURCE_GUARD, "IPv6 source guard")                   \
   X(SWSEC_FP_DROP_ND_BUDGET, "dropped: over the ND punt budget")

#define SWSEC_FP_REASON_ENUM(name, text) name,
enum swsec_fp_reason { SWSEC_FP_REASON_LIST(SWSEC_FP_REASON_ENUM) SWSEC_FP_REASON_COUNT };
#undef SWSEC_FP_REASON_ENUM

/* swsec_fp_punt.flags */
#define SWSEC_FP_PUNT_TAG_IN_BYTES 0x1u /* the outer tag (the VLAN below) is still in the bytes */
#define SWSEC_FP_PUNT_HAS_TAG 0x2u      /* the frame had an outer tag (VLAN 0 included) */
#define SWSEC_FP_PUNT_TPID_8021AD 0x4u  /* its TPID was 0x88a8 (else 0x8100 ... */
#define SWSEC_FP_PUNT_TPID_9100 0x8u    /* ... or 0x9100) */

/* A punted frame in the ring buffer: this header, then `captured` bytes of the frame. */
struct swsec_fp_punt {
   __u32 port_id;
   __u32 frame_len; /* the frame's length as the program saw it */
   __u32 captured;  /* bytes that follow: the frame's first, at most SWSEC_FP_PUNT_MAX_BYTES */
   __u16 vlan;      /* VLAN ID of the outer tag; 0 untagged */
   __u8 direction;  /* SWSEC_FP_DIR_* */
   __u8 flags;      /* SWSEC_FP_PUNT_* */
   __u8 reason;     /* enum swsec_fp_reason */
   __u8 tag_high;   /* the outer tag's priority and DEI (its TCI's top 4 bits) */
   __u8 reserved[2];
};
SWSEC_FP_STATIC_ASSERT(sizeof(struct swsec_fp_punt) == 20, "swsec_fp_punt layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_punt, frame_len) == 4, "swsec_fp_punt layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_punt, captured) == 8, "swsec_fp_punt layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_punt, vlan) == 12, "swsec_fp_punt layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_punt, direction) == 14, "swsec_fp_punt layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_punt, reason) == 16, "swsec_fp_punt layout");
SWSEC_FP_STATIC_ASSERT(offsetof(struct swsec_fp_punt, tag_high) == 17, "swsec_fp_punt layout");

/* Frame bytes a punt record carries at most (a jumbo frame and its tag). */
#define SWSEC_FP_PUNT_MAX_BYTES 9220u
#define SWSEC_FP_PUNT_RING_BYTES (1u << 20)

#endif /* SWSEC_FASTPATH_H */
