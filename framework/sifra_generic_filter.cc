/* Filter creation, destruction and the dispatch of host calls to the agent. */
#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_ops.h"
#include "framework/sifra_generic_slow_path.h"

orr_Status SifraGenericCreateFilter(orr_SifraAgentHandle agent, orr_SifraFilterHandle /* handle */,
                                    orr_SifraFilter * /* filter */, uint8_t /* flags */)
{
   if (!SifraGenericAgentHandleIsValid(agent)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for fastPath");
      return ORR_BAD_PARAM;
   }
   /* Filter records are built next; until then no filter is made. */
   return ORR_NOT_SUPPORTED;
}

orr_Status SifraGenericDestroyFilter(orr_SifraFilter filter)
{
   if (!SifraGenericFilterIsValid(filter)) {
      /* ORR_OK: the host is not to retry a record that is no filter. */
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_OK;
   }
   /* Filter records are built next; no live one can exist yet. */
   return ORR_NOT_SUPPORTED;
}

orr_Status SifraGenericProcessPackets(orr_SifraFilter filter, orr_PktList * /* pktList */,
                                      uint32_t /* direction */)
{
   if (!SifraGenericFilterIsValid(filter)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   /* The dispatch to the agent comes with the filter records. */
   return ORR_NOT_SUPPORTED;
}

orr_Status SifraGenericProcessSlowPathPackets(orr_SifraFilter filter, orr_PktList * /* pktList */,
                                              uint32_t /* direction */)
{
   if (!SifraGenericFilterIsValid(filter)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   /* The dispatch to the agent comes with the filter records. */
   return ORR_NOT_SUPPORTED;
}

/*
 * A bad record in the ioctl and configuration-change calls is refused with
 * ORR_BAD_PARAM, as the frame calls do: the host's signatures carry a status.
 */
orr_Status SifraGenericProcessFilterIoctl(orr_SifraFilter filter, uint32_t /* requestId */,
                                          void * /* payload */, uint64_t /* payloadSize */)
{
   if (!SifraGenericFilterIsValid(filter)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   /* The dispatch to the agent comes with the filter records. */
   return ORR_NOT_SUPPORTED;
}

orr_Status SifraGenericProcessSlowPathIoctl(orr_SifraSlowPath slowPath, uint32_t /* requestId */,
                                            void * /* payload */, uint64_t /* payloadSize */)
{
   if (!SifraGenericSlowPathIsValid(slowPath)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for slowPath");
      return ORR_BAD_PARAM;
   }
   /* The dispatch to the agent comes with the slow path records. */
   return ORR_NOT_SUPPORTED;
}

orr_Status SifraGenericConfigurationChanged(orr_SifraFilter filter)
{
   if (!SifraGenericFilterIsValid(filter)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   /* Re-reading the configuration comes with the filter records. */
   return ORR_NOT_SUPPORTED;
}
