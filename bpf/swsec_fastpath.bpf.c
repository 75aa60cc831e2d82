/*
 * The kernel fast path of a guarded VM port: a tc program (clsact, direct
 * action) on the VM interface's ingress (frames from the VM) and egress
 * (frames to it). It decides the frames whose verdict the maps fix exactly
 * as the module would give it, with nothing in the module to change; every
 * other frame is punted to user space, where the module judges it:
 *
 *   passed   TC_ACT_OK      the module would pass it and change nothing
 *   dropped  TC_ACT_SHOT    IP source guard: an IPv4 or IPv6 source not bound
 *   punted   TC_ACT_STOLEN  copied to the ring buffer for the module
 *
 * Punted: every frame while the port is not ready; ARP; DHCP (UDP port 67
 * or 68 either side; DHCPv6 server replies where they are blocked); BPDU
 * destinations where they are filtered; an inner tag; IPv4 fragments,
 * options or short headers; every frame from the VM in either agent's
 * error state; and, on a trusted port, IPv4 from a binding the module
 * refreshes. With the IPv6 agent on the port, also: IPv6 with an extension
 * header (fragments included) or a header it does not parse whole, DHCPv6
 * both ways, ND, RA, redirects and MLD from the VM, and a frame from a
 * first-come-first-served binding once in SWSEC_FP_FCFS_REFRESH_NS.
 *
 * The outer VLAN tag is metadata on tc (vlan_present, vlan_tci); a frame
 * that carries it in its bytes (BPF_PROG_TEST_RUN, a device without
 * offload) is read the same way.
 */
#include <linux/bpf.h>
#include <linux/if_ether.h>
#include <linux/pkt_cls.h>
#include <bpf/bpf_helpers.h>
#include <bpf/bpf_endian.h>

#include "swsec_fastpath.h"

struct {
   __uint(type, BPF_MAP_TYPE_ARRAY);
   __uint(max_entries, 1);
   __type(key, __u32);
   __type(value, struct swsec_fp_port);
} swsec_port SEC(".maps");

struct {
   __uint(type, BPF_MAP_TYPE_HASH);
   __uint(max_entries, SWSEC_FP_MAX_BINDINGS);
   __type(key, struct swsec_fp_binding_key);
   __type(value, struct swsec_fp_binding);
} swsec_bindings SEC(".maps");

struct {
   __uint(type, BPF_MAP_TYPE_HASH);
   __uint(max_entries, SWSEC_FP_MAX_BINDINGS6);
   __type(key, struct swsec_fp_binding6_key);
   __type(value, struct swsec_fp_binding6);
} swsec_bindings6 SEC(".maps");

struct {
   __uint(type, BPF_MAP_TYPE_PERCPU_ARRAY);
   __uint(max_entries, SWSEC_FP_REASON_COUNT);
   __type(key, __u32);
   __type(value, __u64);
} swsec_counters SEC(".maps");

struct {
   __uint(type, BPF_MAP_TYPE_RINGBUF);
   __uint(max_entries, SWSEC_FP_PUNT_RING_BYTES);
} swsec_punts SEC(".maps");

struct {
   __uint(type, BPF_MAP_TYPE_ARRAY);
   __uint(max_entries, 1);
   __type(key, __u32);
   __type(value, struct swsec_fp_arp_budget);
} swsec_arp_budget SEC(".maps");

/* A punt record is built here, then copied into the ring at its own size. */
struct swsec_fp_punt_slot {
   struct swsec_fp_punt head;
   __u8 bytes[SWSEC_FP_PUNT_MAX_BYTES];
};

struct {
   __uint(type, BPF_MAP_TYPE_PERCPU_ARRAY);
   __uint(max_entries, 1);
   __type(key, __u32);
   __type(value, struct swsec_fp_punt_slot);
} swsec_punt_slot SEC(".maps");

#define ETH_P_8021AD_ 0x88a8
#define ETH_P_QINQ_ 0x9100
#define DHCP_SERVER_PORT 67
#define DHCP_CLIENT_PORT 68
#define DHCPV6_CLIENT_PORT 546
#define DHCPV6_SERVER_PORT 547
#define IPPROTO_TCP_ 6
#define IPPROTO_UDP_ 17
#define IPPROTO_ICMPV6_ 58
#define IPV6_HEADER_LEN 40

