// Bindings learned by frames that several threads hand to one port at once:
// learning frames take the write lock, the others judge under the read lock
// alongside. Run under ThreadSanitizer in CI; the host checks lock ranks.
#include "support/frames.h"
#include "support/host_fixture.h"

#include <string>
#include <thread>

namespace swsec::testing {
namespace {

constexpr uint32_t kPortId = 21;
constexpr const char *kAgent = "sifra-generic-tarlin-swsec";

// Gratuitous ARP announcements and ordinary IPv4 from one VM interface.
std::vector<host::FrameSpec> trafficOf(const Mac &mac, uint8_t subnet, int round)
{
   std::vector<host::FrameSpec> list;
   const Mac gateway = Mac::parse("02:00:00:00:00:fe");
   for (uint8_t host = 1; host <= 8; ++host) {
      const Ip4 ip{{10, 0, subnet, host}};
      if ((host + round) % 2 == 0) {
         list.push_back({.bytes = arpFrame(mac, kBroadcastMac,
                                           {.op = 1, .senderMac = mac, .senderIp = ip, .targetIp = ip})});
      }
      list.push_back({.bytes = udpFrame({.src = mac, .dst = gateway, .ipSrc = ip,
                                         .ipDst = Ip4{{10, 0, subnet, 254}}})});
   }
   return list;
}

TEST_F(ModuleTest, two_threads_learn_bindings_on_one_port_while_judging_frames)
{
   host().portsets().addPortset("vs0");
   host().portsets().addPort("vs0", kPortId);
   host::FilterId id = 0;
   ASSERT_EQ(host().sifra().createFilter(kAgent, kPortId, {}, &id), ORR_OK);

   auto sender = [&](Mac mac, uint8_t subnet) {
      for (int round = 0; round < 40; ++round) {
         auto result = host().sifra().processPackets(id, ORR_SIFRA_DIR_TX, trafficOf(mac, subnet, round));
         EXPECT_EQ(result.status, ORR_OK);
         EXPECT_EQ(result.released, 0u) << "a trusted, learning port drops nothing here";
      }
   };
   std::thread first(sender, Mac::parse("02:00:00:00:0a:01"), 1);
   std::thread second(sender, Mac::parse("02:00:00:00:0b:01"), 2);
   first.join();
   second.join();

   host::NexoRecord summary;
   ASSERT_EQ(host().nexo().get("/security/" + std::to_string(kPortId) + "/featureSummary", &summary), ORR_OK);
   EXPECT_EQ(summary.value("numVmiEntries"), "16") << "8 addresses of each of the two interfaces";
   EXPECT_EQ(summary.value("numNonAuthVmiEntries"), "16");

   size_t added = 0;
   for (const auto &message : host().portsets().posted()) {
      added += message.name == "portdb.entry.added";
   }
   EXPECT_EQ(added, 16u) << "each binding announced once, however the threads interleaved";
   EXPECT_EQ(host().sifra().destroyFilter(id), ORR_OK);
}

}  // namespace
}  // namespace swsec::testing
