// Fast paths, filters, slow paths, per-filter properties and migrations
// driven as the hypervisor and the management plane drive them, against a
// fast path made here; and the contract checks that catch a module's
// mistakes.
#include "host_unit.h"

#include <gmock/gmock.h>

#include <atomic>
#include <cstring>
#include <functional>
#include <thread>

using ::testing::ElementsAre;
using ::testing::FieldsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

namespace swsec::testing {
namespace {

using host::SlowPathRequestKind;

// What the fast path saw and how it answers.
struct Agent {
   orr_SifraFilterHandle handle = nullptr;
   std::string name;   // as read at creation: name, VM UUID (or its status), vNIC index
   std::string uuid;
   int32_t vnic = 0;
   uint32_t minMapped = 0;
   int busyDestroys = 0;
   int destroyCalls = 0;
   int busyUnregisters = 0;
   int unregisterCalls = 0;
   int slowPathRecords[4] = {};
   std::function<void(uint8_t *, uint64_t *)> save;
   std::function<void(const uint8_t *, uint64_t)> restore;
   std::vector<uint8_t> written;   // the last property write
};
Agent agent;
std::atomic<uint32_t> mappedSeen{0};   // written from several threads
int record = 0;                        // the module record handed back

orr_Status createFilter(orr_SifraAgentHandle, orr_SifraFilterHandle handle, orr_SifraFilter *filter, uint8_t)
{
   agent.handle = handle;
   char name[100] = {};
   char uuid[128] = {};
   EXPECT_EQ(orr_SifraGetName(handle, name, sizeof(name)), ORR_OK);
   agent.name = name;
   const orr_Status uuidStatus = orr_SifraGetVMUUID(handle, uuid, sizeof(uuid));
   agent.uuid = uuidStatus == ORR_OK ? uuid : "status " + std::to_string(uuidStatus);
   if (orr_Status status = orr_SifraGetVnicIndex(handle, &agent.vnic); status != ORR_OK) {
      return status;
   }
   if (agent.minMapped != 0) {
      EXPECT_EQ(orr_SifraSetMinPktMappedLen(handle, agent.minMapped, ORR_SIFRA_DIR_TX), ORR_OK);
   }
   *filter = &record;
   return ORR_OK;
}

orr_Status destroyFilter(orr_SifraFilter filter)
{
   EXPECT_EQ(filter, &record);
   ++agent.destroyCalls;
   return agent.busyDestroys-- > 0 ? ORR_BUSY : ORR_OK;
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

// Replies to every ioctl with its payload reversed.
orr_Status processIoctl(orr_SifraFilter, uint32_t requestId, void *payload, uint64_t size)
{
   std::reverse(static_cast<uint8_t *>(payload), static_cast<uint8_t *>(payload) + size);
   return orr_SifraSendFilterIoctlReply(agent.handle, requestId, payload, size);
}

orr_Status configurationChanged(orr_SifraFilter)
{
   char name[8] = {};
   EXPECT_EQ(orr_SifraGetName(agent.handle, name, sizeof(name)), ORR_OK);
   agent.name = name;
   return ORR_OK;
}

void onReply(orr_SifraFilter, void *, orr_Status) {}

// The saveState and restoreState bodies are the test's; the state is 16 bytes.
const orr_SifraFastPathOps ops = {
   .registerSlowPath = [](orr_SifraAgentHandle, uint32_t id, orr_SifraSlowPath *slowPath) -> orr_Status {
      *slowPath = &agent.slowPathRecords[id % 4];
      return ORR_OK;
   },
   .unregisterSlowPath = [](orr_SifraSlowPath) -> orr_Status {
      ++agent.unregisterCalls;
      return agent.busyUnregisters-- > 0 ? ORR_BUSY : ORR_OK;
   },
   .createFilter = createFilter,
   .destroyFilter = destroyFilter,
   .getSavedStateLen = [](orr_SifraFilter, uint64_t *length) -> orr_Status {
      *length = 16;
      return ORR_OK;
   },
   .saveState = [](orr_SifraFilter, void *buffer, uint64_t *length) -> orr_Status {
      agent.save(static_cast<uint8_t *>(buffer), length);
      return ORR_OK;
   },
   .restoreState = [](orr_SifraFilter, const void *buffer, uint64_t length) -> orr_Status {
      agent.restore(static_cast<const uint8_t *>(buffer), length);
      return ORR_OK;
   },
   .processPackets = processPackets,
   .processFilterIoctl = processIoctl,
   .configurationChanged = configurationChanged};

const orr_SifraPropertyOps propertyOps = {
   .write = [](orr_SifraFilter, void *, const void *data, uint32_t length) -> orr_Status {
      agent.written.assign(static_cast<const uint8_t *>(data), static_cast<const uint8_t *>(data) + length);
      return length == 3 ? ORR_OK : ORR_BAD_PARAM;
   },
   .read = [](orr_SifraFilter filter, void *, void *buffer, uint32_t length) -> orr_Status {
      std::memset(buffer, filter == &record ? 0x42 : 0x24, length);
      return ORR_OK;
   },
   .poll = [](orr_SifraFilter filter, void *, uint32_t *length) {
      *length = 62;
      return filter != nullptr;
   },
   .cleanup = nullptr};

class SifraTest : public HostUnitTest {
public:
   SifraTest()
   {
      agent = Agent{};
      host.portsets().addPortset("vswitch0");
      host.portsets().addPort("vswitch0", 10);
      EXPECT_EQ(orr_SifraRegisterFastPath("test-agent", ORR_SIFRA_FASTPATH_REVISION, ORR_SIFRA_FASTPATH_REVISION, 7,
                                          &ops, &agent, &fastPath),
                ORR_OK);
   }

   ~SifraTest() override
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

   host::SlowPaths &slowPaths() { return host.sifra().slowPaths(); }

   orr_SifraFastPath fastPath = nullptr;
   int cookie = 0;
};

TEST_F(SifraTest, RegistrationsAreUniqueByNameAndPropertiesAreReachedByName)
{
   orr_SifraFastPath refused = nullptr;
   EXPECT_EQ(orr_SifraRegisterFastPath("test-agent", 0x1010000, 0x1010000, 1, &ops, nullptr, &refused), ORR_EXISTS);
   EXPECT_EQ(orr_SifraRegisterFastPath("new", 0x2000000, 0x2000000, 1, &ops, nullptr, &refused), ORR_NOT_SUPPORTED);
   EXPECT_EQ(refused, nullptr);
   // name, revision, compatRevision, module, ops, agent: the first registration stands.
   EXPECT_THAT(host.sifra().fastPaths(), ElementsAre(FieldsAre("test-agent", 0x1010000u, 0x1010000u, 7u, &ops, &agent)));
   orr_SifraPropertyHandle property = nullptr;
   orr_SifraPropertyHandle again = nullptr;
   ASSERT_EQ(orr_SifraPropertyRegister(&property, "agent.security", &propertyOps), ORR_OK);
   EXPECT_EQ(orr_SifraPropertyRegister(&again, "agent.security", &propertyOps), ORR_EXISTS);
   const host::FilterId id = create();
   EXPECT_EQ(host.sifra().writeProperty("agent.security", std::nullopt, {1, 2, 3}), ORR_OK);
   EXPECT_EQ(agent.written, (std::vector<uint8_t>{1, 2, 3}));
   EXPECT_EQ(host.sifra().writeProperty("agent.security", id, {1, 2}), ORR_BAD_PARAM) << "the module's status";
   std::vector<uint8_t> buffer(61, 0);
   EXPECT_EQ(host.sifra().readProperty("agent.security", id, buffer), ORR_OK);
   EXPECT_EQ(buffer, std::vector<uint8_t>(61, 0x42)) << "the filter's record, the whole buffer offered";
   EXPECT_EQ(host.sifra().pollProperty("agent.security", std::nullopt), std::nullopt);
   EXPECT_EQ(host.sifra().pollProperty("agent.security", id), 62u);
   EXPECT_EQ(host.sifra().writeProperty("other.security", std::nullopt, {1}), ORR_NOT_FOUND);
   EXPECT_EQ(host.sifra().readProperty("other.security", std::nullopt, buffer), ORR_NOT_FOUND);
   EXPECT_THROW((void)host.sifra().writeProperty("agent.security", host::FilterId{999}, {1}), std::invalid_argument);
   orr_SifraPropertyUnregister(property);
   orr_SifraPropertyUnregister(property);
   orr_SifraUnregisterFastPath(fastPath);
   orr_SifraUnregisterFastPath(std::exchange(fastPath, nullptr));
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("unknown"), HasSubstr("unknown fast path")));
   EXPECT_TRUE(host.sifra().properties().empty());
   EXPECT_TRUE(host.sifra().fastPaths().empty());
}

TEST_F(SifraTest, TheModuleReadsTheConfigurationItWasCreatedWithAndItsChanges)
{
   const host::FilterId id = create({.name = "vm-1.eth0", .vmUuid = "42-42", .vnicIndex = 3});
   EXPECT_EQ(agent.name + " " + agent.uuid + " " + std::to_string(agent.vnic), "vm-1.eth0 42-42 3");
   const auto info = host.sifra().filter(id);
   ASSERT_TRUE(info);
   EXPECT_EQ(info->record, &record);
   uint32_t portID = 0;
   EXPECT_EQ(orr_SifraGetPortID(info->handle, &portID), ORR_OK);
   EXPECT_EQ(portID, 10u);
   EXPECT_EQ(host.sifra().changeConfiguration(id, {.name = "a-much-longer-name"}), ORR_OK);
   EXPECT_EQ(agent.name, "a-much-") << "cut to 8 bytes with the terminator";
   create({.name = "vm-2.eth0"});
   EXPECT_EQ(agent.uuid, "status " + std::to_string(ORR_NO_VM_UUID));

   host.faults().failOnce("orr_SifraGetVnicIndex", ORR_FAILURE);
   host::FilterId failed = 0;
   EXPECT_EQ(host.sifra().createFilter("test-agent", 10, {}, &failed), ORR_FAILURE);
   EXPECT_EQ(host.sifra().filters().size(), 2u);
   EXPECT_EQ(host.sifra().createFilter("test-agent", 99, {}, &failed), ORR_NOT_FOUND) << "no such port";
   EXPECT_EQ(host.sifra().createFilter("other", 10, {}, &failed), ORR_NOT_FOUND) << "no such fast path";
   EXPECT_EQ(host.sifra().destroyFilter(id), ORR_OK);
   EXPECT_EQ(orr_SifraGetPortID(info->handle, &portID), ORR_INVALID_HANDLE);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("unknown filter handle")));
}

