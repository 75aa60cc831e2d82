// The Nexo node tree: the branch a loaded module declares, parameter lists,
// and list/get/set by path with rendering of the output records.
#pragma once

#include "host/faults.h"
#include "host/host.h"
#include "host/violations.h"

#include <condition_variable>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

// The host's parameter list: typed arguments, at most NEXO_PARAM_LIST_CAPACITY.
struct Nexo_ParamList {
   struct Entry {
      bool isText = false;
      int64_t number = 0;
      std::string text;
   };
   std::vector<Entry> entries;
};

namespace swsec::host {

class NexoRegistry final : public Nexo {
public:
   NexoRegistry(Violations &violations, FaultTable &faults);

   // Checks a module's branch before it is loaded: one root, unique IDs,
   // parents declared before children, handlers that fit each kind, record
   // fields inside their record. Throws std::runtime_error naming the fault.
   static void validate(const Nexo_Tree &tree);
   // Makes a validated branch visible (null: nothing to install).
   void install(const Nexo_Tree *tree);
   // Withdraws the branch and waits until no handler call is running.
   void remove();

   // Platform operations.
   std::optional<orr_Status> hit(size_t point) { return faults_.hit(point); }
   std::optional<orr_Status> hit(std::string_view op) { return faults_.hit(op); }

   // Nexo
   bool installed() const override;
   std::vector<std::string> paths() const override;
   orr_Status list(std::string_view path, std::vector<int64_t> *instances) override;
   orr_Status get(std::string_view path, NexoRecord *record) override;
   orr_Status set(std::string_view path, const std::vector<std::string> &args) override;

   // Renders an output record by its definition; a text field without its
   // terminator is a violation (its bytes up to the field's end are shown).
   NexoRecord render(const Nexo_RecordDef &def, const uint8_t *bytes);

private:
   struct Resolved {
      const Nexo_NodeDef *node = nullptr;
      Nexo_ParamList instanceArgs;
      bool keyGiven = false;   // the path ends with the node's own instance key
   };

   // Resolves under the lock and counts one call in flight; throws
   // std::invalid_argument for a path that names no node.
   Resolved enter(std::string_view path);
   void leave();

   Violations &violations_;
   FaultTable &faults_;
   mutable std::mutex mutex_;
   std::condition_variable idle_;
   const Nexo_Tree *tree_ = nullptr;
   uint32_t inFlight_ = 0;
};

}  // namespace swsec::host
