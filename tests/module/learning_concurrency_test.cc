// Bindings learned by frames that several threads hand to one port at once:
// learning frames take the write lock, the others judge under the read lock
// alongside. Run under ThreadSanitizer in CI; the host checks lock ranks.
#include "port_fixture.h"

#include <string>
#include <thread>

namespace swsec::testing {
namespace {

// Gratuitous ARP announcements and ordinary IPv4 from one VM interface.
std::vector<Bytes> trafficOf(const Mac &mac, uint8_t subnet, int round)
{
   std::vector<Bytes> list;
   for (uint8_t host = 1; host <= 8; ++host) {
      const Ip4 ip{{10, 0, subnet, host}};
      if ((host + round) % 2 == 0) {
         list.push_back(arpFrame(mac, kBroadcastMac, {.op = 1, .senderMac = mac, .senderIp = ip, .targetIp = ip}));
      }
      list.push_back(udpFrame({.src = mac, .dst = Mac::parse("02:00:00:00:00:fe"), .ipSrc = ip,
                               .ipDst = Ip4{{10, 0, subnet, 254}}}));
   }
   return list;
}

TEST_F(PortTest, two_threads_learn_bindings_on_one_port_while_judging_frames)
{
   const host::FilterId id = create();
   auto sender = [&](Mac mac, uint8_t subnet) {
      for (int round = 0; round < 40; ++round) {
         auto result = send(id, kTx, trafficOf(mac, subnet, round));
         EXPECT_EQ(result.status, ORR_OK);
         EXPECT_EQ(result.released, 0u) << "a trusted, learning port drops nothing here";
      }
   };
   std::thread first(sender, Mac::parse("02:00:00:00:0a:01"), 1);
   std::thread second(sender, Mac::parse("02:00:00:00:0b:01"), 2);
   first.join();
   second.join();

   host::NexoRecord summary;
   ASSERT_EQ(host().nexo().get("/security/7/featureSummary", &summary), ORR_OK);
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
