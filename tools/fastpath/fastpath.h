// The kernel fast path of a guarded port, from user space: the embedded tc
// program loaded with its maps (pinned so that a restart finds them), its
// attachment to an interface, the maps filled from a plain description of
// the port and kept by binding changes, the per-CPU counters summed, the
// punted frames read from the ring buffer, and a frame run through the
// program with BPF_PROG_TEST_RUN.
#pragma once

#include "bpf/swsec_fastpath.h"

#include <array>
#include <compare>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

struct bpf_object;
struct ring_buffer;

namespace swsec::fastpath {

// A failed kernel operation: what was tried and the kernel's errno.
class Error : public std::runtime_error {
public:
   Error(const std::string &what, int error);
   int error() const { return error_; }

private:
   int error_;
};

// The program's object file as built, embedded in this library.
std::span<const uint8_t> embeddedObject();

// Why this kernel fast path cannot be had here, for the user-space data
// path to say so: the program cannot be loaded for want of privilege or of
// BPF. None when it loads; any other failure is an Error.
std::optional<std::string> unavailable();

// Where libbpf's warnings and information go (its debug output is dropped),
// one message a call without its final newline; standard error until set.
// The kernel's refusal to make a clsact qdisc that exists already, which
// attaching expects and handles, is not passed on.
void setLibbpfLog(std::function<void(std::string_view)> sink);

struct Binding {
   uint16_t vlan = 0;
   std::array<uint8_t, 6> mac{};
   uint32_t ip = 0;              // network order, as frames carry it
   bool authoritative = false;   // DHCP or static
   auto operator<=>(const Binding &) const = default;
};

// An IPv6 binding of the IPv6 agent.
struct Binding6 {
   uint16_t vlan = 0;
   std::array<uint8_t, 6> mac{};
   std::array<uint8_t, 16> addr{};   // network order
   bool fcfs = false;            // first come, first served: renewed by the VM's traffic
   auto operator<=>(const Binding6 &) const = default;
};

// A port as the module has it, all the program needs of it.
struct PortDescription {
   uint32_t portId = 0;
   uint32_t features = 0;        // featuresEnabled
   bool trusted = false;
   bool errorState = false;      // in the error-rate-limit state
   uint32_t arpRateLimit = 0;    // ARP frames a second; 0: none
   std::vector<uint16_t> etherTypes;   // the frame guard's list; empty: every ethertype
   std::vector<Binding> bindings;
   // The IPv6 agent's part; features 0 where the port has no IPv6 agent.
   uint32_t ipv6Features = 0;
   bool ipv6Trusted = false;
   bool ndErrorState = false;    // in the ND error state
   uint32_t ndRateLimit = 0;     // ND frames a second it limits from the VM; 0: none
   std::vector<Binding6> bindings6;
};

struct BindingChange {
   bool added = false;           // else removed
   Binding binding;
   std::optional<Binding6> ipv6; // set: the change is of this IPv6 binding instead
};

// A frame the program handed to user space, with its outer tag taken off
// into `vlan` as the switch presents frames to the module.
struct Punt {
   uint32_t portId = 0;
   uint32_t direction = 0;       // SWSEC_FP_DIR_*
   uint16_t vlan = 0;
   std::optional<uint16_t> tpid; // the outer tag's, none when the frame had none
   uint8_t tagHigh = 0;          // its priority and DEI (the TCI's top 4 bits)
   uint8_t reason = 0;           // enum swsec_fp_reason
   uint32_t frameLen = 0;        // as the program saw it (outer tag included when in the bytes)
   bool truncated = false;       // longer than a punt record carries
   std::vector<uint8_t> bytes;
};

// Frames a port's program counted, by reason, summed over the CPUs.
struct Counters {
   std::array<uint64_t, SWSEC_FP_REASON_COUNT> frames{};
   uint64_t operator[](swsec_fp_reason reason) const { return frames[reason]; }
   uint64_t punted() const;
   uint64_t dropped() const;   // all from the VM
};
std::string_view reasonName(uint32_t reason);

// The outer 802.1Q or 802.1ad tag of a frame's bytes, taken off: the bytes
// without it and its VLAN ID (none when untagged or too short for a tag).
struct Untagged {
   std::vector<uint8_t> bytes;
   std::optional<uint16_t> vlan;
};
Untagged takeOuterTag(std::span<const uint8_t> frame);

// Where a port's maps are pinned: /sys/fs/bpf/swsec/<port>. A port name
// that is empty, longer than 64 bytes, "." or "..", or holds a '/' or a
// control character is refused (Error, EINVAL).
std::string pinDirFor(std::string_view port);

// One port's program and maps. Moving only; the maps stay pinned after
// the object goes (unpin() removes them).
class Program {
public:
   struct Options {
      // Directory on a BPF file system to pin the maps in (made if missing);
      // empty: no pinning. Maps already pinned there are reused.
      std::string pinDir;
   };
   explicit Program(const Options &options);
   ~Program();
   Program(Program &&) noexcept;
   Program &operator=(Program &&) noexcept;
   Program(const Program &) = delete;
   Program &operator=(const Program &) = delete;

