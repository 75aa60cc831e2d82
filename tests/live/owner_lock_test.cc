// One owner per VM interface: a second lock on an interface is refused with
// the owner's PID, one in another namespace's numbering or after the owner
// let go is not.
#include "live/netdev.h"
#include "live/owner_lock.h"

#include <gtest/gtest.h>

#include <unistd.h>

#include <filesystem>
#include <memory>

namespace swsec::live {
namespace {

TEST(InterfaceLock, a_second_owner_is_refused_with_the_first_ones_pid_until_it_lets_go)
{
   const auto dir = std::filesystem::temp_directory_path() / ("swsec-lock-test-" + std::to_string(getpid()));
   std::filesystem::remove_all(dir);
   auto first = std::make_unique<InterfaceLock>(dir.string(), 7, "vnet0");
   try {
      InterfaceLock second(dir.string(), 7, "vnet0");
      ADD_FAILURE() << "a second owner was let in";
   } catch (const NetdevError &e) {
      EXPECT_NE(std::string(e.what()).find("vnet0 is guarded by another swsec inline (PID " +
                                           std::to_string(getpid()) + ")"),
                std::string::npos)
         << e.what();
   }
   EXPECT_NO_THROW(InterfaceLock(dir.string(), 8, "vnet1"));
   first.reset();
   EXPECT_NO_THROW(InterfaceLock(dir.string(), 7, "vnet0"));
   std::filesystem::remove_all(dir);
}

}  // namespace
}  // namespace swsec::live
