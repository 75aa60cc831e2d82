// An AF_PACKET socket on one interface, as a guarded port reads and writes
// frames: the VLAN tag as metadata (PACKET_AUXDATA), offloads through the
// virtio-net header (PACKET_VNET_HDR), its own sends not seen again
// (PACKET_IGNORE_OUTGOING), promiscuous while it is open, batches of frames
// a system call (recvmmsg, sendmmsg).
#pragma once

#include <sys/socket.h>
#include <sys/uio.h>

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace swsec::live {

// The virtio-net header in front of every frame with PACKET_VNET_HDR, in
// host byte order (the kernel's <linux/virtio_net.h> is not C++: it has a
// member named "class").
struct VnetHeader {
   uint8_t flags;
   uint8_t gsoType;
   uint16_t hdrLen;
   uint16_t gsoSize;
   uint16_t csumStart;
   uint16_t csumOffset;
};
static_assert(sizeof(VnetHeader) == 10);
static_assert(offsetof(VnetHeader, hdrLen) == 2 && offsetof(VnetHeader, csumStart) == 6 &&
              offsetof(VnetHeader, csumOffset) == 8);
inline constexpr uint8_t kVnetNeedsChecksum = 1;   // VIRTIO_NET_HDR_F_NEEDS_CSUM

// A frame received: the virtio-net header, the bytes as received (an 802.1Q
// tag the kernel took off is not in them) and the tag it took off.
struct ReceivedFrame {
   VnetHeader vnet{};
   std::span<uint8_t> bytes;
   bool tagged = false;      // the kernel carried an 802.1Q tag as metadata
   uint16_t tpid = 0;        // its TPID (0x8100 when the kernel gives none)
   uint16_t tci = 0;         // its whole TCI (priority, DEI, VLAN ID)
   bool truncated = false;   // longer than a slot: never sent on
};

class PacketSocket {
public:
   // Largest frame a slot holds: a 64 KiB GSO frame and its headers.
   static constexpr size_t kSlotBytes = 65536 + 256;

   // Opens and binds a socket on `ifname` with `batch` receive slots;
   // throws std::system_error naming the interface and the step that failed.
   PacketSocket(const std::string &ifname, size_t batch);
   ~PacketSocket();
   PacketSocket(const PacketSocket &) = delete;
   PacketSocket &operator=(const PacketSocket &) = delete;

   int fd() const { return fd_; }
   int ifindex() const { return ifindex_; }
   const std::string &ifname() const { return ifname_; }

   // Receives what is waiting, without blocking: the frames in `frames`
   // (valid until the next receive). Returns false with errno set on an
   // error other than "nothing waiting" (ENETDOWN: the interface went down
   // or away).
   bool receive(std::vector<ReceivedFrame> &frames);
   // Sends the frames, putting back the tags the kernel took off. Returns
   // the frames the kernel took; a frame it refused is counted and skipped.
   size_t send(std::span<const ReceivedFrame *const> frames, uint64_t *errors);
   // Frames the kernel dropped for want of room in the receive buffer since
   // the last call (the reader fell behind).
   uint64_t takeOverruns();

private:
   std::string ifname_;
   int fd_ = -1;
   int ifindex_ = 0;
   size_t batch_ = 0;
   std::vector<uint8_t> slots_;
   std::vector<VnetHeader> headers_;
   std::vector<uint8_t> control_;
   std::vector<iovec> recvIov_;
   std::vector<mmsghdr> recvMsgs_;
   // Per frame sent: header, addresses, tag, rest (the tag iovec empty
   // when the frame keeps its bytes as they are).
   std::vector<iovec> sendIov_;
   std::vector<mmsghdr> sendMsgs_;
   std::vector<VnetHeader> sendHeaders_;
   std::vector<uint32_t> sendTags_;
};

}  // namespace swsec::live
