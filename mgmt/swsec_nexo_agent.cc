/* "createAgent": a fast path agent made on an administrator's request. */
#include "mgmt/swsec_nexo.h"

#include "framework/sifra_generic_agent.h"
#include "platform/orr_text.h"

orr_Status SwSecNexoCreateAgent(const Nexo_NodeDef *, const Nexo_ParamList *, const Nexo_ParamList *input)
{
   const char *text = nullptr;
   orr_Status status = Nexo_ParamListGetString(input, 0, &text);
   if (status != ORR_OK) {
      return status;
   }
   /*
    * The agent code cuts the text at its first ':' in place, and the host's
    * copy is not ours to change: work on a local copy. It has room for the
    * longest name and arguments the agent keeps, so nothing it would use is lost.
    */
   char creation[SIFRAGENERIC_AGENT_NAME_LEN + SIFRAGENERIC_AGENT_ARGS_LEN];
   const size_t length = orr_Strnlen(text, sizeof creation - 1);
   orr_Memcpy(creation, text, length);
   creation[length] = '\0';
   /* No duplicate check: the host's registration refuses a name it has. */
   return SifraGenericInitFastPathAgent(creation);
}
