/* The filter ioctls of a switch-security port: requests from its slow path. */
#include "swsec/swsec_filter.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_log.h"
#include "swsec/swsec_config.h"
#include "swsec/swsec_context.h"
#include "swsec/swsec_port_db.h"
#include "swsec/swsec_wire.h"

namespace {

constexpr uint32_t kVmiKeyLen = sizeof(SwSecVmiKey);

/* Upper-cases the text after the type and sends the whole payload back. */
void SwSecIoctlEcho(SifraGenericFilter *filter, uint32_t requestId, uint8_t *payload,
                    uint64_t payloadSize)
{
   if (requestId == 0) {
      return;
   }
   const uint64_t room = payloadSize - SWSEC_IOCTL_TYPE_LEN;
   const uint64_t textMax = room < SWSEC_IOCTL_ECHO_TEXT_MAX ? room : SWSEC_IOCTL_ECHO_TEXT_MAX;
   uint8_t *text = payload + SWSEC_IOCTL_TYPE_LEN;
   for (uint64_t i = 0; i < textMax && text[i] != '\0'; i++) {
      if (text[i] >= 'a' && text[i] <= 'z') {
         text[i] = static_cast<uint8_t>(text[i] - 'a' + 'A');
      }
   }
   /* The echo carries no status of its own; a reply the host refuses is just lost. */
   (void)orr_SifraSendFilterIoctlReply(filter->handle, requestId, payload, payloadSize);
}

void SwSecIoctlSetFeatures(SifraGenericFilter *filter, SwSecContext *ctx, uint32_t requestId,
                           uint8_t *payload, uint64_t payloadSize)
{
   SG_LOG(ORR_LOG_INFO, "%s: Received set features via Sifra IOCTL, payloadSize: %lu",
          filter->name, static_cast<unsigned long>(payloadSize));

   /*
    * The record is read only as far as the payload holds it: a payload
    * shorter than its header, or than the static entries (and the frame
    * guard block of a version-2 record) its header announces (counted in
    * 64 bits), is refused like an invalid record.
    */
   uint32_t accepted = 0;
   const uint64_t recordRoom = payloadSize - SWSEC_IOCTL_TYPE_LEN;
   const uint8_t *record = payload + SWSEC_IOCTL_TYPE_LEN;
   if (recordRoom < sizeof(SwSecConfig) ||
       recordRoom < SwSecConfigRecordLength(record[offsetof(SwSecConfig, version)],
                                            SwSecLoadHost32(record + offsetof(SwSecConfig, numStatic)))) {
      SG_LOG(ORR_LOG_ERROR, "%s: Set features payload of %lu bytes is shorter than its record",
             filter->name, static_cast<unsigned long>(payloadSize));
   } else {
      orr_SpinlockWriteLock(ctx->configLock);
      const orr_Status status =
         SwSecConfigFeatures(ctx, reinterpret_cast<const SwSecConfig *>(record));
      orr_SpinlockWriteUnlock(ctx->configLock);
      accepted = status == ORR_OK ? 1 : 0;
   }

   uint8_t reply[SWSEC_IOCTL_SET_FEATURES_REPLY_LEN];
   SwSecStoreHost32(reply, SWSEC_IOCTL_SET_FEATURES_REPLY);
   SwSecStoreHost32(reply + SWSEC_IOCTL_REPLY_RESULT_OFFSET, accepted);
   const orr_Status status =
      orr_SifraSendFilterIoctlReply(filter->handle, requestId, reply, sizeof(reply));
   if (status != ORR_OK) {
      SG_LOG(ORR_LOG_INFO, "%s: Return status on set security features IoctlReply was: %d",
             filter->name, static_cast<int>(status));
   }
}

void SwSecIoctlGetVmi(SifraGenericFilter *filter, SwSecContext *ctx, uint32_t requestId)
{
   orr_SpinlockReadLock(ctx->configLock);
   const uint32_t count = ctx->numVmiEntries;
   /* At most 32 entries: the size cannot overflow. */
   const uint32_t length = SWSEC_IOCTL_GET_VMI_ENTRIES_OFFSET + kVmiKeyLen * count;
   auto *reply = static_cast<uint8_t *>(SifraGenericAlloc(length));
   if (reply == nullptr) {
      orr_SpinlockReadUnlock(ctx->configLock);
      SG_LOG(ORR_LOG_INFO, "%s: Failed allocating msg to get vmi", filter->name);
      return;
   }
   SG_LOG(ORR_LOG_INFO, "%s: Received request to get vmi", filter->name);
   SwSecStoreHost32(reply + SWSEC_IOCTL_GET_VMI_COUNT_OFFSET, count);
   if (count != 0) {
      SwSecQueryPortDb(ctx, reply + SWSEC_IOCTL_GET_VMI_ENTRIES_OFFSET, SWSEC_QUERY_KEY,
                       SwSecDiscAllMask);
   }
   orr_SpinlockReadUnlock(ctx->configLock);

   SwSecStoreHost32(reply, SWSEC_IOCTL_GET_VMI_REPLY);
   if (orr_SifraSendFilterIoctlReply(filter->handle, requestId, reply, length) != ORR_OK) {
      SG_LOG(ORR_LOG_ERROR, "%s: Error sending vmi to slowpath", filter->name);
   }
   SifraGenericFree(reply);
}

void SwSecIoctlClearVmi(SifraGenericFilter *filter, SwSecContext *ctx, const uint8_t *payload,
                        uint64_t payloadSize)
{
   /* The keys are read only as far as the payload holds them (sizes in 64 bits). */
   if (payloadSize < SWSEC_IOCTL_CLEAR_ENTRIES_OFFSET) {
      SG_LOG(ORR_LOG_ERROR, "%s: Clear VMI payload of %lu bytes is too short", filter->name,
             static_cast<unsigned long>(payloadSize));
      return;
   }
   const uint8_t clearAll = payload[SWSEC_IOCTL_CLEAR_ALL_OFFSET];
   const uint32_t numEntries = SwSecLoadHost32(payload + SWSEC_IOCTL_CLEAR_COUNT_OFFSET);
   if (payloadSize < SWSEC_IOCTL_CLEAR_ENTRIES_OFFSET + static_cast<uint64_t>(kVmiKeyLen) * numEntries) {
      SG_LOG(ORR_LOG_ERROR, "%s: Clear VMI payload of %lu bytes is too short", filter->name,
             static_cast<unsigned long>(payloadSize));
      return;
   }
   orr_SpinlockWriteLock(ctx->configLock);
   (void)SwSecClearVmi(ctx, clearAll != 0, numEntries,
                       reinterpret_cast<const SwSecVmiKey *>(payload + SWSEC_IOCTL_CLEAR_ENTRIES_OFFSET));
   orr_SpinlockWriteUnlock(ctx->configLock);
}

}  // namespace

orr_Status SwSecFilterIoctlRequest(SifraGenericFilter *filter, uint32_t requestId, void *data,
                                   uint64_t payloadSize)
{
   auto *ctx = static_cast<SwSecContext *>(filter->agentData);
   /* A payload without a whole type, or a port without a context, is ignored without a reply. */
   if (ctx == nullptr || data == nullptr || payloadSize < SWSEC_IOCTL_TYPE_LEN) {
      return ORR_OK;
   }
   auto *payload = static_cast<uint8_t *>(data);
   switch (SwSecLoadHost32(payload)) {
   case SWSEC_IOCTL_ECHO:
      SwSecIoctlEcho(filter, requestId, payload, payloadSize);
      break;
   case SWSEC_IOCTL_SET_FEATURES:
      SwSecIoctlSetFeatures(filter, ctx, requestId, payload, payloadSize);
      break;
   case SWSEC_IOCTL_GET_VMI:
      SwSecIoctlGetVmi(filter, ctx, requestId);
      break;
   case SWSEC_IOCTL_CLEAR_VMI:
      SwSecIoctlClearVmi(filter, ctx, payload, payloadSize);
      break;
   default:
      /* Reply types and unknown types are not requests. */
      break;
   }
   return ORR_OK;
}
