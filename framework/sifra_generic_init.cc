/* Framework start-up and teardown, and the framework-wide globals. */
#include "framework/sifra_generic.h"

#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_heap.h"
#include "platform/orr_lock.h"
#include "platform/orr_module.h"

constinit orr_ModuleID sifraGenericModuleID = ORR_INVALID_MODULE_ID;
constinit orr_HeapID sifraGenericHeapID = nullptr;
constinit orr_LogHandle sifraGenericLogHandle = nullptr;
constinit orr_TimerQueue sifraGenericTimerQueue = nullptr;
constinit orr_LockDomainID sifraGenericLockDomain = ORR_INVALID_LOCK_DOMAIN;
constinit orr_PlexClientPortHandle sifraGenericPortClient = nullptr;
constinit orr_ListLinks agentList = {&agentList, &agentList};

constinit const orr_PlexClientPortOps sifraGenericCreateAgentOps = {
   .write = SifraGenericAgentPropWrite,
   .read = nullptr,
   .poll = nullptr,
   .cleanup = nullptr,
};

/* Step 2: the module heap, named after the module, made the module's default heap. */
static orr_Status SifraGenericCreateHeap(const orr_Name *moduleName)
{
   orr_HeapProps props = {};
   props.kind = 0;
   orr_NameCopy(&props.name, moduleName);
   props.module = sifraGenericModuleID;
   /* The sizes go to the host as given; it refuses sizes it cannot honour. */
   props.initialSize = static_cast<uint32_t>(SIFRAGENERIC_HEAP_MIN_SIZE);
   props.maximumSize = static_cast<uint32_t>(SIFRAGENERIC_HEAP_MAX_SIZE);
   props.flags = 0;

   orr_HeapID heap = nullptr;
   orr_Status status = orr_HeapCreate(&props, &heap);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Failed to create heap (%#x): %s", SifraGenericStatusValue(status),
             orr_StatusToString(status));
      return status;
   }
   sifraGenericHeapID = heap;

   /*
    * Every allocation of the module names its heap, so the default heap is
    * a convenience for the host; still, a refusal means the host does not
    * accept the heap as the module's, and the start-up fails with it.
    */
   status = orr_ModuleSetHeapID(sifraGenericModuleID, heap);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Failed to set module heap (%#x): %s",
             SifraGenericStatusValue(status), orr_StatusToString(status));
      return status;
   }
   return ORR_OK;
}

/* Step 3: the log component, named after the module. */
static orr_Status SifraGenericRegisterLog(const orr_Name *moduleName)
{
   orr_LogProps props = {};
   orr_NameCopy(&props.name, moduleName);
   props.module = sifraGenericModuleID;
   props.heap = sifraGenericHeapID;
   props.level = 0;
   props.extra = nullptr;

   orr_LogHandle log = nullptr;
   orr_Status status = orr_LogRegister(&props, &log);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Failed to allocate log handle (%#x): %s",
             SifraGenericStatusValue(status), orr_StatusToString(status));
      return status;
   }
   sifraGenericLogHandle = log;
   return ORR_OK;
}

/* Step 4: the timer queue of every framework and agent timer. */
static orr_Status SifraGenericCreateTimerQueue(const orr_Name *name)
{
   orr_TimerQueueProps props = {};
   orr_NameCopy(&props.name, name);
   props.module = sifraGenericModuleID;
   props.heap = sifraGenericHeapID;
   props.flags = 0;

   orr_TimerQueue queue = nullptr;
   orr_Status status = orr_TimerQueueCreate(&props, &queue);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Failed to create timer queue: %s", orr_StatusToString(status));
      return status;
   }
   sifraGenericTimerQueue = queue;
   return ORR_OK;
}

/* Step 5: the lock domain of every spinlock of the module. */
static orr_Status SifraGenericCreateLockDomain(const orr_Name *name)
{
   orr_LockDomainID domain = ORR_INVALID_LOCK_DOMAIN;
   orr_Status status = orr_LockDomainCreate(orr_ModuleCurrentID, sifraGenericHeapID, name, &domain);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Failed to create lock domain (%#x): %s",
             SifraGenericStatusValue(status), orr_StatusToString(status));
      return status;
   }
   sifraGenericLockDomain = domain;
   return ORR_OK;
}

/* Step 6: the handler of the agent-creation client-port property. */
static orr_Status SifraGenericRegisterPortClient(const char *clientPortName)
{
   orr_PlexClientPortHandle handle = nullptr;
   orr_Status status =
      orr_PlexClientPortRegister(&handle, 0, clientPortName, &sifraGenericCreateAgentOps);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Failed to register sifra generic create agent prop handler (%#x): %s",
             SifraGenericStatusValue(status), orr_StatusToString(status));
      return status;
   }
   sifraGenericPortClient = handle;
   SG_LOG(ORR_LOG_INFO, "Registered sifra generic create agent property handler");
   return ORR_OK;
}

