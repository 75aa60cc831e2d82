// Portsets, ports and holds; message listeners, posting, queueing and
// delivery once the poster holds no lock.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <cstring>

using ::testing::ElementsAre;
using ::testing::FieldsAre;
using ::testing::HasSubstr;

namespace swsec::testing {
namespace {

constexpr uint64_t kClass = 1ull << 51;

struct Delivery {
   uint32_t portID;
   std::string name;
   std::string payload;
   bool posterHeldLocks;
   bool operator==(const Delivery &) const = default;
};
std::vector<Delivery> deliveries;

void recordDelivery(uint32_t portID, uint64_t msgClass, const orr_PortsetMessageHeader *message)
{
   EXPECT_EQ(msgClass, kClass);
   const auto *payload = reinterpret_cast<const char *>(message + 1);
   deliveries.push_back({portID, message->name, std::string(payload, message->payloadLength),
                         orr_PortsetHoldState(host::Host::current().portsets().portset("vswitch0")) !=
                            ORR_PORTSET_HOLD_NONE});
}

// A message with its payload following the header.
struct Message {
   orr_PortsetMessageHeader header{};
   char payload[16] = {};

   Message(const char *name, const char *text)
   {
      orr_NameInitialize(reinterpret_cast<orr_Name *>(header.name), name);
      header.payloadLength = std::strlen(text);
      std::memcpy(payload, text, header.payloadLength);
   }
};
static_assert(offsetof(Message, payload) == sizeof(orr_PortsetMessageHeader));

class PortsetsTest : public HostUnitTest {
public:
   PortsetsTest()
   {
      deliveries.clear();
      vswitch = host.portsets().addPortset("vswitch0");
      host.portsets().addPort("vswitch0", 10);
      host.portsets().addPort("vswitch0", 11);
   }

   orr_PortsetMessageCBHandle listen(orr_Portset *portset, uint32_t portID, uint64_t msgClass = kClass)
   {
      orr_PortsetMessageCBHandle handle = 0;
      EXPECT_EQ(orr_PortsetRegisterMessageCB(portset, portID, msgClass, recordDelivery, &deliveries, &handle), ORR_OK);
      return handle;
   }

   orr_Portset *vswitch = nullptr;
};

TEST_F(PortsetsTest, MessagesWaitUntilThePosterLetsGoOfItsLocks)
{
   const orr_PortsetMessageCBHandle listener = listen(vswitch, 0);
   const orr_Spinlock config = makeLock(makeDomain(), "test.config", 4, ORR_SPINLOCK_RW);
   orr_SpinlockWriteLock(config);
   orr_PortsetLockShared(vswitch);
   EXPECT_EQ(orr_PortsetHoldState(vswitch), ORR_PORTSET_HOLD_SHARED);
   const Message first("portdb.entry.added", "one");
   const Message second("portdb.entry.removed", "two");
   EXPECT_EQ(orr_PortsetPostMessage(vswitch, 10, kClass, &first.header), ORR_OK);
   EXPECT_EQ(orr_PortsetPostMessage(vswitch, 11, kClass, &second.header), ORR_OK);
   orr_PortsetUnlockShared(vswitch);
   EXPECT_TRUE(deliveries.empty()) << "still under the poster's spinlock";
   EXPECT_EQ(host.portsets().pendingDeliveries(), 2u);
   orr_SpinlockWriteUnlock(config);
   EXPECT_THAT(deliveries, ElementsAre(Delivery{10, "portdb.entry.added", "one", false},
                                       Delivery{11, "portdb.entry.removed", "two", false}));
   EXPECT_EQ(host.portsets().pendingDeliveries(), 0u);
   // portset, portID, msgClass, name, payload
   EXPECT_THAT(host.portsets().posted(),
               ElementsAre(FieldsAre("vswitch0", 10u, kClass, "portdb.entry.added", ElementsAre('o', 'n', 'e')),
                           FieldsAre("vswitch0", 11u, kClass, "portdb.entry.removed", ElementsAre('t', 'w', 'o'))));
   orr_PortsetUnregisterMessageCB(listener);
   orr_SpinlockDestroy(config);
}

TEST_F(PortsetsTest, ListenersMatchPortsetPortAndClassUntilWithdrawn)
{
   orr_Portset *other = host.portsets().addPortset("vswitch1");
   host.portsets().addPort("vswitch1", 20);
   const orr_PortsetMessageCBHandle handles[] = {
      listen(vswitch, 10),               // this port only
      listen(nullptr, 0),                // anything of the class
      listen(other, 0),                  // another portset
      listen(vswitch, 0, kClass >> 1),   // another class
   };
   // handle, portset, portID, msgClass, callback, priv
   EXPECT_THAT(host.portsets().listeners()[1], FieldsAre(handles[1], nullptr, 0u, kClass, &recordDelivery, &deliveries));
   EXPECT_NE(handles[0], handles[1]);
   const Message message("m", "x");
   orr_PortsetLockShared(vswitch);
   EXPECT_EQ(orr_PortsetPostMessage(vswitch, 11, kClass, &message.header), ORR_OK);
   EXPECT_EQ(orr_PortsetPostMessage(vswitch, 10, kClass, &message.header), ORR_OK);
   orr_PortsetUnlockShared(vswitch);
   std::vector<uint32_t> ports;
   for (const Delivery &delivery : deliveries) {
      ports.push_back(delivery.portID);
   }
   EXPECT_THAT(ports, ElementsAre(11u, 10u, 10u)) << "port 11: the catch-all; port 10: both";
   for (auto handle : handles) {
      orr_PortsetUnregisterMessageCB(handle);
   }
   EXPECT_TRUE(host.portsets().listeners().empty());
   orr_PortsetUnregisterMessageCB(handles[0]);
   EXPECT_EQ(takeViolations().size(), 1u);
}

TEST_F(PortsetsTest, PostingNeedsTheLockCanFailAndMayTurnTheHoldExclusive)
{
   const Message message("m", "x");
   EXPECT_EQ(orr_PortsetPostMessage(vswitch, 10, kClass, &message.header), ORR_FAILURE);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("without holding its lock")));
   orr_PortsetLockShared(vswitch);
   host.faults().failOnce("orr_PortsetPostMessage", ORR_NO_MEMORY);
   EXPECT_EQ(orr_PortsetPostMessage(vswitch, 10, kClass, &message.header), ORR_NO_MEMORY);
   EXPECT_TRUE(host.portsets().posted().empty());
   host.portsets().upgradeHoldOnNextPost();
   EXPECT_EQ(orr_PortsetPostMessage(vswitch, 10, kClass, &message.header), ORR_OK);
   EXPECT_EQ(orr_PortsetHoldState(vswitch), ORR_PORTSET_HOLD_EXCL);
   orr_PortsetUnlockExcl(vswitch);
   EXPECT_EQ(orr_PortsetHoldState(vswitch), ORR_PORTSET_HOLD_NONE);
   EXPECT_EQ(host.portsets().pendingDeliveries(), 0u);
   GTEST_FLAG_SET(death_test_style, "threadsafe");
   EXPECT_DEATH(orr_PortsetUnlockShared(vswitch), "not held shared");
   EXPECT_DEATH(
      {
         orr_PortsetLockShared(vswitch);
         orr_PortsetUnlockExcl(vswitch);
      },
      "not held exclusive");
}

}  // namespace
}  // namespace swsec::testing
