// Frames, frame lists and header lookup through the platform functions.
#include "host_unit.h"
#include "support/frames.h"

#include <arpa/inet.h>
#include <gmock/gmock.h>

#include <array>
#include <cstring>

using ::testing::ElementsAre;
using ::testing::HasSubstr;

namespace swsec::testing {
namespace {

using host::FrameSpec;

const Mac kVm = Mac::parse("02:00:00:00:00:01");
const Mac kPeer = Mac::parse("02:00:00:00:00:02");

// 14 + 20 + 8 + 18 = 60 bytes.
Bytes sampleUdp(std::optional<uint16_t> vlanTag = std::nullopt)
{
   return udpFrame({.src = kVm, .dst = kPeer, .ipSrc = Ip4::parse("10.0.0.1"), .ipDst = Ip4::parse("10.0.0.2"),
                    .srcPort = 68, .dstPort = 67, .vlanTag = vlanTag});
}

// A list iterator in stack storage, as a module keeps one.
struct Iter {
   explicit Iter(host::FrameList &frames) { orr_PktListIterStart(frames.list(), get()); }
   orr_PktListIter *get() { return reinterpret_cast<orr_PktListIter *>(storage.data()); }
   alignas(void *) std::array<uint8_t, ORR_PKT_LIST_ITER_MAX_SIZE> storage{};
};

orr_Pkt *takeOut(host::FrameList &frames)
{
   return orr_PktListIterRemovePkt(Iter(frames).get());
}

const uint32_t kClasses[] = {ORR_PKT_HEADER_CLASS_L2, ORR_PKT_HEADER_CLASS_L3, ORR_PKT_HEADER_CLASS_L4};

orr_PktHeaderEntry *find(orr_Pkt *pkt, uint32_t layer)
{
   orr_PktHeaderEntry *entry = nullptr;
   const orr_Status status = orr_PktHeaderFind(pkt, static_cast<orr_PktLayer>(layer), kClasses[layer], 1, &entry, 0);
   return status == ORR_OK ? entry : nullptr;
}

// Maps the layer 2 header and leaves the mapping outstanding.
void mapLayer2(orr_Pkt *pkt)
{
   uint8_t *data = nullptr;
   ASSERT_EQ(orr_PktHeaderDataGet(pkt, find(pkt, 0), &data), ORR_OK);
}

void releaseTwice(host::FrameList &frames)
{
   orr_Pkt *pkt = takeOut(frames);
   orr_PktRelease(pkt);
   orr_PktRelease(pkt);
}

void releaseUnknownMapping(orr_Pkt *pkt)
{
   uint8_t unknown = 0;
   orr_PktHeaderDataRelease(pkt, find(pkt, 0), &unknown, 0);
}

Bytes copyOut(orr_Pkt *pkt)
{
   Bytes copy(orr_PktFrameLenGet(pkt));
   EXPECT_EQ(orr_PktCopyBytesOut(pkt, 0, static_cast<uint32_t>(copy.size()), copy.data()), ORR_OK);
   return copy;
}

class FramesTest : public HostUnitTest {
public:
   orr_Pkt *single(FrameSpec frameSpec, uint32_t minMappedLen = 0)
   {
      list = host.frames().makeList({std::move(frameSpec)}, minMappedLen);
      return list->frame(0);
   }

