/*
 * The agents the module can make, by name: the composition of the module's
 * agents. A further agent is one entry before the last.
 */
#include "framework/sifra_generic_agent.h"

#include "fhs/fhs_agent.h"
#include "platform/orr_text.h"
#include "swsec/swsec_agent.h"
#include "swsec/swsec_security_property.h"

namespace {

constinit const SifraGenericAgentKind sifraGenericAgentKinds[] = {
   {.name = FHS_AGENT_NAME, .ops = &fhsAgentOps, .initProperty = FhsInitProperty,
    .cleanupProperty = FhsCleanupProperty},
   /* Every other name runs the switch-security callbacks (the property only for the built-in name). */
   {.name = nullptr, .ops = &sifraGenericFwFastPathOps, .initProperty = SifraGenericFWInitProperty,
    .cleanupProperty = SifraGenericFWCleanupProperty},
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
