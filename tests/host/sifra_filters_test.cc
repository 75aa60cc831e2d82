// Filters driven as the hypervisor drives them, against a fast path made
// here: configuration reads, destroy retries, ioctl reply capture, minimum
// mapped length and frame lists handed in from several threads.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <atomic>
#include <cstring>
#include <thread>

using ::testing::_;
using ::testing::ElementsAre;
using ::testing::FieldsAre;
using ::testing::IsEmpty;
using ::testing::HasSubstr;

namespace swsec::testing {
namespace {

// What the fast path saw and how it answers.
struct Agent {
   orr_SifraFilterHandle handle = nullptr;
   std::string name;
   orr_Status uuidStatus = ORR_OK;
   std::string uuid;
   int32_t vnic = 0;
   uint32_t minMapped = 0;
   int busyDestroys = 0;
   int destroyCalls = 0;
   int configChanges = 0;
};
Agent agent;
std::atomic<uint32_t> mappedSeen{0};   // written from several threads
int record = 0;   // the module record handed back

orr_Status createFilter(orr_SifraAgentHandle, orr_SifraFilterHandle handle, orr_SifraFilter *filter, uint8_t)
{
   agent.handle = handle;
   char name[100] = {};
   char uuid[128] = {};
   orr_Status status = orr_SifraGetName(handle, name, sizeof(name));
   if (status != ORR_OK) {
      return status;
   }
   agent.name = name;
   agent.uuidStatus = orr_SifraGetVMUUID(handle, uuid, sizeof(uuid));
   agent.uuid = uuid;
   status = orr_SifraGetVnicIndex(handle, &agent.vnic);
   if (status != ORR_OK) {
      return status;
   }
   if (agent.minMapped != 0) {
      status = orr_SifraSetMinPktMappedLen(handle, agent.minMapped, ORR_SIFRA_DIR_TX);
      if (status != ORR_OK) {
         return status;
      }
   }
   *filter = &record;
   return ORR_OK;
}

orr_Status destroyFilter(orr_SifraFilter filter)
{
   EXPECT_EQ(filter, &record);
   ++agent.destroyCalls;
   if (agent.busyDestroys > 0) {
      --agent.busyDestroys;
      return ORR_BUSY;
   }
   return ORR_OK;
}

// Drops every frame whose first byte is odd; notes the mapped length.
orr_Status processPackets(orr_SifraFilter, orr_PktList *list, uint32_t)
{
   alignas(void *) uint8_t storage[ORR_PKT_LIST_ITER_MAX_SIZE];
   auto *iter = reinterpret_cast<orr_PktListIter *>(storage);
   orr_PktListIterStart(list, iter);
   while (!orr_PktListIterIsAtEnd(iter)) {
      orr_Pkt *pkt = orr_PktListIterGetPkt(iter);
      mappedSeen = orr_PktFrameMappedLenGet(pkt);
      if ((orr_PktFrameMappedPointerGet(pkt)[0] & 1) != 0) {
         orr_PktRelease(orr_PktListIterRemovePkt(iter));
      } else {
         orr_PktListIterMove(iter);
      }
   }
   return ORR_OK;
}

// Replies to every ioctl with its payload reversed, request ID and all.
orr_Status processIoctl(orr_SifraFilter, uint32_t requestId, void *payload, uint64_t size)
{
   auto *bytes = static_cast<uint8_t *>(payload);
   std::reverse(bytes, bytes + size);
   return orr_SifraSendFilterIoctlReply(agent.handle, requestId, payload, size);
}

orr_Status configurationChanged(orr_SifraFilter)
{
   ++agent.configChanges;
   char name[8] = {};
   EXPECT_EQ(orr_SifraGetName(agent.handle, name, sizeof(name)), ORR_OK);
   agent.name = name;
   return ORR_OK;
}

const orr_SifraFastPathOps ops = {.createFilter = createFilter,
                                  .destroyFilter = destroyFilter,
                                  .processPackets = processPackets,
                                  .processFilterIoctl = processIoctl,
                                  .configurationChanged = configurationChanged};

class SifraFiltersTest : public HostUnitTest {
public:
   SifraFiltersTest()
   {
      agent = Agent{};
      host.portsets().addPortset("vswitch0");
      host.portsets().addPort("vswitch0", 10);
      EXPECT_EQ(orr_SifraRegisterFastPath("test-agent", ORR_SIFRA_FASTPATH_REVISION, ORR_SIFRA_FASTPATH_REVISION, 7,
                                          &ops, nullptr, &fastPath),
                ORR_OK);
   }

