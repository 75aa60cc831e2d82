#include "framework/sifra_generic_lock.h"

#include "framework/sifra_generic.h"

orr_Status SifraGenericCreateSpinlock(const char *name, orr_SpinlockType type,
                                      SifraGenericLockRank rank, orr_Spinlock *lock)
{
   orr_SpinlockProps props = {};
   props.module = orr_ModuleCurrentID;
   props.heap = sifraGenericHeapID;
   orr_NameInitialize(&props.name, name);
   props.type = type;
   props.domain = sifraGenericLockDomain;
   props.rank = static_cast<uint32_t>(rank);

   orr_Spinlock created = nullptr;
   orr_Status status = orr_SpinlockCreate(&props, &created);
   if (status != ORR_OK) {
      return status;
   }
   *lock = created;
   return ORR_OK;
}