static __always_inline void swsec_count(__u32 reason)
{
   __u64 *count = bpf_map_lookup_elem(&swsec_counters, &reason);
   if (count)
      *count += 1; /* per CPU: no other writer */
}

static __always_inline __u16 swsec_load_be16(const __u8 *p)
{
   return (__u16)((p[0] << 8) | p[1]);
}

static __always_inline int swsec_is_mac(const __u8 *p, __u8 a, __u8 b, __u8 c, __u8 d, __u8 e, __u8 f)
{
   return p[0] == a && p[1] == b && p[2] == c && p[3] == d && p[4] == e && p[5] == f;
}

struct swsec_fp_frame {
   __u32 direction;
   __u16 vlan;
   __u8 tag_in_bytes;
   __u8 tag_flags;  /* SWSEC_FP_PUNT_HAS_TAG and the TPID's */
   __u8 tag_high;
};

static __always_inline int swsec_punt(struct __sk_buff *skb, const struct swsec_fp_port *port,
                                      const struct swsec_fp_frame *frame, __u32 reason)
{
   __u32 zero = 0;
   struct swsec_fp_punt_slot *slot = bpf_map_lookup_elem(&swsec_punt_slot, &zero);
   if (!slot) {
      swsec_count(SWSEC_FP_PUNT_LOST);
      return TC_ACT_SHOT;
   }
   __u32 len = skb->len;
   if (len > SWSEC_FP_PUNT_MAX_BYTES)
      len = SWSEC_FP_PUNT_MAX_BYTES;
   if (len == 0 || bpf_skb_load_bytes(skb, 0, slot->bytes, len) != 0) {
      swsec_count(SWSEC_FP_PUNT_LOST);
      return TC_ACT_SHOT;
   }
   slot->head.port_id = port ? port->port_id : 0;
   slot->head.frame_len = skb->len;
   slot->head.captured = len;
   slot->head.vlan = frame->vlan;
   slot->head.direction = (__u8)frame->direction;
   slot->head.flags = (frame->tag_in_bytes ? SWSEC_FP_PUNT_TAG_IN_BYTES : 0) | frame->tag_flags;
   slot->head.reason = (__u8)reason;
   slot->head.tag_high = frame->tag_high;
   slot->head.reserved[0] = slot->head.reserved[1] = 0;
   if (bpf_ringbuf_output(&swsec_punts, slot, sizeof(slot->head) + len, 0) != 0) {
      swsec_count(SWSEC_FP_PUNT_LOST);
      return TC_ACT_SHOT;
   }
   swsec_count(reason);
   return TC_ACT_STOLEN;
}

static __always_inline int swsec_pass(struct __sk_buff *skb, __u32 direction)
{
   swsec_count(direction == SWSEC_FP_DIR_FROM_VM ? SWSEC_FP_PASSED : SWSEC_FP_PASSED_TO_VM);
   /* A runt goes on padded to 60 bytes, as a switch pads it. */
   if (skb->len < 60)
      bpf_skb_change_tail(skb, 60, 0);
   return TC_ACT_OK;
}

/* Counts a punt from the VM against this second's budget `limit`
 * (ARP's, or with `nd` ND's); true when the frame is over it. */
static __always_inline int swsec_over_budget(__u32 limit, int nd)
{
   __u32 zero = 0;
   struct swsec_fp_arp_budget *budget = bpf_map_lookup_elem(&swsec_arp_budget, &zero);
   if (limit == 0 || !budget)
      return 0;
   const __u64 second = bpf_ktime_get_ns() / 1000000000ull;
   if (budget->second != second) {
      budget->second = second;
      budget->punts = 0;
      budget->nd_punts = 0;
   }
   /* Not atomic: CPUs racing may punt a few more, never fewer. */
   __u32 *used = nd ? &budget->nd_punts : &budget->punts;
   return (*used)++ >= limit;
}

/* The IPv6 extension headers the IPv6 agent walks. */
static __always_inline int swsec_is_ipv6_extension(__u8 next)
{
   return next == 0 || next == 43 || next == 44 || next == 51 || next == 60 || next == 135 || next == 139 ||
          next == 140;
}

/*
 * IPv6 on a port with the IPv6 agent, after the IPv4 agent's checks. The
 * program decides a packet whose fixed header is followed directly by its
 * upper-layer header, both whole in the frame; anything else the agent's
 * header-chain walk must see is punted, as is every frame it learns from
 * or judges beyond the source: DHCPv6 either way, and ND, RA, redirects
 * and MLD from the VM (to the VM, ICMPv6 changes nothing in the module).
 */
