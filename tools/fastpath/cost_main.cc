// swsec-fastpath-cost: what the kernel fast path program costs a frame on
// the IPv4 and IPv6 common paths of a port enforcing every feature of both
// agents (as examples/dual-stack.json), by BPF_PROG_TEST_RUN's mean
// over many runs and by the kernel's BPF statistics (run time over run
// count, switched on only for their own runs). Needs root.
//
//   swsec-fastpath-cost [--runs N] [--json]
#include "fastpath.h"

#include <bpf/bpf.h>
#include <linux/bpf.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

namespace {

using swsec::fastpath::Binding;
using swsec::fastpath::Binding6;
using swsec::fastpath::Program;

// An IPv4/UDP frame of 60 bytes from 02:00:5e:c0:00:01, 192.0.2.<host>, to port 53.
std::vector<uint8_t> udpFrame(uint8_t host)
{
   std::vector<uint8_t> frame = {0x02, 0x00, 0x5e, 0xc0, 0x00, 0xfe, 0x02, 0x00, 0x5e, 0xc0, 0x00, 0x01, 0x08, 0x00,
                                 0x45, 0x00, 0x00, 0x2e, 0x00, 0x01, 0x00, 0x00, 0x40, 0x11, 0x00, 0x00, 192,  0,
                                 2,    host, 192,  0,    2,    1,    0x04, 0x00, 0x00, 0x35, 0x00, 0x1a, 0x00, 0x00};
   frame.resize(60, 0);
   return frame;
}

// An IPv6/UDP frame of 66 bytes from 02:00:5e:c0:00:01, 2001:db8::<host>, to port 53.
std::vector<uint8_t> udp6Frame(uint8_t host)
{
   std::vector<uint8_t> frame = {0x02, 0x00, 0x5e, 0xc0, 0x00, 0xfe, 0x02, 0x00, 0x5e, 0xc0, 0x00, 0x01, 0x86, 0xdd,
                                 0x60, 0x00, 0x00, 0x00, 0x00, 0x0c, 0x11, 0x40};
   const std::array<uint8_t, 16> source = {0x20, 0x01, 0x0d, 0xb8, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, host};
   std::array<uint8_t, 16> destination = source;
   destination[15] = 1;
   frame.insert(frame.end(), source.begin(), source.end());
   frame.insert(frame.end(), destination.begin(), destination.end());
   frame.insert(frame.end(), {0x04, 0x00, 0x00, 0x35, 0x00, 0x0c, 0x00, 0x00});
   frame.resize(66, 0);
   return frame;
}

struct Figures {
   double testRunNs = 0;
   double statsNs = 0;
};

// Both measures of `runs` runs of `frame` through the program from the VM:
// test runs with the statistics off (reading the clock twice a frame costs
// more than the program), then again with them on for the kernel's count.
Figures measure(const Program &program, const std::vector<uint8_t> &frame, uint32_t runs)
{
   const Program::Run plain = program.testRun(frame, SWSEC_FP_DIR_FROM_VM, runs);
   const int stats = bpf_enable_stats(BPF_STATS_RUN_TIME);
   if (stats < 0) {
      throw swsec::fastpath::Error("cannot switch on BPF statistics", -stats);
   }
   const int fd = program.programFd(SWSEC_FP_DIR_FROM_VM);
   bpf_prog_info before{};
   bpf_prog_info after{};
   uint32_t length = sizeof before;
   const int got = bpf_obj_get_info_by_fd(fd, &before, &length);
   (void)program.testRun(frame, SWSEC_FP_DIR_FROM_VM, runs);
   length = sizeof after;
   if (got != 0 || bpf_obj_get_info_by_fd(fd, &after, &length) != 0) {
      close(stats);
      throw swsec::fastpath::Error("cannot read the program's statistics", errno);
   }
   close(stats);
   const uint64_t count = after.run_cnt - before.run_cnt;
   return {static_cast<double>(plain.nanoseconds),
           count != 0 ? static_cast<double>(after.run_time_ns - before.run_time_ns) / static_cast<double>(count) : 0};
}

}  // namespace

