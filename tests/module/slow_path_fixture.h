// Ports of the built-in agent with slow paths registered, replied to and
// withdrawn as the hypervisor does, and a look at the module's own records:
// the agent, each filter's attachment and each slow path's counts.
#pragma once

#include "port_fixture.h"

#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_slow_path.h"

#include <map>
#include <optional>
#include <string>
#include <vector>

namespace swsec::testing {

class SlowPathTest : public PortTest {
protected:
   host::SlowPaths &slowPaths() { return host().sifra().slowPaths(); }

   SifraGenericFastPathAgent *agent()
   {
      return SifraGenericAgentFromHandle(host().sifra().fastPath(kAgent)->agent);
   }
   // The module's record of a registered (or withdrawing) slow path; null when the host forgot it.
   SifraGenericSlowPath *slowPath(uint32_t id)
   {
      for (const auto &info : slowPaths().registered()) {
         if (info.id == id) {
            return static_cast<SifraGenericSlowPath *>(info.record);
         }
      }
      return nullptr;
   }
   void registerSlowPath(uint32_t id) { EXPECT_EQ(slowPaths().registerSlowPath(kAgent, id), ORR_OK); }
   uint32_t state(host::FilterId id) { return record(id)->attachState; }
   // The slow path ID the module has the filter on; nothing when detached.
   std::optional<uint32_t> moduleSlowPath(host::FilterId id)
   {
      const SifraGenericSlowPath *slowPath = record(id)->slowPath;
      return slowPath == nullptr ? std::nullopt : std::optional<uint32_t>(slowPath->slowPathID);
   }
   // Runs the attach callback(s) scheduled so far.
   void runAttach() { host().clock().runDue(); }
   size_t deliver() { return slowPaths().deliverReplies(); }

   // Set requests made so far, as "filter->slow path".
   std::vector<std::string> setRequests()
   {
      std::vector<std::string> texts;
      for (const auto &request : slowPaths().requests()) {
         if (request.kind == host::SlowPathRequestKind::Set) {
            texts.push_back(std::to_string(request.filter) + "->" + std::to_string(request.slowPathID));
         }
      }
      return texts;
   }

   // Whatever happened, the records agree with each other and with the
   // host: every slow path counts exactly the filters on it; a filter holds
   // one reference more than its creation's for each reply owed to it;
   // a filter is on a slow path exactly when its state says so, and the
   // host pairs it with that slow path exactly when it is attached.
   void expectConsistent()
   {
      std::map<const SifraGenericSlowPath *, uint32_t> onSlowPath;
      std::map<host::FilterId, uint32_t> owed;
      for (const auto &reply : slowPaths().pendingReplies()) {
         ++owed[reply.filter];
      }
      for (const auto &filter : host().sifra().filters()) {
         const auto *rec = static_cast<const SifraGenericFilter *>(filter.record);
         SCOPED_TRACE("filter " + filter.config.name);
         EXPECT_EQ(rec->refCount, 1u + owed[filter.id]);
         EXPECT_EQ(rec->slowPath == nullptr, rec->attachState == SifraGenericAttachDetached);
         if (rec->slowPath != nullptr) {
            ++onSlowPath[rec->slowPath];
         }
         if (rec->attachState == SifraGenericAttachAttached) {
            EXPECT_EQ(filter.slowPathID, rec->slowPath->slowPathID);
         }
         if (rec->attachState == SifraGenericAttachAttaching) {
            EXPECT_EQ(owed[filter.id], 1u) << "an attaching filter is owed its reply";
         }
      }
      for (const auto &info : slowPaths().registered()) {
         const auto *rec = static_cast<const SifraGenericSlowPath *>(info.record);
         SCOPED_TRACE("slow path " + std::to_string(info.id));
         EXPECT_EQ(rec->magic, SIFRAGENERIC_SLOWPATH_MAGIC);
         EXPECT_EQ(rec->numFilters, onSlowPath[rec]);
         EXPECT_EQ(rec->useCount, 1u + rec->numFilters);
         EXPECT_EQ(SifraGenericListIsLinked(&rec->links), !info.withdrawing);
      }
   }
};

}  // namespace swsec::testing
