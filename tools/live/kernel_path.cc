// A guarded port's kernel data path: the program, its maps and hooks, and
// the thread that judges the frames it punts.
#include "live/kernel_path.h"
#include "live/lease_reply.h"

#include "host/header_lookup.h"

#include <linux/if_packet.h>
#include <net/if.h>
#include <poll.h>
#include <sys/mount.h>
#include <sys/socket.h>
#include <sys/statfs.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <system_error>

namespace swsec::live {

namespace {

constexpr long kBpfFsMagic = 0xcafe4a11;
constexpr const char *kBpfFs = "/sys/fs/bpf";
// The VM interface's filters sit at this priority on both hooks: a restart
// replaces a crashed run's program there in one step.
constexpr uint32_t kHookPriority = 0x5357;
// How often the judging thread looks whether the VM interface is still there.
constexpr int kLivenessMs = 250;

int markedSocket(const std::string &ifname, uint32_t mark)
{
   const int fd = socket(AF_PACKET, SOCK_RAW | SOCK_CLOEXEC, 0);
   if (fd < 0) {
      throw std::system_error(errno, std::generic_category(), ifname + ": packet socket");
   }
   const int value = static_cast<int>(mark);
   if (setsockopt(fd, SOL_SOCKET, SO_MARK, &value, sizeof value) != 0) {
      const int error = errno;
      close(fd);
      throw std::system_error(error, std::generic_category(), ifname + ": SO_MARK");
   }
   return fd;
}

uint32_t addWords(std::span<const uint8_t> bytes, uint32_t sum)
{
   for (size_t i = 0; i + 1 < bytes.size(); i += 2) {
      sum += static_cast<uint32_t>(bytes[i] << 8 | bytes[i + 1]);
   }
   if (bytes.size() % 2 != 0) {
      sum += static_cast<uint32_t>(bytes.back() << 8);
   }
   return sum;
}

uint16_t fold(uint32_t sum)
{
   while (sum >> 16 != 0) {
      sum = (sum & 0xffff) + (sum >> 16);
   }
   return static_cast<uint16_t>(sum);
}

}  // namespace

// A frame the sending stack left for the device to checksum (its TCP or UDP
// checksum field holds the pseudo-header's sum alone) would reach the VM
// with a wrong checksum once copied out: its checksum is completed, as the
// device would have. IPv4 without fragments, and IPv6 with its upper-layer
// header right after the fixed one; any other frame is left as it is.
void completeChecksum(std::vector<uint8_t> &frame)
{
   constexpr size_t l3 = 14;
   if (frame.size() < l3 + 20) {
      return;
   }
   const uint16_t etherType = static_cast<uint16_t>(frame[12] << 8 | frame[13]);
   size_t l4 = 0;
   size_t l4Len = 0;
   uint8_t protocol = 0;
   uint32_t pseudo = 0;
   if (etherType == 0x0800 && (frame[l3] >> 4) == 4) {
      const size_t headerLen = static_cast<size_t>(frame[l3] & 0x0f) * 4;
      const size_t totalLen = static_cast<size_t>(frame[l3 + 2] << 8 | frame[l3 + 3]);
      const bool fragment = (frame[l3 + 6] & 0x3f) != 0 || frame[l3 + 7] != 0;
      if (fragment || headerLen < 20 || totalLen < headerLen || l3 + totalLen > frame.size()) {
         return;
      }
      protocol = frame[l3 + 9];
      l4 = l3 + headerLen;
      l4Len = totalLen - headerLen;
      pseudo = addWords(std::span(frame).subspan(l3 + 12, 8), 0);
   } else if (etherType == 0x86dd && frame.size() >= l3 + 40 && (frame[l3] >> 4) == 6) {
      l4Len = static_cast<size_t>(frame[l3 + 4] << 8 | frame[l3 + 5]);
      if (l3 + 40 + l4Len > frame.size()) {
         return;
      }
      protocol = frame[l3 + 6];
      l4 = l3 + 40;
      pseudo = addWords(std::span(frame).subspan(l3 + 8, 32), 0);
   } else {
      return;
   }
   const size_t checkAt = protocol == 6 ? 16 : protocol == 17 ? 6 : 0;
   if (checkAt == 0 || l4Len < checkAt + 2) {
      return;
   }
   pseudo += protocol + static_cast<uint32_t>(l4Len);
   const uint16_t field = static_cast<uint16_t>(frame[l4 + checkAt] << 8 | frame[l4 + checkAt + 1]);
   if (field != fold(pseudo)) {
      return;
   }
   frame[l4 + checkAt] = frame[l4 + checkAt + 1] = 0;
   uint16_t check = static_cast<uint16_t>(~fold(addWords(std::span(frame).subspan(l4, l4Len), pseudo)));
   if (check == 0 && protocol == 17) {
      check = 0xffff;
   }
   frame[l4 + checkAt] = static_cast<uint8_t>(check >> 8);
   frame[l4 + checkAt + 1] = static_cast<uint8_t>(check);
}

bool removeLeftoverProgram(int vmIfindex)
{
   try {
      return fastpath::Attachment::removeLeftover(vmIfindex, kHookPriority);
   } catch (const fastpath::Error &) {
      return false;   // no clsact qdisc, or no BPF here: nothing of ours can be there
   }
}

const char *datapathName(Datapath datapath)
{
   return datapath == Datapath::kernel ? "kernel" : "user";
}

bool mountBpfFs()
{
   struct statfs fs {};
   if (statfs(kBpfFs, &fs) == 0 && fs.f_type == kBpfFsMagic) {
      return false;
   }
   if (mount("bpf", kBpfFs, "bpf", 0, nullptr) != 0) {
      throw fastpath::Error(std::string("cannot mount a BPF file system on ") + kBpfFs, errno);
   }
   return true;
}

void PostedFeed::follow(uint32_t portID, fastpath::Mirror *mirror)
{
   std::lock_guard guard(mutex_);
   if (mirror == nullptr) {
      mirrors_.erase(portID);
   } else {
      mirrors_[portID] = mirror;
   }
}

void PostedFeed::restart(uint32_t portID)
{
   std::lock_guard guard(mutex_);
   // Changes posted before the new configuration belong to the old one.
   for (auto &message : host_.portsets().takePosted()) {
      kept_.push_back(std::move(message));
   }
   if (const auto found = mirrors_.find(portID); found != mirrors_.end()) {
      found->second->start();
   }
}

void PostedFeed::take()
{
   std::lock_guard guard(mutex_);
   std::vector<host::PostedMessage> taken = host_.portsets().takePosted();
   for (const auto &[portID, mirror] : mirrors_) {
      mirror->follow(taken);
   }
   for (auto &message : taken) {
      kept_.push_back(std::move(message));
   }
}

std::vector<host::PostedMessage> PostedFeed::drain()
{
   std::lock_guard guard(mutex_);
   std::vector<host::PostedMessage> out;
   out.swap(kept_);
   return out;
}

KernelPath::KernelPath(session::ModuleSession &session, PostedFeed &feed, Options options,
                       std::function<void(const std::string &)> log)
   : session_(session), feed_(feed), options_(std::move(options)), log_(std::move(log))
{
}

KernelPath::~KernelPath()
{
   stop();
}

void KernelPath::start(host::FilterId filter)
{
   filter_ = filter;
   if (mountBpfFs()) {
      log_(std::string("mounted a BPF file system on ") + kBpfFs + " to pin the fast path's maps");
   }
   program_.emplace(fastpath::Program::Options{.pinDir = fastpath::pinDirFor(options_.name)});
   const size_t left = program_->drainPunts([](fastpath::Punt &&) {});
   if (left != 0) {
      log_(options_.name + ": dropped " + std::to_string(left) + " frames an earlier run left in the punt ring");
   }
   const bool earlierQdisc = (program_->port().flags & SWSEC_FP_PORT_OWN_QDISC) != 0;
   program_->setVmInterface(static_cast<uint32_t>(options_.vmIfindex), earlierQdisc);
   mirror_.emplace(*program_, session_.host(), filter_, options_.portID);
   feed_.follow(options_.portID, &*mirror_);
   feed_.restart(options_.portID);
   configured();

   injectIfindex_ = static_cast<int>(if_nametoindex(options_.injectEnd.c_str()));
   const int programIfindex = static_cast<int>(if_nametoindex(options_.programEnd.c_str()));
   if (injectIfindex_ == 0 || programIfindex == 0) {
      throw std::system_error(ENODEV, std::generic_category(), options_.injectEnd + " or " + options_.programEnd);
   }
   sockets_[SWSEC_FP_DIR_TO_VM] = markedSocket(options_.injectEnd, SWSEC_FP_MARK_TO_VM);
   sockets_[SWSEC_FP_DIR_FROM_VM] = markedSocket(options_.injectEnd, SWSEC_FP_MARK_FROM_VM);
   injectHook_ = std::make_unique<fastpath::Attachment>(programIfindex,
                                                        fastpath::Attachment::Hooks{.ingressFd = program_->injectFd()});
   vmHooks_ = std::make_unique<fastpath::Attachment>(
      options_.vmIfindex, fastpath::Attachment::Hooks{.ingressFd = program_->programFd(SWSEC_FP_DIR_FROM_VM),
                                                      .egressFd = program_->programFd(SWSEC_FP_DIR_TO_VM),
                                                      .priority = kHookPriority});
   if (earlierQdisc) {
      vmHooks_->adoptQdisc();
   }
   program_->setVmInterface(static_cast<uint32_t>(options_.vmIfindex), vmHooks_->madeQdisc());
}

void KernelPath::configured()
{
   feed_.restart(options_.portID);
   std::lock_guard guard(baseMutex_);
   base_ = program_->counters();
}

fastpath::Counters KernelPath::counters() const
{
   return program_ ? program_->counters() : fastpath::Counters{};
}

std::map<std::string, uint64_t> KernelPath::dropsSinceConfigured() const
{
   if (!program_) {
      return {};
   }
   const fastpath::Counters now = program_->counters();
   std::lock_guard guard(baseMutex_);
   return {{"ipSrcGuardDropCnt", now[SWSEC_FP_DROP_IP_SOURCE_GUARD] - base_[SWSEC_FP_DROP_IP_SOURCE_GUARD]},
           {"txRateLimitDropCnt", now[SWSEC_FP_DROP_ARP_BUDGET] - base_[SWSEC_FP_DROP_ARP_BUDGET]},
           {"etherTypeDropCnt", now[SWSEC_FP_DROP_ETHER_TYPE] - base_[SWSEC_FP_DROP_ETHER_TYPE]},
           {"sourceGuardDropCnt", now[SWSEC_FP_DROP_IPV6_SOURCE_GUARD] - base_[SWSEC_FP_DROP_IPV6_SOURCE_GUARD]},
           {"ndRateLimitDropCnt", now[SWSEC_FP_DROP_ND_BUDGET] - base_[SWSEC_FP_DROP_ND_BUDGET]}};
}

void KernelPath::inject(fastpath::Punt &punt)
{
   completeChecksum(punt.bytes);
   // The outer tag back into the bytes, as it came (TPID, priority, VLAN):
   // the receiving end takes an 802.1Q or 802.1ad one off into metadata
   // again before the redirect.
   std::vector<uint8_t> frame;
   std::span<const uint8_t> bytes = punt.bytes;
   if (punt.tpid && punt.bytes.size() >= 12) {
      const uint16_t tci = static_cast<uint16_t>(punt.tagHigh << 12 | punt.vlan);
      frame.assign(punt.bytes.begin(), punt.bytes.begin() + 12);
      frame.insert(frame.end(), {static_cast<uint8_t>(*punt.tpid >> 8), static_cast<uint8_t>(*punt.tpid),
                                 static_cast<uint8_t>(tci >> 8), static_cast<uint8_t>(tci)});
      frame.insert(frame.end(), punt.bytes.begin() + 12, punt.bytes.end());
      bytes = frame;
   }
   sockaddr_ll to{};
   to.sll_family = AF_PACKET;
   to.sll_ifindex = injectIfindex_;
   to.sll_halen = 6;
   std::memcpy(to.sll_addr, bytes.data(), bytes.size() >= 6 ? 6 : 0);
   (void)sendto(sockets_[punt.direction], bytes.data(), bytes.size(), 0, reinterpret_cast<sockaddr *>(&to), sizeof to);
}

void judgePunts(session::ModuleSession &session, host::FilterId filter, PostedFeed &feed, std::span<fastpath::Punt> punts,
                PortCounters &counters, const std::function<void(fastpath::Punt &)> &pass)
{
   std::vector<fastpath::Punt *> passed;
   for (fastpath::Punt &punt : punts) {
      if (punt.truncated || (punt.direction != SWSEC_FP_DIR_TO_VM && punt.direction != SWSEC_FP_DIR_FROM_VM)) {
         counters.truncated.fetch_add(1, std::memory_order_relaxed);
         continue;
      }
      // A runt is judged and goes on padded, as on the user path.
      punt.bytes.resize(host::switchPaddedLength(punt.bytes.size()), 0);
      const host::FrameView view{.bytes = punt.bytes, .vlanId = punt.vlan};
      const bool kept = session.judge(filter, punt.direction, std::span(&view, 1)).kept.size() == 1;
      (kept ? counters.passed : counters.dropped)[punt.direction].fetch_add(1, std::memory_order_relaxed);
      if (kept) {
         passed.push_back(&punt);
         if (punt.direction == SWSEC_FP_DIR_TO_VM && fromDhcpServer(punt.bytes)) {
            counters.leaseReplies.fetch_add(1, std::memory_order_relaxed);
         }
      }
   }
   // A binding the module just learned is in the map before its frame goes on.
   feed.take();
   for (fastpath::Punt *punt : passed) {
      pass(*punt);
   }
}

void KernelPath::run(int stopEvent, PortCounters &counters, const std::function<void(const std::string &)> &vanish)
{
   std::vector<fastpath::Punt> punts;
   for (;;) {
      pollfd fds[2] = {{program_->puntFd(), POLLIN, 0}, {stopEvent, POLLIN, 0}};
      if (poll(fds, 2, kLivenessMs) < 0 && errno != EINTR) {
         vanish(std::string("poll: ") + std::strerror(errno));
         return;
      }
      if ((fds[1].revents & POLLIN) != 0) {
         return;
      }
      char name[IF_NAMESIZE];
      if (if_indextoname(static_cast<unsigned>(options_.vmIfindex), name) == nullptr) {
         vanish(options_.vmIface + " disappeared");
         return;
      }
      punts.clear();
      program_->drainPunts([&punts](fastpath::Punt &&punt) { punts.push_back(std::move(punt)); });
      judgePunts(session_, filter_, feed_, punts, counters, [this](fastpath::Punt &punt) { inject(punt); });
   }
}

void KernelPath::stop()
{
   feed_.follow(options_.portID, nullptr);
   for (int &fd : sockets_) {
      if (fd >= 0) {
         close(fd);
         fd = -1;
      }
   }
   try {
      if (vmHooks_) {
         vmHooks_->detach();
      }
   } catch (const fastpath::Error &e) {
      log_(options_.name + ": " + e.what());
   }
   vmHooks_.reset();
   injectHook_.reset();
   if (program_) {
      try {
         program_->unpin();
      } catch (const fastpath::Error &e) {
         log_(options_.name + ": " + e.what());
      }
   }
   mirror_.reset();
   program_.reset();
}

}  // namespace swsec::live