   std::unique_ptr<host::FrameList> list;
};

TEST_F(FramesTest, SplitMakesElementsInTheirOwnBuffersAndSetsTheMappedLength)
{
   struct Case {
      std::vector<uint32_t> split;
      uint32_t minimum;
      std::optional<uint32_t> override;
      std::vector<uint32_t> lengths;
      uint32_t mapped;
   };
   const Case cases[] = {
      {{}, 0, {}, {60}, 60},                        // one element maps the whole frame
      {{10, 0, 20}, 0, {}, {10, 0, 20, 30}, 10},    // the rest is one last element
      {std::vector<uint32_t>(59, 1), 0, {}, std::vector<uint32_t>(60, 1), 1},
      {{14, 46}, 42, {}, {14, 46}, 42},             // raised to the filter's minimum
      {{14, 46}, 66, {}, {14, 46}, 60},             // capped at the frame
      {{14, 46}, 42, 20, {14, 46}, 20},             // a test override wins
      {{0, 60}, 0, {}, {0, 60}, 0},
   };
   const Bytes bytes = sampleUdp();
   for (const Case &c : cases) {
      SCOPED_TRACE(c.lengths.size() * 1000 + c.mapped);
      orr_Pkt *pkt = single({.bytes = bytes, .split = c.split, .mappedLen = c.override}, c.minimum);
      std::vector<uint32_t> lengths;
      Bytes joined;
      for (uint16_t index = 0; index < orr_PktSgArrayGet(pkt)->numElems; ++index) {
         const orr_SgElem *element = orr_PktSgElemGet(pkt, index);
         lengths.push_back(element->length);
         void *va = nullptr;
         ASSERT_EQ(orr_MA2VA(element->addr, element->length, &va), ORR_OK);
         joined.insert(joined.end(), static_cast<uint8_t *>(va), static_cast<uint8_t *>(va) + element->length);
      }
      EXPECT_EQ(lengths, c.lengths);
      EXPECT_EQ(joined, bytes);
      EXPECT_EQ(orr_PktSgElemGet(pkt, static_cast<uint16_t>(lengths.size())), nullptr);
      EXPECT_EQ(orr_PktFrameLenGet(pkt), 60u);
      EXPECT_EQ(copyOut(pkt), bytes);
      ASSERT_EQ(orr_PktFrameMappedLenGet(pkt), c.mapped);
      EXPECT_EQ(0, std::memcmp(orr_PktFrameMappedPointerGet(pkt), bytes.data(), c.mapped));
   }
   EXPECT_THROW(host.frames().makeList({{.bytes = Bytes(20, 1), .split = {15, 6}}}), std::invalid_argument);
   EXPECT_THROW(host.frames().makeList({{.bytes = Bytes(20, 1), .mappedLen = 21}}), std::invalid_argument);
}

TEST_F(FramesTest, UntaggingMovesTheVlanIdIntoTheMetadataAndViewsAreCopied)
{
   Bytes tagged = sampleUdp(uint16_t{42});
   const Bytes plain = sampleUdp();
   orr_Pkt *pkt = single({.bytes = tagged, .vlanId = 7});
   EXPECT_EQ(orr_PktVlanIDGet(pkt), 7) << "without untagging the metadata is the test's";
   EXPECT_EQ(orr_PktFrameLenGet(pkt), tagged.size());
   const host::FrameView views[] = {{.bytes = tagged, .untag = true}, {.bytes = plain, .vlanId = 5}};
   list = host.frames().makeList(std::span<const host::FrameView>(views), 66);
   std::fill(tagged.begin(), tagged.end(), uint8_t{0});   // the host kept its own copy
   EXPECT_EQ(orr_PktVlanIDGet(list->frame(0)), 42);
   EXPECT_EQ(orr_PktVlanIDGet(list->frame(1)), 5);
   for (orr_Pkt *frame : {list->frame(0), list->frame(1)}) {
      EXPECT_EQ(copyOut(frame), plain);
      EXPECT_EQ(orr_PktFrameMappedLenGet(frame), plain.size()) << "one element, mapped whole";
      EXPECT_EQ(0, std::memcmp(orr_PktFrameMappedPointerGet(frame), plain.data(), plain.size()));
   }
   EXPECT_EQ(copyOut(single({.bytes = sampleUdp(uint16_t{42}), .untag = true})), plain);
}

TEST_F(FramesTest, CopyOutAndMachineAddressesAreBoundedByTheFrameAndOneLiveElement)
{
   const Bytes bytes = sampleUdp();
   orr_Pkt *pkt = single({.bytes = bytes, .split = {7, 13}});
   std::array<uint8_t, 8> out{};
   EXPECT_EQ(orr_PktCopyBytesOut(pkt, 52, 8, out.data()), ORR_OK);
   EXPECT_EQ(0, std::memcmp(out.data(), bytes.data() + 52, 8));
   EXPECT_EQ(orr_PktCopyBytesOut(pkt, 53, 8, out.data()), ORR_BAD_PARAM);
   EXPECT_EQ(orr_PktCopyBytesOut(pkt, 61, 0, out.data()), ORR_BAD_PARAM);
   EXPECT_EQ(orr_PktCopyBytesOut(pkt, 0xffffffffu, 2, out.data()), ORR_BAD_PARAM) << "no wrap-around";
   EXPECT_EQ(orr_PktCopyBytesOut(pkt, 60, 0, out.data()), ORR_OK);

   const orr_SgElem second = *orr_PktSgElemGet(pkt, 1);
   void *va = nullptr;
   EXPECT_EQ(orr_MA2VA(second.addr + 4, 9, &va), ORR_OK);
   EXPECT_EQ(0, std::memcmp(va, bytes.data() + 11, 9));
   EXPECT_EQ(orr_MA2VA(second.addr + 4, 10, &va), ORR_BAD_PARAM) << "runs past the element";
   EXPECT_EQ(orr_MA2VA(second.addr - 1, 2, &va), ORR_BAD_PARAM);
   EXPECT_EQ(orr_MA2VA(1234, 1, &va), ORR_BAD_PARAM) << "not a machine address of a frame";
   for (const char *op : {"orr_PktCopyBytesOut", "orr_MA2VA"}) {
      host.faults().failOnce(op, ORR_NO_MEMORY);
   }
   EXPECT_EQ(orr_PktCopyBytesOut(pkt, 0, 8, out.data()), ORR_NO_MEMORY);
   EXPECT_EQ(orr_MA2VA(second.addr, 1, &va), ORR_NO_MEMORY);
   orr_PktRelease(takeOut(*list));
   EXPECT_EQ(orr_MA2VA(second.addr, 1, &va), ORR_BAD_PARAM) << "the frame went back to the host";
}

// Per layer 2, 3, 4: {offset, length, nextProto, nextHdrOffset} of the
// header found, or nothing.
using Entry = std::optional<std::array<uint16_t, 4>>;

TEST_F(FramesTest, HeaderLookupByFrameKind)
{
   using E = std::array<uint16_t, 4>;
   const Arp arp{.senderMac = kVm, .senderIp = Ip4::parse("10.0.0.1"), .targetIp = Ip4::parse("10.0.0.2")};
   const Bytes fragment = ethernet({.dst = kPeer, .src = kVm},
                                   ipv4({.protocol = 17, .fragmentOffset = 4}, udp({}, Bytes(8, 0))));
   const Bytes whole = sampleUdp();
   const Bytes tcp = ethernet({.dst = kPeer, .src = kVm}, ipv4({.protocol = 6}, Bytes(24, 0x60)));
   Bytes options = tcp;   // four bytes of IPv4 options
   options[14] = 0x46;
   options.insert(options.begin() + 34, 4, 0x01);
   struct Case {
      const char *what;
      Bytes bytes;
      Entry l2, l3, l4;
   };
   const Case cases[] = {
      {"UDP over IPv4", whole, E{0, 14, htons(0x0800), 14}, E{14, 20, 17, 34}, E{34, 8, 0, 42}},
      {"tagged", sampleUdp(uint16_t{5}), E{0, 18, htons(0x0800), 18}, E{18, 20, 17, 38}, E{38, 8, 0, 46}},
      {"ARP", arpFrame(kVm, kBroadcastMac, arp), E{0, 14, htons(0x0806), 14}, E{14, 28, 0, 42}, {}},
      {"UDP over IPv6", udp6Frame({.src = kVm, .dst = kPeer}), E{0, 14, htons(0x86dd), 14}, E{14, 40, 17, 54},
       E{54, 8, 0, 62}},
      {"802.3 BPDU", bpduFrame(kVm), E{0, 14, htons(38), 14}, {}, {}},
      {"non-first IPv4 fragment", fragment, E{0, 14, htons(0x0800), 14}, E{14, 20, 17, 34}, {}},
      {"TCP over IPv4", tcp, E{0, 14, htons(0x0800), 14}, E{14, 20, 6, 34}, E{34, 24, 0, 58}},
      {"IPv4 options", options, E{0, 14, htons(0x0800), 14}, E{14, 24, 6, 38}, E{38, 24, 0, 62}},
      {"truncated IPv4", Bytes(whole.begin(), whole.begin() + 30), E{0, 14, htons(0x0800), 14}, {}, {}},
      {"runt", Bytes(13, 0), {}, {}, {}},
      {"ARP behind 802.1ad and 802.1Q", pushTag(pushTag(arpFrame(kVm, kBroadcastMac, arp), 0x8100), 0x88a8),
       E{0, 22, htons(0x0806), 22}, E{22, 28, 0, 50}, {}},
      {"five tags: the walk stops at four", pushTag(pushTag(whole, 0x9100), 0x8100, 0, 4), E{0, 30, htons(0x9100), 30},
       {}, {}},
      {"a tag cut short", [&] { Bytes b = pushTag(whole, 0x8100); b.resize(17); return b; }(),
       E{0, 14, htons(0x8100), 14}, {}, {}},
   };
   for (const Case &c : cases) {
      SCOPED_TRACE(c.what);
      orr_Pkt *pkt = single({.bytes = c.bytes});
      std::array<Entry, 3> found;
      for (uint32_t layer = 0; layer < 3; ++layer) {
         if (const orr_PktHeaderEntry *e = find(pkt, layer)) {
            found[layer] = E{e->offset, e->length, e->nextProto, e->nextHdrOffset};
         }
      }
      EXPECT_EQ(found, (std::array<Entry, 3>{c.l2, c.l3, c.l4}));
   }
   orr_Pkt *pkt = single({.bytes = whole});
   orr_PktHeaderEntry *entry = nullptr;
   EXPECT_EQ(orr_PktHeaderFind(pkt, ORR_PKT_LAYER_3, ORR_PKT_HEADER_CLASS_L2, 1, &entry, 0), ORR_NOT_FOUND);
   EXPECT_EQ(orr_PktHeaderFind(pkt, ORR_PKT_LAYER_3, ORR_PKT_HEADER_CLASS_L3, 2, &entry, 0), ORR_NOT_FOUND);
   host.faults().failOnce("orr_PktHeaderFind", ORR_FAILURE);
   EXPECT_EQ(orr_PktHeaderFind(pkt, ORR_PKT_LAYER_3, ORR_PKT_HEADER_CLASS_L3, 1, &entry, 0), ORR_FAILURE);
}

TEST_F(FramesTest, HeaderDataComesFromMappedPartElementOrCopyAndGoesBackInAnyOrder)
{
   const Bytes bytes = sampleUdp();
   // Mapped: 14 bytes; elements 14 | 30 | 16: IPv4 header (14..34) lies in
   // the second element, UDP (34..42) is spread over the second and third.
   orr_Pkt *pkt = single({.bytes = bytes, .split = {14, 30}});
   orr_PktHeaderEntry *entries[3] = {};
   uint8_t *data[3] = {};
   for (uint32_t layer = 0; layer < 3; ++layer) {
      entries[layer] = find(pkt, layer);
      ASSERT_EQ(orr_PktHeaderDataGet(pkt, entries[layer], &data[layer]), ORR_OK);
      EXPECT_EQ(0, std::memcmp(data[layer], bytes.data() + entries[layer]->offset, entries[layer]->length));
   }
   EXPECT_EQ(data[0], orr_PktFrameMappedPointerGet(pkt));
   void *second = nullptr;
   ASSERT_EQ(orr_MA2VA(orr_PktSgElemGet(pkt, 1)->addr, 30, &second), ORR_OK);
   EXPECT_EQ(data[1], second);
   EXPECT_EQ(host.frames().outstandingMappings(), 3u);
   for (uint32_t layer : {1, 0, 2}) {   // from the middle, then the oldest
      orr_PktHeaderDataRelease(pkt, entries[layer], data[layer], 0);
   }
   EXPECT_EQ(host.frames().outstandingMappings(), 0u);
   host.faults().failOnce("orr_PktHeaderDataGet", ORR_NO_MEMORY);
   EXPECT_EQ(orr_PktHeaderDataGet(pkt, entries[0], &data[0]), ORR_NO_MEMORY);
   orr_PktHeaderEntry foreign = *entries[0];
   EXPECT_EQ(orr_PktHeaderDataGet(pkt, &foreign, &data[0]), ORR_BAD_PARAM) << "not one of the frame's entries";
   EXPECT_EQ(host.frames().outstandingMappings(), 0u);
}

TEST_F(FramesTest, RemovalMovesOnAndWorkLeftAtReturnIsAViolation)
{
   ASSERT_LE(orr_PktListIterSizeOf(), ORR_PKT_LIST_ITER_MAX_SIZE);
   list = host.frames().makeList({{.bytes = Bytes(60, 0)}, {.bytes = Bytes(61, 0)}, {.bytes = Bytes(62, 0)},
                                  {.bytes = Bytes(63, 0)}, {.bytes = Bytes(64, 0)}});
   ASSERT_NO_FATAL_FAILURE(mapLayer2(list->frame(3)));
   Iter storage(*list);
   orr_PktListIter *iter = storage.get();
   std::vector<uint32_t> seen;
   while (!orr_PktListIterIsAtEnd(iter)) {
      orr_Pkt *pkt = orr_PktListIterGetPkt(iter);
      seen.push_back(orr_PktFrameLenGet(pkt));
      if (seen.size() == 5) {
         (void)orr_PktListIterRemovePkt(iter);   // taken out, never released
      } else if (orr_PktFrameLenGet(pkt) % 2 == 0) {
         EXPECT_EQ(orr_PktListIterRemovePkt(iter), pkt);
         orr_PktRelease(pkt);
      } else {
         orr_PktListIterMove(iter);
      }
   }
   EXPECT_THAT(seen, ElementsAre(60u, 61u, 62u, 63u, 64u));
   EXPECT_THAT(list->kept(), ElementsAre(1u, 3u));
   EXPECT_EQ(list->released(), 2u);
   EXPECT_EQ(list->frame(0), nullptr);
   EXPECT_EQ(host.frames().releases(), 2u);
   list.reset();
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("header mapping(s) outstanding"), HasSubstr("never released")));
   EXPECT_EQ(host.frames().outstandingMappings(), 0u);

