// The user-space Orrin host: the one implementation of platform/, and the
// facade that tests and tools drive.
//
// One Host exists at a time in a process (the platform's C functions reach
// it as the current host). It loads a module image, runs it strictly and,
// by default, on a virtual clock, and reports everything the module did.
// Misuse that a real kernel would survive only by luck (a lock taken out of
// rank order, a spinlock held across a sleep, unlocking a lock not held)
// aborts the process with a message naming what was wrong; problems found
// at a boundary (live heap blocks or host objects left at unload, a failed
// load that leaves registrations behind) are reported as violations.
#pragma once

#include "platform/platform.h"

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace swsec::host {

// ---------------------------------------------------------------- log

struct LogRecord {
   uint32_t severity = 0;      // 1 information, 2 error
   bool viaNoLevel = false;    // written with orr_LogNoLevel (no component)
   bool hasComponent = false;  // orr_LogLevel with a registered handle
   std::string component;      // the component's name, empty without one
   std::string text;           // the formatted text, final newline included
};

class Log {
public:
   virtual ~Log() = default;
   virtual std::vector<LogRecord> records() const = 0;
   virtual void clear() = 0;
   // The records written since the last take (or clear), taken out: what a
   // long-running caller uses so that the log does not grow without bound.
   virtual std::vector<LogRecord> take() = 0;
   // Records whose text contains `needle`.
   virtual size_t count(std::string_view needle) const = 0;
   bool contains(std::string_view needle) const { return count(needle) != 0; }
   // Echo every record to stderr as it is written (tools' -v, debugging).
   virtual void setEcho(bool echo) = 0;
};

// ---------------------------------------------------------------- faults

// Any host operation that can fail can be told to fail. Operations are named
// by their platform function name ("orr_HeapCreate"); an allocation that is
// told to fail ("orr_HeapAllocWithRA") returns null whatever the status.
class Faults {
public:
   virtual ~Faults() = default;
   // The `nth` call from now (1 = the next one) fails with `status`, once.
   virtual void failOnce(std::string_view op, orr_Status status, uint64_t nth = 1) = 0;
   // Every call from the `nth` from now on fails with `status`.
   virtual void failFrom(std::string_view op, orr_Status status, uint64_t nth = 1) = 0;
   virtual void clear() = 0;
   // Calls of `op` since the host was made (failed ones included).
   virtual uint64_t calls(std::string_view op) const = 0;
};

// ---------------------------------------------------------------- heap

struct HeapSite {
   std::string site;      // symbolised calling site ("function+0x1c"), or an address
   uint64_t liveBytes = 0;
   uint64_t liveBlocks = 0;
   uint64_t allocations = 0;
};

class Heap {
public:
   virtual ~Heap() = default;
   // Totals over every heap the module made.
   virtual uint64_t liveBytes() const = 0;
   virtual uint64_t liveBlocks() const = 0;
   virtual uint64_t peakBytes() const = 0;
   virtual std::vector<HeapSite> sites() const = 0;
   // Properties of the module heap as it was created (name, sizes).
   virtual std::optional<orr_HeapProps> moduleHeapProps() const = 0;
};

// ---------------------------------------------------------------- time

class Clock {
public:
   virtual ~Clock() = default;
   // Virtual time only: moves the clock on, firing due timers in order of
   // their due time on the calling thread.
   virtual void advance(std::chrono::microseconds by) = 0;
   // Virtual time only: moves the clock on as advance() does, except that
   // the ticks of periodic timers due in the span are not fired: each keeps
   // its phase and is next due at its first tick after the new time. For a
   // caller that knows those ticks would change nothing (idle time in a
   // replay), so that a long span costs no more than a short one.
   virtual void skipIdle(std::chrono::microseconds by) = 0;
   // Fires the timers that are due now (a timer with timeout 0 is due at once).
   virtual void runDue() = 0;
   // Time since the host was made.
   virtual std::chrono::microseconds now() const = 0;
   // Switches to the real clock, with timers fired by a host thread.
   virtual void useRealTime() = 0;
   virtual bool isVirtual() const = 0;
   // Pending timers (one-shot or periodic) on all queues.
   virtual size_t pendingTimers() const = 0;
   // Calls of orr_WorldSleep so far.
   virtual uint64_t sleeps() const = 0;
};

// ---------------------------------------------------------------- locks

struct LockInfo {
   std::string name;
   uint32_t type = 0;
   uint32_t rank = 0;
   uint64_t acquisitions = 0;
};

class Locks {
public:
   virtual ~Locks() = default;
   // Live spinlocks in creation order.
   virtual std::vector<LockInfo> live() const = 0;
   virtual std::vector<std::string> domains() const = 0;
};

// ---------------------------------------------------------------- Plex

class Plex {
public:
   virtual ~Plex() = default;
   virtual std::vector<std::string> clientPorts() const = 0;
   // Writes bytes to a registered client-port property, as the management
   // plane would; ORR_NOT_FOUND when no handler is registered by that name.
   virtual orr_Status write(std::string_view clientPort, std::string_view bytes) = 0;
};

// ---------------------------------------------------------------- Sifra

struct FastPathInfo {
   std::string name;
   uint32_t revision = 0;
   uint32_t compatRevision = 0;
   orr_ModuleID module = ORR_INVALID_MODULE_ID;
   const orr_SifraFastPathOps *ops = nullptr;
   orr_SifraAgentHandle agent = nullptr;
};

// ---------------------------------------------------------------- frames

// A frame the host builds for a test. Bytes are laid out in scatter-gather
// elements of the lengths in `split` (zero-length elements allowed); bytes
// left over after them form one last element; an empty `split` is one
// element. Each element is its own exact-size allocation, so an overread
// is caught by AddressSanitizer. Split lengths beyond the frame throw
// std::invalid_argument.
struct FrameSpec {
   std::vector<uint8_t> bytes;
   // VLAN ID metadata (orr_PktVlanIDGet).
   uint16_t vlanId = 0;
   // Present it as a virtual switch does: an outer tag in the bytes (any
   // TPID) is removed and its VLAN ID becomes the metadata, and a runt is
   // padded to 60 bytes (split applies to the result).
   bool untag = false;
   std::vector<uint32_t> split;
   // The mapped length. Default: the first element's length, raised to the
   // filter's minimum mapped length, capped at the frame length. The mapped
   // bytes are their own exact-size contiguous buffer.
   std::optional<uint32_t> mappedLen;
};

// A frame handed over by reference, for callers that build many lists
// (the replay tool, the benchmark): one scatter-gather element, the default
// mapped length. The host copies the bytes during makeList; the caller's
// buffer may change afterwards.
struct FrameView {
   std::span<const uint8_t> bytes;
   uint16_t vlanId = 0;
   bool untag = false;   // as FrameSpec::untag
};

// Frames the host made and handed out as one list (orr_PktList). Destroying
// it returns the list to the host: every frame still in it is freed; a
// frame with header mappings outstanding, or taken out of the list and
// never released, is a violation.
class FrameList {
public:
   virtual ~FrameList() = default;
   virtual orr_PktList *list() = 0;
   // The `index`th input frame, or null once it has been released.
   virtual orr_Pkt *frame(size_t index) = 0;
   // Indices of the input frames still in the list, in list order.
   virtual std::vector<size_t> kept() const = 0;
   // Frames released with orr_PktRelease.
   virtual size_t released() const = 0;
};

class Frames {
public:
   virtual ~Frames() = default;
   // Builds the frames as a list; `minMappedLen` raises the default mapped
   // length as a filter's minimum would.
   virtual std::unique_ptr<FrameList> makeList(const std::vector<FrameSpec> &frames, uint32_t minMappedLen = 0) = 0;
   virtual std::unique_ptr<FrameList> makeList(std::span<const FrameView> frames, uint32_t minMappedLen = 0) = 0;
   // Header mappings (orr_PktHeaderDataGet) not yet given back, over all frames.
   virtual uint64_t outstandingMappings() const = 0;
   // Frames released with orr_PktRelease since the host was made.
   virtual uint64_t releases() const = 0;
};

// ---------------------------------------------------------------- Sifra filters

using FilterId = uint64_t;

// A filter's configuration as the module reads it through orr_SifraGet*.
struct FilterConfig {
   std::string name = "filter";
   uint32_t failurePolicy = 0;
   uint32_t endPointType = 0;               // 0: a VM's vNIC
   std::optional<std::string> vmUuid;       // none: ORR_NO_VM_UUID
   int32_t vnicIndex = 0;
};

struct FilterInfo {
   FilterId id = 0;
   std::string agent;                       // the fast path's name
   uint32_t portID = 0;
   FilterConfig config;
   orr_SifraFilterHandle handle = nullptr;  // the host's handle, given to the module
   orr_SifraFilter record = nullptr;        // the module's record, from createFilter
   // orr_SifraSetMinPktMappedLen: length and directions (bit mask of ORR_SIFRA_DIR_*).
   uint32_t minMappedLen = 0;
   uint32_t minMappedDirections = 0;
   // The slow path the host paired the filter with (a set request whose
   // reply said success), until a clear request succeeds.
   std::optional<uint32_t> slowPathID;
};

struct DestroyResult {
   orr_Status status = ORR_OK;   // the last call's status
   uint32_t attempts = 0;        // calls made
};

struct IoctlReply {
   FilterId filter = 0;
   uint32_t requestId = 0;
   std::vector<uint8_t> bytes;
};

struct PacketsResult {
   orr_Status status = ORR_OK;
   std::vector<size_t> kept;     // indices of the input frames still in the list, in order
   size_t released = 0;          // frames the module released
};

// ---------------------------------------------------------------- Sifra slow paths

// The requests a module makes about a filter's slow path. An accepted
// asynchronous request (Set) owes the module exactly one reply; Clear is
// answered by the call itself.
enum class SlowPathRequestKind { Set, Clear };

struct SlowPathInfo {
   uint32_t id = 0;
   std::string agent;                      // the fast path's name
   orr_SifraSlowPath record = nullptr;     // the module's record, from registerSlowPath
   bool withdrawing = false;               // unregistration answered ORR_BUSY so far
   uint32_t unregisterCalls = 0;
};

// A request as the host saw it.
struct SlowPathRequest {
   SlowPathRequestKind kind = SlowPathRequestKind::Set;
   FilterId filter = 0;
   uint32_t slowPathID = 0;      // Set: the slow path asked for
   int32_t timeoutMs = 0;        // Set: the communication timeout given
   orr_Status result = ORR_OK;   // the call's status (Set: ORR_OK = accepted)
};

// A reply the host owes the module.
struct PendingReply {
   SlowPathRequestKind kind = SlowPathRequestKind::Set;
   FilterId filter = 0;
   uint32_t slowPathID = 0;
   orr_Status status = ORR_OK;   // the outcome it will carry
};

// Slow paths as the hypervisor drives them. What a request does is
// scripted: a request refused at once, or a clear's failure, is a fault
// ("orr_SifraSetSlowPath", "orr_SifraClearSlowPath"); an accepted request's
// reply status comes from scriptReplies, else the default (ORR_OK). Replies
// wait until the test delivers them (or auto-delivery is on). The host
// checks the contract: a request made with a module spinlock held, a
// second reply owed for one filter, a reply lost with its filter, or a
// reply delivered from a context holding a lock are violations.
class SlowPaths {
public:
   virtual ~SlowPaths() = default;
   // registerSlowPath of the fast path `agent` with `id`: the module's
   // status. Throws std::invalid_argument for an unknown fast path or an ID
   // already registered.
   virtual orr_Status registerSlowPath(std::string_view agent, uint32_t id) = 0;
   // One unregisterSlowPath call: ORR_BUSY leaves the slow path
   // withdrawing (retryWithdrawals calls again); any other status forgets it.
   virtual orr_Status unregisterSlowPath(uint32_t id) = 0;
   // Calls unregisterSlowPath again for every withdrawing slow path, oldest
   // first, as the hypervisor keeps doing; returns how many still are.
   virtual size_t retryWithdrawals() = 0;
   // Registered slow paths (withdrawing ones included), oldest first.
   virtual std::vector<SlowPathInfo> registered() const = 0;

   // The next accepted requests of `kind` reply with these statuses in order.
   virtual void scriptReplies(SlowPathRequestKind kind, std::vector<orr_Status> statuses) = 0;
   // The reply status once the script is used up.
   virtual void setDefaultReply(SlowPathRequestKind kind, orr_Status status) = 0;
   // Called on the requesting thread after each request's outcome is
   // decided, before it returns to the module (whose locks are released
   // then): a test may call into the module from here.
   virtual void onRequest(std::function<void(const SlowPathRequest &)> hook) = 0;

   // Replies owed, oldest first.
   virtual std::vector<PendingReply> pendingReplies() const = 0;
   // Delivers the replies owed when called (to one filter, or all), oldest
   // first, on the calling thread, which must hold no lock; replies owed
   // for requests the module makes meanwhile wait for the next call.
   // Returns how many were delivered.
   virtual size_t deliverReplies(std::optional<FilterId> filter = std::nullopt) = 0;
   // With auto-delivery, the replies owed are delivered after every facade
   // call into the module, as a hypervisor completes requests on its own.
   virtual void setAutoDeliver(bool on) = 0;
   // Every request so far, in order.
   virtual std::vector<SlowPathRequest> requests() const = 0;
   virtual void clearRequests() = 0;
};

class Sifra {
public:
   virtual ~Sifra() = default;
   // Registered fast paths, in registration order.
   virtual std::vector<FastPathInfo> fastPaths() const = 0;
   virtual std::optional<FastPathInfo> fastPath(std::string_view name) const = 0;
   // Registered per-filter property names, in registration order.
   virtual std::vector<std::string> properties() const = 0;

   // ---- filters, as the hypervisor drives them

   // Creates a filter of the fast path registered as `agent` on the port
   // `portID` (which must exist in a portset): calls the module's
   // createFilter(agent handle, host handle, &record, 0) and keeps the
   // record it returns. On success `*id` names the filter; on failure the
   // module's status is returned and no filter exists. ORR_NOT_FOUND: no
   // such fast path or port.
   virtual orr_Status createFilter(std::string_view agent, uint32_t portID, const FilterConfig &config,
                                   FilterId *id) = 0;
   // One destroyFilter call; ORR_OK forgets the filter, any other status
   // keeps it (the hypervisor would call again).
   virtual orr_Status destroyFilter(FilterId id) = 0;
   // Destroys as the hypervisor does: calls again while the module answers
   // ORR_BUSY, advancing virtual time by 1 ms and delivering the filter's
   // owed slow path replies between calls, at most `maxAttempts` calls.
   virtual DestroyResult destroyFilterAsHypervisor(FilterId id, uint32_t maxAttempts = 100) = 0;
   // Replaces the filter's configuration, then calls configurationChanged.
   virtual orr_Status changeConfiguration(FilterId id, const FilterConfig &config) = 0;
   virtual std::optional<FilterInfo> filter(FilterId id) const = 0;
   // Live filters, in creation order.
   virtual std::vector<FilterInfo> filters() const = 0;

   // Sends a filter ioctl: the payload is copied into an exact-size buffer
   // and handed to processFilterIoctl; returns the module's status.
   virtual orr_Status sendIoctl(FilterId id, uint32_t requestId, const std::vector<uint8_t> &payload) = 0;
   // Every orr_SifraSendFilterIoctlReply accepted so far, in order.
   virtual std::vector<IoctlReply> ioctlReplies() const = 0;
   virtual void clearIoctlReplies() = 0;

   // Hands the frames, as one list, to the filter's processPackets in
   // `direction` (ORR_SIFRA_DIR_RX or ORR_SIFRA_DIR_TX); the filter's
   // minimum mapped length for that direction applies. Thread-safe: several
   // threads may hand lists to the same filter at once.
   virtual PacketsResult processPackets(FilterId id, uint32_t direction, const std::vector<FrameSpec> &frames) = 0;
   virtual PacketsResult processPackets(FilterId id, uint32_t direction, std::span<const FrameView> frames) = 0;
   // Hands the frames, as one list, to every filter of port `portID` in
   // creation order, as the port's filter chain does: a frame one filter
   // drops is not seen by the next. The list is mapped to the largest
   // minimum of those filters for `direction`. The first failing status is
   // returned; no filter on the port passes everything.
   virtual PacketsResult processPort(uint32_t portID, uint32_t direction, const std::vector<FrameSpec> &frames) = 0;

   // ---- per-filter properties, as the management plane uses them

   // Writes a registered property of a filter (no filter: the operation gets
   // a null record). The bytes are handed over in an exact-size buffer.
   // ORR_NOT_FOUND when no property of that name is registered.
   virtual orr_Status writeProperty(std::string_view property, std::optional<FilterId> filter,
                                    const std::vector<uint8_t> &bytes) = 0;
   // Reads into `buffer`, whose size is the length offered to the module.
   virtual orr_Status readProperty(std::string_view property, std::optional<FilterId> filter,
                                   std::vector<uint8_t> &buffer) = 0;
   // The length a read needs, or nothing when the module has no value.
   virtual std::optional<uint32_t> pollProperty(std::string_view property, std::optional<FilterId> filter) = 0;

   // ---- slow paths
   virtual SlowPaths &slowPaths() = 0;
};

// ---------------------------------------------------------------- migration

// The scripted outcome of one slow path state request (retrieve or
// restore) that the module makes. Refused: the request returns `refusal`
// and no reply ever comes. Accepted: the request returns ORR_OK and one
// reply is queued, carrying `replyStatus` (and, for a retrieve, `state`),
// delivered when the test asks.
struct SlowPathStateOutcome {
   std::optional<orr_Status> refusal;
   orr_Status replyStatus = ORR_OK;
   std::vector<uint8_t> state;              // retrieve replies only
};

// A slow path state request as the module made it.
struct SlowPathStateRequest {
   enum class Kind : uint8_t { retrieve, restore };
   Kind kind = Kind::retrieve;
   FilterId filter = 0;
   void *cookie = nullptr;
   uint32_t timeoutMs = 0;
   std::vector<uint8_t> state;              // restore requests: the bytes handed over
   bool accepted = false;
   bool replied = false;
};

// Save and restore of filters' state as the hypervisor drives a migration.
// Every buffer handed to the module is an exact-size allocation between
// guard bytes: a write outside it is a violation, a read outside it is
// caught by AddressSanitizer.
class Migration {
public:
   virtual ~Migration() = default;

   // ---- the module's fast path operations, one call each
   virtual void prefetch(FilterId id) = 0;
   // getSavedStateLen; a null `length` cancels the save.
   virtual orr_Status length(FilterId id, uint64_t *length) = 0;
   // saveState into a buffer of `bufferSize` bytes; on ORR_OK `blob` holds
   // the bytes the module said it wrote. A null `blob` passes a null
   // buffer (a cancel).
   virtual orr_Status save(FilterId id, uint64_t bufferSize, std::vector<uint8_t> *blob) = 0;
   // restoreState with a copy of `blob`, kept alive until the restore's
   // slow path reply has been delivered (or no request was accepted).
   virtual orr_Status restore(FilterId id, std::span<const uint8_t> blob) = 0;

   // ---- the source side whole: prefetch, the length asked again while
   // it answers ORR_NOT_READY (delivering the replies due meanwhile, at
   // most `maxPolls` times), then the save in a buffer of that length.
   virtual orr_Status saveAsHypervisor(FilterId id, std::vector<uint8_t> *blob, uint32_t maxPolls = 100) = 0;

   // ---- the slow path state requests: outcomes scripted per call, in
   // order; a request with no outcome scripted is accepted and replied to
   // with success (and, for a retrieve, no bytes).
   virtual void scriptRetrieve(SlowPathStateOutcome outcome) = 0;
   virtual void scriptRestore(SlowPathStateOutcome outcome) = 0;
   virtual std::vector<SlowPathStateRequest> requests() const = 0;
   // Replies queued and not yet delivered.
   virtual size_t pendingReplies() const = 0;
   // Delivers up to `count` queued replies in order, from a context that
   // holds no module lock; returns how many.
   virtual size_t deliverReplies(size_t count = SIZE_MAX) = 0;
};

// ---------------------------------------------------------------- portsets

struct MessageListenerInfo {
   orr_PortsetMessageCBHandle handle = 0;
   const orr_Portset *portset = nullptr;   // null: any portset
   uint32_t portID = 0;                    // 0: any port
   uint64_t msgClass = 0;
   orr_PortsetMessageCB callback = nullptr;
   void *priv = nullptr;
};

// A message as it was posted: class, name and payload copied at the post.
struct PostedMessage {
   std::string portset;          // the portset's name
   uint32_t portID = 0;
   uint64_t msgClass = 0;
   std::string name;
   std::vector<uint8_t> payload;
};

class Portsets {
public:
   virtual ~Portsets() = default;
   // Registered message listeners, in registration order.
   virtual std::vector<MessageListenerInfo> listeners() const = 0;

   // Adds a portset (virtual switch); throws std::invalid_argument when the
   // name is taken.
   virtual orr_Portset *addPortset(std::string_view name) = 0;
   // Adds a port to a portset; throws std::invalid_argument for an unknown
   // portset, a port ID of 0 or one already in use.
   virtual void addPort(std::string_view portset, uint32_t portID) = 0;
   virtual orr_Portset *portset(std::string_view name) const = 0;
   // orr_PortsetAcquireByPortID holds not yet released.
   virtual uint64_t outstandingAcquisitions() const = 0;

   // Every message posted, in order (delivered or not).
   virtual std::vector<PostedMessage> posted() const = 0;
   virtual void clearPosted() = 0;
   // The messages posted since the last call (or clearPosted), taken out:
   // what a caller that follows posts as they come uses.
   virtual std::vector<PostedMessage> takePosted() = 0;
   // Messages posted and not yet delivered (the posting threads still hold locks).
   virtual size_t pendingDeliveries() const = 0;
   // The next post on a thread holding a portset shared turns the hold
   // exclusive, as a post on a real switch may.
   virtual void upgradeHoldOnNextPost() = 0;
};

// ---------------------------------------------------------------- Nexo

// A field of an output record, rendered: its value as text (u8 as "%u",
// char[N] up to its terminator, an enumeration by its element's label).
struct NexoField {
   std::string name;
   std::string label;       // as the module gives it, padding included
   std::string value;
};

struct NexoRecord {
   std::string name;
   std::string label;
   std::vector<NexoField> fields;

   // The record's label on the first line, then "<label>: <value>" a line.
   std::string text() const;
   // Field name -> value, for machines (JSON).
   std::map<std::string, std::string, std::less<>> values() const;
   // The value of a field by name; throws std::out_of_range when there is none.
   const std::string &value(std::string_view field) const;
};

// The node tree that loaded modules declare. Paths are node names from the
// module's root, with an instance key (a number) after each list node:
// "/security", "/security/7/vmi", "/security/7/vmi/0". A path that names no
// node, or an operation the node does not offer, throws
// std::invalid_argument; otherwise each call returns the handler's status.
class Nexo {
public:
   virtual ~Nexo() = default;
   // True while a loaded module's branch is installed.
   virtual bool installed() const = 0;
   // Paths of the installed nodes, list nodes shown with "<key>" ("/security/<key>/vmi").
   virtual std::vector<std::string> paths() const = 0;
   // The instance keys of a list node.
   virtual orr_Status list(std::string_view path, std::vector<int64_t> *instances) = 0;
   // Gets a node into its output record (zero-filled on a failure status).
   virtual orr_Status get(std::string_view path, NexoRecord *record) = 0;
   // Sets a node with text arguments. A count outside the node's rule is
   // refused with ORR_BAD_PARAM without calling the handler.
   virtual orr_Status set(std::string_view path, const std::vector<std::string> &args) = 0;
};

// ---------------------------------------------------------------- loader

struct LoadOptions {
   // The module image; empty: the module built with this host
   // (SWSEC_MODULE_PATH, or the environment variable of the same name).
   std::string modulePath;
   // The module's name as the loader reports it.
   std::string moduleName = "swsec";
   // Module parameters set at load, by name.
   std::map<std::string, int, std::less<>> parameters;
   // A module linked into the calling program instead of an image to open
   // (white-box tests that also call the module's internal functions).
   // Its globals are not renewed between loads: only its own teardown
   // resets them.
   const orr_ModuleInfo *linkedModule = nullptr;
};

struct ModuleParamInfo {
   std::string name;
   std::string description;
   int value = 0;
};

struct ModuleExportInfo {
   std::string nameSpace;
   std::string name;
};

struct ModuleDescription {
   std::string name;
   std::string version;
   std::vector<std::string> requiredNamespaces;
   std::string providedNamespace;
   std::vector<ModuleParamInfo> parameters;
   std::vector<ModuleExportInfo> exports;
};

// Called for each violation; the default prints it and aborts.
using ViolationHandler = std::function<void(const std::string &)>;

class Host {
public:
   Host();
   ~Host();
   Host(const Host &) = delete;
   Host &operator=(const Host &) = delete;

   static Host &current();

   // Opens the image, sets its parameters, calls init_module and returns its
   // result (0 ready, 1 failed). A failed load is unloaded at once and must
   // leave nothing behind. Throws std::runtime_error when the image cannot be
   // opened or has no module information.
   int load(const LoadOptions &options = {});
   // ORR_BUSY while the use count is held; else calls cleanup_module,
   // returns its status, checks for leaks and closes the image.
   orr_Status unload();
   bool loaded() const;
   const ModuleDescription &module() const;
   uint32_t useCount() const;
   // An exported function of the loaded module, found by namespace and name.
   orr_ExportedFn resolveExport(std::string_view nameSpace, std::string_view name) const;

   void setViolationHandler(ViolationHandler handler);
   std::vector<std::string> violations() const;

   Log &log();
   Faults &faults();
   Heap &heap();
   Clock &clock();
   Locks &locks();
   Plex &plex();
   Sifra &sifra();
   Portsets &portsets();
   Frames &frames();
   Nexo &nexo();
   Migration &migration();

   struct State;
   State &state();

private:
   std::unique_ptr<State> state_;
};

}  // namespace swsec::host