TEST_F(SifraTest, BusyDestroysAreRetriedAndTheFastPathGoesAfterItsFilters)
{
   const host::FilterId id = create();
   agent.busyDestroys = 3;
   const auto start = host.clock().now();
   EXPECT_THAT(host.sifra().destroyFilterAsHypervisor(id), FieldsAre(ORR_OK, 4u));   // status, attempts
   EXPECT_EQ(host.clock().now() - start, std::chrono::milliseconds(3));
   const host::FilterId busy = create();
   agent.busyDestroys = 10;
   EXPECT_THAT(host.sifra().destroyFilterAsHypervisor(busy, 5), FieldsAre(ORR_BUSY, 5u));
   EXPECT_TRUE(host.sifra().filter(busy)) << "a busy filter stays";
   create();
   agent.busyDestroys = 2;
   EXPECT_EQ(slowPaths().registerSlowPath("test-agent", 1), ORR_OK);
   agent.busyUnregisters = 5;
   orr_SifraUnregisterFastPath(std::exchange(fastPath, nullptr));
   EXPECT_EQ(agent.destroyCalls, 4 + 5 + 2 + 2);
   EXPECT_EQ(agent.unregisterCalls, 6) << "slow paths withdrawn however busy";
   EXPECT_TRUE(host.sifra().filters().empty());
   EXPECT_TRUE(slowPaths().registered().empty());
}

