// swsec_frame_blaster: sends copies of one minimum-size UDP frame on an
// interface through a packet socket, in batches of 64 a sendmmsg, at most
// RATE frames a second (0: as fast as it can), for SECONDS; prints the
// frames sent, the time taken, the sends refused and its own CPU seconds
// (the kernel's forwarding of what it sends mostly runs in its context).
// The inline benchmark's traffic source.
//
//   swsec_frame_blaster IFACE SRC_MAC DST_MAC SRC_IP DST_IP RATE SECONDS
#include <arpa/inet.h>
#include <linux/if_packet.h>
#include <net/ethernet.h>
#include <net/if.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

namespace {

constexpr size_t kFrameBytes = 60;
constexpr unsigned kBatch = 64;

bool parseMac(const char *text, uint8_t *mac)
{
   unsigned parts[6];
   if (std::sscanf(text, "%x:%x:%x:%x:%x:%x", &parts[0], &parts[1], &parts[2], &parts[3], &parts[4], &parts[5]) != 6) {
      return false;
   }
   for (int i = 0; i < 6; ++i) {
      mac[i] = static_cast<uint8_t>(parts[i]);
   }
   return true;
}

uint16_t checksum(const uint8_t *bytes, size_t length)
{
   uint32_t sum = 0;
   for (size_t i = 0; i + 1 < length; i += 2) {
      sum += static_cast<uint32_t>(bytes[i] << 8 | bytes[i + 1]);
   }
   while ((sum >> 16) != 0) {
      sum = (sum & 0xffff) + (sum >> 16);
   }
   return static_cast<uint16_t>(~sum);
}

}  // namespace

int main(int argc, char **argv)
{
   if (argc != 8) {
      std::fprintf(stderr, "usage: %s IFACE SRC_MAC DST_MAC SRC_IP DST_IP RATE SECONDS\n", argv[0]);
      return 2;
   }
   std::array<uint8_t, kFrameBytes> frame{};
   in_addr source{};
   in_addr destination{};
   if (!parseMac(argv[3], frame.data()) || !parseMac(argv[2], frame.data() + 6) ||
       inet_pton(AF_INET, argv[4], &source) != 1 || inet_pton(AF_INET, argv[5], &destination) != 1) {
      std::fprintf(stderr, "%s: bad MAC or IPv4 address\n", argv[0]);
      return 2;
   }
   const double rate = std::atof(argv[6]);
   const double seconds = std::atof(argv[7]);
   frame[12] = 0x08;
   frame[13] = 0x00;
   uint8_t *ip = frame.data() + 14;
   ip[0] = 0x45;
   ip[3] = 46;             // total length: IP and UDP headers and 18 bytes
   ip[8] = 64;
   ip[9] = 17;             // UDP
   std::memcpy(ip + 12, &source, 4);
   std::memcpy(ip + 16, &destination, 4);
   const uint16_t ipSum = checksum(ip, 20);
   ip[10] = static_cast<uint8_t>(ipSum >> 8);
   ip[11] = static_cast<uint8_t>(ipSum);
   uint8_t *udp = ip + 20;
   udp[0] = 0x0f;          // source port 4000
   udp[1] = 0xa0;
   udp[2] = 0x23;          // destination port 9000 (discard: nobody listens)
   udp[3] = 0x28;
   udp[5] = 26;            // UDP length; checksum 0 (none)

   const int fd = socket(AF_PACKET, SOCK_RAW, 0);
   sockaddr_ll address{};
   address.sll_family = AF_PACKET;
   address.sll_ifindex = static_cast<int>(if_nametoindex(argv[1]));
   if (fd < 0 || address.sll_ifindex == 0 || bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof address) != 0) {
      std::fprintf(stderr, "%s: %s: %s\n", argv[0], argv[1], std::strerror(errno));
      return 1;
   }
   std::vector<iovec> iov(kBatch, iovec{frame.data(), frame.size()});
   std::vector<mmsghdr> messages(kBatch);
   for (unsigned i = 0; i < kBatch; ++i) {
      messages[i].msg_hdr.msg_iov = &iov[i];
      messages[i].msg_hdr.msg_iovlen = 1;
   }
   using Clock = std::chrono::steady_clock;
   const auto start = Clock::now();
   const auto end = start + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
   uint64_t sent = 0;
   uint64_t refused = 0;
   for (auto now = start; now < end; now = Clock::now()) {
      if (rate > 0) {
         // Paced: no further ahead of the schedule than one batch.
         const double due = std::chrono::duration<double>(now - start).count() * rate;
         if (static_cast<double>(sent) > due) {
            std::this_thread::sleep_for(std::chrono::microseconds(50));
            continue;
         }
      }
      const int done = sendmmsg(fd, messages.data(), kBatch, 0);
      if (done > 0) {
         sent += static_cast<uint64_t>(done);
      } else {
         ++refused;
      }
   }
   const double elapsed = std::chrono::duration<double>(Clock::now() - start).count();
   rusage usage{};
   getrusage(RUSAGE_SELF, &usage);
   const double cpu = static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) +
                      static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) / 1e6;
   std::printf("%llu %.6f %llu %.6f\n", static_cast<unsigned long long>(sent), elapsed,
               static_cast<unsigned long long>(refused), cpu);
   close(fd);
   return 0;
}
