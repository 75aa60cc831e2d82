// The replay run: host, port, configuration, the frame lists on the
// capture's clock, then the port's state read back through the management
// nodes, as an administrator would.
#include "replay_engine.h"

#include "replay_capture.h"
#include "replay_describe.h"
#include "replay_error.h"
#include "replay_frame_batch.h"
#include "replay_output_path.h"
#include "replay_pcap_writer.h"

#include "host/host.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <chrono>
#include <cmath>
#include <cstring>

namespace swsec::replay {

namespace {

using namespace std::chrono_literals;

constexpr const char *kAgent = "sifra-generic-tarlin-swsec";
constexpr const char *kSecurityProperty = "sifra-generic-tarlin-swsec.security";
constexpr const char *kPortset = "vs0";
constexpr uint32_t kPortId = 1;
// The port is configured this long before the first frame, so that a first
// frame is not seen in the same instant as the configuration.
constexpr std::chrono::microseconds kConfigLead = 500ms;
// A list is cut when the next frame is more than this after its first one,
// so that timers fire between frames as capture time passes.
constexpr int64_t kListSpanNs = 1'000'000;
constexpr size_t kPortDbMsgPayload = 40;
// The list arena starts with room for a list of full-size untagged
// Ethernet frames, up to 1 MiB (a list of 65536 frames grows it only if
// its frames need it).
constexpr size_t kTypicalFrameBytes = 1514;
constexpr size_t kMaxInitialArenaBytes = size_t{1} << 20;
// A pcap record of a minimum-size frame (16-byte record header, 60 bytes):
// the file size over it bounds the frame count of ordinary captures, to
// reserve every frame's record at once; past 4 Mi records (96 MiB) the
// vector grows as it needs.
constexpr uint64_t kSmallRecordBytes = 76;
constexpr uint64_t kMaxReservedRecords = uint64_t{1} << 22;
// A span of capture time without frames longer than this is crossed with
// the port timers' idle ticks skipped (see crossIdle).
constexpr std::chrono::microseconds kIdleSpan = 1h;
// Three ticks of the port timer: every tick within this of an expiry is
// fired as it falls due.
constexpr std::chrono::microseconds kTickMargin = 30s;
constexpr const char *kCounterFields[] = {"dhcpSnoopingDropCnt", "daiDropCnt",          "ipSrcGuardDropCnt",
                                          "txRateLimitDropCnt",  "rxRateLimitDropCnt", "txRateLimitErrEntryCnt"};

std::string withoutNewline(std::string text)
{
   while (!text.empty() && text.back() == '\n') {
      text.pop_back();
   }
   return text;
}

class Run {
public:
   Run(const ReplayOptions &options, ReplayResult &result)
      : options_(options), result_(result),
        list_(options.batch, std::min(size_t{options.batch} * kTypicalFrameBytes, kMaxInitialArenaBytes))
   {
      kept_.reserve(options.batch);
   }

   // A run cut short by bad input still takes the port down and unloads
   // the module, as the hypervisor would, before the error is reported.
   ~Run()
   {
      if (!host_.loaded()) {
         return;
      }
      if (portMade_) {
         (void)host_.sifra().destroyFilterAsHypervisor(filter_);
      }
      (void)host_.unload();
   }
   Run(const Run &) = delete;
   Run &operator=(const Run &) = delete;

   void execute();

private:
   void openOutputs(const CaptureReader &reader);
   void startPort();
   void warn(uint64_t frame, const std::string &text);
   int64_t frameTime(const CaptureFrame &frame);
   void crossIdle(std::chrono::microseconds target);
   std::optional<std::chrono::seconds> soonestExpiry();
   uint8_t directionOf(const CaptureFrame &frame) const;
   void add(const CaptureFrame &frame, uint8_t direction);
   void flush();
   void record(size_t frame, bool passed, DropReason reason);
   DropCounters readCounters();
   uint32_t batch() const { return options_.reasons ? 1 : options_.batch; }
   std::chrono::microseconds clockAt(int64_t timeNs) const;
   void advanceTo(std::chrono::microseconds target);
   void collectNotifications();
   void readPortState();

