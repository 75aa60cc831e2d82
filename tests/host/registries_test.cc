// Registrations by name: Plex client-port properties, Sifra fast paths and
// per-filter properties, portset message listeners.
#include "host_unit.h"

#include <gmock/gmock.h>

using ::testing::ElementsAre;
using ::testing::FieldsAre;
using ::testing::HasSubstr;

namespace swsec::testing {
namespace {

// What the last write handler call received.
struct WriteSeen {
   int calls = 0;
   bool contextWasNull = false;
   std::string bytes;
   int32_t count = -1;
   orr_Status answer = ORR_OK;
};
WriteSeen seen;

orr_Status recordWrite(void *portset, void *port, void *extra, const char *bytes, int32_t count)
{
   ++seen.calls;
   seen.contextWasNull = portset == nullptr && port == nullptr && extra == nullptr;
   seen.bytes.assign(bytes, static_cast<size_t>(count));
   seen.count = count;
   return seen.answer;
}

const orr_PlexClientPortOps writeOps = {.write = recordWrite, .read = nullptr, .poll = nullptr, .cleanup = nullptr};

class PlexTest : public HostUnitTest {
public:
   PlexTest() { seen = WriteSeen{}; }
};

TEST_F(PlexTest, WriteHandsTheBytesAndTheirCountToTheHandler)
{
   orr_PlexClientPortHandle handle = nullptr;
   ASSERT_EQ(orr_PlexClientPortRegister(&handle, 0, "com.example.agents", &writeOps), ORR_OK);
   seen.answer = ORR_TRY_AGAIN;
   EXPECT_EQ(host.plex().write("com.example.agents", "a b:c"), ORR_TRY_AGAIN) << "the handler's status comes back";
   EXPECT_THAT(seen, FieldsAre(1, true, "a b:c", 5, ORR_TRY_AGAIN));
   EXPECT_EQ(host.plex().write("com.example.agents", ""), ORR_TRY_AGAIN);
   EXPECT_EQ(seen.count, 0);
   EXPECT_EQ(orr_PlexClientPortUnregister(handle), ORR_OK);
   EXPECT_EQ(host.plex().write("com.example.agents", "x"), ORR_NOT_FOUND);
   EXPECT_EQ(seen.calls, 2);
}

TEST_F(PlexTest, NamesAreUniqueListedInOrderAndWithdrawnOnce)
{
   const orr_PlexClientPortOps noWrite = {};
   orr_PlexClientPortHandle first = nullptr;
   orr_PlexClientPortHandle second = nullptr;
   orr_PlexClientPortHandle refused = nullptr;
   EXPECT_EQ(orr_PlexClientPortRegister(&refused, 0, "port.a", &noWrite), ORR_BAD_PARAM);
   EXPECT_EQ(orr_PlexClientPortRegister(&refused, 1, "port.a", &writeOps), ORR_BAD_PARAM) << "no flags are known";
   ASSERT_EQ(orr_PlexClientPortRegister(&first, 0, "port.b", &writeOps), ORR_OK);
   ASSERT_EQ(orr_PlexClientPortRegister(&second, 0, "port.a", &writeOps), ORR_OK);
   EXPECT_EQ(orr_PlexClientPortRegister(&refused, 0, "port.b", &writeOps), ORR_EXISTS);
   EXPECT_EQ(refused, nullptr);
   EXPECT_THAT(host.plex().clientPorts(), ElementsAre("port.b", "port.a"));
   EXPECT_EQ(orr_PlexClientPortUnregister(first), ORR_OK);
   EXPECT_EQ(orr_PlexClientPortUnregister(second), ORR_OK);
   EXPECT_TRUE(host.plex().clientPorts().empty());
   EXPECT_EQ(orr_PlexClientPortUnregister(nullptr), ORR_INVALID_HANDLE);
   EXPECT_EQ(orr_PlexClientPortUnregister(first), ORR_INVALID_HANDLE);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("unknown registration")))
      << "a stale handle is a violation, a null one is not";
}

// ---------------------------------------------------------------- Sifra

const orr_SifraFastPathOps opsA = {};
const orr_SifraFastPathOps opsB = {};
const orr_SifraPropertyOps propertyOps = {};

using SifraTest = HostUnitTest;

