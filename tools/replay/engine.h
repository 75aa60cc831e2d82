// The replay engine: loads the module into a host, makes one port of the
// built-in agent per VM of the capture, configures each, hands them every
// frame of a capture in direction lists on the capture's clock and gathers
// what each port did.
#pragma once

#include "replay/drop_reason.h"
#include "session/config_file.h"
#include "session/ports_session.h"

#include "platform/orr_module.h"

#include <array>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

namespace swsec::replay {

using Mac = std::array<uint8_t, 6>;

// Which frames the result keeps a record of. Records cost memory and time
// per frame, so a run keeps only what its outputs show; a sink sees every
// record as it is made whatever is kept.
enum class FrameRecords : uint8_t {
   none,      // totals only
   dropped,   // the dropped frames
   all,       // every frame (callers that inspect verdicts)
};

// One VM's port. Frames from its MACs go from the VM (direction 2), frames
// to them go to it (1); a broadcast or multicast from the network goes to
// every port.
struct PortSpec {
   std::string name;
   std::vector<Mac> macs;
   std::optional<session::PortSecurityConfig> config;   // none: ReplayOptions::config
};

inline constexpr uint32_t kNoDescription = UINT32_MAX;
inline constexpr uint16_t kNoPort = UINT16_MAX;

// One frame's verdict at one port: a plain struct, so that a million of
// them are one allocation without a destructor to run.
struct FrameVerdict {
   uint64_t index = 0;
   int64_t timeNs = 0;                    // since the first frame
   uint32_t description = kNoDescription; // into ReplayResult::descriptions
   uint16_t vlan = 0;
   uint16_t port = 0;                     // into ReplayResult::ports
   uint8_t direction = 0;                 // kDirToVm or kDirFromVm
   bool passed = true;
   DropReason reason = DropReason::none;  // with ReplayOptions::reasons

   double seconds() const { return static_cast<double>(timeNs) / 1e9; }
};
static_assert(sizeof(FrameVerdict) == 32);

// What a sink is shown of a frame as the port decides it.
struct FrameEvent {
   const FrameVerdict &verdict;
   std::string_view description;   // "" unless describeDrops and dropped
};

struct ReplayOptions {
   std::string capturePath;
   // The VMs. Empty: one port "vm" whose VM is `vmMac` (or, without it,
   // known only by the capture's direction flags).
   std::vector<PortSpec> ports;
   std::optional<Mac> vmMac;
   std::optional<session::PortSecurityConfig> config;      // every port without its own; none: a new port's defaults
   // Frames from these come from the network, so that any other source is
   // a VM whatever MAC it claims (with one port: that port's VM).
   std::vector<Mac> networkMacs;
   std::optional<uint16_t> vlan;                  // only frames of this VLAN (0: untagged)
   double untilSeconds = 0;                       // clock runs on after the last frame (0 to kMaxUntilSeconds)
   uint32_t batch = 32;                           // most frames in one list
   FrameRecords frameRecords = FrameRecords::all;
   bool describeDrops = false;                    // one-line description per dropped frame
   // The check behind every dropped frame: frames then go to the port one
   // a list, and the drop counters are read after each list with a drop.
   bool reasons = false;
   std::string writePassed;                       // pcap of passed frames ("" none)
   std::string writeDropped;                      // pcap of dropped frames ("" none)
   std::string modulePath;                        // a module image to open ("" none)
   // The module linked into the program, loaded when no image is named;
   // null: the image built with the host.
   const orr_ModuleInfo *linkedModule = nullptr;
   // Idle capture time (no frame for a long span) is crossed in one step
   // where no timer's tick can change anything; false ticks through it, for
   // tests that compare the two.
   bool skipIdleTime = true;
   // Each verdict as it is made, in the order frames are handed over.
   std::function<void(const FrameEvent &)> sink;
   // The port's saved state: restored before the first frame (before the
   // configuration, which then applies on top), and saved at the end,
   // after --until, written whole or not at all ("" none).
   std::string restoreStatePath;
   std::string saveStatePath;
   // Called now and then with frames done and bytes read of the file's size
   // (0: unknown), and while the clock runs on after the last frame.
   std::function<void(uint64_t frames, uint64_t bytesRead, uint64_t fileSize)> progress;
};

// The longest --until: past any lease (a 32-bit count of seconds), and
// small enough that the clock's microseconds cannot overflow.
inline constexpr double kMaxUntilSeconds = 1e10;
inline constexpr size_t kMaxWarnings = 20;

// A port database notification and where in the capture it was seen.
struct Notification : session::PortDbNotification {
   uint64_t afterFrame = 0;   // the last frame handed over before it was seen (0: none yet)
};

// A line of the module's log; a run of identical lines is one LogLine.
struct LogLine {
   uint32_t severity = 0;     // as the module gave it: 2 failures and refusals, 1 information
   std::string text;          // without the final newline
   uint64_t repeated = 0;     // further identical lines that followed it
};

// A port's frame totals and notifications, and its nodes as read at the end.
struct PortResult : session::PortState {
   std::string name;
   std::vector<std::string> macs;
   uint64_t seen = 0;         // frames from or to one of its MACs
   // [direction][0 passed, 1 dropped], direction indexed by kDirToVm/kDirFromVm.
   std::array<std::array<uint64_t, 2>, 3> totals{};
   std::vector<Notification> notifications;
};

struct ReplayResult {
   // In the order handed over, as options.frameRecords asks.
   std::vector<FrameVerdict> frames;
   // Dropped frames' descriptions, with describeDrops.
   std::vector<std::string> descriptions;
   std::vector<PortResult> ports;
   uint64_t framesRead = 0;
   uint64_t otherVlan = 0;    // frames left out by ReplayOptions::vlan
   uint64_t unassigned = 0;   // frames to or from no port's VM (several ports only)
   std::vector<LogLine> log;
   std::vector<std::string> violations;   // host checks (leaks at unload, ...)
   // What the capture got wrong without making the run fail (timestamps
   // that go backwards, ...), each naming the frame; at most kMaxWarnings,
   // the rest counted.
   std::vector<std::string> warnings;
   uint64_t warningsNotShown = 0;

   // The frame's description, "" when it has none.
   std::string_view description(const FrameVerdict &frame) const
   {
      return frame.description < descriptions.size() ? std::string_view(descriptions[frame.description])
                                                     : std::string_view();
   }
};

// The security configuration was refused by the module: `what()` is the
// module's own message.
class ConfigRefused : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

// Throws session::InputError on bad input (before any output file is left behind;
// a state file the module refuses is bad input, with the module's message),
// ConfigRefused when a port refuses its configuration, std::runtime_error
// when the module does not load.
ReplayResult runReplay(const ReplayOptions &options);

}  // namespace swsec::replay
