// Per-filter properties driven through the facade as the management plane
// would: by name, with or without a filter, exact-size buffers.
#include "host_unit.h"

#include <cstring>

namespace swsec::testing {
namespace {

struct Seen {
   orr_SifraFilter record = reinterpret_cast<orr_SifraFilter>(1);
   std::vector<uint8_t> written;
   uint32_t readLength = 0;
};
Seen seen;

orr_Status write(orr_SifraFilter filter, void *, const void *data, uint32_t length)
{
   seen.record = filter;
   const auto *bytes = static_cast<const uint8_t *>(data);
   seen.written.assign(bytes, bytes + length);
   return length == 3 ? ORR_OK : ORR_BAD_PARAM;
}

orr_Status read(orr_SifraFilter filter, void *, void *buffer, uint32_t length)
{
   seen.record = filter;
   seen.readLength = length;
   std::memset(buffer, 0x42, length);
   return ORR_OK;
}

bool poll(orr_SifraFilter filter, void *, uint32_t *length)
{
   if (filter == nullptr) {
      return false;
   }
   *length = 62;
   return true;
}

constexpr orr_SifraPropertyOps kOps = {.write = write, .read = read, .poll = poll, .cleanup = nullptr};

class PropertyFacadeTest : public HostUnitTest {
protected:
   void SetUp() override
   {
      seen = Seen{};
      ASSERT_EQ(orr_SifraPropertyRegister(&handle_, "agent.security", &kOps), ORR_OK);
   }
   void TearDown() override
   {
      orr_SifraPropertyUnregister(handle_);
      HostUnitTest::TearDown();
   }

private:
   orr_SifraPropertyHandle handle_ = nullptr;
};

TEST_F(PropertyFacadeTest, write_hands_the_bytes_and_returns_the_module_status)
{
   EXPECT_EQ(host.sifra().writeProperty("agent.security", std::nullopt, {1, 2, 3}), ORR_OK);
   EXPECT_EQ(seen.written, (std::vector<uint8_t>{1, 2, 3}));
   EXPECT_EQ(seen.record, nullptr);
   EXPECT_EQ(host.sifra().writeProperty("agent.security", std::nullopt, {1, 2}), ORR_BAD_PARAM);
}

TEST_F(PropertyFacadeTest, read_offers_the_buffer_size_and_poll_reports_absence)
{
   std::vector<uint8_t> buffer(61, 0);
   EXPECT_EQ(host.sifra().readProperty("agent.security", std::nullopt, buffer), ORR_OK);
   EXPECT_EQ(seen.readLength, 61u);
   EXPECT_EQ(buffer[60], 0x42);
   EXPECT_EQ(host.sifra().pollProperty("agent.security", std::nullopt), std::nullopt);
}

TEST_F(PropertyFacadeTest, unknown_names_are_not_found)
{
   EXPECT_EQ(host.sifra().writeProperty("other.security", std::nullopt, {1}), ORR_NOT_FOUND);
   std::vector<uint8_t> buffer(4);
   EXPECT_EQ(host.sifra().readProperty("other.security", std::nullopt, buffer), ORR_NOT_FOUND);
   EXPECT_EQ(host.sifra().pollProperty("other.security", std::nullopt), std::nullopt);
   EXPECT_THROW((void)host.sifra().writeProperty("agent.security", host::FilterId{999}, {1}),
                std::invalid_argument);
}

}  // namespace
}  // namespace swsec::testing