static __always_inline int swsec_judge_ipv6(struct __sk_buff *skb, const struct swsec_fp_port *port,
                                            const struct swsec_fp_frame *frame, const __u8 *data,
                                            const __u8 *l3, const __u8 *end)
{
   if (l3 + IPV6_HEADER_LEN > end || (l3[0] >> 4) != 6)
      return swsec_punt(skb, port, frame, SWSEC_FP_PUNT_UNPARSED);
   const __u32 packet_len = IPV6_HEADER_LEN + swsec_load_be16(l3 + 4);
   if (packet_len > skb->len - (__u32)(l3 - data))
      return swsec_punt(skb, port, frame, SWSEC_FP_PUNT_UNPARSED);
   const __u8 next = l3[6];
   if (swsec_is_ipv6_extension(next))
      return swsec_punt(skb, port, frame, SWSEC_FP_PUNT_IPV6_CHAIN);
   const __u32 upper_len = next == IPPROTO_TCP_ ? 20 : next == IPPROTO_UDP_ ? 8 : next == IPPROTO_ICMPV6_ ? 4 : 0;
   const __u8 *upper = l3 + IPV6_HEADER_LEN;
   if (IPV6_HEADER_LEN + upper_len > packet_len || upper + upper_len > end)
      return swsec_punt(skb, port, frame, SWSEC_FP_PUNT_UNPARSED);
   const int from_vm = frame->direction == SWSEC_FP_DIR_FROM_VM;
   if (next == IPPROTO_ICMPV6_ && upper + 1 <= end) {
      const __u8 type = upper[0];
      /* Router solicitation to redirect: what the ND limiter counts. */
      if (from_vm && type >= 133 && type <= 137) {
         if (swsec_over_budget(port->nd_punts, 1)) {
            swsec_count(SWSEC_FP_DROP_ND_BUDGET);
            return TC_ACT_SHOT;
         }
         return swsec_punt(skb, port, frame, SWSEC_FP_PUNT_ND);
      }
      /* MLD queries and reports, which may come from no address. */
      if (from_vm && ((type >= 130 && type <= 132) || type == 143))
         return swsec_punt(skb, port, frame, SWSEC_FP_PUNT_ND);
   }
   if (next == IPPROTO_UDP_ && upper + 4 <= end) {
      const __u16 sport = swsec_load_be16(upper);
      const __u16 dport = swsec_load_be16(upper + 2);
      if (dport == DHCPV6_CLIENT_PORT || dport == DHCPV6_SERVER_PORT || sport == DHCPV6_SERVER_PORT)
         return swsec_punt(skb, port, frame, SWSEC_FP_PUNT_DHCPV6);
   }
   if (!from_vm || (port->flags & SWSEC_FP_PORT_FHS_TRUSTED) || !(port->fhs_features & SWSEC_FP_FHS_SOURCE_GUARD))
      return swsec_pass(skb, frame->direction);

   /* Source guard. The unspecified source passes only for the ICMPv6 punted
    * above, even where a claim bound it. */
   struct swsec_fp_binding6_key key = {.vlan = frame->vlan};
   __builtin_memcpy(key.mac, data + 6, 6);
   __builtin_memcpy(key.addr, l3 + 8, 16);
   __u64 halves[2];
   __builtin_memcpy(halves, key.addr, 16);
   struct swsec_fp_binding6 *binding =
      (halves[0] | halves[1]) != 0 ? bpf_map_lookup_elem(&swsec_bindings6, &key) : (void *)0;
   if (!binding) {
      swsec_count(SWSEC_FP_DROP_IPV6_SOURCE_GUARD);
      return TC_ACT_SHOT;
   }
   if (binding->fcfs) {
      const __u64 now = bpf_ktime_get_ns();
      if (now >= binding->refresh_ns) {
         binding->refresh_ns = now + SWSEC_FP_FCFS_REFRESH_NS;
         return swsec_punt(skb, port, frame, SWSEC_FP_PUNT_REFRESH);
      }
   }
   return swsec_pass(skb, frame->direction);
}

