/* Switching the port database test hooks off, and their lock. */
#include "mgmt/swsec_test_hooks.h"

#include "framework/sifra_generic_lock.h"
#include "framework/sifra_generic_log.h"
#include "mgmt/swsec_nexo.h"
#include "swsec/swsec_notify.h"
#include "swsec/swsec_port_db_export.h"

constinit orr_Spinlock testConfigLock = nullptr;
constinit orr_PortsetMessageCBHandle cbHandle = 0;

orr_Status SwSecTestsInit(void)
{
   orr_Status status = SifraGenericCreateSpinlock(SWSEC_TEST_CONFIG_LOCK_NAME, ORR_SPINLOCK_RW,
                                                  SifraGenericLockRank::TestConfig,
                                                  &testConfigLock);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Could not allocate test configuration lock");
      return status;
   }
   cbHandle = 0;
   return ORR_OK;
}

orr_Status SwSecPortDbTestStart(void)
{
   orr_Status status = ORR_OK;
   orr_SpinlockWriteLock(testConfigLock);
   if (cbHandle == 0) {
      orr_PortsetMessageCBHandle handle = 0;
      status = orr_PortsetRegisterMessageCB(nullptr, 0, SWSEC_PORTSET_MSG_PORTDB, SwSecPortDbTestMsgCb, nullptr,
                                            &handle);
      if (status == ORR_OK) {
         cbHandle = handle;
      }
   }
   orr_SpinlockWriteUnlock(testConfigLock);
   return status;
}

orr_Status SwSecPortDbTestStop(void)
{
   /* Without the lock the hooks were never started: nothing to switch off. */
   if (testConfigLock == nullptr) {
      return ORR_OK;
   }
   orr_SpinlockWriteLock(testConfigLock);
   if (cbHandle != 0) {
      orr_PortsetUnregisterMessageCB(cbHandle);
      cbHandle = 0;
   }
   orr_SpinlockWriteUnlock(testConfigLock);
   return ORR_OK;
}

orr_Status SwSecTestsCleanup(void)
{
   (void)SwSecPortDbTestStop();
   if (testConfigLock != nullptr) {
      orr_SpinlockDestroy(testConfigLock);
      testConfigLock = nullptr;
   }
   return ORR_OK;
}

void SwSecPortDbTestMsgCb(uint32_t portId, uint64_t msgClass, const orr_PortsetMessageHeader *message)
{
   if (msgClass != SWSEC_PORTSET_MSG_PORTDB || message == nullptr) {
      return;
   }
   orr_PortsetHandle portset{};
   if (orr_PortsetAcquireByPortID(portId, ORR_PORTSET_ACQUIRE_SHARED, &portset) != ORR_OK) {
      return;
   }
   static constexpr uint32_t selectors[] = {SwSecPortDbAuth, SwSecPortDbNonAuth, SwSecPortDbAll};
   for (uint32_t selector : selectors) {
      uint32_t numEntries = 0;
      if (SwSec_PortDBGetNumEntries(portId, selector, &numEntries) != ORR_OK) {
         break;
      }
      void *entries = nullptr;
      void *buffer = nullptr;
      if (SwSec_PortDBGetEntries(portId, selector, &entries, &numEntries, &buffer) != ORR_OK) {
         break;
      }
      /* The entries are not examined; a null buffer (no entries) is refused, as expected. */
      (void)SwSec_PortDBReleaseBuf(buffer);
   }
   orr_PortsetRelease(&portset);
}

orr_Status SwSecNexoStartTest(const Nexo_NodeDef *, const Nexo_ParamList *, const Nexo_ParamList *)
{
   return SwSecPortDbTestStart();
}

orr_Status SwSecNexoStopTest(const Nexo_NodeDef *, const Nexo_ParamList *, const Nexo_ParamList *)
{
   return SwSecPortDbTestStop();
}
