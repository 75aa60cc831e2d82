// A switch-security port made by hand, for unit tests of the module's
// pieces: the module heap and log as start-up makes them, a filter record
// with a name, and a context with an enabled, empty port database on a host
// portset. Fixtures add what their piece needs (configLock in a lock
// domain, the port filter map).
#pragma once

#include "support/host_fixture.h"

#include "contract/config_record.h"
#include "framework/sifra_generic.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_lock.h"
#include "swsec/swsec_context.h"

#include <chrono>
#include <cstddef>
#include <cstring>
#include <vector>

namespace swsec::testing {

class HandMadePortTest : public HostTest {
protected:
   static constexpr uint32_t kPortId = 7;

   // The heap and log are named `name`; a block left on the heap at the end
   // is reported by the host as a leak.
   void makePort(const char *name)
   {
      orr_NameInitialize(&heapProps_.name, name);
      heapProps_.initialSize = 4096;
      heapProps_.maximumSize = 1u << 20;
      ASSERT_EQ(orr_HeapCreate(&heapProps_, &sifraGenericHeapID), ORR_OK);
      orr_LogProps logProps{};
      logProps.name = heapProps_.name;
      logProps.heap = sifraGenericHeapID;
      ASSERT_EQ(orr_LogRegister(&logProps, &sifraGenericLogHandle), ORR_OK);

      std::strcpy(filter_.name, "port-7");
      filter_.magic = SIFRAGENERIC_FILTER_MAGIC;
      ctx_.filter = &filter_;
      ctx_.config.featuresEnabled = SwSecFeatureIpDiscovery;
      ctx_.config.trusted = 1;
      ctx_.config.portDbSize = 32;
      SifraGenericListInit(&ctx_.portDbList);
      SifraGenericListInit(&ctx_.dhcpReqList);
      ctx_.portset = host().portsets().addPortset("vswitch0");
      host().portsets().addPort("vswitch0", kPortId);
      ctx_.portId = kPortId;
   }

   // The lock domain start-up makes, and the port's configLock in it.
   void makeConfigLock()
   {
      ASSERT_EQ(orr_LockDomainCreate(orr_ModuleCurrentID, sifraGenericHeapID, &heapProps_.name,
                                     &sifraGenericLockDomain),
                ORR_OK);
      ASSERT_EQ(SifraGenericCreateSpinlock("sifg.sec.config", ORR_SPINLOCK_RW, SifraGenericLockRank::PortConfig,
                                           &ctx_.configLock),
                ORR_OK);
   }

   void releasePort()
   {
      if (ctx_.configLock != nullptr) {
         orr_SpinlockDestroy(ctx_.configLock);
         ctx_.configLock = nullptr;
      }
      if (sifraGenericLockDomain != ORR_INVALID_LOCK_DOMAIN) {
         orr_LockDomainDestroy(sifraGenericLockDomain);
         sifraGenericLockDomain = ORR_INVALID_LOCK_DOMAIN;
      }
      if (sifraGenericLogHandle != nullptr) {
         orr_LogUnregister(sifraGenericLogHandle);
         sifraGenericLogHandle = nullptr;
      }
      if (sifraGenericHeapID != nullptr) {
         orr_HeapDestroy(sifraGenericHeapID);
         sifraGenericHeapID = nullptr;
      }
   }

   static SwSecVmi *vmiAt(orr_ListLinks *links)
   {
      return reinterpret_cast<SwSecVmi *>(reinterpret_cast<uint8_t *>(links) -
                                          offsetof(SwSecVmi, listLinks));
   }
   static SwSecDhcpReq *reqAt(orr_ListLinks *links)
   {
      return reinterpret_cast<SwSecDhcpReq *>(reinterpret_cast<uint8_t *>(links) -
                                              offsetof(SwSecDhcpReq, links));
   }

   // Every VMI and every pending request, oldest first.
   std::vector<SwSecVmi *> vmis()
   {
      std::vector<SwSecVmi *> out;
      for (orr_ListLinks *l = ctx_.portDbList.next; l != &ctx_.portDbList; l = l->next) {
         out.push_back(vmiAt(l));
      }
      return out;
   }
   std::vector<SwSecDhcpReq *> requests()
   {
      std::vector<SwSecDhcpReq *> out;
      for (orr_ListLinks *l = ctx_.dhcpReqList.next; l != &ctx_.dhcpReqList; l = l->next) {
         out.push_back(reqAt(l));
      }
      return out;
   }

   void advanceSeconds(int64_t seconds) { host().clock().advance(std::chrono::seconds(seconds)); }

   int64_t uptime()
   {
      orr_TimeVal now{};
      orr_GetUptime(&now);
      return now.sec;
   }

   SifraGenericFilter filter_{};
   SwSecContext ctx_{};

private:
   orr_HeapProps heapProps_{};
};

}  // namespace swsec::testing
