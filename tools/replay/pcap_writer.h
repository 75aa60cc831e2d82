// A pcap file written whole or not at all (session::AtomicFile) to the file
// the target resolved to.
#pragma once

#include "replay/output_path.h"
#include "session/atomic_file.h"

#include <cstdint>
#include <span>
#include <string>

struct pcap;
struct pcap_dumper;

namespace swsec::replay {

class PcapWriter {
public:
   // Throws session::InputError naming the output when the temporary file cannot be
   // made. The file gets the target's mode.
   explicit PcapWriter(const OutputTarget &target);
   ~PcapWriter();
   PcapWriter(const PcapWriter &) = delete;
   PcapWriter &operator=(const PcapWriter &) = delete;

   void write(int64_t timeNs, std::span<const uint8_t> bytes);
   // Flushes, closes and renames; throws session::InputError on a write failure.
   void commit();

private:
   void closeDumper();

   session::AtomicFile file_;
   pcap *dead_ = nullptr;
   pcap_dumper *dumper_ = nullptr;
};

}  // namespace swsec::replay
