// The BPF object file, built by CMake, carried in the library's read-only data.
#include "fastpath.h"

asm(".section .rodata.swsec_fastpath_object,\"a\"\n"
    ".balign 8\n"
    ".globl swsec_fastpath_object_start\n.hidden swsec_fastpath_object_start\n"
    "swsec_fastpath_object_start:\n"
    ".incbin \"" SWSEC_FASTPATH_OBJECT "\"\n"
    ".globl swsec_fastpath_object_end\n.hidden swsec_fastpath_object_end\n"
    "swsec_fastpath_object_end:\n"
    ".previous\n");

extern "C" const uint8_t swsec_fastpath_object_start[];
extern "C" const uint8_t swsec_fastpath_object_end[];

namespace swsec::fastpath {

std::span<const uint8_t> embeddedObject()
{
   return {swsec_fastpath_object_start, swsec_fastpath_object_end};
}

}  // namespace swsec::fastpath
