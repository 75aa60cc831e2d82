// A Host for tests of the host itself, with no module loaded. Violations
// are collected instead of aborting; a test takes the ones it expects, and
// any left at the end fail it.
#pragma once

#include "host/host.h"

#include <gtest/gtest.h>

#include <mutex>
#include <string>
#include <utility>
#include <vector>

#if defined(__SANITIZE_ADDRESS__)
#define SWSEC_TEST_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define SWSEC_TEST_ASAN 1
#endif
#endif

namespace swsec::testing {

// Members are public so that table-driven cases (lambdas) can use them.
class HostUnitTest : public ::testing::Test {
public:
   HostUnitTest()
   {
      host.setViolationHandler([this](const std::string &violation) {
         std::lock_guard guard(violationsMutex_);
         violations_.push_back(violation);
      });
   }

   void TearDown() override
   {
      for (const auto &violation : takeViolations()) {
         ADD_FAILURE() << "unexpected host violation: " << violation;
      }
   }

   std::vector<std::string> takeViolations()
   {
      std::lock_guard guard(violationsMutex_);
      return std::exchange(violations_, {});
   }

   orr_HeapID makeHeap(const char *name, uint32_t maximumSize = 1u << 20)
   {
      orr_HeapProps props{};
      orr_NameInitialize(&props.name, name);
      props.module = 7;
      props.maximumSize = maximumSize;
      orr_HeapID heap = nullptr;
      EXPECT_EQ(orr_HeapCreate(&props, &heap), ORR_OK);
      return heap;
   }

   orr_LockDomainID makeDomain(const char *name = "test.domain")
   {
      orr_Name domainName;
      orr_NameInitialize(&domainName, name);
      orr_LockDomainID domain = ORR_INVALID_LOCK_DOMAIN;
      EXPECT_EQ(orr_LockDomainCreate(7, nullptr, &domainName, &domain), ORR_OK);
      return domain;
   }

   orr_Spinlock makeLock(orr_LockDomainID domain, const char *name, uint32_t rank,
                         orr_SpinlockType type = ORR_SPINLOCK_PLAIN)
   {
      orr_SpinlockProps props{};
      props.module = 7;
      orr_NameInitialize(&props.name, name);
      props.type = type;
      props.domain = domain;
      props.rank = rank;
      orr_Spinlock lock = nullptr;
      EXPECT_EQ(orr_SpinlockCreate(&props, &lock), ORR_OK);
      return lock;
   }

   orr_TimerQueue makeQueue(const char *name = "test.queue")
   {
      orr_TimerQueueProps props{};
      orr_NameInitialize(&props.name, name);
      props.module = 7;
      orr_TimerQueue queue = nullptr;
      EXPECT_EQ(orr_TimerQueueCreate(&props, &queue), ORR_OK);
      return queue;
   }

   host::Host host;

private:
   std::mutex violationsMutex_;
   std::vector<std::string> violations_;
};

}  // namespace swsec::testing
