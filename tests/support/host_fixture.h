// Test fixtures over the host facade.
//
// HostTest gives each test a fresh Host whose violations (leaks at unload,
// objects left behind by a failed load) become test failures. ModuleTest
// also loads the module and unloads it at the end, so that every test that
// uses it is checked for leaks.
#pragma once

#include "host/host.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

namespace swsec::testing {

class HostTest : public ::testing::Test {
protected:
   void SetUp() override;
   void TearDown() override;

   host::Host &host() { return *host_; }
   // Log texts, in order, for readable failure output.
   std::vector<std::string> logTexts() const;
   // True when some log record contains `needle`.
   bool logged(std::string_view needle) const { return host_->log().contains(needle); }

private:
   std::unique_ptr<host::Host> host_;
};

class ModuleTest : public HostTest {
protected:
   void SetUp() override
   {
      HostTest::SetUp();
      ASSERT_EQ(host().load(), 0) << "module failed to load";
   }
};

}  // namespace swsec::testing
