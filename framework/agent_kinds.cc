/* The agents the module can make, by name: the composition of the module's agents. */
#include "framework/sifra_generic_agent.h"

#include "fhs/fhs_agent.h"
#include "platform/orr_text.h"
#include "swsec/swsec_agent.h"
#include "swsec/swsec_security_property.h"

namespace {

/* Without its property an agent still works; the failure is logged there. */
orr_Status SwSecAgentAttach(SifraGenericFastPathAgent *agent)
{
   (void)SifraGenericFWInitProperty(agent);
   return ORR_OK;
}

orr_Status FhsAgentAttach(SifraGenericFastPathAgent *agent)
{
   (void)FhsInitProperty(agent);
   return ORR_OK;
}

constinit const SifraGenericAgentKind sifraGenericAgentKinds[] = {
   {.name = FHS_AGENT_NAME, .ops = &fhsAgentOps, .attach = FhsAgentAttach, .detach = FhsCleanupProperty,
    .release = nullptr},
   /* Every other name runs the switch-security callbacks. */
   {.name = nullptr, .ops = &sifraGenericFwFastPathOps, .attach = SwSecAgentAttach,
    .detach = SifraGenericFWCleanupProperty, .release = nullptr},
};

}  // namespace

const SifraGenericAgentKind *SifraGenericAgentKindOf(const char *name)
{
   const SifraGenericAgentKind *kind = sifraGenericAgentKinds;
   while (kind->name != nullptr && orr_Strncmp(kind->name, name, SIFRAGENERIC_AGENT_NAME_LEN - 1) != 0) {
      kind++;
   }
   return kind;
}
