/*
 * Lock domains, spinlocks (plain and reader-writer) and the sleeping mutex.
 *
 * Every spinlock has a rank within its lock domain; a thread takes locks in
 * strictly increasing rank. No spinlock may be held across a sleep.
 */
#pragma once

#include "platform/orr_base.h"

ORR_API orr_Status orr_LockDomainCreate(orr_ModuleID module, orr_HeapID heap,
                                        const orr_Name *name, orr_LockDomainID *domain);
ORR_API void orr_LockDomainDestroy(orr_LockDomainID domain);

typedef struct orr_SpinlockOpaque *orr_Spinlock;

enum orr_SpinlockType : uint32_t {
   ORR_SPINLOCK_PLAIN = 1,
   ORR_SPINLOCK_RW = 3,
};

typedef struct orr_SpinlockProps {
   orr_ModuleID module;
   orr_HeapID heap;
   orr_Name name;
   orr_SpinlockType type;
   orr_LockDomainID domain;
   uint32_t rank;
} orr_SpinlockProps;

ORR_API orr_Status orr_SpinlockCreate(const orr_SpinlockProps *props, orr_Spinlock *lock);
ORR_API void orr_SpinlockDestroy(orr_Spinlock lock);
/* Plain spinlocks. */
ORR_API void orr_SpinlockLock(orr_Spinlock lock);
ORR_API void orr_SpinlockUnlock(orr_Spinlock lock);
/* Reader-writer spinlocks. */
ORR_API void orr_SpinlockReadLock(orr_Spinlock lock);
ORR_API void orr_SpinlockReadUnlock(orr_Spinlock lock);
ORR_API void orr_SpinlockWriteLock(orr_Spinlock lock);
ORR_API void orr_SpinlockWriteUnlock(orr_Spinlock lock);

/*
 * A sleeping mutex that needs no creation: a zero-filled or
 * ORR_MUTEX_INITIALIZER record is unlocked. It may not be taken while a
 * spinlock is held, and is taken before any spinlock.
 */
typedef struct orr_Mutex {
   const char *name;
   uint32_t state;
   uint32_t waiters;
} orr_Mutex;

#define ORR_MUTEX_INITIALIZER(text) { (text), 0u, 0u }

ORR_API void orr_MutexLock(orr_Mutex *mutex);
ORR_API void orr_MutexUnlock(orr_Mutex *mutex);
