#include "host/log.h"

#include "host/state.h"

#include <algorithm>
#include <cstdio>
#include <cstring>

// The record behind an orr_LogHandle.
struct orr_LogOpaque {};

namespace swsec::host {

struct LogBook::Component : orr_LogOpaque {
   uint64_t seq = 0;
   std::string name;
   orr_ModuleID module = ORR_INVALID_MODULE_ID;
   orr_HeapID heap = nullptr;
   int32_t level = 0;
};

namespace {

__attribute__((format(printf, 1, 0))) std::string formatted(const char *format, va_list args)
{
   if (format == nullptr) {
      return {};
   }
   va_list measure;
   va_copy(measure, args);
   int length = std::vsnprintf(nullptr, 0, format, measure);
   va_end(measure);
   if (length <= 0) {
      return {};
   }
   std::string text(static_cast<size_t>(length) + 1, '\0');
   std::vsnprintf(text.data(), text.size(), format, args);
   text.resize(static_cast<size_t>(length));
   return text;
}

}  // namespace

LogBook::LogBook(Violations &violations, FaultTable &faults, HeapRegistry &heaps)
   : violations_(violations), faults_(faults), heaps_(heaps)
{
}

LogBook::~LogBook() = default;

LogBook::Component *LogBook::find(orr_LogHandle log) const
{
   auto found = components_.find(log);
   return found == components_.end() ? nullptr : found->second.get();
}

orr_Status LogBook::registerComponent(const orr_LogProps *props, orr_LogHandle *log)
{
   if (auto status = faults_.hit(faultPoint("orr_LogRegister"))) {
      return *status;
   }
   if (props == nullptr || log == nullptr || props->extra != nullptr) {
      return ORR_BAD_PARAM;
   }
   auto component = std::make_unique<Component>();
   component->name.assign(props->name.name, strnlen(props->name.name, sizeof props->name.name));
   component->module = props->module;
   component->heap = props->heap;
   component->level = props->level;
   std::lock_guard guard(mutex_);
   // Components are found by name (to change their level), so a second
   // component of the same name is refused.
   for (const auto &[key, other] : components_) {
      if (other->name == component->name) {
         return ORR_EXISTS;
      }
   }
   if (!heaps_.attach(props->heap, component.get(), "log '" + component->name + "'")) {
      return ORR_INVALID_HANDLE;
   }
   component->seq = nextSeq_++;
   *log = component.get();
   components_.emplace(static_cast<const orr_LogOpaque *>(component.get()), std::move(component));
   return ORR_OK;
}

void LogBook::unregisterComponent(orr_LogHandle log)
{
   std::string problem;
   {
      std::lock_guard guard(mutex_);
      Component *component = find(log);
      if (component != nullptr) {
         heaps_.detach(component->heap, component);
         components_.erase(log);
         return;
      }
      problem = "orr_LogUnregister: unknown log handle " + pointerText(log);
   }
   violations_.report(std::move(problem));
}

int32_t LogBook::currentLevel(orr_LogHandle log)
{
   std::string problem;
   {
      std::lock_guard guard(mutex_);
      if (Component *component = find(log)) {
         return component->level;
      }
      problem = "orr_LogGetCurrentLogLevel: unknown log handle " + pointerText(log);
   }
   violations_.report(std::move(problem));
   return 0;
}

const char *LogBook::name(orr_LogHandle log)
{
   std::string problem;
   {
      std::lock_guard guard(mutex_);
      if (Component *component = find(log)) {
         // Stays valid while the component is registered, as in the kernel.
         return component->name.c_str();
      }
      problem = "orr_LogGetName: unknown log handle " + pointerText(log);
   }
   violations_.report(std::move(problem));
   return "";
}

bool LogBook::checkSeverity(const char *op, uint32_t severity)
{
   if (severity == ORR_LOG_INFO || severity == ORR_LOG_ERROR) {
      return true;
   }
   violations_.report(std::string(op) + ": severity " + std::to_string(severity) + " is neither 1 nor 2");
   return false;
}

void LogBook::keep(LogRecord record)
{
   std::lock_guard guard(mutex_);
   if (echo_) {
      const char *newline = record.text.ends_with('\n') ? "" : "\n";
      std::fprintf(stderr, "[%s%s%u] %s%s", record.component.c_str(), record.component.empty() ? "" : " ",
                   record.severity, record.text.c_str(), newline);
   }
   records_.push_back(std::move(record));
}

void LogBook::write(uint32_t severity, orr_LogHandle log, int32_t level, const char *format, va_list args)
{
   if (!checkSeverity("orr_LogLevel", severity)) {
      return;
   }
   LogRecord record;
   record.severity = severity;
   if (log != nullptr) {
      std::string problem;
      {
         std::lock_guard guard(mutex_);
         Component *component = find(log);
         if (component == nullptr) {
            problem = "orr_LogLevel: unknown log handle " + pointerText(log);
         } else if (level > component->level) {
            return;
         } else {
            record.hasComponent = true;
            record.component = component->name;
         }
      }
      if (!problem.empty()) {
         violations_.report(std::move(problem));
         return;
      }
   }
   // Without a component a real kernel drops the message. It is kept here,
   // marked as having no component, so that a test can see that it went
   // nowhere a user would look.
   record.text = formatted(format, args);
   keep(std::move(record));
}

void LogBook::writeNoLevel(uint32_t severity, const char *format, va_list args)
{
   if (!checkSeverity("orr_LogNoLevel", severity)) {
      return;
   }
   LogRecord record;
   record.severity = severity;
   record.viaNoLevel = true;
   record.text = formatted(format, args);
   keep(std::move(record));
}

std::vector<std::string> LogBook::purge(std::string_view when)
{
   std::vector<std::string> problems;
   std::lock_guard guard(mutex_);
   std::vector<const Component *> live;
   for (const auto &[key, component] : components_) {
      live.push_back(component.get());
   }
   std::sort(live.begin(), live.end(), [](const Component *a, const Component *b) { return a->seq < b->seq; });
   for (const Component *component : live) {
      problems.push_back(std::string(when) + ": log '" + component->name + "' was not unregistered");
      heaps_.detach(component->heap, component);
   }
   components_.clear();
   return problems;
}

std::vector<LogRecord> LogBook::records() const
{
   std::lock_guard guard(mutex_);
   return records_;
}

void LogBook::clear()
{
   std::lock_guard guard(mutex_);
   records_.clear();
}

std::vector<LogRecord> LogBook::take()
{
   std::vector<LogRecord> taken;
   std::lock_guard guard(mutex_);
   taken.swap(records_);
   return taken;
}

size_t LogBook::count(std::string_view needle) const
{
   std::lock_guard guard(mutex_);
   return static_cast<size_t>(std::count_if(records_.begin(), records_.end(), [&](const LogRecord &record) {
      return record.text.find(needle) != std::string::npos;
   }));
}

void LogBook::setEcho(bool echo)
{
   std::lock_guard guard(mutex_);
   echo_ = echo;
}

}  // namespace swsec::host

using swsec::host::detail::requireState;

ORR_API orr_Status orr_LogRegister(const orr_LogProps *props, orr_LogHandle *log)
{
   return requireState("orr_LogRegister").logs.registerComponent(props, log);
}

ORR_API void orr_LogUnregister(orr_LogHandle log)
{
   requireState("orr_LogUnregister").logs.unregisterComponent(log);
}

ORR_API int32_t orr_LogGetCurrentLogLevel(orr_LogHandle log)
{
   return requireState("orr_LogGetCurrentLogLevel").logs.currentLevel(log);
}

ORR_API const char *orr_LogGetName(orr_LogHandle log)
{
   return requireState("orr_LogGetName").logs.name(log);
}

ORR_API void orr_LogLevel(uint32_t severity, orr_LogHandle log, int32_t level, const char *format, ...)
{
   auto &logs = requireState("orr_LogLevel").logs;
   va_list args;
   va_start(args, format);
   logs.write(severity, log, level, format, args);
   va_end(args);
}

ORR_API void orr_LogNoLevel(uint32_t severity, const char *format, ...)
{
   auto &logs = requireState("orr_LogNoLevel").logs;
   va_list args;
   va_start(args, format);
   logs.writeNoLevel(severity, format, args);
   va_end(args);
}
