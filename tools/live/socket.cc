// AF_PACKET sockets of a guarded port.
#include "live/socket.h"

#include <linux/if_packet.h>
#include <net/ethernet.h>
#include <net/if.h>
#include <arpa/inet.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <system_error>

namespace swsec::live {

namespace {

constexpr size_t kControlBytes = CMSG_SPACE(sizeof(tpacket_auxdata));
constexpr size_t kAddressBytes = 12;    // destination and source MAC
constexpr size_t kTagBytes = 4;
constexpr uint16_t kTpid8021Q = 0x8100;
// Buffers as deep as a burst of full-size frames at line rate over the
// time a busy machine takes to schedule the reading thread.
constexpr int kSocketBufferBytes = 8 << 20;

[[noreturn]] void fail(const std::string &ifname, const char *step)
{
   throw std::system_error(errno, std::generic_category(), ifname + ": " + step);
}

void setInt(int fd, int level, int option, int value, const std::string &ifname, const char *step)
{
   if (setsockopt(fd, level, option, &value, sizeof value) != 0) {
      fail(ifname, step);
   }
}

}  // namespace

PacketSocket::PacketSocket(const std::string &ifname, size_t batch)
   : ifname_(ifname), batch_(batch), slots_(batch * kSlotBytes), headers_(batch), control_(batch * kControlBytes),
     recvIov_(batch * 2), recvMsgs_(batch), sendIov_(batch * 4), sendMsgs_(batch), sendHeaders_(batch),
     sendTags_(batch)
{
   ifindex_ = static_cast<int>(if_nametoindex(ifname.c_str()));
   if (ifindex_ == 0) {
      fail(ifname, "no such interface");
   }
   // Protocol 0 until bound: a socket made for every protocol would take
   // frames of every interface until the bind.
   fd_ = socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, 0);
   if (fd_ < 0) {
      fail(ifname, "packet socket");
   }
   try {
      setInt(fd_, SOL_PACKET, PACKET_VNET_HDR, 1, ifname, "PACKET_VNET_HDR");
      setInt(fd_, SOL_PACKET, PACKET_AUXDATA, 1, ifname, "PACKET_AUXDATA");
      setInt(fd_, SOL_PACKET, PACKET_IGNORE_OUTGOING, 1, ifname, "PACKET_IGNORE_OUTGOING");
      setInt(fd_, SOL_SOCKET, SO_RCVBUFFORCE, kSocketBufferBytes, ifname, "SO_RCVBUFFORCE");
      setInt(fd_, SOL_SOCKET, SO_SNDBUFFORCE, kSocketBufferBytes, ifname, "SO_SNDBUFFORCE");
      sockaddr_ll address{};
      address.sll_family = AF_PACKET;
      address.sll_protocol = htons(ETH_P_ALL);
      address.sll_ifindex = ifindex_;
      if (bind(fd_, reinterpret_cast<const sockaddr *>(&address), sizeof address) != 0) {
         fail(ifname, "bind");
      }
      // Frames for the VM's own MAC and every other: the port sees all that
      // crosses it. The membership ends with the socket.
      packet_mreq promiscuous{};
      promiscuous.mr_ifindex = ifindex_;
      promiscuous.mr_type = PACKET_MR_PROMISC;
      if (setsockopt(fd_, SOL_PACKET, PACKET_ADD_MEMBERSHIP, &promiscuous, sizeof promiscuous) != 0) {
         fail(ifname, "promiscuous mode");
      }
   } catch (...) {
      close(fd_);
      throw;
   }
}

PacketSocket::~PacketSocket()
{
   if (fd_ >= 0) {
      close(fd_);
   }
}

