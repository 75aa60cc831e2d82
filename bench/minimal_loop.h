// The floor for the frame path: a hand-written loop over the same host frame
// list that makes the same reads as the module's source check (mapped bytes,
// VLAN ID, EtherType, source MAC and IPv4 address, UDP destination port) and
// the same lookup (a 12-byte key hashed with the platform's byte hash into
// 16 buckets of linked entries), and nothing else: no locks, no counters,
// no other feature, no frame removed.
#pragma once

#include "frame_mix.h"

#include "platform/platform.h"
#include "swsec/swsec_vmi.h"

#include <array>
#include <cstdint>
#include <vector>

namespace swsec::bench {

class MinimalLoop {
public:
   explicit MinimalLoop(const std::vector<Binding> &bindings);
   MinimalLoop(const MinimalLoop &) = delete;
   MinimalLoop &operator=(const MinimalLoop &) = delete;

   // Judges every frame of the list from its mapped bytes; returns how many
   // would be dropped.
   uint32_t run(orr_PktList *list) const;
   // The same, with the headers located and mapped through the platform's
   // header calls as the module must (find, map and give back each of
   // Ethernet, IP and UDP): the host's share of the module's cost.
   uint32_t runViaHeaders(orr_PktList *list) const;

private:
   // The module's key and its bucket hash: the same lookup.
   using Key = SwSecVmiKey;

   struct Entry {
      Key key;
      Entry *next;
   };

   const Entry *find(const Key &key) const;
   // Whether the frame's VLAN, source MAC and IPv4 source are a binding.
   bool isBound(orr_Pkt *pkt, const uint8_t *ethHdr, const uint8_t *ipHdr) const;

   static constexpr uint32_t kBuckets = 16;
   std::vector<Entry> entries_;
   std::array<Entry *, kBuckets> buckets_{};
};

}  // namespace swsec::bench