   const ReplayOptions &options_;
   ReplayResult &result_;
   host::Host host_;
   host::FilterId filter_ = 0;
   bool portMade_ = false;
   std::optional<PcapWriter> passed_;
   std::optional<PcapWriter> dropped_;
   FrameBatch list_;
   std::vector<uint8_t> kept_;                   // per frame of the list handed over
   std::chrono::microseconds clockBase_{0};      // host time of the first frame
   std::chrono::microseconds clockReached_{0};   // the host clock is at least here
   int64_t firstTimeNs_ = 0;
   DropCounters counters_;      // as last read, with options.reasons
   int64_t lastTimeNs_ = 0;     // the frame before's time
   int64_t latestTimeNs_ = 0;   // the latest time of any frame
   bool haveTime_ = false;
   uint64_t lastHandedOver_ = 0;
};

void Run::startPort()
{
   host::LoadOptions load;
   load.modulePath = options_.modulePath;
   if (options_.modulePath.empty()) {
      load.linkedModule = options_.linkedModule;
   }
   int loaded = 1;
   try {
      loaded = host_.load(load);
   } catch (const std::runtime_error &e) {
      // An image the user named that cannot be opened is bad input.
      if (!options_.modulePath.empty()) {
         throw ReplayError("--module " + options_.modulePath + ": " + e.what());
      }
      throw;
   }
   if (loaded != 0) {
      throw std::runtime_error("the module failed to load");
   }
   host_.portsets().addPortset(kPortset);
   host_.portsets().addPort(kPortset, kPortId);
   host::FilterConfig filterConfig;
   filterConfig.name = "vm.eth0";
   filterConfig.vmUuid = "replay";
   const orr_Status status = host_.sifra().createFilter(kAgent, kPortId, filterConfig, &filter_);
   if (status != ORR_OK) {
      throw std::runtime_error(std::string("the port could not be made: ") + orr_StatusToString(status));
   }
   portMade_ = true;
   if (options_.config) {
      const size_t logBefore = host_.log().records().size();
      const orr_Status written =
         host_.sifra().writeProperty(kSecurityProperty, filter_, configRecord(*options_.config));
      if (written != ORR_OK) {
         // The module says why in its log; its error lines are the message.
         const auto records = host_.log().records();
         std::string message;
         for (size_t i = logBefore; i < records.size(); ++i) {
            if (records[i].severity >= 2) {
               message += (message.empty() ? "" : "; ") + withoutNewline(records[i].text);
            }
         }
         if (message.empty()) {
            message = orr_StatusToString(written);
         }
         throw ConfigRefused("configuration refused: " + message);
      }
   }
   if (options_.reasons) {
      counters_ = readCounters();
   }
   host_.clock().advance(kConfigLead);
   clockBase_ = host_.clock().now();
   clockReached_ = clockBase_;
}

uint8_t Run::directionOf(const CaptureFrame &frame) const
{
   if (frame.recordedDirection != kDirUnknown) {
      return frame.recordedDirection;
   }
   if (options_.vmMac) {
      if (frame.bytes.size() >= 12 && std::memcmp(frame.bytes.data() + 6, options_.vmMac->data(), 6) == 0) {
         return kDirFromVm;
      }
      return kDirToVm;
   }
   throw ReplayError(options_.capturePath + ": frame " + std::to_string(frame.index) +
                     " has no recorded direction; give the VM's MAC with --vm-mac");
}

void Run::add(const CaptureFrame &frame, uint8_t direction)
{
   if (!list_.empty() && (direction != list_.direction() || frame.timeNs - list_.firstTimeNs() > kListSpanNs ||
                          list_.size() >= batch())) {
      flush();
   }
   list_.add(frame.index, frame.timeNs, direction, frame.bytes);
   lastTimeNs_ = frame.timeNs;
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
      const auto now = host_.clock().now();
      if (target - now > kIdleSpan && options_.skipIdleTime) {
         crossIdle(target);
      } else if (target > now) {
         host_.clock().advance(target - now);
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
   while (host_.clock().now() < target) {
      auto now = host_.clock().now();
      const std::optional<std::chrono::seconds> soonest = soonestExpiry();
      const auto until = soonest ? std::min(target, now + std::chrono::microseconds(*soonest)) : target;
      if (until - kTickMargin > now) {
         host_.clock().skipIdle(until - kTickMargin - now);
      }
      now = host_.clock().now();
      host_.clock().advance(std::min(target, until + kTickMargin) - now);
      if (options_.progress) {
         options_.progress(lastHandedOver_, 0, 0);
      }
   }
}

// The time left to the binding that expires first, as the "vmi" nodes show it.
std::optional<std::chrono::seconds> Run::soonestExpiry()
{
   const std::string port = "/security/" + std::to_string(kPortId) + "/vmi";
   std::vector<int64_t> instances;
   if (host_.nexo().list(port, &instances) != ORR_OK) {
      return std::nullopt;
   }
   std::optional<std::chrono::seconds> soonest;
   for (int64_t instance : instances) {
      host::NexoRecord vmi;
      if (host_.nexo().get(port + "/" + std::to_string(instance), &vmi) != ORR_OK) {
         return std::chrono::seconds(0);   // unknown: tick on
      }
      const auto values = vmi.values();
      const auto found = values.find("timeRemaining");
      if (found == values.end() || found->second == "N/A") {
         continue;   // a static binding does not expire
      }
      uint32_t seconds = 0;
      const std::string &text = found->second;
      if (std::from_chars(text.data(), text.data() + text.size(), seconds).ec != std::errc{}) {
         return std::chrono::seconds(0);
      }
      soonest = std::min(soonest.value_or(std::chrono::seconds(seconds)), std::chrono::seconds(seconds));
   }
   return soonest;
}

void Run::warn(uint64_t frame, const std::string &text)
{
   if (result_.warnings.size() < kMaxWarnings) {
      result_.warnings.push_back(options_.capturePath + ": frame " + std::to_string(frame) + ": " + text);
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
      warn(frame.index, "timestamp out of range; replayed at the time of the frame before");
      return haveTime_ ? lastTimeNs_ : 0;
   }
   if (frame.timeNs < 0) {
      warn(frame.index, "timestamp before 1970 (" + std::to_string(frame.timeNs / 1'000'000'000) + " s)");
   }
   if (haveTime_ && frame.timeNs < lastTimeNs_) {
      std::array<char, 64> text{};
      std::snprintf(text.data(), text.size(), "timestamp %.6f s before the frame before's",
                    static_cast<double>(lastTimeNs_ - frame.timeNs) / 1e9);
      warn(frame.index, text.data());
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
         throw ReplayError((*target)->named + ": cannot write: it is the input capture");
      }
   }
   if (passed && dropped && sameFile(*passed, *dropped)) {
      throw ReplayError(dropped->named + ": cannot write: it is also the --write-passed file");
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
   const host::PacketsResult out = host_.sifra().processPackets(filter_, list_.direction(), list_.views());
   kept_.assign(list_.size(), 0);
   for (size_t index : out.kept) {
      if (index < kept_.size()) {
         kept_[index] = 1;
      }
   }
   std::array<uint64_t, 2> &totals = result_.totals[list_.direction()];
   const FrameRecords records = options_.frameRecords;
   for (size_t i = 0; i < list_.size(); ++i) {
      const bool passed = kept_[i] != 0;
      ++totals[passed ? 0 : 1];
      DropReason reason = DropReason::none;
      if (!passed && options_.reasons) {
         // Alone in its list, so whatever counter moved moved for it.
         DropCounters after = readCounters();
         reason = explainDrop(counters_, after, list_.bytes(i), list_.direction());
         counters_ = std::move(after);
      }
      if (records == FrameRecords::all || (records == FrameRecords::dropped && !passed)) {
         record(i, passed, reason);
      }
      std::optional<PcapWriter> &writer = passed ? passed_ : dropped_;
      if (writer) {
         writer->write(list_.timeNs(i), list_.bytes(i));
      }
   }
   lastHandedOver_ = list_.index(list_.size() - 1);
   list_.clear();
}

DropCounters Run::readCounters()
{
   DropCounters counters;
   host::NexoRecord summary;
   if (host_.nexo().get("/security/" + std::to_string(kPortId) + "/featureSummary", &summary) != ORR_OK) {
      return counters;   // no IP discovery: the port shows no counters
   }
   const auto values = summary.values();
   for (const char *field : kCounterFields) {
      const auto found = values.find(field);
      uint64_t value = 0;
      if (found != values.end() &&
          std::from_chars(found->second.data(), found->second.data() + found->second.size(), value).ec ==
             std::errc{}) {
         counters[field] = value;
      }
   }
   return counters;
}

void Run::record(size_t frame, bool passed, DropReason reason)
{
   const std::span<const uint8_t> bytes = list_.bytes(frame);
   FrameVerdict &verdict = result_.frames.emplace_back();
   verdict.index = list_.index(frame);
   verdict.timeNs = list_.timeNs(frame) - firstTimeNs_;
   verdict.direction = list_.direction();
   verdict.passed = passed;
   verdict.reason = reason;
   verdict.vlan = frameVlan(bytes);
   if (!passed && options_.describeDrops) {
      verdict.description = static_cast<uint32_t>(result_.descriptions.size());
      result_.descriptions.push_back(describeFrame(bytes));
   }
}

void Run::collectNotifications()
{
   const auto posted = host_.portsets().takePosted();
   for (const auto &message : posted) {
      if (message.name.rfind("portdb.entry.", 0) != 0 || message.payload.size() < kPortDbMsgPayload) {
         continue;
      }
      const uint8_t *payload = message.payload.data();
      Notification &note = result_.notifications.emplace_back();
      note.afterFrame = lastHandedOver_;
      note.name = message.name;
      uint16_t vlan = 0;
      std::memcpy(&vlan, payload + 8, sizeof vlan);
      note.vlan = vlan;
      note.mac = macText(payload + 10);
      note.ip = ipText(payload + 20);
      note.authoritative = payload[36] != 0;
   }
}

void Run::readPortState()
{
   const std::string port = "/security/" + std::to_string(kPortId);
   host::NexoRecord summary;
   if (host_.nexo().get(port + "/featureSummary", &summary) == ORR_OK) {
      result_.featureSummary = summary.values();
      result_.featureSummaryText = summary.text();
      for (const char *field : kCounterFields) {
         const auto found = result_.featureSummary->find(field);
         if (found != result_.featureSummary->end() && found->second != "N/A") {
            result_.counters[field] = std::stoull(found->second);
         }
      }
   }
   std::vector<int64_t> instances;
   if (host_.nexo().list(port + "/vmi", &instances) != ORR_OK) {
      return;
   }
   for (int64_t instance : instances) {
      host::NexoRecord vmi;
      if (host_.nexo().get(port + "/vmi/" + std::to_string(instance), &vmi) != ORR_OK) {
         continue;
      }
      const auto values = vmi.values();
      auto field = [&values](const char *name) {
         const auto found = values.find(name);
         return found != values.end() ? found->second : std::string();
      };
      PortDbEntry &entry = result_.portDb.emplace_back();
      entry.vlan = static_cast<uint16_t>(std::stoul(field("vlanId")));
      entry.mac = field("macAddr");
      entry.ip = field("ipAddr");
      entry.method = field("discoveryMethod");
      entry.timeRemaining = field("timeRemaining");
      entry.chaddr = field("chaddr");
      entry.clientIdLen = field("clientIdLen");
      entry.serverIp = field("serverIp");
      entry.leaseTime = field("leaseTime");
   }
}

void Run::execute()
{
   host_.setViolationHandler([this](const std::string &v) { result_.violations.push_back(v); });
   CaptureReader reader(options_.capturePath);
   openOutputs(reader);
   if (options_.frameRecords == FrameRecords::all) {
      result_.frames.reserve(std::min(reader.fileSize() / kSmallRecordBytes, kMaxReservedRecords));
   }
   startPort();

   CaptureFrame frame;
   bool first = true;
   while (reader.next(frame)) {
      frame.timeNs = frameTime(frame);
      if (first) {
         firstTimeNs_ = frame.timeNs;
         latestTimeNs_ = frame.timeNs;
         first = false;
      }
      haveTime_ = true;
      latestTimeNs_ = std::max(latestTimeNs_, frame.timeNs);
      add(frame, directionOf(frame));
      if (options_.progress && frame.index % 4096 == 0) {
         options_.progress(frame.index, reader.bytesRead(), reader.fileSize());
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
   readPortState();
   for (const auto &record : host_.log().records()) {
      result_.log.push_back({record.severity, withoutNewline(record.text)});
   }

   const host::DestroyResult destroyed = host_.sifra().destroyFilterAsHypervisor(filter_);
   portMade_ = false;
   if (destroyed.status != ORR_OK) {
      result_.violations.push_back(std::string("the port could not be destroyed: ") +
                                   orr_StatusToString(destroyed.status));
   }
   const orr_Status unloaded = host_.unload();
   if (unloaded != ORR_OK) {
      result_.violations.push_back(std::string("the module did not unload: ") + orr_StatusToString(unloaded));
   }
   // Outputs are renamed into place only once the whole run succeeded.
   if (passed_) {
      passed_->commit();
   }
   if (dropped_) {
      dropped_->commit();
   }
}

}  // namespace

ReplayResult runReplay(const ReplayOptions &options)
{
   if (options.batch == 0) {
      throw ReplayError("--batch must be at least 1");
   }
   if (!(options.untilSeconds >= 0 && options.untilSeconds <= kMaxUntilSeconds)) {
      throw ReplayError("--until must be a number of seconds from 0 to 10000000000");
   }
   ReplayResult result;
   Run run(options, result);
   run.execute();
   return result;
}

}  // namespace swsec::replay