   ~SifraFiltersTest() override
   {
      if (fastPath != nullptr) {
         orr_SifraUnregisterFastPath(fastPath);
      }
   }

   host::FilterId create(host::FilterConfig config = {})
   {
      host::FilterId id = 0;
      EXPECT_EQ(host.sifra().createFilter("test-agent", 10, config, &id), ORR_OK);
      return id;
   }

   orr_SifraFastPath fastPath = nullptr;
};

TEST_F(SifraFiltersTest, TheModuleReadsTheConfigurationItWasCreatedWith)
{
   const host::FilterId id = create({.name = "vm-1.eth0", .vmUuid = "42-42", .vnicIndex = 3});
   // handle, name, uuidStatus, uuid, vnic, ...
   EXPECT_THAT(agent, FieldsAre(_, "vm-1.eth0", ORR_OK, "42-42", 3, _, _, _, _));
   const auto info = host.sifra().filter(id);
   ASSERT_TRUE(info);
   EXPECT_EQ(info->record, &record);
   EXPECT_EQ(info->portID, 10u);
   uint32_t portID = 0;
   EXPECT_EQ(orr_SifraGetPortID(info->handle, &portID), ORR_OK);
   EXPECT_EQ(portID, 10u);

   create({.name = "vm-2.eth0"});
   EXPECT_EQ(agent.uuidStatus, ORR_NO_VM_UUID);
   EXPECT_EQ(agent.uuid, "");
}

TEST_F(SifraFiltersTest, FailedConfigurationReadsFailTheCreation)
{
   host.faults().failOnce("orr_SifraGetVnicIndex", ORR_FAILURE);
   host::FilterId id = 0;
   EXPECT_EQ(host.sifra().createFilter("test-agent", 10, {}, &id), ORR_FAILURE);
   EXPECT_TRUE(host.sifra().filters().empty());
   EXPECT_EQ(host.sifra().createFilter("test-agent", 99, {}, &id), ORR_NOT_FOUND) << "no such port";
   EXPECT_EQ(host.sifra().createFilter("other", 10, {}, &id), ORR_NOT_FOUND) << "no such fast path";
}

TEST_F(SifraFiltersTest, NamesAreCutToTheBufferAndChangesReachTheModule)
{
   const host::FilterId id = create({.name = "short"});
   EXPECT_EQ(host.sifra().changeConfiguration(id, {.name = "a-much-longer-name"}), ORR_OK);
   EXPECT_EQ(agent.configChanges, 1);
   EXPECT_EQ(agent.name, "a-much-") << "cut to 8 bytes with the terminator";
   EXPECT_EQ(host.sifra().filter(id)->config.name, "a-much-longer-name");
}

TEST_F(SifraFiltersTest, DestroyAsTheHypervisorRetriesWhileBusy)
{
   const host::FilterId id = create();
   agent.busyDestroys = 3;
   const auto start = host.clock().now();
   EXPECT_THAT(host.sifra().destroyFilterAsHypervisor(id), FieldsAre(ORR_OK, 4u));   // status, attempts
   EXPECT_EQ(host.clock().now() - start, std::chrono::milliseconds(3));
   EXPECT_FALSE(host.sifra().filter(id));

   const host::FilterId busy = create();
   agent.busyDestroys = 10;
   EXPECT_THAT(host.sifra().destroyFilterAsHypervisor(busy, 5), FieldsAre(ORR_BUSY, 5u));
   EXPECT_TRUE(host.sifra().filter(busy)) << "a busy filter stays";
}

TEST_F(SifraFiltersTest, UnregisteringTheFastPathDestroysItsFiltersFirst)
{
   create();
   create();
   agent.busyDestroys = 2;
   orr_SifraUnregisterFastPath(fastPath);
   fastPath = nullptr;
   EXPECT_EQ(agent.destroyCalls, 4);
   EXPECT_TRUE(host.sifra().filters().empty());
   EXPECT_TRUE(host.sifra().fastPaths().empty());
}

TEST_F(SifraFiltersTest, IoctlRepliesAreCapturedInOrder)
{
   const host::FilterId id = create();
   EXPECT_EQ(host.sifra().sendIoctl(id, 5, {1, 2, 3}), ORR_OK);
   EXPECT_EQ(host.sifra().sendIoctl(id, 6, {}), ORR_OK);
   host.faults().failOnce("orr_SifraSendFilterIoctlReply", ORR_NO_MEMORY);
   EXPECT_EQ(host.sifra().sendIoctl(id, 7, {9}), ORR_NO_MEMORY);
   EXPECT_THAT(host.sifra().ioctlReplies(),
               ElementsAre(FieldsAre(id, 5u, ElementsAre(3, 2, 1)), FieldsAre(id, 6u, IsEmpty())));
}

TEST_F(SifraFiltersTest, AStaleHandleIsAViolation)
{
   const host::FilterId id = create();
   const orr_SifraFilterHandle handle = host.sifra().filter(id)->handle;
   EXPECT_EQ(host.sifra().destroyFilter(id), ORR_OK);
   uint32_t portID = 0;
   EXPECT_EQ(orr_SifraGetPortID(handle, &portID), ORR_INVALID_HANDLE);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("unknown filter handle")));
}