int main(int argc, char **argv)
{
   uint32_t runs = 1'000'000;
   bool json = false;
   for (int i = 1; i < argc; ++i) {
      const std::string_view arg = argv[i];
      if (arg == "--json") {
         json = true;
      } else if (arg == "--runs" && i + 1 < argc && std::sscanf(argv[i + 1], "%u", &runs) == 1 && runs != 0) {
         ++i;
      } else {
         std::fprintf(stderr, "usage: swsec-fastpath-cost [--runs N] [--json]\n");
         return 2;
      }
   }
   try {
      Program program(Program::Options{});
      if (!json) {
         std::printf("%-9s %-10s %14s %14s\n", "bindings", "frame", "test-run ns", "bpf_stats ns");
      }
      std::string out;
      for (const uint32_t count : {1u, 16u, 32u}) {
         swsec::fastpath::PortDescription port;
         port.portId = 1;
         port.features = 0x1f;       // every feature of each agent, untrusted
         port.ipv6Features = 0x7f;
         port.ndRateLimit = 10;
         for (uint32_t n = 0; n < count; ++n) {
            // The VM's own address first, then others of its MAC; of each family.
            Binding binding;
            binding.mac = {0x02, 0x00, 0x5e, 0xc0, 0x00, 0x01};
            binding.ip = 0x6502'00c0u + (n << 24);   // 192.0.2.101 + n, network order
            binding.authoritative = true;
            port.bindings.push_back(binding);
            Binding6 binding6;
            binding6.mac = binding.mac;
            binding6.addr = {0x20, 0x01, 0x0d, 0xb8, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, static_cast<uint8_t>(101 + n)};
            port.bindings6.push_back(binding6);   // learned by DHCPv6: no refresh punts
         }
         program.describe(port);
         for (const auto &[name, frame] : {std::pair{"bound", udpFrame(101)}, std::pair{"spoofed", udpFrame(66)},
                                           std::pair{"bound6", udp6Frame(101)}, std::pair{"spoofed6", udp6Frame(66)}}) {
            const Figures figures = measure(program, frame, runs);
            if (json) {
               out += std::string(out.empty() ? "" : ",") + "{\"bindings\":" + std::to_string(count) +
                      ",\"frame\":\"" + name + "\",\"testRunNs\":" + std::to_string(figures.testRunNs) +
                      ",\"bpfStatsNs\":" + std::to_string(figures.statsNs) + "}";
            } else {
               std::printf("%-9u %-10s %14.1f %14.1f\n", count, name, figures.testRunNs, figures.statsNs);
            }
         }
      }
      // A punted frame (ARP from the VM) and its copy into the ring buffer,
      // in runs the ring holds; each record is read back after the run.
      std::vector<uint8_t> arp = udpFrame(101);
      arp[12] = 0x08;
      arp[13] = 0x06;
      const uint32_t puntRuns = std::min(runs, 4096u);   // twice over: the ring holds 8192
      const Figures punt = measure(program, arp, puntRuns);
      const size_t records = program.drainPunts([](swsec::fastpath::Punt &&) {});
      if (json) {
         std::printf("{\"runs\":%u,\"results\":[%s],\"punt\":{\"runs\":%u,\"records\":%zu,\"testRunNs\":%.1f,"
                     "\"bpfStatsNs\":%.1f}}\n",
                     runs, out.c_str(), 2 * puntRuns, records, punt.testRunNs, punt.statsNs);
      } else {
         std::printf("%-9s %-10s %14.1f %14.1f  (%zu of %u runs read back)\n", "32", "punted", punt.testRunNs,
                     punt.statsNs, records, 2 * puntRuns);
      }
   } catch (const swsec::fastpath::Error &error) {
      std::fprintf(stderr, "swsec-fastpath-cost: %s\n", error.what());
      return 1;
   }
   return 0;
}