TEST_F(SifraTest, IoctlRepliesAreCapturedInOrderAndMappedLengthFollowsTheDirection)
{
   agent.minMapped = 42;
   const host::FilterId id = create();
   EXPECT_EQ(host.sifra().sendIoctl(id, 5, {1, 2, 3}), ORR_OK);
   EXPECT_EQ(host.sifra().sendIoctl(id, 6, {}), ORR_OK);
   host.faults().failOnce("orr_SifraSendFilterIoctlReply", ORR_NO_MEMORY);
   EXPECT_EQ(host.sifra().sendIoctl(id, 7, {9}), ORR_NO_MEMORY);
   EXPECT_THAT(host.sifra().ioctlReplies(),
               ElementsAre(FieldsAre(id, 5u, ElementsAre(3, 2, 1)), FieldsAre(id, 6u, IsEmpty())));
   const host::FrameSpec frame{.bytes = std::vector<uint8_t>(60, 0), .split = {14}};
   (void)host.sifra().processPackets(id, ORR_SIFRA_DIR_TX, {frame});
   EXPECT_EQ(mappedSeen.load(), 42u);
   (void)host.sifra().processPackets(id, ORR_SIFRA_DIR_RX, {frame});
   EXPECT_EQ(mappedSeen.load(), 14u);
}

