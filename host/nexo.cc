#include "host/nexo.h"

#include "host/state.h"

#include <algorithm>
#include <charconv>
#include <functional>
#include <cstring>
#include <limits>
#include <map>
#include <set>
#include <stdexcept>

namespace swsec::host {

namespace {

std::string textOf(const char *text)
{
   return text != nullptr ? std::string(text) : std::string();
}

std::vector<std::string_view> splitPath(std::string_view path)
{
   std::vector<std::string_view> parts;
   size_t at = 0;
   while (at <= path.size()) {
      size_t end = path.find('/', at);
      if (end == std::string_view::npos) {
         end = path.size();
      }
      if (end > at) {
         parts.push_back(path.substr(at, end - at));
      }
      at = end + 1;
   }
   return parts;
}

bool isList(const Nexo_NodeDef &node)
{
   return node.kind == NEXO_NODE_LIST || node.kind == NEXO_NODE_LEAF_LIST;
}

bool isLeaf(const Nexo_NodeDef &node)
{
   return node.kind == NEXO_NODE_LEAF || node.kind == NEXO_NODE_LEAF_LIST;
}

const Nexo_NodeDef *rootOf(const Nexo_Tree &tree)
{
   for (uint32_t i = 0; i < tree.numNodes; ++i) {
      if (tree.nodes[i].parentId == NEXO_NO_PARENT) {
         return &tree.nodes[i];
      }
   }
   return nullptr;
}

void validateRecord(const Nexo_RecordDef &record)
{
   const std::string name = textOf(record.name);
   if (record.name == nullptr || record.label == nullptr || record.size == 0 ||
       (record.numFields != 0 && record.fields == nullptr)) {
      throw std::runtime_error("Nexo record '" + name + "' is incomplete");
   }
   for (uint32_t i = 0; i < record.numFields; ++i) {
      const Nexo_FieldDef &field = record.fields[i];
      const std::string where = "Nexo record '" + name + "' field '" + textOf(field.name) + "'";
      if (field.name == nullptr || field.label == nullptr) {
         throw std::runtime_error(where + " has no name or label");
      }
      if (static_cast<uint64_t>(field.offset) + field.size > record.size) {
         throw std::runtime_error(where + " lies outside the record");
      }
      const bool fits = (field.type == NEXO_FIELD_U8 && field.size == 1) ||
                        (field.type == NEXO_FIELD_CHARS && field.size >= 1) ||
                        (field.type == NEXO_FIELD_ENUM32 && field.size == 4 && field.enumDef != nullptr &&
                         (field.enumDef->numElements == 0 || field.enumDef->elements != nullptr));
      if (!fits) {
         throw std::runtime_error(where + " has a type that does not fit its size");
      }
   }
}

}  // namespace

// ---------------------------------------------------------------- records

std::string NexoRecord::text() const
{
   std::string out = label + "\n";
   for (const auto &field : fields) {
      out += "   " + field.label + ": " + field.value + "\n";
   }
   return out;
}

std::map<std::string, std::string, std::less<>> NexoRecord::values() const
{
   std::map<std::string, std::string, std::less<>> out;
   for (const auto &field : fields) {
      out.emplace(field.name, field.value);
   }
   return out;
}

const std::string &NexoRecord::value(std::string_view field) const
{
   for (const auto &candidate : fields) {
      if (candidate.name == field) {
         return candidate.value;
      }
   }
   throw std::out_of_range("record '" + name + "' has no field '" + std::string(field) + "'");
}

// ---------------------------------------------------------------- registry

NexoRegistry::NexoRegistry(Violations &violations, FaultTable &faults) : violations_(violations), faults_(faults) {}

void NexoRegistry::validate(const Nexo_Tree &tree)
{
   if (tree.numNodes == 0 || tree.nodes == nullptr || (tree.numRecords != 0 && tree.records == nullptr)) {
      throw std::runtime_error("Nexo tree has no nodes");
   }
   std::set<uint32_t> seen;
   uint32_t roots = 0;
   for (uint32_t i = 0; i < tree.numNodes; ++i) {
      const Nexo_NodeDef &node = tree.nodes[i];
      const std::string where = "Nexo node " + std::to_string(node.id) + " '" + textOf(node.name) + "'";
      if (node.id == NEXO_NO_PARENT || node.name == nullptr || *node.name == '\0' ||
          std::strchr(node.name, '/') != nullptr) {
         throw std::runtime_error(where + " has a reserved ID or an unusable name");
      }
      if (!seen.insert(node.id).second) {
         throw std::runtime_error(where + " repeats an ID");
      }
      if (node.parentId == NEXO_NO_PARENT) {
         roots++;
      } else if (seen.count(node.parentId) == 0) {
         throw std::runtime_error(where + " comes before its parent " + std::to_string(node.parentId));
      }
      const bool handlersFit =
         (isList(node) == (node.list != nullptr)) && (isLeaf(node) || (node.get == nullptr && node.set == nullptr)) &&
         (node.output == nullptr || node.get != nullptr) && node.minArgs <= node.maxArgs &&
         node.maxArgs <= NEXO_PARAM_LIST_CAPACITY;
      if (node.kind < NEXO_NODE_BRANCH || node.kind > NEXO_NODE_LEAF_LIST || !handlersFit) {
         throw std::runtime_error(where + " has handlers or an argument rule that do not fit its kind");
      }
      if (node.output != nullptr) {
         validateRecord(*node.output);
      }
   }
   if (roots != 1) {
      throw std::runtime_error("Nexo tree has " + std::to_string(roots) + " roots (1 expected)");
   }
   for (uint32_t i = 0; i < tree.numRecords; ++i) {
      if (tree.records[i] == nullptr) {
         throw std::runtime_error("Nexo tree has a null record");
      }
      validateRecord(*tree.records[i]);
   }
}

void NexoRegistry::install(const Nexo_Tree *tree)
{
   std::lock_guard guard(mutex_);
   tree_ = tree;
}

void NexoRegistry::remove()
{
   std::unique_lock guard(mutex_);
   tree_ = nullptr;
   idle_.wait(guard, [this] { return inFlight_ == 0; });
}

bool NexoRegistry::installed() const
{
   std::lock_guard guard(mutex_);
   return tree_ != nullptr;
}

std::vector<std::string> NexoRegistry::paths() const
{
   std::lock_guard guard(mutex_);
   std::vector<std::string> out;
   if (tree_ == nullptr) {
      return out;
   }
   // Each node's path as its children continue it ("/security/<key>").
   std::map<uint32_t, std::string> prefixOf;
   for (uint32_t i = 0; i < tree_->numNodes; ++i) {
      const Nexo_NodeDef &node = tree_->nodes[i];
      const std::string path = node.parentId == NEXO_NO_PARENT ? "" : prefixOf[node.parentId] + "/" + node.name;
      prefixOf[node.id] = isList(node) ? path + "/<key>" : path;
      out.push_back(path.empty() ? "/" : path);
   }
   return out;
}

NexoRegistry::Resolved NexoRegistry::enter(std::string_view path)
{
   std::lock_guard guard(mutex_);
   if (tree_ == nullptr) {
      throw std::invalid_argument("no Nexo branch is installed");
   }
   Resolved resolved;
   const Nexo_NodeDef *node = rootOf(*tree_);
   for (std::string_view part : splitPath(path)) {
      if (isList(*node) && !resolved.keyGiven) {
         int64_t key = 0;
         const auto [end, error] = std::from_chars(part.data(), part.data() + part.size(), key);
         if (error != std::errc() || end != part.data() + part.size() ||
             key < std::numeric_limits<int32_t>::min() || key > std::numeric_limits<uint32_t>::max()) {
            throw std::invalid_argument("Nexo path '" + std::string(path) + "': '" + std::string(part) +
                                        "' is not an instance key of '" + node->name + "'");
         }
         resolved.instanceArgs.entries.push_back({.isText = false, .number = key, .text = {}});
         resolved.keyGiven = true;
         continue;
      }
      const Nexo_NodeDef *child = nullptr;
      for (uint32_t i = 0; i < tree_->numNodes && child == nullptr; ++i) {
         if (tree_->nodes[i].parentId == node->id && part == tree_->nodes[i].name) {
            child = &tree_->nodes[i];
         }
      }
      if (child == nullptr) {
         throw std::invalid_argument("Nexo path '" + std::string(path) + "': no node '" + std::string(part) + "'");
      }
      node = child;
      resolved.keyGiven = false;
   }
   resolved.node = node;
   inFlight_++;
   return resolved;
}

void NexoRegistry::leave()
{
   std::lock_guard guard(mutex_);
   if (--inFlight_ == 0) {
      idle_.notify_all();
   }
}

namespace {

// Counts the call in flight for the duration of a handler.
struct InFlight {
   std::function<void()> done;
   ~InFlight() { done(); }
};

}  // namespace

orr_Status NexoRegistry::list(std::string_view path, std::vector<int64_t> *instances)
{
   Resolved resolved = enter(path);
   InFlight inFlight{[this] { leave(); }};
   const Nexo_NodeDef &node = *resolved.node;
   if (!isList(node) || resolved.keyGiven) {
      throw std::invalid_argument("Nexo path '" + std::string(path) + "' names no list");
   }
   Nexo_ParamList out;
   out.entries.reserve(NEXO_PARAM_LIST_CAPACITY);
   const orr_Status status = node.list(&node, &resolved.instanceArgs, &out);
   if (instances != nullptr) {
      instances->clear();
      for (const auto &entry : out.entries) {
         instances->push_back(entry.number);
      }
   }
   return status;
}

orr_Status NexoRegistry::get(std::string_view path, NexoRecord *record)
{
   Resolved resolved = enter(path);
   InFlight inFlight{[this] { leave(); }};
   const Nexo_NodeDef &node = *resolved.node;
   if (!isLeaf(node) || node.get == nullptr) {
      throw std::invalid_argument("Nexo path '" + std::string(path) + "' names no node with a get handler");
   }
   // Not zeroed, as a kernel buffer would not be: an unwritten field shows.
   std::vector<uint8_t> bytes(node.output != nullptr ? node.output->size : 0, 0xa5);
   const orr_Status status = node.get(&node, &resolved.instanceArgs, bytes.empty() ? nullptr : bytes.data());
   if (record != nullptr) {
      *record = NexoRecord{};
      if (node.output != nullptr) {
         if (status != ORR_OK) {
            std::fill(bytes.begin(), bytes.end(), 0);
         }
         *record = render(*node.output, bytes.data());
      }
   }
   return status;
}

orr_Status NexoRegistry::set(std::string_view path, const std::vector<std::string> &args)
{
   Resolved resolved = enter(path);
   InFlight inFlight{[this] { leave(); }};
   const Nexo_NodeDef &node = *resolved.node;
   if (!isLeaf(node) || node.set == nullptr) {
      throw std::invalid_argument("Nexo path '" + std::string(path) + "' names no node with a set handler");
   }
   if (args.size() < node.minArgs || args.size() > node.maxArgs) {
      return ORR_BAD_PARAM;
   }
   Nexo_ParamList input;
   for (const auto &arg : args) {
      input.entries.push_back({.isText = true, .number = 0, .text = arg});
   }
   return node.set(&node, &resolved.instanceArgs, &input);
}

NexoRecord NexoRegistry::render(const Nexo_RecordDef &def, const uint8_t *bytes)
{
   NexoRecord record{.name = textOf(def.name), .label = textOf(def.label), .fields = {}};
   std::vector<std::string> problems;
   for (uint32_t i = 0; i < def.numFields; ++i) {
      const Nexo_FieldDef &field = def.fields[i];
      const uint8_t *at = bytes + field.offset;
      std::string value;
      switch (field.type) {
      case NEXO_FIELD_U8:
         value = std::to_string(static_cast<unsigned>(*at));
         break;
      case NEXO_FIELD_CHARS: {
         const auto *text = reinterpret_cast<const char *>(at);
         const size_t length = strnlen(text, field.size);
         if (length == field.size) {
            problems.push_back("Nexo record '" + record.name + "' field '" + field.name + "' is not terminated");
         }
         value.assign(text, length);
         break;
      }
      case NEXO_FIELD_ENUM32: {
         uint32_t number = 0;
         std::memcpy(&number, at, sizeof number);
         value = "unknown (" + std::to_string(number) + ")";
         for (uint32_t e = 0; e < field.enumDef->numElements; ++e) {
            if (field.enumDef->elements[e].value == number) {
               value = textOf(field.enumDef->elements[e].label);
            }
         }
         break;
      }
      }
      record.fields.push_back(NexoField{.name = field.name, .label = field.label, .value = std::move(value)});
   }
   violations_.reportAll(std::move(problems));
   return record;
}

}  // namespace swsec::host

