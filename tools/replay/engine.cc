// The replay run: host, ports, configurations, the frame lists on the
// capture's clock, then each port's state read back through the management
// nodes, as an administrator would.
#include "replay/engine.h"

#include "replay/capture.h"
#include "replay/describe.h"
#include "replay/frame_batch.h"
#include "replay/output_path.h"
#include "replay/pcap_writer.h"
#include "replay/routing.h"
#include "session/error.h"

#include "host/host.h"
#include "session/port_state.h"
#include "session/ports_session.h"
#include "session/state_file.h"

#include <algorithm>
#include <array>
#include <chrono>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <filesystem>

namespace swsec::replay {

namespace {

using namespace std::chrono_literals;

// The port is configured this long before the first frame, so that a first
// frame is not seen in the same instant as the configuration.
constexpr std::chrono::microseconds kConfigLead = 500ms;
// A list is cut when the next frame is more than this after its first one,
// so that timers fire between frames as capture time passes.
constexpr int64_t kListSpanNs = 1'000'000;
// The list arena starts with room for a list of full-size untagged
// Ethernet frames, up to 1 MiB (a list of 65536 frames grows it only if
// its frames need it).
constexpr size_t kTypicalFrameBytes = 1514;
constexpr size_t kMaxInitialArenaBytes = size_t{1} << 20;
// A pcap record of a minimum-size frame (16-byte record header, 60 bytes):
// the file size over it bounds the frame count of ordinary captures, to
// reserve every frame's record at once; past 4 Mi records (128 MiB) the
// vector grows as it needs.
constexpr uint64_t kSmallRecordBytes = 76;
constexpr uint64_t kMaxReservedRecords = uint64_t{1} << 22;
// A span of capture time without frames longer than this is crossed with
// the port timers' idle ticks skipped (see crossIdle).
constexpr std::chrono::microseconds kIdleSpan = 1h;
// Three ticks of the port timer: every tick within this of an expiry is
// fired as it falls due.
constexpr std::chrono::microseconds kTickMargin = 30s;
// Progress, the module's log and posted messages are looked at after this
// many frames.
constexpr uint64_t kFramesBetweenLooks = 4096;

struct Port {
   PortSpec portSpec;
   uint32_t id = 0;   // the switch port number, index + 1
   host::FilterId filter = 0;
   DropCounters counters;   // as last read, with options.reasons
};

class Run {
public:
   Run(const ReplayOptions &options, ReplayResult &result);

   Run(const Run &) = delete;
   Run &operator=(const Run &) = delete;

   void execute();

private:
   void openOutputs(const CaptureReader &reader);
   void loadModule();
   void startPort(Port &port);
   void warn(const std::string &text);
   void warnFrame(uint64_t frame, const std::string &text);
   int64_t frameTime(const CaptureFrame &frame);
   void crossIdle(std::chrono::microseconds target);
   void handle(const CaptureFrame &frame);
   void add(const CaptureFrame &frame, const Delivery &delivery);
   void flush();
   void record(size_t frame, bool passed, DropReason reason);
   uint32_t batch() const { return options_.reasons ? 1 : options_.batch; }
   std::chrono::microseconds clockAt(int64_t timeNs) const;
   void advanceTo(std::chrono::microseconds target);
   void collectNotifications();
   void drainLog();
   void warnUnseenMacs(const FrameRouter &router);
   void readRestoreState();

