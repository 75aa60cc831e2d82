/*
 * Module registration, module information published to the loader, module
 * parameters and the module use count.
 */
#pragma once

#include "platform/orr_base.h"
#include "platform/orr_nexo.h"

/* Interface revision a module registers with. */
#define ORR_MODULE_INTERFACE_REVISION 0x2020000u

ORR_API orr_Status orr_ModuleRegister(orr_ModuleID *moduleID, uint32_t revision);
ORR_API orr_Status orr_ModuleUnregister(orr_ModuleID moduleID);
/* Copies the module's name, terminated, into a buffer of `size` bytes. */
ORR_API orr_Status orr_ModuleGetName(orr_ModuleID moduleID, char *buffer, uint32_t size);
ORR_API orr_Status orr_ModuleSetHeapID(orr_ModuleID moduleID, orr_HeapID heap);
/*
 * Use count: while it is above zero the loader refuses to unload the module.
 * The increment can be refused (a module being unloaded takes no new users).
 */
ORR_API orr_Status orr_ModuleIncUseCount(orr_ModuleID moduleID);
ORR_API void orr_ModuleDecUseCount(orr_ModuleID moduleID);

/*
 * What a module image publishes to the loader, found by the symbol name
 * "orr_moduleInfo". Every member is constant data: the loader reads it and
 * writes only through `parameters[i].value` and `currentID`.
 */
typedef enum orr_ModuleParamType : uint32_t {
   ORR_MODULE_PARAM_INT = 1,
} orr_ModuleParamType;

typedef struct orr_ModuleParam {
   const char *name;
   orr_ModuleParamType type;
   int *value;               /* the module's variable, holding its default */
   const char *description;
} orr_ModuleParam;

/* A function exported to other modules; the caller knows its real type. */
typedef void (*orr_ExportedFn)(void);

typedef struct orr_ModuleExport {
   const char *name;
   orr_ExportedFn function;
} orr_ModuleExport;

#define ORR_MODULE_INFO_VERSION 1u

typedef struct orr_ModuleInfo {
   uint32_t infoVersion;                  /* ORR_MODULE_INFO_VERSION */
   const char *const *requiredNamespaces;
   uint32_t numRequiredNamespaces;
   const char *providedNamespace;         /* the namespace of `exports` */
   const char *version;
   const orr_ModuleParam *parameters;
   uint32_t numParameters;
   const orr_ModuleExport *exports;
   uint32_t numExports;
   orr_ModuleID *currentID;               /* where the loader writes the module's identity */
   int (*initModule)(void);               /* 0 when ready, 1 on failure */
   orr_Status (*cleanupModule)(void);
   /* The module's branch of the Nexo tree; null: none. Installed while loaded. */
   const Nexo_Tree *nexoTree;
} orr_ModuleInfo;

#define ORR_MODULE_INFO_SYMBOL "orr_moduleInfo"
