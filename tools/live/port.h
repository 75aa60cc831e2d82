// One guarded port: a bump in the wire between a VM's interface and the
// bridge it was a port of.
//
//   VM iface ==(from the VM, direction 2)==> swsec ==> swsec<N>g -- swsec<N>b (in the bridge)
//   VM iface <==(to the VM, direction 1)==== swsec <== swsec<N>g -- swsec<N>b
//
// N is the VM interface's index, so a pair left by a run that was killed is
// found and replaced by the next. Life: made (nothing changed), started
// (network changed, module port made, two forwarding threads running),
// stopped (threads joined, module port destroyed, network put back as the
// fail mode says). A start that fails half way leaves the network as found.
#pragma once

#include "live/owner_lock.h"
#include "live/socket.h"
#include "session/ports_session.h"

#include <array>
#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace swsec::live {

// What the VM is left with when swsec stops guarding it: cut off (closed,
// its interface stays out of the bridge) or on the bridge unguarded (open).
enum class FailMode : uint8_t { closed, open };

// Who carries the VM's frames: the fast path program on the VM interface,
// which stays in the bridge (kernel), or this process through a veth pair
// bump (user).
enum class Datapath : uint8_t { kernel, user };
const char *datapathName(Datapath datapath);

class KernelPath;
class PostedFeed;

struct PortOptions {
   std::string name;       // the port's name for the administrator ("vm1")
   std::string vmIface;    // the VM's interface, a port of `bridge`
   std::string bridge;
   uint32_t portID = 0;    // the module port's ID
   FailMode failMode = FailMode::closed;
   size_t batch = 64;      // most frames in one system call and one list
   std::string runDir = kDefaultRunDir;   // where the interface's owner lock is
   Datapath datapath = Datapath::user;
   PostedFeed *feed = nullptr;            // the kernel path's notifications
};

// Frames a port has seen, by direction (1 to the VM, 2 from it).
struct PortCounters {
   std::array<std::atomic<uint64_t>, 3> passed{};
   std::array<std::atomic<uint64_t>, 3> dropped{};
   std::atomic<uint64_t> truncated{0};     // longer than a slot, never sent on
   std::atomic<uint64_t> sendErrors{0};    // refused by the outgoing interface
   std::atomic<uint64_t> overruns{0};      // dropped by the kernel: a socket's buffer was full
   std::atomic<uint64_t> leaseReplies{0};  // DHCP server frames passed to the VM (see lease_reply.h)
};

// The frame as the virtual switch hands it to the port: the outer tag, of
// any TPID (taken off by the kernel or left in the bytes), becomes VLAN
// metadata, and a runt is padded to 60 bytes in its buffer (which has room
// for them), so that what goes on is what was judged.
host::FrameView portView(ReceivedFrame &frame);

class GuardedPort {
public:
   // `log` takes a line for the administrator; `stopped` is called (from a
   // forwarding thread) when the port stops by itself, its interface gone.
   GuardedPort(session::ModuleSession &session, PortOptions options, std::function<void(const std::string &)> log,
               std::function<void()> stopped);
   ~GuardedPort();
   GuardedPort(const GuardedPort &) = delete;
   GuardedPort &operator=(const GuardedPort &) = delete;

   // Sets the port up and configures it with `config`; `restore`, if given,
   // is called with the new module port before it is configured and before
   // any frame flows. Throws (session::Refused, NetdevError, std::system_error)
   // after putting back what it changed.
   void start(const session::PortSecurityConfig &config, const std::function<void(host::FilterId)> &restore = {});
   // Stops forwarding and takes the set-up down as the fail mode says, or,
   // for a start-up that fails after this port started, as it was found.
   // `save`, if given, is called with the module port once the last frame
   // is through and before the port goes. Idempotent.
   void stop(bool restoreAsFound = false, const std::function<void(host::FilterId)> &save = {});
   // Stopped by itself (its interface gone) and not yet taken down.
   bool vanished() const { return vanished_.load(std::memory_order_acquire); }

   const PortOptions &options() const { return options_; }
   host::FilterId filter() const { return filter_; }
   bool running() const { return running_.load(std::memory_order_acquire); }
   // Why the port stopped by itself, "" while it has not.
   std::string stopReason() const;
   const PortCounters &counters() const { return counters_; }
   // Gathers the sockets' overruns into the counters (reading them resets
   // the kernel's count) and returns the total.
   uint64_t overruns();
   std::string guardEnd() const { return guardEnd_; }
   std::string bridgeEnd() const { return bridgeEnd_; }
   // The VM interface's index and the pair's MTU, as found at start.
   int vmIfindex() const { return vmIfindex_; }
   unsigned mtu() const { return mtu_; }
   // The VM interface's MTU changed: the pair follows it, so that the
   // frames it may now send fit. Throws NetdevError.
   void followMtu(unsigned mtu);
   // Why the port was stopped from outside (its bridge gone), for stopReason.
   void setStopReason(const std::string &reason);
   // The kernel path, while the port runs on it (else null).
   KernelPath *kernel() { return kernel_.get(); }

private:
   void forward(PacketSocket &from, PacketSocket &to, uint32_t direction);
   bool interfaceGone(const PacketSocket &socket) const;
   void vanish(const std::string &reason);
   void takeDown(bool restoreAsFound);

   session::ModuleSession &session_;
   PortOptions options_;
   std::function<void(const std::string &)> log_;
   std::function<void()> stopped_;
   PortCounters counters_;

   // The set-up, in the order it is made; takeDown undoes what is set.
   std::string bridgeEnd_;
   std::string guardEnd_;
   int vmIfindex_ = 0;
   unsigned mtu_ = 0;
   bool wasInBridge_ = false;
   bool pairMade_ = false;
   bool portMade_ = false;
   bool vmOutOfBridge_ = false;
   host::FilterId filter_ = 0;
   std::unique_ptr<InterfaceLock> lock_;   // held from the first check to the end of the take-down
   std::unique_ptr<KernelPath> kernel_;
   std::unique_ptr<PacketSocket> vmSocket_;
   std::unique_ptr<PacketSocket> guardSocket_;
   int stopEvent_ = -1;                       // eventfd: the forwarding threads stop
   std::vector<std::thread> threads_;
   std::atomic<bool> running_{false};
   std::atomic<bool> vanished_{false};
   // stop against stop; held while the forwarding threads are joined, so
   // nothing they take may wait for it.
   std::mutex stopMutex_;
   bool stopping_ = false;
   mutable std::mutex mutex_;                 // stopReason_ and the sockets' lifetime
   std::string stopReason_;
};

}  // namespace swsec::live
