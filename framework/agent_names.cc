/* Splitting the agent-creation property's text into agent names. */
#include "framework/sifra_generic_agent.h"

orr_Status SifraGenericForEachAgentName(char *text, SifraGenericAgentNameFn registerName,
                                        void *context)
{
   /*
    * The name most recently found. A name that ends at the end of the text
    * is handed over only here, at the end; one that ends at a space is
    * handed over at once and stays pending, so a text that ends with a
    * space offers its last name twice.
    */
   char *pending = nullptr;
   char *cursor = text;

   for (;;) {
      if (*cursor == '\0') {
         return pending != nullptr ? registerName(pending, context) : ORR_OK;
      }
      pending = cursor;
      while (*cursor != '\0' && *cursor != ' ') {
         cursor++;
      }
      if (*cursor == '\0') {
         continue;
      }
      *cursor = '\0';
      orr_Status status = registerName(pending, context);
      if (status != ORR_OK) {
         return status;
      }
      cursor++;
   }
}