TEST_F(SifraTest, FastPathsAreUniqueByNameAndListedWithTheirOperationsAndAgent)
{
   int agentA = 0;
   int agentB = 0;
   orr_SifraFastPath a = nullptr;
   orr_SifraFastPath b = nullptr;
   orr_SifraFastPath refused = nullptr;
   ASSERT_EQ(orr_SifraRegisterFastPath("agent-a", 0x1010000, 0x1010000, 77, &opsA, &agentA, &a), ORR_OK);
   ASSERT_EQ(orr_SifraRegisterFastPath("agent-b", 0x1010000, 0x1010000, 77, &opsB, &agentB, &b), ORR_OK);
   EXPECT_EQ(orr_SifraRegisterFastPath("agent-a", 0x1010000, 0x1010000, 1, &opsB, &agentB, &refused), ORR_EXISTS);
   EXPECT_EQ(orr_SifraRegisterFastPath("future", 0x2000000, 0x2000000, 1, &opsA, nullptr, &refused),
             ORR_NOT_SUPPORTED) << "needs a newer host";
   EXPECT_EQ(refused, nullptr);
   // name, revision, compatRevision, module, ops, agent: the first registration stands.
   EXPECT_THAT(host.sifra().fastPaths(), ElementsAre(FieldsAre("agent-a", 0x1010000u, 0x1010000u, 77u, &opsA, &agentA),
                                                     FieldsAre("agent-b", 0x1010000u, 0x1010000u, 77u, &opsB, &agentB)));
   auto found = host.sifra().fastPath("agent-b");
   ASSERT_TRUE(found.has_value());
   EXPECT_EQ(found->agent, &agentB);

   orr_SifraUnregisterFastPath(a);
   EXPECT_FALSE(host.sifra().fastPath("agent-a").has_value());
   orr_SifraUnregisterFastPath(a);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("orr_SifraUnregisterFastPath: unknown fast path")));
   orr_SifraUnregisterFastPath(b);
}

TEST_F(SifraTest, PropertiesAreUniqueByName)
{
   orr_SifraPropertyHandle first = nullptr;
   orr_SifraPropertyHandle again = nullptr;
   orr_SifraPropertyHandle other = nullptr;
   ASSERT_EQ(orr_SifraPropertyRegister(&first, "agent-a.security", &propertyOps), ORR_OK);
   EXPECT_EQ(orr_SifraPropertyRegister(&again, "agent-a.security", &propertyOps), ORR_EXISTS);
   ASSERT_EQ(orr_SifraPropertyRegister(&other, "agent-b.security", &propertyOps), ORR_OK);
   EXPECT_THAT(host.sifra().properties(), ElementsAre("agent-a.security", "agent-b.security"));
   orr_SifraPropertyUnregister(first);
   EXPECT_THAT(host.sifra().properties(), ElementsAre("agent-b.security"));
   orr_SifraPropertyUnregister(first);
   EXPECT_EQ(takeViolations().size(), 1u);
   orr_SifraPropertyUnregister(other);
}

// ---------------------------------------------------------------- portsets

void listener(uint32_t, uint64_t, const orr_PortsetMessageHeader *) {}

using PortsetListenerTest = HostUnitTest;

TEST_F(PortsetListenerTest, RegistrationsAreKeptUntilWithdrawn)
{
   int priv = 0;
   orr_PortsetMessageCBHandle first = 0;
   orr_PortsetMessageCBHandle second = 0;
   ASSERT_EQ(orr_PortsetRegisterMessageCB(nullptr, 0, 0x0008000000000000ull, listener, &priv, &first), ORR_OK);
   ASSERT_EQ(orr_PortsetRegisterMessageCB(nullptr, 12, 1, listener, nullptr, &second), ORR_OK);
   EXPECT_NE(first, 0u);
   EXPECT_NE(first, second);
   // handle, portset, portID, msgClass, callback, priv
   const auto secondInfo = FieldsAre(second, nullptr, 12u, 1u, &listener, nullptr);
   EXPECT_THAT(host.portsets().listeners(),
               ElementsAre(FieldsAre(first, nullptr, 0u, 0x0008000000000000ull, &listener, &priv), secondInfo));
   orr_PortsetUnregisterMessageCB(first);
   EXPECT_THAT(host.portsets().listeners(), ElementsAre(secondInfo));
   orr_PortsetUnregisterMessageCB(first);
   EXPECT_EQ(takeViolations().size(), 1u);
   orr_PortsetUnregisterMessageCB(second);
}

}  // namespace
}  // namespace swsec::testing
