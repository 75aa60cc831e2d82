/* A filter's port: lookup, periodic timer, blocks handed out and change messages. */
#include "framework/sifra_generic_port.h"

#include "framework/sifra_generic_log.h"
#include "platform/orr_module.h"
#include "platform/orr_text.h"

/* Every port timer fires every 10 s with the same host options. */
constexpr int64_t SIFRAGENERIC_PORT_TIMER_PERIOD_US = 10'000'000;
constexpr uint32_t SIFRAGENERIC_PORT_TIMER_OPTIONS = 0x2001;

orr_Status SifraGenericFindPort(const SifraGenericFilter *filter, uint32_t *portId, orr_Portset **portset)
{
   orr_Status status = orr_SifraGetPortID(filter->handle, portId);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not get portId", filter->name);
      return status;
   }
   orr_PortsetHandle held = {};
   status = orr_PortsetAcquireByPortID(*portId, ORR_PORTSET_ACQUIRE_SHARED, &held);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not lock portset", filter->name);
      return status;
   }
   *portset = held.portset;
   orr_PortsetRelease(&held);
   return ORR_OK;
}

orr_Status SifraGenericAddPortTimer(const SifraGenericFilter *filter, orr_TimerCallback callback, void *data,
                                    orr_Timer *timer)
{
   const orr_Status status = orr_TimerAdd(callback, data, SIFRAGENERIC_PORT_TIMER_PERIOD_US, true,
                                          SIFRAGENERIC_PORT_TIMER_OPTIONS, timer);
   if (status != ORR_OK) {
      *timer = 0;
      SG_LOG(ORR_LOG_ERROR, "%s: Timer creation failed: %s", filter->name, orr_StatusToString(status));
   }
   return status;
}

void SifraGenericRemovePortTimer(orr_Timer *timer)
{
   if (*timer != 0) {
      (void)orr_TimerRemoveSync(*timer);
      *timer = 0;
   }
}

orr_Status SifraGenericHandOutBlock(const char *name, uint32_t portId, void *block)
{
   const orr_Status status = orr_ModuleIncUseCount(sifraGenericModuleID);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: portId= %u: ModIncUseCnt() failed: %s", name, portId, orr_StatusToString(status));
      SifraGenericFree(block);
      return ORR_FAILURE;
   }
   return ORR_OK;
}

orr_Status SifraGenericGiveBackBlock(void *block)
{
   if (block == nullptr) {
      return ORR_BAD_PARAM;
   }
   SifraGenericFree(block);
   orr_ModuleDecUseCount(sifraGenericModuleID);
   return ORR_OK;
}

void SifraGenericPostPortMessage(const SifraGenericFilter *filter, orr_Portset *portset, uint32_t portId,
                                 uint64_t msgClass, const char *msgName, orr_PortsetMessageHeader *header,
                                 uint64_t payloadLength)
{
   orr_Name name;
   orr_NameInitialize(&name, msgName);
   orr_Memcpy(header->name, name.name, sizeof(header->name));
   header->payloadLength = payloadLength;

   bool locked = false;
   if (orr_PortsetHoldState(portset) == ORR_PORTSET_HOLD_NONE) {
      /*
       * The hold is per CPU: a second look catches a hold that appeared
       * since, which taking the lock again would deadlock on.
       */
      if (orr_PortsetHoldState(portset) != ORR_PORTSET_HOLD_NONE) {
         SG_LOG(ORR_LOG_ERROR, "%s: Could not lock portset:%u:%s:%s", filter->name, portId, msgName,
                orr_StatusToString(ORR_FAILURE));
         return;
      }
      orr_PortsetLockShared(portset);
      locked = true;
   }
   const orr_Status status = orr_PortsetPostMessage(portset, portId, msgClass, header);
   if (locked) {
      if (orr_PortsetHoldState(portset) == ORR_PORTSET_HOLD_EXCL) {
         orr_PortsetUnlockExcl(portset);
      } else {
         orr_PortsetUnlockShared(portset);
      }
   }
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Could not post message:%u:%s:%s", filter->name, portId, msgName,
             orr_StatusToString(status));
   }
}
