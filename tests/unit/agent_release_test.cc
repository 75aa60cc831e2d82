// The framework teardown: agents released oldest first, each record freed
// with its magic complemented, then every framework resource; a second
// teardown releases nothing.
#include "support/host_fixture.h"
#include "freed_blocks.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_list.h"

#include <cstring>
#include <string>
#include <vector>

namespace swsec::testing {
namespace {

using FrameworkTeardownTest = HostTest;

// What a complete start leaves, made directly with the host (no module is
// loaded, so there is no module registration), plus agent records as
// creation leaves them, without host registrations of their own.
void makeFramework(const std::vector<const char *> &agents)
{
   orr_HeapProps heapProps{};
   orr_NameInitialize(&heapProps.name, "unit");
   heapProps.initialSize = 4096;
   heapProps.maximumSize = 1u << 20;
   ASSERT_EQ(orr_HeapCreate(&heapProps, &sifraGenericHeapID), ORR_OK);
   orr_LogProps logProps{};
   logProps.name = heapProps.name;
   logProps.heap = sifraGenericHeapID;
   ASSERT_EQ(orr_LogRegister(&logProps, &sifraGenericLogHandle), ORR_OK);
   orr_TimerQueueProps queueProps{};
   queueProps.name = heapProps.name;
   queueProps.heap = sifraGenericHeapID;
   ASSERT_EQ(orr_TimerQueueCreate(&queueProps, &sifraGenericTimerQueue), ORR_OK);
   ASSERT_EQ(orr_LockDomainCreate(orr_ModuleCurrentID, sifraGenericHeapID, &heapProps.name,
                                  &sifraGenericLockDomain),
             ORR_OK);
   ASSERT_EQ(orr_PlexClientPortRegister(&sifraGenericPortClient, 0, "unit.agents",
                                        &sifraGenericCreateAgentOps),
             ORR_OK);
   for (const char *name : agents) {
      auto *agent = static_cast<SifraGenericFastPathAgent *>(
         SifraGenericAlloc(sizeof(SifraGenericFastPathAgent)));
      ASSERT_NE(agent, nullptr);
      freedBlocks::watch(agent, sizeof(*agent));
      std::strncpy(agent->name, name, sizeof(agent->name) - 1);
      agent->magic = SIFRAGENERIC_AGENT_MAGIC;
      SifraGenericListAppend(&agentList, &agent->links);
   }
}

TEST_F(FrameworkTeardownTest, releases_agents_oldest_first_and_nothing_on_a_second_run)
{
   freedBlocks::clear();
   makeFramework({"sifra-generic-tarlin-swsec", "b", "c"});

   EXPECT_EQ(SifraGenericCleanup(), ORR_OK);

   std::vector<std::string> order;
   for (const auto &block : freedBlocks::freed()) {
      const uint8_t *bytes = block.bytes.data();
      order.emplace_back(reinterpret_cast<const char *>(bytes + offsetof(SifraGenericFastPathAgent, name)));
      uint64_t magic = 0;
      std::memcpy(&magic, bytes + offsetof(SifraGenericFastPathAgent, magic), sizeof(magic));
      EXPECT_EQ(magic, ~SIFRAGENERIC_AGENT_MAGIC) << order.back();
   }
   EXPECT_EQ(order, (std::vector<std::string>{"sifra-generic-tarlin-swsec", "b", "c"}));
   EXPECT_TRUE(SifraGenericListIsEmpty(&agentList));
   EXPECT_TRUE(host().locks().domains().empty());
   EXPECT_TRUE(host().plex().clientPorts().empty());
   EXPECT_EQ(sifraGenericHeapID, nullptr);
   EXPECT_EQ(sifraGenericLogHandle, nullptr);
   EXPECT_EQ(sifraGenericTimerQueue, nullptr);
   EXPECT_EQ(sifraGenericLockDomain, ORR_INVALID_LOCK_DOMAIN);
   EXPECT_EQ(sifraGenericPortClient, nullptr);

   // The strict host reports any handle that is given back twice.
   EXPECT_EQ(SifraGenericCleanup(), ORR_OK);
   EXPECT_EQ(host().faults().calls("orr_PlexClientPortUnregister"), 1u);
   EXPECT_EQ(freedBlocks::freed().size(), 3u);
}

}  // namespace
}  // namespace swsec::testing
