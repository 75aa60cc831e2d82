/* What the module image publishes to the host loader. */
#include "fhs/fhs_export.h"
#include "framework/sifra_generic.h"
#include "mgmt/swsec_nexo.h"
#include "module/module_entry.h"
#include "platform/orr_module.h"
#include "swsec/swsec_port_db_export.h"

#ifndef SWSEC_BUILD_DATE
#error "SWSEC_BUILD_DATE must be set by the build"
#endif

constinit orr_ModuleID orr_moduleCurrentID = ORR_INVALID_MODULE_ID;

constinit int SIFRAGENERIC_HEAP_MIN_SIZE = 4096;
constinit int SIFRAGENERIC_HEAP_MAX_SIZE = 0x40000000;
constinit int SIFRAGENERIC_SLOWPATH_TIMEOUT = 2000;

static constinit const char *const sifraGenericRequiredNamespaces[] = {
   "com.tarlin.orrapi#v2_2_0_0",
   "com.tarlin.orrapi.incompat#v2_2_0_0",
   "orrin#nover",
};

static constinit const orr_ModuleParam sifraGenericModuleParams[] = {
   {"SIFRAGENERIC_HEAP_MIN_SIZE", ORR_MODULE_PARAM_INT, &SIFRAGENERIC_HEAP_MIN_SIZE,
    "Minimum heap size (default: 4096 bytes)"},
   {"SIFRAGENERIC_HEAP_MAX_SIZE", ORR_MODULE_PARAM_INT, &SIFRAGENERIC_HEAP_MAX_SIZE,
    "Maximum heap size (default: 1GB)"},
   {"SIFRAGENERIC_SLOWPATH_TIMEOUT", ORR_MODULE_PARAM_INT, &SIFRAGENERIC_SLOWPATH_TIMEOUT,
    "Slow path communication timeout (default: 2000ms)"},
};

/*
 * The callers know each function's real type. The casts are folded at
 * compile time (address constants), so the table needs no constructor.
 */
static const orr_ModuleExport sifraGenericModuleExports[] = {
   {"SwSec_PortDBReleaseBuf", reinterpret_cast<orr_ExportedFn>(&SwSec_PortDBReleaseBuf)},
   {"SwSec_PortDBGetEntries", reinterpret_cast<orr_ExportedFn>(&SwSec_PortDBGetEntries)},
   {"SwSec_PortDBGetNumEntries", reinterpret_cast<orr_ExportedFn>(&SwSec_PortDBGetNumEntries)},
   {"Fhs_BindingsReleaseBuf", reinterpret_cast<orr_ExportedFn>(&Fhs_BindingsReleaseBuf)},
   {"Fhs_BindingsGetEntries", reinterpret_cast<orr_ExportedFn>(&Fhs_BindingsGetEntries)},
   {"Fhs_BindingsGetNumEntries", reinterpret_cast<orr_ExportedFn>(&Fhs_BindingsGetNumEntries)},
};


ORR_MODULE_EXPORT const orr_ModuleInfo orr_moduleInfo = {
   .infoVersion = ORR_MODULE_INFO_VERSION,
   .requiredNamespaces = sifraGenericRequiredNamespaces,
   .numRequiredNamespaces = SifraGenericCountOf(sifraGenericRequiredNamespaces),
   .providedNamespace = "switchSecurity#1.0",
   .version = "Verison 0.1.0-0 (Built on: " SWSEC_BUILD_DATE ")",
   .parameters = sifraGenericModuleParams,
   .numParameters = SifraGenericCountOf(sifraGenericModuleParams),
   .exports = sifraGenericModuleExports,
   .numExports = SifraGenericCountOf(sifraGenericModuleExports),
   .currentID = &orr_moduleCurrentID,
   .initModule = sifraGenericInitModule,
   .cleanupModule = sifraGenericCleanupModule,
   .nexoTree = &swsecNexoTree,
};
