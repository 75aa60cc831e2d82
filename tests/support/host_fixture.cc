#include "host_fixture.h"

namespace swsec::testing {

void HostTest::SetUp()
{
   host_ = std::make_unique<host::Host>();
   host_->setViolationHandler([](const std::string &violation) {
      ADD_FAILURE() << "host violation: " << violation;
   });
}

void HostTest::TearDown()
{
   if (host_->loaded()) {
      EXPECT_EQ(host_->unload(), ORR_OK);
   }
   host_.reset();
}

std::vector<std::string> HostTest::logTexts() const
{
   std::vector<std::string> texts;
   for (const auto &record : host_->log().records()) {
      texts.push_back(record.text);
   }
   return texts;
}

bool HostTest::logged(std::string_view needle) const
{
   return host_->log().contains(needle);
}

void ModuleTest::SetUp()
{
   HostTest::SetUp();
   ASSERT_EQ(host().load(), 0) << "module failed to load";
}

}  // namespace swsec::testing
