// Log components and the captured log records.
#pragma once

#include "host/faults.h"
#include "host/heap.h"
#include "host/host.h"
#include "host/violations.h"

#include <cstdarg>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace swsec::host {

class LogBook final : public Log {
public:
   LogBook(Violations &violations, FaultTable &faults, HeapRegistry &heaps);
   ~LogBook() override;

   // Platform operations.
   orr_Status registerComponent(const orr_LogProps *props, orr_LogHandle *log);
   void unregisterComponent(orr_LogHandle log);
   int32_t currentLevel(orr_LogHandle log);
   const char *name(orr_LogHandle log);
   void write(uint32_t severity, orr_LogHandle log, int32_t level, const char *format, va_list args)
      __attribute__((format(printf, 5, 0)));
   void writeNoLevel(uint32_t severity, const char *format, va_list args) __attribute__((format(printf, 3, 0)));

   // Reports and removes components still registered.
   std::vector<std::string> purge(std::string_view when);

   // Log
   std::vector<LogRecord> records() const override;
   void clear() override;
   std::vector<LogRecord> take() override;
   size_t count(std::string_view needle) const override;
   void setEcho(bool echo) override;

   struct Component;

private:
   Component *find(orr_LogHandle log) const;
   void keep(LogRecord record);
   bool checkSeverity(const char *op, uint32_t severity);

   Violations &violations_;
   FaultTable &faults_;
   HeapRegistry &heaps_;

   mutable std::mutex mutex_;
   uint64_t nextSeq_ = 1;
   std::map<const orr_LogOpaque *, std::unique_ptr<Component>> components_;
   std::vector<LogRecord> records_;
   bool echo_ = false;
};

}  // namespace swsec::host
