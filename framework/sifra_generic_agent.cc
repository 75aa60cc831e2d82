/* The registry of fast path agents. */
#include "framework/sifra_generic_agent.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_lock.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_ops.h"
#include "framework/sifra_generic_slow_path.h"
#include "platform/orr_text.h"

/*
 * The host may run the agent-creation property write and the management
 * node "createAgent" at the same time as each other; both append to
 * agentList and the property write looks names up in it. One mutex around
 * creation and lookup serialises them; the module entry creates the
 * built-in agent through the same path and the teardown empties the list
 * under it.
 */
constinit orr_Mutex sifraGenericAgentRegistryLock = ORR_MUTEX_INITIALIZER("sifg.agentRegistry");

/*
 * Copies text into a fixed field of `size` bytes. The copy stops one byte
 * short of the field, so that the field always ends in a terminating zero:
 * a longer text is cut to size - 1 bytes.
 */
static void SifraGenericCopyText(char *field, size_t size, const char *text)
{
   orr_Strncpy(field, text, size - 1);
   field[size - 1] = '\0';
}

/*
 * The agent that `text` names, as its name would be stored: a text longer
 * than the name field is compared over the bytes the field keeps, since an
 * agent created from it would get that cut name.
 */
static SifraGenericFastPathAgent *SifraGenericFindAgent(const char *text)
{
   for (orr_ListLinks *links = agentList.next; links != &agentList; links = links->next) {
      SifraGenericFastPathAgent *agent = SifraGenericAgentFromLinks(links);
      if (orr_Strncmp(agent->name, text, SIFRAGENERIC_AGENT_NAME_LEN - 1) == 0) {
         return agent;
      }
   }
   return nullptr;
}

/* Agent creation proper; the caller holds sifraGenericAgentRegistryLock. */
static orr_Status SifraGenericCreateAgent(char *text)
{
   auto *agent =
      static_cast<SifraGenericFastPathAgent *>(SifraGenericAlloc(sizeof(SifraGenericFastPathAgent)));
   if (agent == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "Failed to allocate memory for fast path agent");
      return ORR_NO_MEMORY;
   }

   if (text != nullptr) {
      char *colon = orr_Strchr(text, ':');
      if (colon != nullptr) {
         *colon = '\0';
         SifraGenericCopyText(agent->agentArgs, sizeof(agent->agentArgs), colon + 1);
      }
      SifraGenericCopyText(agent->name, sizeof(agent->name), text);
   }
   if (agent->name[0] == '\0') {
      SifraGenericFree(agent);
      return ORR_OK;
   }

   agent->magic = SIFRAGENERIC_AGENT_MAGIC;
   agent->namePtr = agent->name;
   agent->agentArgsPtr = agent->agentArgs;
   const SifraGenericAgentKind *kind = SifraGenericAgentKindOf(agent->name);
   agent->ops = kind->ops;
   SifraGenericListInit(&agent->filterList);
   SifraGenericListInit(&agent->slowPathList);

   orr_Status status = SifraGenericCreateSpinlock(SIFRAGENERIC_AGENT_LOCK_NAME, ORR_SPINLOCK_PLAIN,
                                                  SifraGenericLockRank::Agent, &agent->lock);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Failed to create lock (%#x): %s", agent->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      goto out_free_agent;
   }

   status = orr_SifraRegisterFastPath(agent->name, ORR_SIFRA_FASTPATH_REVISION,
                                      ORR_SIFRA_FASTPATH_REVISION, sifraGenericModuleID,
                                      &sifraGenericOps, SifraGenericAgentHandle(agent),
                                      &agent->fastPath);
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Failed to register agent (%#x): %s", agent->name,
             SifraGenericStatusValue(status), orr_StatusToString(status));
      agent->fastPath = nullptr;
      goto out_destroy_lock;
   }

   /* Without its property the agent still works; the failure is logged there. */
   if (kind->initProperty != nullptr) {
      (void)kind->initProperty(agent);
   }

   SifraGenericListAppend(&agentList, &agent->links);
   return ORR_OK;

out_destroy_lock:
   orr_SpinlockDestroy(agent->lock);
   agent->lock = nullptr;
out_free_agent:
   agent->magic = ~SIFRAGENERIC_AGENT_MAGIC;
   SifraGenericFree(agent);
   return status;
}

orr_Status SifraGenericInitFastPathAgent(char *text)
{
   orr_MutexLock(&sifraGenericAgentRegistryLock);
   orr_Status status = SifraGenericCreateAgent(text);
   orr_MutexUnlock(&sifraGenericAgentRegistryLock);
   return status;
}

orr_Status SifraGenericRegisterFastpath(char *text)
{
   char *colon = orr_Strchr(text, ':');
   if (colon != nullptr) {
      *colon = '\0';
   }

   orr_MutexLock(&sifraGenericAgentRegistryLock);
   if (SifraGenericFindAgent(text) != nullptr) {
      orr_MutexUnlock(&sifraGenericAgentRegistryLock);
      SG_LOG(ORR_LOG_INFO, "Agent %s already exists. Not recreating", text);
      return ORR_OK;
   }
   if (colon != nullptr) {
      *colon = ':';
   }
   SG_LOG(ORR_LOG_INFO, "Registering new fastpath '%s'", text);
   orr_Status status = SifraGenericCreateAgent(text);
   orr_MutexUnlock(&sifraGenericAgentRegistryLock);
   return status;
}

static orr_Status SifraGenericRegisterAgentName(char *name, void * /* context */)
{
   return SifraGenericRegisterFastpath(name);
}

orr_Status SifraGenericAgentPropWrite(void * /* portset */, void * /* port */, void * /* extra */,
                                      const char *bytes, int32_t count)
{
   /* The count is the host's; a negative one, or bytes missing, is refused outright. */
   if (count < 0 || (bytes == nullptr && count > 0)) {
      SG_LOG(ORR_LOG_ERROR, "Invalid agent names (%d bytes)", count);
      return ORR_BAD_PARAM;
   }

   const uint32_t length = static_cast<uint32_t>(count);
   auto *names = static_cast<char *>(SifraGenericAlloc(length + 1u));
   if (names == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "Failed to allocate memory for agent names");
      return ORR_FAILURE;
   }
   if (length != 0) {
      orr_Memcpy(names, bytes, length);
   }
   names[length] = '\0';

   orr_Status status = SifraGenericForEachAgentName(names, SifraGenericRegisterAgentName, nullptr);
   SifraGenericFree(names);
   return status;
}

void SifraGenericCleanupFastPathAgent(SifraGenericFastPathAgent *agent)
{
   const SifraGenericAgentKind *kind = SifraGenericAgentKindOf(agent->name);
   if (kind->cleanupProperty != nullptr) {
      kind->cleanupProperty(agent);
   }

   if (agent->fastPath != nullptr) {
      orr_SifraUnregisterFastPath(agent->fastPath);
      agent->fastPath = nullptr;
   }

   /* An attach callback still scheduled would run on a freed agent. */
   if (agent->lock != nullptr) {
      SifraGenericCancelAttach(agent);
   }

   if (agent->lock != nullptr) {
      /* Whoever still holds the lock has left before it is destroyed. */
      orr_SpinlockLock(agent->lock);
      orr_SpinlockUnlock(agent->lock);
      orr_SpinlockDestroy(agent->lock);
      agent->lock = nullptr;
   }

   agent->magic = ~SIFRAGENERIC_AGENT_MAGIC;
   SifraGenericFree(agent);
}
