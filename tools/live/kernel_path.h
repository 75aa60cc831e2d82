// The kernel data path of a guarded port: the VM interface stays in the
// bridge and the fast path program on its tc hooks carries the data frames;
// the frames it punts are judged by the module here and those passed go on
// where they were going, re-injected through a veth pair:
//
//   VM iface --tc ingress/egress (program, maps)--> bridge / VM
//       | punt ring                                  ^ redirected, marked
//       v                                            |
//   swsec inline: module judges --> swsec<N>g ==veth==> swsec<N>b (tc ingress: swsec_inject)
//
// The maps are filled from the module's port at start and kept by its port
// database notifications, taken by one PostedFeed for every port, so that a
// binding is in the map before the frame that made it goes on.
#pragma once

#include "fastpath/fastpath.h"
#include "fastpath/port_mirror.h"
#include "live/port.h"

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace swsec::live {

// The module's posted messages, taken from the host in one place: binding
// changes go to the mirror of their port as they are taken, and every
// message is kept for the daemon's notifications.
class PostedFeed {
public:
   explicit PostedFeed(host::Host &host) : host_(host) {}
   // Starts (or, with null, stops) handing port `portID`'s changes to `mirror`.
   void follow(uint32_t portID, fastpath::Mirror *mirror);
   // Starts the port's mirror over from the module (a new configuration).
   void restart(uint32_t portID);
   // Takes what was posted since the last take and brings every mirror up to date.
   void take();
   // Every message taken since the last call, in order.
   std::vector<host::PostedMessage> drain();

private:
   host::Host &host_;
   std::mutex mutex_;
   std::map<uint32_t, fastpath::Mirror *> mirrors_;
   std::vector<host::PostedMessage> kept_;
};

// Judges punted frames with the module's port `filter` (both agents, where
// it has the IPv6 agent), brings every mirror of `feed` up to date with what
// they taught it, and only then hands each passed frame to `pass`, in order.
void judgePunts(session::ModuleSession &session, host::FilterId filter, PostedFeed &feed, std::span<fastpath::Punt> punts,
                PortCounters &counters, const std::function<void(fastpath::Punt &)> &pass);

class KernelPath {
public:
   struct Options {
      std::string name;        // the port's, names the pin directory
      std::string vmIface;
      int vmIfindex = 0;
      uint32_t portID = 0;
      std::string injectEnd;   // where the passed frames are sent (swsec<N>g)
      std::string programEnd;  // its peer, whose ingress redirects them (swsec<N>b)
   };
   KernelPath(session::ModuleSession &session, PostedFeed &feed, Options options,
              std::function<void(const std::string &)> log);
   ~KernelPath();
   KernelPath(const KernelPath &) = delete;
   KernelPath &operator=(const KernelPath &) = delete;

   // Loads the program (finding maps a previous run pinned, and dropping
   // the frames it left in the ring), fills the maps from the configured
   // module port and attaches: the re-injection end first, then the VM
   // interface's hooks, replacing a program a previous run left there.
   // Throws fastpath::Error or std::system_error.
   void start(host::FilterId filter);
   // Judges punted frames until `stopEvent` is readable or the VM interface
   // goes (then `vanish` is called with why).
   void run(int stopEvent, PortCounters &counters, const std::function<void(const std::string &)> &vanish);
   // Detaches from the VM interface (removing the clsact qdisc only when
   // this or a previous run made it) and unpins the maps. Idempotent.
   void stop();

   // The frames the program counted, by reason.
   fastpath::Counters counters() const;
   // The module's counters restarted (a new configuration): the program's
   // drops counted so far are no longer to be added to them.
   void configured();
   // The program's drops since then, by the module's drop counter they add
   // to (IP source guard of either agent; ARP and ND over their punt
   // budgets to their rate limits'; the ethertype list).
   std::map<std::string, uint64_t> dropsSinceConfigured() const;

private:
   void inject(fastpath::Punt &punt);

   session::ModuleSession &session_;
   PostedFeed &feed_;
   Options options_;
   std::function<void(const std::string &)> log_;
   host::FilterId filter_ = 0;
   std::optional<fastpath::Program> program_;
   std::optional<fastpath::Mirror> mirror_;
   std::unique_ptr<fastpath::Attachment> injectHook_;
   std::unique_ptr<fastpath::Attachment> vmHooks_;
   int sockets_[3] = {-1, -1, -1};   // by direction: the marked sockets on the injection end
   int injectIfindex_ = 0;
   fastpath::Counters base_;   // at the last configuration
   mutable std::mutex baseMutex_;
};

// Removes the fast path program a killed kernel-path run left on the VM
// interface (its hooks at the kernel path's priority); true when it did.
bool removeLeftoverProgram(int vmIfindex);

// Completes the TCP or UDP checksum of an IPv4 or IPv6 frame whose checksum
// field holds the pseudo-header's sum alone (its stack left the rest to the device).
void completeChecksum(std::vector<uint8_t> &frame);

// Mounts a BPF file system on /sys/fs/bpf when none is there; true when it did.
bool mountBpfFs();

}  // namespace swsec::live
