/* The security property of the built-in agent. */
#include "swsec/swsec_security_property.h"

#include "contract/config_record.h"
#include "framework/sifra_generic_filter.h"
#include "swsec/swsec_agent.h"
#include "framework/sifra_generic_log.h"
#include "platform/orr_text.h"
#include "swsec/swsec_config.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_port_db.h"

#include <cstddef>

constinit const orr_SifraPropertyOps securityPropOps = {
   .write = SWSecPropWrite,
   .read = SWSecPropRead,
   .poll = SWSecPropPoll,
   .cleanup = SWSecPropCleanup,
};

#define SWSEC_PROPERTY_NAME_LEN 128

orr_Status SifraGenericFWInitProperty(SifraGenericFastPathAgent *agent)
{
   agent->propHandle = nullptr;
   if (orr_Strncmp(agent->name, SIFRAGENERIC_BUILTIN_AGENT_NAME, SIFRAGENERIC_AGENT_NAME_LEN) != 0) {
      return ORR_OK;
   }

   char propertyName[SWSEC_PROPERTY_NAME_LEN];
   orr_Status status =
      orr_StringFormat(propertyName, sizeof(propertyName), 0, "%s.security", agent->name);
   if (status == ORR_OK) {
      orr_SifraPropertyHandle handle = nullptr;
      status = orr_SifraPropertyRegister(&handle, propertyName, &securityPropOps);
      if (status == ORR_OK) {
         agent->propHandle = handle;
         SG_LOG(ORR_LOG_INFO, "%s: Registered security rules property handler", agent->name);
         return ORR_OK;
      }
   }
   SG_LOG(ORR_LOG_ERROR, "%s: Failed to register security property handler (%#x): %s",
          agent->name, SifraGenericStatusValue(status), orr_StatusToString(status));
   return status;
}

void SifraGenericFWCleanupProperty(SifraGenericFastPathAgent *agent)
{
   if (agent->propHandle == nullptr) {
      return;
   }
   SG_LOG(ORR_LOG_INFO, "%s: Unregistering security property handler", agent->name);
   orr_SifraPropertyUnregister(agent->propHandle);
   agent->propHandle = nullptr;
}

/* The port context of a filter record, or null when there is none (or it is another agent's). */
static SwSecContext *SWSecPropContext(orr_SifraFilter filter)
{
   if (filter == nullptr) {
      return nullptr;
   }
   const auto *record = static_cast<SifraGenericFilter *>(filter);
   if (record->agent != nullptr && record->agent->ops != &sifraGenericFwFastPathOps) {
      return nullptr;
   }
   return static_cast<SwSecContext *>(record->agentData);
}

orr_Status SWSecPropWrite(orr_SifraFilter filter, void * /* extra */, const void *data,
                          uint32_t length)
{
   /* An empty write carries no record, like a missing one. */
   if (data == nullptr || length == 0) {
      SG_LOG(ORR_LOG_ERROR, "Invalid security config");
      return ORR_BAD_PARAM;
   }
   const auto *bytes = static_cast<const uint8_t *>(data);

   const uint8_t version = bytes[offsetof(SwSecConfig, version)];
   if (version < SWSEC_CONFIG_VERSION || version > SWSEC_CONFIG_VERSION_MAX) {
      SG_LOG(ORR_LOG_ERROR, "Invalid version. Got %d, expecting %d", version,
             SWSEC_CONFIG_VERSION_MAX);
      return ORR_BAD_PARAM;
   }

   /*
    * numStatic is read only when the write holds it; a shorter write is
    * measured against the bare header, the least a record can be.
    */
   uint32_t numStatic = 0;
   if (length >= offsetof(SwSecConfig, numStatic) + sizeof(numStatic)) {
      orr_Memcpy(&numStatic, bytes + offsetof(SwSecConfig, numStatic), sizeof(numStatic));
   }
   const uint64_t expected = SwSecConfigRecordLength(version, numStatic);
   if (length != expected) {
      SG_LOG(ORR_LOG_ERROR, "Invalid security config length for version %u. Got %u, expecting %lu",
             static_cast<unsigned>(version), length,
             static_cast<unsigned long>(expected));
      return ORR_BAD_PARAM;
   }

   SwSecContext *ctx = SWSecPropContext(filter);
   if (ctx == nullptr) {
      SG_LOG(ORR_LOG_ERROR, "Filter not found: %p", filter);
      return ORR_INVALID_HANDLE;
   }
   orr_SpinlockWriteLock(ctx->configLock);
   const orr_Status status = SwSecConfigFeatures(ctx, reinterpret_cast<const SwSecConfig *>(bytes));
   orr_SpinlockWriteUnlock(ctx->configLock);
   return status;
}

orr_Status SWSecPropRead(orr_SifraFilter filter, void * /* extra */, void *buffer,
                         uint32_t length)
{
   SwSecContext *ctx = SWSecPropContext(filter);
   if (ctx == nullptr) {
      return ORR_INVALID_HANDLE;
   }
   orr_SpinlockReadLock(ctx->configLock);
   const uint64_t needed = SwSecConfigRecordLength(ctx->config.version, ctx->config.numStatic);
   if (length < needed) {
      SG_LOG(ORR_LOG_INFO,
             "%s: Invalid security config read length for version %u. Got %u, expecting %lu",
             ctx->filter->name, static_cast<unsigned>(ctx->config.version), length,
             static_cast<unsigned long>(needed));
      orr_SpinlockReadUnlock(ctx->configLock);
      return ORR_BAD_PARAM;
   }
   auto *out = static_cast<uint8_t *>(buffer);
   orr_Memcpy(out, &ctx->config, sizeof(SwSecConfig));
   if (ctx->config.numStatic != 0) {
      SwSecQueryPortDb(ctx, out + sizeof(SwSecConfig), SWSEC_QUERY_KEY, SwSecDiscStatic);
   }
   if (SwSecConfigHasFrameGuard(ctx->config.version)) {
      orr_Memcpy(out + SwSecConfigLength(ctx->config.numStatic), &ctx->frameGuard, sizeof(ctx->frameGuard));
   }
   orr_SpinlockReadUnlock(ctx->configLock);
   return ORR_OK;
}

bool SWSecPropPoll(orr_SifraFilter filter, void * /* extra */, uint32_t *length)
{
   SwSecContext *ctx = SWSecPropContext(filter);
   if (ctx == nullptr) {
      return false;
   }
   orr_SpinlockReadLock(ctx->configLock);
   /* At most 32 static entries and a frame guard block: the length fits in 32 bits. */
   *length = static_cast<uint32_t>(SwSecConfigRecordLength(ctx->config.version, ctx->config.numStatic));
   orr_SpinlockReadUnlock(ctx->configLock);
   return true;
}

void SWSecPropCleanup(void)
{
}
