// The program on a veth end's tc hooks and its maps pinned, in a network
// and mount namespace of the test's own (a thread's: both go with it).
#include "twin.h"

#include <gtest/gtest.h>

#include <linux/if_packet.h>
#include <net/if.h>
#include <sys/socket.h>
#include <unistd.h>
#include <sched.h>
#include <sys/mount.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <thread>

namespace swsec::testing {
namespace {

TEST(FastPathKernel, attaches_only_what_it_made_reads_the_vlan_metadata_and_its_pinned_maps_outlive_it)
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
      // A tagged frame reaches the hook untagged, its VLAN as metadata: one
      // from the bound source on VLAN 100 passes, the spoofed one after it drops.
      fastpath::PortDescription port;
      port.features = SWSEC_FP_FEATURE_IP_DISCOVERY | SWSEC_FP_FEATURE_IP_SOURCE_GUARD;
      port.bindings = {fastpath::Binding{.vlan = 100, .mac = {2, 0, 0, 0, 0, 1}, .ip = 0x0100000a}};
      program.describe(port);
      const fastpath::Attachment attachment(program, static_cast<int>(if_nametoindex("fp0")), true, false);
      // No IPv6 on the sending end: the hook sees the test's frames alone.
      ASSERT_EQ(std::system("sysctl -qw net.ipv6.conf.fp1.disable_ipv6=1 && ip link set fp0 up && ip link set fp1 up"), 0);
      const int out = socket(AF_PACKET, SOCK_RAW, 0);
      sockaddr_ll to{.sll_family = AF_PACKET, .sll_ifindex = static_cast<int>(if_nametoindex("fp1"))};
      for (const uint8_t source : {1, 2}) {
         uint8_t frame[64] = {0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 2, 0, 0, 0, 0, 1, 0x81, 0, 0, 100, 8, 0, 0x45, 0, 0, 46,
                              0, 0, 0, 0, 64, 17, 0, 0, 10, 0, 0, source, 10, 0, 0, 9, 4, 0, 0, 9, 0, 26};
         ASSERT_EQ(sendto(out, frame, sizeof frame, 0, reinterpret_cast<sockaddr *>(&to), sizeof to), 64);
      }
      close(out);
      for (int wait = 0; wait < 100 && program.counters()[SWSEC_FP_PASSED] + program.counters()[SWSEC_FP_DROP_IP_SOURCE_GUARD] < 2; ++wait) {
         std::this_thread::sleep_for(std::chrono::milliseconds(10));
      }
      EXPECT_EQ(program.counters()[SWSEC_FP_DROP_IP_SOURCE_GUARD], 1u);
      // A BPF file system of this namespace's own where the daemon pins.
      ASSERT_EQ(mount("bpf", "/sys/fs/bpf", "bpf", 0, nullptr), 0);
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
