/* Copying a port database out in one of three record formats. */
#include "swsec/swsec_port_db.h"

#include "platform/orr_text.h"
#include "swsec/swsec_port_db_export.h"
#include "swsec/swsec_port_db_links.h"

void SwSecPortDbEntryFill(SwSecPortDbEntry *entry, const SwSecVmi *vmi)
{
   entry->vlanId = vmi->vlanId;
   orr_Memcpy(entry->macAddr, vmi->macAddr, sizeof(entry->macAddr));
   entry->ipAddrType = SWSEC_PORT_DB_ENTRY_IPV4;
   entry->ipAddr = vmi->ipAddr;
   entry->authoritative = (vmi->discoveryMethod & SwSecDiscAuthoritativeMask) != 0 ? 1 : 0;
}

void SwSecQueryPortDb(SwSecContext *ctx, void *out, SwSecQueryFormat format, uint8_t methodMask)
{
   uint8_t *cursor = static_cast<uint8_t *>(out);
   for (orr_ListLinks *links = ctx->portDbList.next; links != &ctx->portDbList; links = links->next) {
      const SwSecVmi *vmi = SwSecVmiFromListLinks(links);
      if ((vmi->discoveryMethod & methodMask) == 0) {
         continue;
      }
      switch (format) {
      case SWSEC_QUERY_VMI:
         orr_Memcpy(cursor, vmi, sizeof(*vmi));
         cursor += sizeof(*vmi);
         break;
      case SWSEC_QUERY_ENTRY: {
         SwSecPortDbEntry entry;
         orr_Memset(&entry, 0, sizeof(entry));
         SwSecPortDbEntryFill(&entry, vmi);
         orr_Memcpy(cursor, &entry, sizeof(entry));
         cursor += sizeof(entry);
         break;
      }
      case SWSEC_QUERY_KEY: {
         SwSecVmiKey key;
         key.vlanId = vmi->vlanId;
         orr_Memcpy(key.macAddr, vmi->macAddr, sizeof(key.macAddr));
         key.ipAddr = vmi->ipAddr;
         orr_Memcpy(cursor, &key, sizeof(key));
         cursor += sizeof(key);
         break;
      }
      default:
         return;
      }
   }
}
