/* Switching the port database test hooks off, and their lock. */
#include "mgmt/swsec_test_hooks.h"

#include "framework/sifra_generic_lock.h"
#include "framework/sifra_generic_log.h"

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
