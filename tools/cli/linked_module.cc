// The module swsec runs by default: its objects are linked into the
// program, so the compiler sees the module and the host as one program.
// `--module IMAGE` opens a module image through the host's loader instead,
// as the hypervisor would.
#include "cli/commands.h"

extern "C" const orr_ModuleInfo orr_moduleInfo;

namespace swsec::tools {

const orr_ModuleInfo *linkedModule()
{
   return &orr_moduleInfo;
}

}  // namespace swsec::tools
