// Writes the fuzz targets' seed corpora from capture files: every Ethernet
// frame of the captures, wrapped in each target's input layout, and a few
// control inputs made from known-good records.
//
//   seed_corpus OUT_DIR CAPTURE...
// makes OUT_DIR/dhcp_parse_fuzz, OUT_DIR/frame_fuzz and OUT_DIR/control_fuzz.
#include "replay/capture.h"
#include "tests/support/security_config.h"

#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

namespace {

namespace fs = std::filesystem;
using Bytes = std::vector<uint8_t>;

// The frames of a capture file, read as `swsec replay` reads them.
std::vector<Bytes> framesOf(const fs::path &path)
{
   swsec::replay::CaptureReader reader(path.string());
   std::vector<Bytes> frames;
   for (swsec::replay::CaptureFrame frame; reader.next(frame);) {
      frames.emplace_back(frame.bytes.begin(), frame.bytes.end());
   }
   return frames;
}

void write(const fs::path &path, const Bytes &prefix, const Bytes &body)
{
   std::ofstream out(path, std::ios::binary | std::ios::trunc);
   out.write(reinterpret_cast<const char *>(prefix.data()), static_cast<std::streamsize>(prefix.size()));
   out.write(reinterpret_cast<const char *>(body.data()), static_cast<std::streamsize>(body.size()));
}

}  // namespace

int main(int argc, char **argv)
{
   if (argc < 3) {
      std::fprintf(stderr, "usage: seed_corpus OUT_DIR CAPTURE...\n");
      return 2;
   }
   const fs::path out = argv[1];
   const fs::path dhcpDir = out / "dhcp_parse_fuzz";
   const fs::path frameDir = out / "frame_fuzz";
   const fs::path controlDir = out / "control_fuzz";
   for (const auto &dir : {dhcpDir, frameDir, controlDir}) {
      fs::create_directories(dir);
   }

   size_t count = 0;
   try {
      for (int i = 2; i < argc; ++i) {
         const fs::path capture = argv[i];
         const std::string stem = capture.stem().string();
         const auto frames = framesOf(capture);
         for (size_t n = 0; n < frames.size(); ++n) {
            const std::string name = stem + "-" + std::to_string(n + 1);
            // No split, the whole frame mapped.
            write(dhcpDir / name, {0, 0x05, 0xee}, frames[n]);
            // From the VM through the enforcing port, and to the VM through the learning one,
            // 200 ms apart: slower than the ARP and ND rate limits, so that a flood among
            // the seeds does not hold the port in the error state for the seeds after it.
            write(frameDir / (name + "-tx"), {0x00, 2}, frames[n]);
            write(frameDir / (name + "-rx"), {0x03, 2}, frames[n]);
            ++count;
         }
      }
   } catch (const std::exception &e) {
      std::fprintf(stderr, "seed_corpus: %s\n", e.what());
      return 1;
   }

   using swsec::testing::configRecord;
   const swsec::testing::StaticBinding vm{.vlan = 0, .mac = {0x02, 0, 0x5e, 0xc0, 0, 1}, .ip = {192, 0, 2, 101}};
   write(controlDir / "security-learning", {0, 0}, configRecord(swsec::testing::learningConfig()));
   write(controlDir / "security-enforcing", {0, 1}, configRecord(swsec::testing::enforcingConfig({vm, vm})));
   for (uint8_t type = 0; type < 16; ++type) {
      // Request ID 1, then the message type as the payload's first u32.
      write(controlDir / ("ioctl-" + std::to_string(type)), {1, 0, 0, 0, 0, 1}, {type, 0, 0, 0, 0, 0, 0, 0});
   }
   const auto text = [](std::string_view chars) { return Bytes(chars.begin(), chars.end()); };
   write(controlDir / "agent-one", {2, 0}, text("swsec-extra"));
   write(controlDir / "agent-args", {2, 0}, text("a:b,c"));
   std::printf("seed_corpus: %zu frames\n", count);
   return 0;
}