   const ReplayOptions &options_;
   ReplayResult &result_;
   // A run cut short by bad input still takes the ports down and unloads
   // the module (the session's destructor), as the hypervisor would,
   // before the error is reported.
   std::optional<session::ModuleSession> session_;
   std::vector<Port> ports_;
   std::vector<uint8_t> restoreState_;   // the state file's bytes, read before the port is made
   std::vector<uint8_t> savedState_;     // the port's state at the end, to write
   // The IPv6 agent's, kept beside them in FILE6.
   std::vector<uint8_t> restoreIpv6State_;
   std::vector<uint8_t> savedIpv6State_;
   std::optional<FrameRouter> router_;
   Route route_;
   std::optional<PcapWriter> passed_;
   std::optional<PcapWriter> dropped_;
   FrameBatch list_;
   uint16_t listPort_ = 0;
   std::vector<uint8_t> kept_;                   // per frame of the list handed over
   // A frame handed to several ports is written out once all have judged
   // it: dropped if any dropped it.
   uint64_t sharedFrame_ = 0;
   bool sharedDropped_ = false;
   std::chrono::microseconds clockBase_{0};      // host time of the first frame
   std::chrono::microseconds clockReached_{0};   // the host clock is at least here
   int64_t firstTimeNs_ = 0;
   int64_t lastTimeNs_ = 0;     // the frame before's time
   int64_t latestTimeNs_ = 0;   // the latest time of any frame
   bool haveTime_ = false;
   uint64_t lastHandedOver_ = 0;
   bool haveLog_ = false;   // result_.log's last line can take repeats
};

Run::Run(const ReplayOptions &options, ReplayResult &result)
   : options_(options), result_(result),
     list_(options.batch, std::min(size_t{options.batch} * kTypicalFrameBytes, kMaxInitialArenaBytes))
{
   kept_.reserve(options.batch);
   std::vector<PortSpec> specs = options.ports;
   if (specs.empty()) {
      PortSpec only;
      only.name = "vm";
      if (options.vmMac) {
         only.macs.push_back(*options.vmMac);
      }
      specs.push_back(std::move(only));
   }
   std::vector<std::vector<Mac>> macs;
   for (size_t i = 0; i < specs.size(); ++i) {
      Port &port = ports_.emplace_back();
      port.portSpec = specs[i];
      port.id = static_cast<uint32_t>(i + 1);
      macs.push_back(port.portSpec.macs);
      PortResult &shown = result_.ports.emplace_back();
      shown.name = port.portSpec.name;
      for (const Mac &mac : port.portSpec.macs) {
         shown.macs.push_back(macText(mac.data()));
      }
   }
   router_.emplace(std::move(macs), options.networkMacs);
}

void Run::loadModule()
{
   session_.emplace(options_.modulePath, options_.linkedModule,
                    [this](const std::string &v) { result_.violations.push_back(v); });
}

void Run::startPort(Port &port)
{
   port.filter = session_->addPort(port.id, port.portSpec.name, "replay-" + port.portSpec.name);
   if (!options_.restoreStatePath.empty()) {
      try {
         session::restorePortState(session_->host(), port.filter, restoreState_);
      } catch (const session::StateRefused &e) {
         throw session::InputError(options_.restoreStatePath + ": saved state refused: " + e.what());
      }
      try {
         if (!restoreIpv6State_.empty()) {
            session::restorePortState(session_->host(), session_->ipv6Filter(port.filter), restoreIpv6State_);
         }
      } catch (const session::StateRefused &e) {
         throw session::InputError(options_.restoreStatePath + "6: saved state refused: " + e.what());
      }
   }
   const std::optional<session::PortSecurityConfig> &config =
      port.portSpec.config ? port.portSpec.config : options_.config;
   if (config) {
      try {
         session_->configure(port.filter, *config);
      } catch (const session::Refused &e) {
         throw ConfigRefused((config->origin.empty() ? "port " + port.portSpec.name : config->origin) + ": " +
                             e.what());
      }
   }
   if (options_.reasons) {
      port.counters = session_->dropCounters(port.id);
   }
}

void Run::add(const CaptureFrame &frame, const Delivery &delivery)
{
   if (!list_.empty() && (delivery.port != listPort_ || delivery.direction != list_.direction() ||
                          frame.timeNs - list_.firstTimeNs() > kListSpanNs || list_.size() >= batch())) {
      flush();
   }
   listPort_ = delivery.port;
   list_.add(frame.index, frame.timeNs, delivery.direction, frame.bytes);
}

std::chrono::microseconds Run::clockAt(int64_t timeNs) const
{
   return clockBase_ +
          std::chrono::duration_cast<std::chrono::microseconds>(std::chrono::nanoseconds(timeNs - firstTimeNs_));
}

// Collects the notifications posted since the last list was handed over,
// after the timers due by `target` ran: both are seen after that list.
void Run::advanceTo(std::chrono::microseconds target)
{
   // Lists that start within the same microsecond need no look at the clock.
   if (target > clockReached_) {
      const auto now = session_->host().clock().now();
      if (target - now > kIdleSpan && options_.skipIdleTime) {
         crossIdle(target);
      } else if (target > now) {
         session_->host().clock().advance(target - now);
      }
      clockReached_ = std::max(target, now);
   }
   collectNotifications();
}

// The port timer's tick ages the port database, pending DHCP requests and
// the error-rate-limit state; between frames, a tick changes something
// only when a binding's lifetime ends (requests and the error state end
// the same whichever tick after their end removes them, and say nothing).
// So idle time is skipped up to a margin before the soonest binding's
// expiry, ticked through that expiry, and so on; the ticks just before
// the target always fire. The outcome is that of firing every tick.
void Run::crossIdle(std::chrono::microseconds target)
{
   while (session_->host().clock().now() < target) {
      auto now = session_->host().clock().now();
      std::optional<std::chrono::seconds> soonest;
      for (const Port &port : ports_) {
         const auto left = session_->soonestExpiry(port.id);
         if (left) {
            soonest = soonest ? std::min(*soonest, *left) : *left;
         }
      }
      const auto until = soonest ? std::min(target, now + std::chrono::microseconds(*soonest)) : target;
      if (until - kTickMargin > now) {
         session_->host().clock().skipIdle(until - kTickMargin - now);
      }
      now = session_->host().clock().now();
      session_->host().clock().advance(std::min(target, until + kTickMargin) - now);
      if (options_.progress) {
         options_.progress(result_.framesRead, 0, 0);
      }
   }
}

void Run::warn(const std::string &text)
{
   if (result_.warnings.size() < kMaxWarnings) {
      result_.warnings.push_back(text);
   } else {
      ++result_.warningsNotShown;
   }
}

void Run::warnFrame(uint64_t frame, const std::string &text)
{
   if (result_.warnings.size() < kMaxWarnings) {
      warn(options_.capturePath + ": frame " + std::to_string(frame) + ": " + text);
   } else {
      ++result_.warningsNotShown;
   }
}

// The time a frame is replayed at. Timestamps that do not fit, lie before
// 1970 or go backwards are reported; the clock never goes back, so a frame
// earlier than the one before is judged at the time already reached.
int64_t Run::frameTime(const CaptureFrame &frame)
{
   if (!frame.timeInRange) {
      warnFrame(frame.index, "timestamp out of range; replayed at the time of the frame before");
      return haveTime_ ? lastTimeNs_ : 0;
   }
   if (frame.timeNs < 0) {
      warnFrame(frame.index, "timestamp before 1970 (" + std::to_string(frame.timeNs / 1'000'000'000) + " s)");
   }
   if (haveTime_ && frame.timeNs < lastTimeNs_) {
      std::array<char, 64> text{};
      std::snprintf(text.data(), text.size(), "timestamp %.6f s before the frame before's",
                    static_cast<double>(lastTimeNs_ - frame.timeNs) / 1e9);
      warnFrame(frame.index, text.data());
   }
   return frame.timeNs;
}

void Run::openOutputs(const CaptureReader &reader)
{
   std::optional<OutputTarget> passed;
   std::optional<OutputTarget> dropped;
   if (!options_.writePassed.empty()) {
      passed = resolveOutput(options_.writePassed);
   }
   if (!options_.writeDropped.empty()) {
      dropped = resolveOutput(options_.writeDropped);
   }
   for (const auto *target : {&passed, &dropped}) {
      if (*target && (*target)->identity && reader.identity() && *(*target)->identity == *reader.identity()) {
         throw session::InputError((*target)->named + ": cannot write: it is the input capture");
      }
   }
   if (passed && dropped && sameFile(*passed, *dropped)) {
      throw session::InputError(dropped->named + ": cannot write: it is also the --write-passed file");
   }
   if (passed) {
      passed_.emplace(*passed);
   }
   if (dropped) {
      dropped_.emplace(*dropped);
   }
}

void Run::flush()
{
   if (list_.empty()) {
      return;
   }
   // Capture time that goes backwards leaves the clock where it is.
   advanceTo(clockAt(list_.firstTimeNs()));
   Port &port = ports_[listPort_];
   const host::PacketsResult out = session_->judge(port.filter, list_.direction(), list_.views());
   kept_.assign(list_.size(), 0);
   for (size_t index : out.kept) {
      if (index < kept_.size()) {
         kept_[index] = 1;
      }
   }
   std::array<uint64_t, 2> &totals = result_.ports[listPort_].totals[list_.direction()];
   const FrameRecords records = options_.frameRecords;
   for (size_t i = 0; i < list_.size(); ++i) {
      const bool passed = kept_[i] != 0;
      ++totals[passed ? 0 : 1];
      DropReason reason = DropReason::none;
      if (!passed && options_.reasons) {
         // Alone in its list, so whatever counter moved moved for it.
         DropCounters after = session_->dropCounters(port.id);
         reason = explainDrop(port.counters, after, list_.bytes(i), list_.direction());
         port.counters = std::move(after);
      }
      if (options_.sink || records == FrameRecords::all || (records == FrameRecords::dropped && !passed)) {
         record(i, passed, reason);
      }
      if (list_.index(i) == sharedFrame_) {
         sharedDropped_ = sharedDropped_ || !passed;
         continue;
      }
      std::optional<PcapWriter> &writer = passed ? passed_ : dropped_;
      if (writer) {
         writer->write(list_.timeNs(i), list_.bytes(i));
      }
   }
   lastHandedOver_ = list_.index(list_.size() - 1);
   list_.clear();
}

void Run::record(size_t frame, bool passed, DropReason reason)
{
   const std::span<const uint8_t> bytes = list_.bytes(frame);
   FrameVerdict verdict;
   verdict.index = list_.index(frame);
   verdict.timeNs = list_.timeNs(frame) - firstTimeNs_;
   verdict.direction = list_.direction();
   verdict.port = listPort_;
   verdict.passed = passed;
   verdict.reason = reason;
   verdict.vlan = frameVlan(bytes);
   std::string description;
   if (!passed && options_.describeDrops) {
      description = describeFrame(bytes);
   }
   if (options_.sink) {
      options_.sink(FrameEvent{verdict, description});
   }
   const FrameRecords records = options_.frameRecords;
   if (records == FrameRecords::all || (records == FrameRecords::dropped && !passed)) {
      if (!description.empty()) {
         verdict.description = static_cast<uint32_t>(result_.descriptions.size());
         result_.descriptions.push_back(std::move(description));
      }
      result_.frames.push_back(verdict);
   }
}

void Run::collectNotifications()
{
   for (auto &note : session_->takeNotifications()) {
      if (note.portID == 0 || note.portID > ports_.size()) {
         continue;
      }
      Notification &shown = result_.ports[note.portID - 1].notifications.emplace_back();
      static_cast<session::PortDbNotification &>(shown) = std::move(note);
      shown.afterFrame = lastHandedOver_;
   }
}

void Run::drainLog()
{
   for (auto &record : session_->takeLog()) {
      std::string text = session::withoutNewline(std::move(record.text));
      if (haveLog_ && result_.log.back().severity == record.severity && result_.log.back().text == text) {
         ++result_.log.back().repeated;
         continue;
      }
      result_.log.push_back({record.severity, std::move(text), 0});
      haveLog_ = true;
   }
}

void Run::handle(const CaptureFrame &frame)
{
   if (options_.vlan && frameVlan(frame.bytes) != *options_.vlan) {
      ++result_.otherVlan;
      return;
   }
   router_->route(frame.bytes, frame.recordedDirection, route_);
   switch (route_.kind) {
   case Route::Kind::delivered: break;
   case Route::Kind::noDirection:
      throw session::InputError(options_.capturePath + ": frame " + std::to_string(frame.index) +
                        " has no recorded direction; give the VM's MAC with --vm-mac");
   case Route::Kind::spoofedSource:
      warnFrame(frame.index, "sent from " + (frame.bytes.size() >= 12 ? macText(frame.bytes.data() + 6) : "?") +
                                " by a VM, but by which is unknown; not replayed");
      ++result_.unassigned;
      return;
   case Route::Kind::unassigned: ++result_.unassigned; return;
   }
   const bool shared = route_.first.size() + route_.onward.size() > 1;
   if (shared) {
      // Its earlier frames are judged first, so outputs keep capture order.
      flush();
      sharedFrame_ = frame.index;
      sharedDropped_ = false;
   }
   for (const Delivery &delivery : route_.first) {
      add(frame, delivery);
   }
   if (!route_.onward.empty()) {
      flush();   // the sender's port judges it before it crosses the bridge
      if (!sharedDropped_) {
         for (const Delivery &delivery : route_.onward) {
            add(frame, delivery);
         }
      }
   }
   if (shared) {
      flush();
      std::optional<PcapWriter> &writer = sharedDropped_ ? dropped_ : passed_;
      if (writer) {
         writer->write(frame.timeNs, frame.bytes);
      }
      sharedFrame_ = 0;
   }
}

void Run::warnUnseenMacs(const FrameRouter &router)
{
   for (size_t port = 0; port < ports_.size(); ++port) {
      for (size_t i = 0; i < ports_[port].portSpec.macs.size(); ++i) {
         if (!router.seen(port, i)) {
            const std::string mac = macText(ports_[port].portSpec.macs[i].data());
            warn(options_.capturePath + ": " + mac +
                 (options_.ports.empty() ? " (--vm-mac)" : " (port " + ports_[port].portSpec.name + ")") +
                 " is in no frame of the capture");
         }
      }
   }
}

void Run::readRestoreState()
{
   if (options_.restoreStatePath.empty()) {
      return;
   }
   try {
      restoreState_ = session::readStoredState(options_.restoreStatePath).blob;
      const std::string ipv6Path = options_.restoreStatePath + "6";
      if (std::error_code error; std::filesystem::exists(std::filesystem::symlink_status(ipv6Path, error))) {
         restoreIpv6State_ = session::readStoredState(ipv6Path).blob;
      }
   } catch (const session::StateFileError &e) {
      throw session::InputError(e.what());
   }
}

void Run::execute()
{
   CaptureReader reader(options_.capturePath);
   openOutputs(reader);
   readRestoreState();
   if (options_.frameRecords == FrameRecords::all) {
      result_.frames.reserve(std::min(reader.fileSize() / kSmallRecordBytes, kMaxReservedRecords));
   }
   loadModule();
   for (Port &port : ports_) {
      startPort(port);
   }
   session_->host().clock().advance(kConfigLead);
   clockBase_ = session_->host().clock().now();
   clockReached_ = clockBase_;

   CaptureFrame frame;
   bool first = true;
   while (reader.next(frame)) {
      ++result_.framesRead;
      frame.timeNs = frameTime(frame);
      if (first) {
         firstTimeNs_ = frame.timeNs;
         latestTimeNs_ = frame.timeNs;
         first = false;
      }
      haveTime_ = true;
      lastTimeNs_ = frame.timeNs;
      latestTimeNs_ = std::max(latestTimeNs_, frame.timeNs);
      handle(frame);
      if (frame.index % kFramesBetweenLooks == 0) {
         drainLog();
         if (options_.progress) {
            options_.progress(frame.index, reader.bytesRead(), reader.fileSize());
         }
      }
   }
   flush();
   if (options_.untilSeconds > 0) {
      // Both terms are bounded (timestamps within +-2^62 ns, --until within
      // kMaxUntilSeconds), so the sum of microseconds fits.
      const auto until = std::chrono::microseconds(static_cast<int64_t>(std::llround(options_.untilSeconds * 1e6)));
      const auto last = std::chrono::microseconds(first ? 0 : (latestTimeNs_ - firstTimeNs_) / 1000);
      advanceTo(clockBase_ + last + until);
   }
   collectNotifications();
   warnUnseenMacs(*router_);
   for (Port &port : ports_) {
      static_cast<session::PortState &>(result_.ports[port.id - 1]) = session_->readState(port.id);
   }
   drainLog();
   if (!options_.saveStatePath.empty()) {
      // Saving only reads the port; it comes after the report's reads so
      // that the report is the same with or without it.
      savedState_ = session::savePortState(session_->host(), ports_.front().filter);
      if (const std::optional<host::FilterId> ipv6 = session_->findIpv6Filter(ports_.front().filter)) {
         savedIpv6State_ = session::savePortState(session_->host(), *ipv6);
      }
   }

   (void)session_->finish();   // its findings went to the violation handler
   // Outputs are renamed into place only once the whole run succeeded.
   if (passed_) {
      passed_->commit();
   }
   if (dropped_) {
      dropped_->commit();
   }
   if (!options_.saveStatePath.empty()) {
      session::writeStateFile(options_.saveStatePath, savedState_);
      if (!savedIpv6State_.empty()) {
         session::writeStateFile(options_.saveStatePath + "6", savedIpv6State_);
      }
   }
}

}  // namespace

ReplayResult runReplay(const ReplayOptions &options)
{
   if (options.batch == 0) {
      throw session::InputError("--batch must be at least 1");
   }
   if (!(options.untilSeconds >= 0 && options.untilSeconds <= kMaxUntilSeconds)) {
      throw session::InputError("--until must be a number of seconds from 0 to 10000000000");
   }
   // A saved state is one port's.
   if ((!options.saveStatePath.empty() || !options.restoreStatePath.empty()) && options.ports.size() > 1) {
      throw session::InputError("--save-state and --restore-state take a replay of one port");
   }
   ReplayResult result;
   Run run(options, result);
   run.execute();
   return result;
}

}  // namespace swsec::replay