TEST_F(SifraFiltersTest, MinimumMappedLengthAppliesToItsDirectionsOnly)
{
   agent.minMapped = 42;
   const host::FilterId id = create();
   EXPECT_EQ(host.sifra().filter(id)->minMappedLen, 42u);
   EXPECT_EQ(host.sifra().filter(id)->minMappedDirections, uint32_t{ORR_SIFRA_DIR_TX});
   const host::FrameSpec frame{.bytes = std::vector<uint8_t>(60, 0), .split = {14}};
   (void)host.sifra().processPackets(id, ORR_SIFRA_DIR_TX, {frame});
   EXPECT_EQ(mappedSeen.load(), 42u);
   (void)host.sifra().processPackets(id, ORR_SIFRA_DIR_RX, {frame});
   EXPECT_EQ(mappedSeen.load(), 14u);
}

TEST_F(SifraFiltersTest, FrameListsFromSeveralThreadsReportWhatWasKept)
{
   const host::FilterId id = create();
   std::vector<host::FrameSpec> frames;
   for (uint8_t first : {2, 3, 4, 5, 7, 8}) {
      frames.push_back({.bytes = std::vector<uint8_t>(20, first), .split = {5, 0}});
   }
   constexpr int kThreads = 4;
   std::vector<host::PacketsResult> results(kThreads);
   std::vector<std::thread> threads;
   for (int t = 0; t < kThreads; ++t) {
      threads.emplace_back([&, t] {
         for (int round = 0; round < 20; ++round) {
            results[static_cast<size_t>(t)] = host.sifra().processPackets(id, ORR_SIFRA_DIR_RX, frames);
         }
      });
   }
   for (auto &thread : threads) {
      thread.join();
   }
   for (const auto &result : results) {
      EXPECT_THAT(result, FieldsAre(ORR_OK, ElementsAre(0u, 2u, 5u), 3u));
   }
   EXPECT_EQ(host.frames().releases(), 3u * 20u * kThreads);
}

}  // namespace
}  // namespace swsec::testing