orr_Status SifraGenericInit(const char *name, const char *clientPortName)
{
   char moduleText[ORR_NAME_LEN] = {};
   orr_Name moduleName;
   orr_Name frameworkName;

   orr_ModuleID moduleID = ORR_INVALID_MODULE_ID;
   orr_Status status = orr_ModuleRegister(&moduleID, ORR_MODULE_INTERFACE_REVISION);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Registration failed (%#x): %s", SifraGenericStatusValue(status),
             orr_StatusToString(status));
      return status;
   }
   sifraGenericModuleID = moduleID;

   /*
    * The module's name names the heap and the log. A host that cannot say
    * it fails the heap step: neither could be named.
    */
   status = orr_ModuleGetName(sifraGenericModuleID, moduleText, sizeof(moduleText));
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Failed to create heap (%#x): %s", SifraGenericStatusValue(status),
             orr_StatusToString(status));
      goto out_release_framework;
   }
   moduleText[sizeof(moduleText) - 1] = '\0';
   orr_NameInitialize(&moduleName, moduleText);
   orr_NameInitialize(&frameworkName, name);

   status = SifraGenericCreateHeap(&moduleName);
   if (status != ORR_OK) {
      goto out_release_framework;
   }
   status = SifraGenericRegisterLog(&moduleName);
   if (status != ORR_OK) {
      goto out_release_framework;
   }
   status = SifraGenericCreateTimerQueue(&frameworkName);
   if (status != ORR_OK) {
      goto out_release_framework;
   }
   status = SifraGenericCreateLockDomain(&frameworkName);
   if (status != ORR_OK) {
      goto out_release_framework;
   }

   /*
    * A failed client-port registration releases everything made above as
    * well: a module whose start-up failed leaves nothing registered with
    * the host and no heap behind.
    */
   status = SifraGenericRegisterPortClient(clientPortName);
   if (status != ORR_OK) {
      goto out_release_framework;
   }

   SifraGenericListInit(&agentList);
   return ORR_OK;

   /* The teardown tests each global: it releases exactly the steps that succeeded. */
out_release_framework:
   (void)SifraGenericCleanup();
   SifraGenericListInit(&agentList);
   return status;
}

void SifraGenericCleanupAgents(void)
{
   /*
    * The loader runs the teardown alone; the registry lock still covers the
    * walk, so that a property write that is late to finish cannot link an
    * agent into the list while it is being emptied.
    */
   orr_MutexLock(&sifraGenericAgentRegistryLock);
   while (!SifraGenericListIsEmpty(&agentList)) {
      orr_ListLinks *links = agentList.next;
      SifraGenericListUnlink(links);
      SifraGenericCleanupFastPathAgent(SifraGenericAgentFromLinks(links));
   }
   orr_MutexUnlock(&sifraGenericAgentRegistryLock);
}

orr_Status SifraGenericCleanup(void)
{
   SifraGenericCleanupAgents();

   if (sifraGenericLockDomain != ORR_INVALID_LOCK_DOMAIN) {
      orr_LockDomainDestroy(sifraGenericLockDomain);
      sifraGenericLockDomain = ORR_INVALID_LOCK_DOMAIN;
   }
   if (sifraGenericTimerQueue != nullptr) {
      orr_TimerQueueDestroy(sifraGenericTimerQueue);
      sifraGenericTimerQueue = nullptr;
   }
   if (sifraGenericLogHandle != nullptr) {
      orr_LogUnregister(sifraGenericLogHandle);
      sifraGenericLogHandle = nullptr;
   }
   if (sifraGenericHeapID != nullptr) {
      orr_HeapDestroy(sifraGenericHeapID);
      sifraGenericHeapID = nullptr;
   }
   if (sifraGenericModuleID != ORR_INVALID_MODULE_ID) {
      orr_Status unregistered = orr_ModuleUnregister(sifraGenericModuleID);
      if (unregistered != ORR_OK) {
         SG_LOG(ORR_LOG_ERROR, "Failed to unregister module (%#x): %s",
                SifraGenericStatusValue(unregistered), orr_StatusToString(unregistered));
      }
      sifraGenericModuleID = ORR_INVALID_MODULE_ID;
   }

   /*
    * Without a registration there is nothing to withdraw, and the host
    * refuses a null handle: the call is skipped.
    */
   if (sifraGenericPortClient == nullptr) {
      return ORR_OK;
   }
   orr_Status status = orr_PlexClientPortUnregister(sifraGenericPortClient);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "Failed to unregister sifra generic create agent prop handler (%#x): %s",
             SifraGenericStatusValue(status), orr_StatusToString(status));
      /* The handle stays: a later teardown tries the withdrawal again. */
      return status;
   }
   sifraGenericPortClient = nullptr;
   return ORR_OK;
}
