/*
 * Basic host types shared by every platform header: statuses, fixed names,
 * module identity and the export attribute.
 *
 * The whole platform/ folder is the contract between the module and the
 * host. It declares, it never implements: host/ is the one implementation.
 */
#pragma once

#include <cstddef>
#include <cstdint>

#define ORR_API extern "C"

/* Symbols that the loader looks up in a module image by name. */
#define ORR_MODULE_EXPORT extern "C" __attribute__((visibility("default")))

#define ORR_PRINTF(fmtIndex, firstArg) __attribute__((format(printf, fmtIndex, firstArg)))

/*
 * Host statuses. One list drives the enumeration and the texts that
 * orr_StatusToString gives.
 */
#define ORR_STATUS_LIST(X)                                    \
   X(ORR_OK,               0x00000000u, "Success")            \
   X(ORR_FAILURE,          0x0bad0001u, "Failure")            \
   X(ORR_EXISTS,           0x0bad0002u, "Already exists")     \
   X(ORR_NOT_FOUND,        0x0bad0003u, "Not found")          \
   X(ORR_BUSY,             0x0bad0004u, "Busy")               \
   X(ORR_NOT_SUPPORTED,    0x0bad0005u, "Not supported")      \
   X(ORR_TRY_AGAIN,        0x0bad0006u, "Try again")          \
   X(ORR_BAD_PARAM,        0x0bad0007u, "Bad parameter")      \
   X(ORR_LIMIT_EXCEEDED,   0x0bad000au, "Limit exceeded")     \
   X(ORR_NO_MEMORY,        0x0bad0014u, "Out of memory")      \
   X(ORR_TIMEOUT,          0x0bad0020u, "Timeout")            \
   X(ORR_NO_VM_UUID,       0x0bad0031u, "No VM UUID")         \
   X(ORR_INVALID_HANDLE,   0x0bad0039u, "Invalid handle")     \
   X(ORR_NOT_READY,        0x0bad0088u, "Not ready")          \
   X(ORR_BUFFER_TOO_SMALL, 0x0bad00dbu, "Buffer too small")

/*
 * A status is a 32-bit value; values outside the list can travel too. The
 * type is [[nodiscard]]: a status that is ignored on purpose is cast to void.
 */
enum [[nodiscard]] orr_Status : uint32_t {
#define ORR_STATUS_ENUMERATOR(name, value, text) name = value,
   ORR_STATUS_LIST(ORR_STATUS_ENUMERATOR)
#undef ORR_STATUS_ENUMERATOR
};

/* The text of a status for messages; "Unknown status" for values outside the list. */
ORR_API const char *orr_StatusToString(orr_Status status);

/* A fixed 32-byte host name: heaps, logs, timer queues, lock domains, locks. */
#define ORR_NAME_LEN 32
typedef struct orr_Name {
   char name[ORR_NAME_LEN];
} orr_Name;
static_assert(sizeof(orr_Name) == ORR_NAME_LEN);

/* Fills a name from text, cut to 31 bytes and always terminated. */
ORR_API void orr_NameInitialize(orr_Name *name, const char *text);
ORR_API void orr_NameCopy(orr_Name *dst, const orr_Name *src);

/* Module identity. */
typedef uint32_t orr_ModuleID;
#define ORR_INVALID_MODULE_ID 0xffffffffu

/*
 * The identity of the running module, the value the loader gives it before
 * init_module. Each module image defines orr_moduleCurrentID itself; the
 * loader writes it through the image's orr_ModuleInfo.
 */
extern "C" orr_ModuleID orr_moduleCurrentID;
#define orr_ModuleCurrentID (orr_moduleCurrentID)

/* Heap handle (orr_heap.h). */
typedef struct orr_HeapOpaque *orr_HeapID;

/* Lock domain (orr_lock.h): a 64-bit ID, all ones when there is none. */
typedef uint64_t orr_LockDomainID;
#define ORR_INVALID_LOCK_DOMAIN (~(orr_LockDomainID)0)
