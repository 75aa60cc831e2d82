// Whole frames through a port of the loaded module, its switch-security and
// IPv6 agents in turn: the enforcing or the learning port, either
// direction, the frame in scatter-gather elements and repeated in one list,
// the virtual clock moved on before it.
//
// Input: [flags] [clock step] [split lengths...] [frame]
//   flags bit 0: direction (0 from the VM, 1 to it)
//         bit 1: port (0 enforcing, 1 learning)
//         bits 2-3: split count
//         bit 4: VLAN ID metadata 100 instead of 0
//         bits 5-6: copies of the frame in the list, less one
#include "fuzz_input.h"
#include "loaded_module.h"

#include <chrono>
#include <cstdint>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
   swsec::fuzz::LoadedModule &module = swsec::fuzz::loadedModule();
   swsec::fuzz::FuzzInput in(data, size);
   const uint8_t flags = in.byte();
   const uint8_t clockStep = in.byte();
   const std::vector<uint8_t> rawSplits = in.bytes((flags >> 2) & 3u);

   swsec::host::FrameSpec frameSpec;
   frameSpec.bytes = in.rest();
   frameSpec.split = swsec::fuzz::clampSplits(rawSplits, frameSpec.bytes.size());
   frameSpec.vlanId = (flags & 0x10u) != 0 ? 100 : 0;
   const std::vector<swsec::host::FrameSpec> frames(1u + ((flags >> 5) & 3u), frameSpec);

   // Rate limits, pending requests and leases depend on time: up to 25.5 s a step.
   module.host.clock().advance(std::chrono::milliseconds(100 * clockStep));
   const uint32_t direction = (flags & 1u) != 0 ? ORR_SIFRA_DIR_RX : ORR_SIFRA_DIR_TX;
   const uint32_t port = (flags & 2u) != 0 ? swsec::fuzz::kLearningPort : swsec::fuzz::kEnforcingPort;
   (void)module.host.sifra().processPort(port, direction, frames);
   module.forgetRecords();
   return 0;
}