// Each breach of the host contract a module can make, as the violation it
// must raise (or, where the host fences a buffer for AddressSanitizer, the
// report that ends the process there).
struct Breach {
   const char *name;
   std::function<void(SifraTest &, host::FilterId)> act;
   const char *violation;
   bool poisoned = false;
};

void restoreFrom(const uint8_t *state, uint64_t length, orr_Status expected = ORR_OK)
{
   EXPECT_EQ(orr_SifraRestoreSlowPathState(agent.handle, state, length, [](orr_SifraFilter, void *, orr_Status) {},
                                           nullptr, 10),
             expected);
}

const Breach breaches[] = {
   {"SlowPathRequestUnderASpinlock",
    [](SifraTest &t, host::FilterId) {
       const orr_Spinlock lock = t.makeLock(t.makeDomain(), "test.lock", 2);
       orr_SpinlockLock(lock);
       EXPECT_EQ(orr_SifraClearSlowPath(agent.handle), ORR_OK);
       orr_SpinlockUnlock(lock);
    },
    "orr_SifraClearSlowPath: request made while holding spinlock 'test.lock'"},
   {"SecondSlowPathReplyOwed",
    [](SifraTest &t, host::FilterId) {
       EXPECT_EQ(orr_SifraSetSlowPath(agent.handle, 9, onReply, &t.cookie, 10), ORR_OK);
       EXPECT_EQ(orr_SifraSetSlowPath(agent.handle, 9, onReply, &t.cookie, 10), ORR_OK);
       EXPECT_EQ(t.slowPaths().deliverReplies(), 2u);
    },
    "a second set request for filter 1 while its reply is owed"},
   {"SlowPathRepliesDeliveredUnderALock",
    [](SifraTest &t, host::FilterId) {
       EXPECT_EQ(orr_SifraSetSlowPath(agent.handle, 9, onReply, &t.cookie, 10), ORR_OK);
       const orr_Spinlock lock = t.makeLock(t.makeDomain("test.other"), "test.lock", 2);
       orr_SpinlockLock(lock);
       EXPECT_EQ(t.slowPaths().deliverReplies(), 0u);
       orr_SpinlockUnlock(lock);
       EXPECT_EQ(t.slowPaths().deliverReplies(), 1u);
    },
    "slow path replies delivered from a context that holds a spinlock"},
   {"UnknownFilterHandle",
    [](SifraTest &, host::FilterId) { EXPECT_EQ(orr_SifraClearSlowPath(nullptr), ORR_INVALID_HANDLE); },
    "orr_SifraClearSlowPath: unknown filter handle"},
   {"SlowPathReplyLostWithItsFilter",
    [](SifraTest &t, host::FilterId id) {
       EXPECT_EQ(orr_SifraSetSlowPath(agent.handle, 9, onReply, &t.cookie, 10), ORR_OK);
       EXPECT_EQ(t.host.sifra().destroyFilter(id), ORR_OK);
       EXPECT_THAT(t.slowPaths().pendingReplies(), IsEmpty());
    },
    "filter 1 destroyed while 1 slow path reply(s) were owed to it"},
   {"SaveWritesPastItsBuffer",
    [](SifraTest &t, host::FilterId id) {
       agent.save = [](uint8_t *buffer, uint64_t *length) { buffer[*length] = 0; };
       std::vector<uint8_t> blob;
       EXPECT_EQ(t.host.migration().saveAsHypervisor(id, &blob), ORR_OK);
    },
    "saveState: the module wrote up to 1 byte(s) past the buffer's 16", true},
   {"SaveWritesBeforeItsBuffer",
    [](SifraTest &t, host::FilterId id) {
       agent.save = [](uint8_t *buffer, uint64_t *) { buffer[-3] = 0; };
       std::vector<uint8_t> blob;
       EXPECT_EQ(t.host.migration().save(id, 16, &blob), ORR_OK);
    },
    "saveState: the module wrote 3 byte(s) before the buffer", true},
   {"SaveClaimsMoreThanItsBuffer",
    [](SifraTest &t, host::FilterId id) {
       agent.save = [](uint8_t *, uint64_t *length) { *length += 1; };
       std::vector<uint8_t> blob;
       EXPECT_EQ(t.host.migration().save(id, 16, &blob), ORR_OK);
       EXPECT_EQ(blob.size(), 16u);
    },
    "saveState: the module says it wrote 17 bytes into a buffer of 16"},
   {"RestoreWritesPastTheBlob",
    [](SifraTest &t, host::FilterId id) {
       agent.restore = [](const uint8_t *blob, uint64_t length) { const_cast<uint8_t *>(blob)[length + 7] = 0; };
       EXPECT_EQ(t.host.migration().restore(id, std::vector<uint8_t>(8, 1)), ORR_OK);
    },
    "restoreState: the module wrote up to 8 byte(s) past the buffer's 8", true},
   {"RestoreHandsTheSlowPathBytesOutsideTheBlob",
    [](SifraTest &t, host::FilterId id) {
       agent.restore = [](const uint8_t *blob, uint64_t length) { restoreFrom(blob + 1, length, ORR_BAD_PARAM); };
       EXPECT_EQ(t.host.migration().restore(id, std::vector<uint8_t>(8, 1)), ORR_OK);
    },
    "the state lies outside the blob being restored"},
   {"TheBlobLivesUntilTheRestoresReplyStillFenced",
    [](SifraTest &t, host::FilterId id) {
       static const uint8_t *kept = nullptr;
       agent.restore = [](const uint8_t *blob, uint64_t length) {
          kept = blob;
          restoreFrom(blob, length);
       };
       EXPECT_EQ(t.host.migration().restore(id, std::vector<uint8_t>(8, 1)), ORR_OK);
       const_cast<uint8_t *>(kept)[8] = 0;
       EXPECT_EQ(t.host.migration().deliverReplies(1), 1u);
    },
    "slow path state restore: the module wrote up to 1 byte(s) past the buffer's 8", true},
};

class SifraBreachTest : public SifraTest, public ::testing::WithParamInterface<Breach> {};

TEST_P(SifraBreachTest, IsReported)
{
   const host::FilterId id = create();
   agent.save = [](uint8_t *buffer, uint64_t *length) { std::memset(buffer, 1, *length); };
#ifdef SWSEC_TEST_ASAN
   if (GetParam().poisoned) {
      GTEST_FLAG_SET(death_test_style, "threadsafe");
      EXPECT_DEATH(GetParam().act(*this, id), "use-after-poison");
      return;
   }
#endif
   GetParam().act(*this, id);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr(GetParam().violation)));
}

INSTANTIATE_TEST_SUITE_P(Contract, SifraBreachTest, ::testing::ValuesIn(breaches),
                         [](const auto &param) { return std::string(param.param.name); });

}  // namespace
}  // namespace swsec::testing