   // The program of one direction (SWSEC_FP_DIR_*), to attach.
   int programFd(uint32_t direction) const;
   // The re-injection program, for the ingress of the veth end that frames
   // the module passed are sent to.
   int injectFd() const;
   // Readable when punted frames wait in the ring buffer.
   int puntFd() const;
   // Where the re-injection program sends frames (0: it drops them), and
   // whether user space made the interface's clsact qdisc; both kept by describe.
   void setVmInterface(uint32_t ifindex, bool ownQdisc);

   // Makes the maps mirror `port` (the bindings replaced whole) and marks
   // the port ready: from then on the program decides.
   void describe(const PortDescription &port);
   // Marks the port not ready: every frame is punted.
   void setNotReady();
   // The IPv4 agent's error-rate-limit state and the IPv6 agent's ND error state.
   void setErrorState(bool on, bool nd);
   void apply(const BindingChange &change);
   std::vector<Binding> bindings() const;
   std::vector<Binding6> bindings6() const;
   swsec_fp_port port() const;

   Counters counters() const;

   // Runs the program of `direction` over `frame` (`repeat` times); the
   // tc action and the kernel's mean time a run.
   struct Run {
      int action = 0;
      uint32_t nanoseconds = 0;
   };
   Run testRun(std::span<const uint8_t> frame, uint32_t direction, uint32_t repeat = 1) const;

   // Hands each punted frame waiting in the ring buffer to `sink`, in
   // order; returns how many. A record the ring holds malformed is skipped.
   size_t drainPunts(const std::function<void(Punt &&)> &sink);

   void unpin();

private:
   void close() noexcept;
   int mapFd(const char *name) const;

   bpf_object *object_ = nullptr;
   ring_buffer *ring_ = nullptr;
   std::function<void(Punt &&)> *sink_ = nullptr;
   std::string pinDir_;
};

// The program attached to an interface's tc hooks (clsact, direct action):
// ingress carries frames from the VM, egress frames to it. The clsact qdisc
// is made only if the interface has none, and removed at detach only if it
// was made here; other filters on the hooks are left alone.
class Attachment {
public:
   struct Hooks {
      int ingressFd = -1;      // -1: not on this hook
      int egressFd = -1;
      uint32_t priority = 0;   // 0: the kernel picks; else the filter there (handle 1) is replaced
   };
   Attachment(int ifindex, const Hooks &hooks);
   Attachment(const Program &program, int ifindex, bool ingress, bool egress);
   ~Attachment();
   Attachment(const Attachment &) = delete;
   Attachment &operator=(const Attachment &) = delete;

   // Detaches now; errors are reported (the destructor ignores them).
   void detach();
   bool madeQdisc() const { return madeQdisc_; }
   // A qdisc found here was made by an earlier run: detach removes it.
   void adoptQdisc() { madeQdisc_ = true; }
   // Removes the filters at `priority` (handle 1) from both hooks of the
   // interface, as a run that was killed left them; true when there were any.
   static bool removeLeftover(int ifindex, uint32_t priority);

private:
   struct Hook {
      bool attached = false;
      uint32_t handle = 0;
      uint32_t priority = 0;
   };
   int ifindex_ = 0;
   bool madeQdisc_ = false;
   Hook ingress_;
   Hook egress_;
};

}  // namespace swsec::fastpath
