/* Slow path registration and the attachment of filters to slow paths. */
#include "framework/sifra_generic_agent.h"
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_list.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_ops.h"
#include "framework/sifra_generic_slow_path.h"

orr_Status SifraGenericRegisterSlowPath(orr_SifraAgentHandle agent, uint32_t /* slowPathID */,
                                        orr_SifraSlowPath * /* slowPath */)
{
   if (!SifraGenericAgentHandleIsValid(agent)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for fastPath");
      return ORR_BAD_PARAM;
   }
   /* Slow path records are built with the filters; until then none is made. */
   return ORR_NOT_SUPPORTED;
}

orr_Status SifraGenericUnregisterSlowPath(orr_SifraSlowPath slowPath)
{
   if (!SifraGenericSlowPathIsValid(slowPath)) {
      /* ORR_OK: the host is not to retry a record that is no slow path. */
      SG_LOG(ORR_LOG_ERROR, "Bad magic for slowPath");
      return ORR_OK;
   }
   /* Slow path records are built with the filters; no live one can exist yet. */
   return ORR_NOT_SUPPORTED;
}

void SifraGenericAttachSlowPath(SifraGenericFilter *filter)
{
   /* No slow path to choose: the filter stays detached. */
   if (SifraGenericListIsEmpty(&filter->agent->slowPathList)) {
      return;
   }
   /* Slow path registration makes no records yet, so the list above is always empty. */
}