// ---------------------------------------------------------------- platform

using swsec::host::detail::requireState;
using swsec::host::faultPoint;

namespace {

const Nexo_ParamList::Entry *entryAt(const Nexo_ParamList *list, uint32_t index)
{
   if (list == nullptr || index >= list->entries.size()) {
      return nullptr;
   }
   return &list->entries[index];
}

orr_Status getNumber(const char *op, const Nexo_ParamList *list, uint32_t index, int64_t *number)
{
   if (auto status = requireState(op).nexo.hit(op)) {
      return *status;
   }
   const Nexo_ParamList::Entry *entry = entryAt(list, index);
   if (entry == nullptr) {
      return ORR_NOT_FOUND;
   }
   // A 32-bit value, signed or not: either reading gives its bit pattern.
   if (entry->isText || entry->number < std::numeric_limits<int32_t>::min() ||
       entry->number > std::numeric_limits<uint32_t>::max()) {
      return ORR_BAD_PARAM;
   }
   *number = entry->number;
   return ORR_OK;
}

}  // namespace

ORR_API orr_Status Nexo_ParamListGetInt32(const Nexo_ParamList *list, uint32_t index, int32_t *value)
{
   int64_t number = 0;
   const orr_Status status = getNumber("Nexo_ParamListGetInt32", list, index, &number);
   if (status == ORR_OK) {
      *value = static_cast<int32_t>(static_cast<uint32_t>(number));
   }
   return status;
}