static __always_inline int swsec_judge(struct __sk_buff *skb, __u32 direction)
{
   /* Re-injected after the module passed it: counted when it was punted. */
   if (skb->mark == (direction == SWSEC_FP_DIR_FROM_VM ? SWSEC_FP_MARK_FROM_VM : SWSEC_FP_MARK_TO_VM)) {
      skb->mark = 0;
      return TC_ACT_OK;
   }
   struct swsec_fp_frame frame = {.direction = direction};
   const __u8 *data = (const __u8 *)(long)skb->data;
   const __u8 *end = (const __u8 *)(long)skb->data_end;
   /* The outer tag: metadata on tc, or still in the bytes where nothing took it off. */
   __u32 l2 = 12; /* where the ethertype after the outer tag is */
   __u16 tpid = 0;
   __u16 tci = 0;
   if (skb->vlan_present) {
      tpid = bpf_ntohs(skb->vlan_proto);
      tci = (__u16)skb->vlan_tci;
   } else if (data + 18 <= end) {
      const __u16 type = swsec_load_be16(data + 12);
      if (type == ETH_P_8021Q || type == ETH_P_8021AD_ || type == ETH_P_QINQ_) {
         tpid = type;
         tci = swsec_load_be16(data + 14);
         frame.tag_in_bytes = 1;
         l2 = 16;
      }
   }
   if (tpid != 0) {
      frame.vlan = tci & 0x0fff;
      frame.tag_high = (__u8)(tci >> 12);
      frame.tag_flags = SWSEC_FP_PUNT_HAS_TAG | (tpid == ETH_P_8021AD_ ? SWSEC_FP_PUNT_TPID_8021AD : 0) |
                        (tpid == ETH_P_QINQ_ ? SWSEC_FP_PUNT_TPID_9100 : 0);
   }
   __u32 zero = 0;
   const struct swsec_fp_port *port = bpf_map_lookup_elem(&swsec_port, &zero);
   if (!port || !(port->flags & SWSEC_FP_PORT_READY))
      return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_NOT_READY);
   const __u32 features = port->features;
   /* A port with every feature of both agents off passes every frame untouched. */
   if (features == 0 && port->fhs_features == 0)
      return swsec_pass(skb, direction);
   /* A frame without an Ethernet header passes unexamined, as in the module. */
   if (data + ETH_HLEN > end)
      return swsec_pass(skb, direction);
   const __u8 *type = data + l2;
   if (type + 2 > end)
      return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_UNPARSED);
   const __u16 ethertype = swsec_load_be16(type);
   const __u8 *l3 = type + 2;

   /* A VM's ARP or ND flood, and its frames in an error state, are cut
    * here above the module's own limits: the VM cannot flood user space. */
   const __u32 err_state = port->flags & (SWSEC_FP_PORT_ERR_STATE | SWSEC_FP_PORT_ND_ERR_STATE);
   if (direction == SWSEC_FP_DIR_FROM_VM && err_state) {
      const int arp = port->arp_punts != 0 && (ethertype == ETH_P_ARP || (port->flags & SWSEC_FP_PORT_ERR_STATE));
      if (arp ? swsec_over_budget(port->arp_punts, 0)
              : (port->flags & SWSEC_FP_PORT_ND_ERR_STATE) && swsec_over_budget(port->nd_punts, 1)) {
         swsec_count(arp ? SWSEC_FP_DROP_ARP_BUDGET : SWSEC_FP_DROP_ND_BUDGET);
         return TC_ACT_SHOT;
      }
      return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_ERR_STATE);
   }
   if (direction == SWSEC_FP_DIR_FROM_VM && ethertype == ETH_P_ARP && features != 0 &&
       swsec_over_budget(port->arp_punts, 0)) {
      swsec_count(SWSEC_FP_DROP_ARP_BUDGET);
      return TC_ACT_SHOT;
   }
   if ((features & SWSEC_FP_FEATURE_BPDU_FILTER) &&
       (swsec_is_mac(data, 0x01, 0x80, 0xc2, 0x00, 0x00, 0x00) ||
        swsec_is_mac(data, 0x01, 0x00, 0x0c, 0xcc, 0xcc, 0xcd)))
      return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_BPDU);
   if (ethertype == ETH_P_8021Q || ethertype == ETH_P_8021AD_ || ethertype == ETH_P_QINQ_)
      return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_TAGGED);
   /* The IPv4 agent's frame guard (its ethertype list) and checks, where it has features on. */
   if (direction == SWSEC_FP_DIR_FROM_VM && features != 0 && port->num_ether_types != 0) {
      int listed = 0;
      for (__u32 i = 0; i < SWSEC_FP_MAX_ETHER_TYPES; i++)
         listed |= i < port->num_ether_types && port->ether_types[i] == ethertype;
      if (!listed) {
         swsec_count(SWSEC_FP_DROP_ETHER_TYPE);
         return TC_ACT_SHOT;
      }
   }
   if (ethertype == ETH_P_ARP && features != 0)
      return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_ARP);

   if (ethertype == ETH_P_IPV6) {
      /* The IPv4 agent's DHCP server block looks at a UDP header right after IPv6 only. */
      if (direction == SWSEC_FP_DIR_FROM_VM && (features & SWSEC_FP_FEATURE_BLOCK_DHCP_SERVER)) {
         if (l3 + 40 > end)
            return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_UNPARSED);
         if (l3[6] == IPPROTO_UDP_) {
            if (l3 + 48 > end)
               return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_UNPARSED);
            if (swsec_load_be16(l3 + 40) == DHCPV6_SERVER_PORT)
               return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_DHCP);
         }
      }
      if (port->fhs_features != 0)
         return swsec_judge_ipv6(skb, port, &frame, data, l3, end);
      return swsec_pass(skb, direction);
   }
   if (ethertype != ETH_P_IP || features == 0)
      return swsec_pass(skb, direction);

   /* IPv4: a plain 20-byte header, not a fragment, else the module decides. */
   if (l3 + 20 > end || l3[0] != 0x45)
      return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_UNPARSED);
   if ((swsec_load_be16(l3 + 6) & 0x3fff) != 0)
      return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_FRAGMENT);
   if (l3[9] == IPPROTO_UDP_) {
      if (l3 + 28 > end)
         return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_UNPARSED);
      const __u16 sport = swsec_load_be16(l3 + 20);
      const __u16 dport = swsec_load_be16(l3 + 22);
      if (sport == DHCP_SERVER_PORT || sport == DHCP_CLIENT_PORT || dport == DHCP_SERVER_PORT ||
          dport == DHCP_CLIENT_PORT)
         return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_DHCP);
   }
   if (direction != SWSEC_FP_DIR_FROM_VM)
      return swsec_pass(skb, direction);

   const int guard = (features & SWSEC_FP_FEATURE_IP_SOURCE_GUARD) != 0;
   const int refresh = (features & SWSEC_FP_FEATURE_IP_DISCOVERY) && (port->flags & SWSEC_FP_PORT_TRUSTED);
   if (!guard && !refresh)
      return swsec_pass(skb, direction);
   struct swsec_fp_binding_key key = {.vlan = frame.vlan};
   __builtin_memcpy(key.mac, data + 6, 6);
   __builtin_memcpy(&key.ip, l3 + 12, 4);
   const struct swsec_fp_binding *binding = bpf_map_lookup_elem(&swsec_bindings, &key);
   /* A trusted port's module renews a learned binding's lifetime on its traffic. */
   if (refresh && binding && !binding->authoritative)
      return swsec_punt(skb, port, &frame, SWSEC_FP_PUNT_REFRESH);
   if (guard && !binding) {
      swsec_count(SWSEC_FP_DROP_IP_SOURCE_GUARD);
      return TC_ACT_SHOT;
   }
   return swsec_pass(skb, direction);
}

SEC("tc")
int swsec_from_vm(struct __sk_buff *skb)
{
   return swsec_judge(skb, SWSEC_FP_DIR_FROM_VM);
}

SEC("tc")
int swsec_to_vm(struct __sk_buff *skb)
{
   return swsec_judge(skb, SWSEC_FP_DIR_TO_VM);
}

/*
 * The re-injection end's ingress: a frame the module passed, sent here by
 * user space with the mark of its direction, goes on into the VM
 * interface's ingress (towards the bridge) or out of it (to the VM).
 */
SEC("tc")
int swsec_inject(struct __sk_buff *skb)
{
   __u32 zero = 0;
   const struct swsec_fp_port *port = bpf_map_lookup_elem(&swsec_port, &zero);
   if (!port || port->vm_ifindex == 0)
      return TC_ACT_SHOT;
   if (skb->mark == SWSEC_FP_MARK_FROM_VM)
      return bpf_redirect(port->vm_ifindex, BPF_F_INGRESS);
   if (skb->mark == SWSEC_FP_MARK_TO_VM)
      return bpf_redirect(port->vm_ifindex, 0);
   return TC_ACT_SHOT;
}

char LICENSE[] SEC("license") = "GPL";
