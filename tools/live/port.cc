// A guarded port's set-up, forwarding threads and take-down.
#include "live/port.h"

#include "live/kernel_path.h"
#include "live/lease_reply.h"
#include "live/netdev.h"
#include "live/owner_lock.h"

#include "host/header_lookup.h"
#include "host/host.h"

#include <net/if.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <system_error>

namespace swsec::live {

host::FrameView portView(ReceivedFrame &frame)
{
   // A runt goes on padded, as a switch pads it, and the port judges the
   // bytes that go on; the slot has room for them.
   const size_t padded = host::switchPaddedLength(frame.bytes.size());
   if (padded != frame.bytes.size()) {
      std::fill(frame.bytes.data() + frame.bytes.size(), frame.bytes.data() + padded, uint8_t{0});
      frame.bytes = {frame.bytes.data(), padded};
   }
   host::FrameView view;
   view.bytes = frame.bytes;
   if (frame.tagged) {
      // The kernel took the outer tag off, whatever its TPID: it is the VLAN.
      view.vlanId = frame.tci & 0x0fff;
   } else {
      // An outer tag left in the bytes (any TPID) becomes the VLAN as the
      // host presents the frame; tags inside it stay for the port to judge.
      view.untag = true;
   }
   return view;
}

GuardedPort::GuardedPort(session::ModuleSession &session, PortOptions options,
                         std::function<void(const std::string &)> log, std::function<void()> stopped)
   : session_(session), options_(std::move(options)), log_(std::move(log)), stopped_(std::move(stopped))
{
}

GuardedPort::~GuardedPort()
{
   stop();
}

void GuardedPort::start(const session::PortSecurityConfig &config, const std::function<void(host::FilterId)> &restore)
{
   const std::string &name = options_.name;
   // Everything that can be refused is checked before anything changes.
   auto vm = findLink(options_.vmIface);
   if (!vm) {
      throw NetdevError(name + ": no interface " + options_.vmIface);
   }
   // This process's from here until the take-down: a second daemon stops
   // here, before it touches what the first one set up. Read again under
   // the lock: an owner that just stopped may have changed it.
   lock_ = std::make_unique<InterfaceLock>(options_.runDir, vm->ifindex, options_.vmIface);
   vm = findLink(options_.vmIface);
   if (!vm) {
      throw NetdevError(name + ": no interface " + options_.vmIface);
   }
   const auto bridge = findLink(options_.bridge);
   if (!bridge || bridge->kind != "bridge") {
      throw NetdevError(name + ": " + options_.bridge + " is not a bridge");
   }
   if (vm->kind == "bridge") {
      throw NetdevError(name + ": " + options_.vmIface + " is a bridge, not a VM's interface");
   }
   if (!vm->master.empty() && vm->master != options_.bridge) {
      throw NetdevError(name + ": " + options_.vmIface + " is a port of " + vm->master + ", not of " +
                        options_.bridge);
   }
   // The pair's names: 15 characters at most, from the VM interface's index.
   bridgeEnd_ = "swsec" + std::to_string(vm->ifindex) + "b";
   guardEnd_ = "swsec" + std::to_string(vm->ifindex) + "g";
   if (bridgeEnd_.size() > IFNAMSIZ - 1) {
      throw NetdevError(name + ": interface index " + std::to_string(vm->ifindex) + " too large for a pair name");
   }
   vmIfindex_ = vm->ifindex;
   mtu_ = vm->mtu;
   wasInBridge_ = vm->master == options_.bridge;
   if (!wasInBridge_) {
      // Left so by a run that stopped closed: guarded again from here.
      log_(name + ": " + options_.vmIface + " is not in " + options_.bridge + "; guarding it into the bridge");
   }
   try {
      if (findLink(bridgeEnd_)) {
         log_(name + ": removing " + bridgeEnd_ + ", left by an earlier run");
         runIp({"link", "del", bridgeEnd_});
      }
      const std::string mtu = std::to_string(vm->mtu);
      runIp({"link", "add", bridgeEnd_, "mtu", mtu, "type", "veth", "peer", "name", guardEnd_, "mtu", mtu});
      pairMade_ = true;
      // The pair is a wire, not a host: no addresses, no router solicitations.
      for (const auto &end : {bridgeEnd_, guardEnd_}) {
         if (ipv6Disabled(end).has_value()) {
            setIpv6Disabled(end, true);
         }
      }
      runIp({"link", "set", guardEnd_, "up"});
      runIp({"link", "set", bridgeEnd_, "up"});
      const bool kernel = options_.datapath == Datapath::kernel;
      if (!kernel && removeLeftoverProgram(vm->ifindex)) {
         // It would punt the VM's frames to a ring nobody reads.
         log_(name + ": removed the fast path program a killed run left on " + options_.vmIface);
      }
      if (!kernel) {
         vmSocket_ = std::make_unique<PacketSocket>(options_.vmIface, options_.batch);
         guardSocket_ = std::make_unique<PacketSocket>(guardEnd_, options_.batch);
      }

      filter_ = session_.addPort(options_.portID, name, "inline:" + name);
      portMade_ = true;
      if (restore) {
         restore(filter_);
      }
      session_.configure(filter_, config);

      stopEvent_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
      if (stopEvent_ < 0) {
         throw std::system_error(errno, std::generic_category(), "eventfd");
      }
      if (kernel) {
         // The VM interface stays in (or goes back into) the bridge, guarded by the program on its hooks.
         kernel_ = std::make_unique<KernelPath>(
            session_, *options_.feed,
            KernelPath::Options{name, options_.vmIface, vm->ifindex, options_.portID, guardEnd_, bridgeEnd_}, log_);
         vmOutOfBridge_ = true;
         kernel_->start(filter_);
         if (!wasInBridge_) {
            runIp({"link", "set", options_.vmIface, "master", options_.bridge});
         }
         running_.store(true, std::memory_order_release);
         threads_.emplace_back([this] { kernel_->run(stopEvent_, counters_, [this](const std::string &why) { vanish(why); }); });
         log_(name + ": guarding " + options_.vmIface + " in " + options_.bridge + " on the kernel data path (port " +
              std::to_string(options_.portID) + ", fail " + (options_.failMode == FailMode::open ? "open" : "closed") +
              ")");
         return;
      }
      // Swapped: out of the bridge first, so that no frame takes both ways.
      if (wasInBridge_) {
         runIp({"link", "set", options_.vmIface, "nomaster"});
      }
      vmOutOfBridge_ = true;
      runIp({"link", "set", bridgeEnd_, "master", options_.bridge});
      running_.store(true, std::memory_order_release);
      threads_.emplace_back([this] { forward(*vmSocket_, *guardSocket_, ORR_SIFRA_DIR_TX); });
      threads_.emplace_back([this] { forward(*guardSocket_, *vmSocket_, ORR_SIFRA_DIR_RX); });
   } catch (...) {
      takeDown(true);
      throw;
   }
   log_(name + ": guarding " + options_.vmIface + " in " + options_.bridge + " through " + bridgeEnd_ +
        " (port " + std::to_string(options_.portID) + ", fail " +
        (options_.failMode == FailMode::open ? "open" : "closed") + ")");
}

bool GuardedPort::interfaceGone(const PacketSocket &socket) const
{
   char name[IF_NAMESIZE];
   return if_indextoname(static_cast<unsigned>(socket.ifindex()), name) == nullptr;
}

void GuardedPort::vanish(const std::string &reason)
{
   if (vanished_.exchange(true)) {
      return;
   }
   {
      std::lock_guard guard(mutex_);
      stopReason_ = reason;
   }
   log_(options_.name + ": " + reason + "; the port stops");
   if (stopped_) {
      stopped_();
   }
}

void GuardedPort::forward(PacketSocket &from, PacketSocket &to, uint32_t direction)
{
   std::vector<ReceivedFrame> frames;
   frames.reserve(options_.batch);
   std::vector<host::FrameView> views;
   views.reserve(options_.batch);
   std::vector<const ReceivedFrame *> passed;
   passed.reserve(options_.batch);
   std::vector<size_t> judged;   // index in `frames` of each view
   judged.reserve(options_.batch);
   uint64_t sendErrors = 0;

   while (!vanished_.load(std::memory_order_acquire)) {
      pollfd fds[2] = {{from.fd(), POLLIN, 0}, {stopEvent_, POLLIN, 0}};
      if (poll(fds, 2, -1) < 0) {
         if (errno == EINTR) {
            continue;
         }
         vanish(std::string("poll: ") + std::strerror(errno));
         return;
      }
      if ((fds[1].revents & POLLIN) != 0) {
         return;
      }
      if (!from.receive(frames)) {
         const int error = errno;
         if (interfaceGone(from) || interfaceGone(to)) {
            vanish((interfaceGone(from) ? from.ifname() : to.ifname()) + " disappeared");
            return;
         }
         if (error != ENETDOWN) {
            log_(options_.name + ": receive on " + from.ifname() + ": " + std::strerror(error));
         }
         // Down, not gone: the socket takes frames again once it is up.
         continue;
      }
      views.clear();
      judged.clear();
      for (size_t i = 0; i < frames.size(); ++i) {
         ReceivedFrame &frame = frames[i];
         if (frame.truncated) {
            counters_.truncated.fetch_add(1, std::memory_order_relaxed);
            continue;
         }
         views.push_back(portView(frame));
         judged.push_back(i);
      }
      if (views.empty()) {
         continue;
      }
      const host::PacketsResult result = session_.judge(filter_, direction, views);
      passed.clear();
      for (size_t kept : result.kept) {
         if (kept < judged.size()) {
            passed.push_back(&frames[judged[kept]]);
         }
      }
      counters_.passed[direction].fetch_add(passed.size(), std::memory_order_relaxed);
      if (direction == ORR_SIFRA_DIR_RX) {
         for (const ReceivedFrame *frame : passed) {
            if (fromDhcpServer(frame->bytes)) {
               counters_.leaseReplies.fetch_add(1, std::memory_order_relaxed);
            }
         }
      }
      counters_.dropped[direction].fetch_add(views.size() - passed.size(), std::memory_order_relaxed);
      if (!passed.empty()) {
         const uint64_t before = sendErrors;
         (void)to.send(passed, &sendErrors);
         if (sendErrors != before) {
            counters_.sendErrors.fetch_add(sendErrors - before, std::memory_order_relaxed);
            if (interfaceGone(to)) {
               vanish(to.ifname() + " disappeared");
               return;
            }
         }
      }
   }
}

uint64_t GuardedPort::overruns()
{
   std::lock_guard guard(mutex_);
   uint64_t more = 0;
   if (vmSocket_) {
      more += vmSocket_->takeOverruns();
   }
   if (guardSocket_) {
      more += guardSocket_->takeOverruns();
   }
   return counters_.overruns.fetch_add(more, std::memory_order_relaxed) + more;
}

void GuardedPort::followMtu(unsigned mtu)
{
   if (mtu == mtu_ || !running()) {
      return;
   }
   // The bridge end last when raising, first when lowering: the bridge
   // never takes a frame the guard end could not carry.
   const std::string text = std::to_string(mtu);
   const bool raising = mtu > mtu_;
   runIp({"link", "set", raising ? guardEnd_ : bridgeEnd_, "mtu", text});
   runIp({"link", "set", raising ? bridgeEnd_ : guardEnd_, "mtu", text});
   log_(options_.name + ": " + options_.vmIface + " MTU " + std::to_string(mtu_) + " -> " + text +
        "; the pair follows");
   mtu_ = mtu;
}

void GuardedPort::setStopReason(const std::string &reason)
{
   std::lock_guard guard(mutex_);
   stopReason_ = reason;
}

std::string GuardedPort::stopReason() const
{
   std::lock_guard guard(mutex_);
   return stopReason_;
}

void GuardedPort::stop(bool restoreAsFound, const std::function<void(host::FilterId)> &save)
{
   // Not mutex_: a forwarding thread that is vanishing takes it to record
   // why, and is joined here.
   std::lock_guard guard(stopMutex_);
   if (stopping_ || !running_.load(std::memory_order_acquire)) {
      return;
   }
   stopping_ = true;
   const uint64_t one = 1;
   if (write(stopEvent_, &one, sizeof one) != sizeof one) {
      log_(options_.name + ": cannot signal the forwarding threads: " + std::strerror(errno));
   }
   for (auto &thread : threads_) {
      thread.join();
   }
   threads_.clear();
   running_.store(false, std::memory_order_release);
   if (save && portMade_) {
      save(filter_);
   }
   takeDown(restoreAsFound);
}

// Undoes the set-up in reverse order. A start-up failure puts back what
// was found; a stop leaves the VM as the fail mode says.
void GuardedPort::takeDown(bool restoreAsFound)
{
   const std::string &name = options_.name;
   auto attempt = [&](const std::vector<std::string> &args) {
      try {
         runIp(args);
      } catch (const NetdevError &e) {
         log_(name + ": " + e.what());
      }
   };
   const bool vmPresent = findLink(options_.vmIface).has_value();
   if (vmOutOfBridge_ && vmPresent) {
      const bool back = restoreAsFound ? wasInBridge_ : options_.failMode == FailMode::open;
      if (back) {
         attempt({"link", "set", options_.vmIface, "master", options_.bridge});
      } else {
         if (kernel_) {
            // Cut off before the program goes: no frame passes unjudged.
            attempt({"link", "set", options_.vmIface, "nomaster"});
         }
         if (!restoreAsFound) {
            log_(name + ": " + options_.vmIface + " stays out of " + options_.bridge + " (fail closed)");
         }
      }
   }
   vmOutOfBridge_ = false;
   if (kernel_) {
      kernel_->stop();
      kernel_.reset();
   }
   if (stopEvent_ >= 0) {
      close(stopEvent_);
      stopEvent_ = -1;
   }
   if (portMade_) {
      const orr_Status status = session_.removePort(filter_);
      if (status != ORR_OK) {
         log_(name + ": the module port would not go: " + orr_StatusToString(status));
      }
      portMade_ = false;
   }
   {
      std::lock_guard guard(mutex_);
      guardSocket_.reset();
      vmSocket_.reset();
   }
   if (pairMade_ && findLink(bridgeEnd_)) {
      attempt({"link", "del", bridgeEnd_});
   }
   pairMade_ = false;
   lock_.reset();
}

}  // namespace swsec::live