ORR_API orr_Status Nexo_ParamListGetUInt32(const Nexo_ParamList *list, uint32_t index, uint32_t *value)
{
   int64_t number = 0;
   const orr_Status status = getNumber("Nexo_ParamListGetUInt32", list, index, &number);
   if (status == ORR_OK) {
      *value = static_cast<uint32_t>(number);
   }
   return status;
}

ORR_API orr_Status Nexo_ParamListGetString(const Nexo_ParamList *list, uint32_t index, const char **text)
{
   if (auto status = requireState("Nexo_ParamListGetString").nexo.hit(faultPoint("Nexo_ParamListGetString"))) {
      return *status;
   }
   const Nexo_ParamList::Entry *entry = entryAt(list, index);
   if (entry == nullptr) {
      return ORR_NOT_FOUND;
   }
   if (!entry->isText) {
      return ORR_BAD_PARAM;
   }
   *text = entry->text.c_str();
   return ORR_OK;
}

ORR_API orr_Status Nexo_ParamListUsedCount(const Nexo_ParamList *list, uint32_t *count)
{
   if (auto status = requireState("Nexo_ParamListUsedCount").nexo.hit(faultPoint("Nexo_ParamListUsedCount"))) {
      return *status;
   }
   if (list == nullptr || count == nullptr) {
      return ORR_BAD_PARAM;
   }
   *count = static_cast<uint32_t>(list->entries.size());
   return ORR_OK;
}

ORR_API orr_Status Nexo_ParamListAddInt(Nexo_ParamList *list, int64_t value)
{
   if (auto status = requireState("Nexo_ParamListAddInt").nexo.hit(faultPoint("Nexo_ParamListAddInt"))) {
      return *status;
   }
   if (list == nullptr) {
      return ORR_BAD_PARAM;
   }
   if (list->entries.size() >= NEXO_PARAM_LIST_CAPACITY) {
      return ORR_LIMIT_EXCEEDED;
   }
   list->entries.push_back({.isText = false, .number = value, .text = {}});
   return ORR_OK;
}

ORR_API orr_Status Nexo_NULL_Get(const Nexo_NodeDef *, const Nexo_ParamList *, void *)
{
   if (auto status = requireState("Nexo_NULL_Get").nexo.hit(faultPoint("Nexo_NULL_Get"))) {
      return *status;
   }
   return ORR_OK;
}

ORR_API orr_Status Nexo_NULL_Set(const Nexo_NodeDef *, const Nexo_ParamList *, const Nexo_ParamList *)
{
   if (auto status = requireState("Nexo_NULL_Set").nexo.hit(faultPoint("Nexo_NULL_Set"))) {
      return *status;
   }
   return ORR_OK;
}
