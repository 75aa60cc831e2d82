// Plex client-port properties: registered by name, written as the
// management plane writes them.
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

TEST_F(PlexTest, NamesAreUniqueListedInOrderAndWritesHandTheBytesAndTheirCountToTheHandler)
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
   seen.answer = ORR_TRY_AGAIN;
   EXPECT_EQ(host.plex().write("port.b", "a b:c"), ORR_TRY_AGAIN) << "the handler's status comes back";
   EXPECT_THAT(seen, FieldsAre(1, true, "a b:c", 5, ORR_TRY_AGAIN));
   EXPECT_EQ(host.plex().write("port.b", ""), ORR_TRY_AGAIN);
   EXPECT_EQ(seen.count, 0);
   EXPECT_EQ(orr_PlexClientPortUnregister(first), ORR_OK);
   EXPECT_EQ(host.plex().write("port.b", "x"), ORR_NOT_FOUND);
   EXPECT_EQ(seen.calls, 2);
   EXPECT_EQ(orr_PlexClientPortUnregister(second), ORR_OK);
   EXPECT_TRUE(host.plex().clientPorts().empty());
   EXPECT_EQ(orr_PlexClientPortUnregister(nullptr), ORR_INVALID_HANDLE);
   EXPECT_EQ(orr_PlexClientPortUnregister(first), ORR_INVALID_HANDLE);
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("unknown registration")))
      << "a stale handle is a violation, a null one is not";
}

}  // namespace
}  // namespace swsec::testing
