/* The saved state of a filter across a migration. */
#include "framework/sifra_generic_filter.h"
#include "framework/sifra_generic_log.h"
#include "framework/sifra_generic_ops.h"

void SifraGenericPrefetchSavedState(orr_SifraFilter filter)
{
   if (!SifraGenericFilterIsValid(filter)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return;
   }
   /* Fetching the slow path's state comes with the filter records. */
}

orr_Status SifraGenericGetSavedStateLen(orr_SifraFilter filter, uint64_t * /* length */)
{
   if (!SifraGenericFilterIsValid(filter)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   /* The saved state comes with the filter records. */
   return ORR_NOT_SUPPORTED;
}

orr_Status SifraGenericSaveState(orr_SifraFilter filter, void * /* buffer */,
                                 uint64_t * /* length */)
{
   if (!SifraGenericFilterIsValid(filter)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   /* The saved state comes with the filter records. */
   return ORR_NOT_SUPPORTED;
}

orr_Status SifraGenericRestoreState(orr_SifraFilter filter, const void * /* buffer */,
                                    uint64_t /* length */)
{
   if (!SifraGenericFilterIsValid(filter)) {
      SG_LOG(ORR_LOG_ERROR, "Bad magic for filter");
      return ORR_BAD_PARAM;
   }
   /* The saved state comes with the filter records. */
   return ORR_NOT_SUPPORTED;
}
