/*
 * A tiny module image for the loader's tests. It registers, makes a heap
 * named after itself and allocates one block, and misbehaves on request
 * through its parameter TINY_MODE.
 */
#include "platform/platform.h"

enum TinyMode : int {
   TinyModeClean = 0,
   TinyModeFailLeavingObjects = 2,   /* init fails and leaves registration, heap and block */
   TinyModeLeakAtUnload = 3,         /* cleanup destroys the heap with the block live */
   TinyModeUseDuringUnload = 4,      /* cleanup returns the status of taking a use */
};

constinit orr_ModuleID orr_moduleCurrentID = ORR_INVALID_MODULE_ID;

static constinit int tinyMode = TinyModeClean;
static constinit int tinyBlockSize = 24;
/* How many times init ran against this copy of the globals. */
static constinit int tinyInitCalls = 0;
static constinit orr_ModuleID tinyModuleID = ORR_INVALID_MODULE_ID;
static constinit orr_HeapID tinyHeap = nullptr;
static constinit void *tinyBlock = nullptr;

extern "C" int TinyInitCalls(void)
{
   return tinyInitCalls;
}

extern "C" orr_Status TinyTakeUse(void)
{
   return orr_ModuleIncUseCount(tinyModuleID);
}

extern "C" void TinyDropUse(void)
{
   orr_ModuleDecUseCount(tinyModuleID);
}

/* Charges the block to its caller, as the real module's allocator does. */
__attribute__((noinline)) static void *TinyAlloc(uint32_t size)
{
   return orr_HeapAllocWithRA(tinyHeap, size, __builtin_return_address(0));
}

static int TinyInit(void)
{
   ++tinyInitCalls;
   if (orr_ModuleRegister(&tinyModuleID, ORR_MODULE_INTERFACE_REVISION) != ORR_OK) {
      return 1;
   }
   orr_HeapProps props = {};
   char name[ORR_NAME_LEN];
   if (orr_ModuleGetName(tinyModuleID, name, sizeof name) != ORR_OK) {
      goto out_unregister;
   }
   orr_NameInitialize(&props.name, name);
   props.module = tinyModuleID;
   props.maximumSize = 4096;
   if (orr_HeapCreate(&props, &tinyHeap) != ORR_OK) {
      goto out_unregister;
   }
   if (orr_ModuleSetHeapID(tinyModuleID, tinyHeap) != ORR_OK) {
      goto out_destroy_heap;
   }
   tinyBlock = TinyAlloc(static_cast<uint32_t>(tinyBlockSize));
   if (tinyBlock == nullptr) {
      goto out_destroy_heap;
   }
   if (tinyMode == TinyModeFailLeavingObjects) {
      return 1;
   }
   return 0;

out_destroy_heap:
   orr_HeapDestroy(tinyHeap);
out_unregister:
   (void)orr_ModuleUnregister(tinyModuleID);
   return 1;
}

static orr_Status TinyCleanup(void)
{
   orr_Status status = ORR_OK;
   if (tinyMode == TinyModeUseDuringUnload) {
      status = orr_ModuleIncUseCount(tinyModuleID);
   }
   if (tinyMode != TinyModeLeakAtUnload) {
      orr_HeapFree(tinyHeap, tinyBlock);
   }
   orr_HeapDestroy(tinyHeap);
   (void)orr_ModuleUnregister(tinyModuleID);
   return status;
}

static constinit const char *const tinyNamespaces[] = {"orrin#nover"};

static constinit const orr_ModuleParam tinyParams[] = {
   {"TINY_MODE", ORR_MODULE_PARAM_INT, &tinyMode, "What to get wrong"},
   {"TINY_BLOCK_SIZE", ORR_MODULE_PARAM_INT, &tinyBlockSize, "Size of the block made at init"},
};

static const orr_ModuleExport tinyExports[] = {
   {"TinyInitCalls", reinterpret_cast<orr_ExportedFn>(&TinyInitCalls)},
   {"TinyTakeUse", reinterpret_cast<orr_ExportedFn>(&TinyTakeUse)},
   {"TinyDropUse", reinterpret_cast<orr_ExportedFn>(&TinyDropUse)},
};

ORR_MODULE_EXPORT const orr_ModuleInfo orr_moduleInfo = {
   .infoVersion = ORR_MODULE_INFO_VERSION,
   .requiredNamespaces = tinyNamespaces,
   .numRequiredNamespaces = 1,
   .providedNamespace = "tiny#1.0",
   .version = "tiny 1",
   .parameters = tinyParams,
   .numParameters = 2,
   .exports = tinyExports,
   .numExports = 3,
   .currentID = &orr_moduleCurrentID,
   .initModule = TinyInit,
   .cleanupModule = TinyCleanup,
   .nexoTree = nullptr,
};
