// The program on a veth end's tc hooks and its maps pinned, in a network
// and mount namespace of the test's own (a thread's: both go with it).
#include "twin.h"

#include <gtest/gtest.h>

#include <net/if.h>
#include <sched.h>
#include <sys/mount.h>

#include <cstdlib>
#include <filesystem>
#include <string>
#include <thread>

namespace swsec::testing {
namespace {

TEST(FastPathKernel, detaching_removes_only_what_attaching_made_and_pinned_maps_outlive_the_loader)
{
   std::string skip = fastpath::unavailable().value_or("");
   std::thread([&skip] {
      if (!skip.empty()) {
         return;
      }
      if (unshare(CLONE_NEWNET | CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
          std::system("ip link add fp0 type veth peer name fp1") != 0) {
         skip = "no network namespace or veth pair here";
         return;
      }
      fastpath::Program program(fastpath::Program::Options{});
      for (const bool before : {false, true}) {
         if (before) {
            ASSERT_EQ(std::system("tc qdisc add dev fp0 clsact"), 0);
         }
         fastpath::Attachment attachment(program, static_cast<int>(if_nametoindex("fp0")), true, true);
         EXPECT_EQ(std::system("tc filter show dev fp0 egress | grep -q swsec_to_vm"), 0);
         attachment.detach();
         EXPECT_EQ(std::system("tc qdisc show dev fp0 | grep -q clsact") == 0, before);
         EXPECT_NE(std::system("tc filter show dev fp0 ingress | grep -q swsec"), 0);
      }
      // A BPF file system of this namespace's own where the daemon pins.
      const std::string dir = "/sys/fs/bpf";
      EXPECT_THROW(fastpath::Program(fastpath::Program::Options{.pinDir = dir}), fastpath::Error);
      ASSERT_EQ(mount("bpf", dir.c_str(), "bpf", 0, nullptr), 0);
      fastpath::PortDescription port;
      port.bindings = {fastpath::Binding{.vlan = 7, .ip = 1}};
      fastpath::Program(fastpath::Program::Options{.pinDir = fastpath::pinDirFor("vm1")}).describe(port);
      fastpath::Program again(fastpath::Program::Options{.pinDir = fastpath::pinDirFor("vm1")});
      EXPECT_EQ(again.bindings(), port.bindings);
      again.unpin();
      EXPECT_FALSE(std::filesystem::exists(fastpath::pinDirFor("vm1")));
      EXPECT_THROW(fastpath::pinDirFor("../vm1"), fastpath::Error);
   }).join();
   if (!skip.empty()) {
      GTEST_SKIP() << skip;
   }
}

}  // namespace
}  // namespace swsec::testing
