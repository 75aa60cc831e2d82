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
   // Fires the timers that are due now (a timer with timeout 0 is due at once).
   virtual void runDue() = 0;
   // Time since the host was made.
   virtual std::chrono::microseconds now() const = 0;
   // Switches to the real clock, with timers fired by a host thread.
   virtual void useRealTime() = 0;
   virtual bool isVirtual() const = 0;
   // Pending timers (one-shot or periodic) on all queues.
   virtual size_t pendingTimers() const = 0;
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

class Sifra {
public:
   virtual ~Sifra() = default;
   // Registered fast paths, in registration order.
   virtual std::vector<FastPathInfo> fastPaths() const = 0;
   virtual std::optional<FastPathInfo> fastPath(std::string_view name) const = 0;
   // Registered per-filter property names, in registration order.
   virtual std::vector<std::string> properties() const = 0;
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

   struct State;
   State &state();

private:
   std::unique_ptr<State> state_;
};

}  // namespace swsec::host