bool PacketSocket::receive(std::vector<ReceivedFrame> &frames)
{
   frames.clear();
   for (size_t i = 0; i < batch_; ++i) {
      recvIov_[2 * i] = {&headers_[i], sizeof(VnetHeader)};
      recvIov_[2 * i + 1] = {slots_.data() + i * kSlotBytes, kSlotBytes};
      msghdr &msg = recvMsgs_[i].msg_hdr;
      msg = msghdr{};
      msg.msg_iov = &recvIov_[2 * i];
      msg.msg_iovlen = 2;
      msg.msg_control = control_.data() + i * kControlBytes;
      msg.msg_controllen = kControlBytes;
   }
   const int got = recvmmsg(fd_, recvMsgs_.data(), static_cast<unsigned>(batch_), MSG_DONTWAIT, nullptr);
   if (got < 0) {
      return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR;
   }
   for (int i = 0; i < got; ++i) {
      const mmsghdr &received = recvMsgs_[static_cast<size_t>(i)];
      // The length returned counts the virtio-net header in front.
      if (received.msg_len < sizeof(VnetHeader)) {
         continue;
      }
      ReceivedFrame &frame = frames.emplace_back();
      frame.vnet = headers_[static_cast<size_t>(i)];
      const size_t length = std::min<size_t>(received.msg_len - sizeof(VnetHeader), kSlotBytes);
      frame.bytes = {slots_.data() + static_cast<size_t>(i) * kSlotBytes, length};
      frame.truncated = (received.msg_hdr.msg_flags & MSG_TRUNC) != 0;
      for (cmsghdr *cmsg = CMSG_FIRSTHDR(&received.msg_hdr); cmsg != nullptr;
           cmsg = CMSG_NXTHDR(const_cast<msghdr *>(&received.msg_hdr), cmsg)) {
         if (cmsg->cmsg_level != SOL_PACKET || cmsg->cmsg_type != PACKET_AUXDATA ||
             cmsg->cmsg_len < CMSG_LEN(sizeof(tpacket_auxdata))) {
            continue;
         }
         tpacket_auxdata aux;
         std::memcpy(&aux, CMSG_DATA(cmsg), sizeof aux);
         if ((aux.tp_status & TP_STATUS_VLAN_VALID) != 0) {
            frame.tagged = true;
            frame.tci = aux.tp_vlan_tci;
            frame.tpid = (aux.tp_status & TP_STATUS_VLAN_TPID_VALID) != 0 ? aux.tp_vlan_tpid : kTpid8021Q;
         }
      }
   }
   return true;
}

uint64_t PacketSocket::takeOverruns()
{
   tpacket_stats stats{};
   socklen_t length = sizeof stats;
   if (getsockopt(fd_, SOL_PACKET, PACKET_STATISTICS, &stats, &length) != 0) {
      return 0;
   }
   return stats.tp_drops;
}

size_t PacketSocket::send(std::span<const ReceivedFrame *const> frames, uint64_t *errors)
{
   size_t sent = 0;
   while (!frames.empty()) {
      const size_t count = std::min(frames.size(), batch_);
      for (size_t i = 0; i < count; ++i) {
         const ReceivedFrame &frame = *frames[i];
         VnetHeader &header = sendHeaders_[i];
         header = frame.vnet;
         // Checksum already checked on the way in means nothing on the way out.
         header.flags &= kVnetNeedsChecksum;
         iovec *iov = &sendIov_[4 * i];
         msghdr &msg = sendMsgs_[i].msg_hdr;
         msg = msghdr{};
         msg.msg_iov = iov;
         iov[0] = {&header, sizeof header};
         if (frame.tagged && frame.bytes.size() >= kAddressBytes) {
            // The tag goes back where it was, and the offsets into the
            // frame that the header gives move with what follows it.
            const uint32_t tag = htonl(static_cast<uint32_t>(frame.tpid) << 16 | frame.tci);
            std::memcpy(&sendTags_[i], &tag, sizeof tag);
            if ((header.flags & kVnetNeedsChecksum) != 0) {
               header.csumStart = static_cast<uint16_t>(header.csumStart + kTagBytes);
            }
            if (header.hdrLen != 0) {
               header.hdrLen = static_cast<uint16_t>(header.hdrLen + kTagBytes);
            }
            iov[1] = {frame.bytes.data(), kAddressBytes};
            iov[2] = {&sendTags_[i], kTagBytes};
            iov[3] = {frame.bytes.data() + kAddressBytes, frame.bytes.size() - kAddressBytes};
            msg.msg_iovlen = 4;
         } else {
            iov[1] = {frame.bytes.data(), frame.bytes.size()};
            msg.msg_iovlen = 2;
         }
      }
      const int done = sendmmsg(fd_, sendMsgs_.data(), static_cast<unsigned>(count), 0);
      if (done < 0) {
         if (errno == EINTR) {
            continue;
         }
         // The first frame was refused (too long for the interface, a bad
         // offload header, the interface down): it is lost, the rest go on.
         ++*errors;
         frames = frames.subspan(1);
         continue;
      }
      sent += static_cast<size_t>(done);
      frames = frames.subspan(static_cast<size_t>(done));
   }
   return sent;
}

}  // namespace swsec::live