   ASSERT_NO_FATAL_FAILURE(mapLayer2(single({.bytes = sampleUdp()})));
   orr_PktRelease(takeOut(*list));
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("released with 1 header mapping(s) outstanding")));
}

using FramesDeathTest = FramesTest;

TEST_F(FramesDeathTest, MisusedFramesAbortWithAMessage)
{
   GTEST_FLAG_SET(death_test_style, "threadsafe");
   EXPECT_DEATH(orr_PktRelease(single({.bytes = Bytes(60, 0)})), "still in a list");
   EXPECT_DEATH(releaseTwice(*host.frames().makeList({{.bytes = Bytes(60, 0)}})), "released twice");
   EXPECT_DEATH(releaseUnknownMapping(single({.bytes = sampleUdp()})), "is not a mapping of header");
}

#ifdef SWSEC_TEST_ASAN
uint8_t readAt(const uint8_t *base, std::ptrdiff_t offset)
{
   return *static_cast<const volatile uint8_t *>(base + offset);
}

void readReleasedFrame(host::FrameList &frames)
{
   orr_Pkt *pkt = takeOut(frames);
   const uint8_t *mapped = orr_PktFrameMappedPointerGet(pkt);
   orr_PktRelease(pkt);
   (void)readAt(mapped, 0);
}

// The frames of a list share one arena; each buffer in it is fenced as
// tightly as an allocation of its own.
TEST_F(FramesDeathTest, ReadsOutsideAFramesBuffersAreCaught)
{
   GTEST_FLAG_SET(death_test_style, "threadsafe");
   orr_Pkt *pkt = single({.bytes = sampleUdp(), .split = {14, 17}});
   const uint8_t *mapped = orr_PktFrameMappedPointerGet(pkt);
   void *element = nullptr;
   ASSERT_EQ(orr_MA2VA(orr_PktSgElemGet(pkt, 1)->addr, 17, &element), ORR_OK);
   const auto *second = static_cast<const uint8_t *>(element);
   (void)readAt(mapped, 13);
   (void)readAt(second, 16);
   const char *caught = "container-overflow|use-after-poison|heap-buffer-overflow";
   EXPECT_DEATH(readAt(mapped, 14), caught);
   EXPECT_DEATH(readAt(second, 17), caught);
   EXPECT_DEATH(readAt(second, -1), caught);
   EXPECT_DEATH(readReleasedFrame(*host.frames().makeList({{.bytes = sampleUdp()}})), "use-after-poison");
}
#endif

}  // namespace
}  // namespace swsec::testing
