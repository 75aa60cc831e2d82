#include "host_fixture.h"

#include <algorithm>
#include <iterator>

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
   std::ranges::transform(host_->log().records(), std::back_inserter(texts), &host::LogRecord::text);
   return texts;
}

}  // namespace swsec::testing
