/*
 * The identity of a virtual machine interface (VMI: VLAN, MAC, IPv4
 * address) as it travels in static entries, clear requests and saved
 * states, how a VMI was learned, and the key's hash.
 *
 * Wire contract: freestanding, shared by the module and the tools.
 */
#pragma once

#include <cstddef>
#include <cstdint>

/* How a VMI was learned; bits, so that classes test by mask. */
enum SwSecDiscMethod : uint8_t {
   SwSecDiscDhcpSnooping = 1,
   SwSecDiscStatic = 2,
   SwSecDiscTofu = 4,
   SwSecDiscApSnooping = 8,
};

constexpr uint8_t SwSecDiscAuthoritativeMask = SwSecDiscDhcpSnooping | SwSecDiscStatic;
constexpr uint8_t SwSecDiscNonAuthoritativeMask = SwSecDiscTofu | SwSecDiscApSnooping;
constexpr uint8_t SwSecDiscAllMask = SwSecDiscAuthoritativeMask | SwSecDiscNonAuthoritativeMask;

/* The identity of a VMI: hash key, static entry and clear request layout. */
struct __attribute__((packed)) SwSecVmiKey {
   uint16_t vlanId;          /* host order */
   uint8_t macAddr[6];
   uint32_t ipAddr;          /* network order */
};
static_assert(sizeof(SwSecVmiKey) == 12);
static_assert(offsetof(SwSecVmiKey, vlanId) == 0);
static_assert(offsetof(SwSecVmiKey, macAddr) == 2);
static_assert(offsetof(SwSecVmiKey, ipAddr) == 8);

/*
 * The port database's hash of a VMI key. Inline because the frame path
 * looks a key up for every frame a guarded port sends: two independent
 * multiplies instead of a call and a pass over the bytes. Here rather than
 * in the module so that the benchmark's yardstick hashes alike.
 */
static inline uint32_t SwSecVmiKeyHash(const SwSecVmiKey *key)
{
   uint64_t head;   /* VLAN ID and MAC */
   uint32_t tail;   /* IPv4 address */
   __builtin_memcpy(&head, key, sizeof(head));
   __builtin_memcpy(&tail, reinterpret_cast<const uint8_t *>(key) + sizeof(head), sizeof(tail));
   const uint64_t mixed =
      head * 0x9e37'79b9'7f4a'7c15ull + (static_cast<uint64_t>(tail) << 32 | tail) * 0xc2b2'ae3d'27d4'eb4full;
   /*
    * A product's low bits see only the factors' low bits; folding the top
    * down makes the bits a bucket mask keeps depend on every key byte.
    */
   return static_cast<uint32_t>((mixed ^ (mixed >> 29)) >> 32);
}
