// A pcap file written whole or not at all: frames go to a temporary file in
// the target's directory, renamed over the target by commit(); a writer
// destroyed without commit removes its temporary file.
#pragma once

#include "replay/output_path.h"

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
   void discard();

   std::string named_;
   std::string path_;
   std::string tempPath_;
   pcap *dead_ = nullptr;
   pcap_dumper *dumper_ = nullptr;
};

}  // namespace swsec::replay
