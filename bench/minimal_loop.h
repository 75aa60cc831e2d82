// The yardsticks for the frame path: hand-written loops that make the
// checks the module must make on the common path and nothing else (no
// locks, no counters, no frame removed):
//
//  - the port's feature flags, read per frame as the module reads its
//    configuration;
//  - BPDU filter: the destination MAC against the two bridge group addresses;
//  - IPv4: the fragment field, the UDP ports (a frame to a DHCP server goes
//    to IP discovery, one from a DHCP server port is blocked);
//  - IP source guard: the VLAN, source MAC and IPv4 source looked up with
//    the module's key and hash (16 buckets of linked entries).
//
// `run` reads the frame through the host list (iterator, mapped bytes and
// lengths, VLAN ID), `runViaHeaders` also locates and maps the headers with
// the host's header calls as the module must, and `runBytes` is the floor:
// the same checks over plain byte buffers, with no host call at all.
#pragma once

#include "frame_mix.h"

#include "contract/vmi_key.h"
#include "platform/platform.h"

#include <array>
#include <cstdint>
#include <vector>

namespace swsec::bench {

class MinimalLoop {
public:
   explicit MinimalLoop(const std::vector<Binding> &bindings);
   MinimalLoop(const MinimalLoop &) = delete;
   MinimalLoop &operator=(const MinimalLoop &) = delete;

   // Each judges every frame and returns how many would be dropped.
   uint32_t run(orr_PktList *list) const;
   uint32_t runViaHeaders(orr_PktList *list) const;
   uint32_t runBytes(const std::vector<testing::Bytes> &frames) const;

private:
   // The module's key and its bucket hash: the same lookup.
   using Key = SwSecVmiKey;

   struct Entry {
      Key key;
      Entry *next;
   };

   const Entry *find(const Key &key) const;
   bool isBound(uint16_t vlanId, const uint8_t *ethHdr, const uint8_t *ipHdr) const;
   // The common-path checks on a frame's first `mapped` bytes; true: drop.
   bool drops(const uint8_t *frame, uint32_t mapped, uint16_t vlanId) const;

   static constexpr uint32_t kBuckets = 16;
   std::vector<Entry> entries_;
   std::array<Entry *, kBuckets> buckets_{};
   // The enforcing port's features, read per frame.
   volatile uint32_t features_;
};

}  // namespace swsec::bench
