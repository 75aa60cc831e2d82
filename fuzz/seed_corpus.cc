// Writes the fuzz targets' seed corpora from capture files: every Ethernet
// frame of the captures, wrapped in each target's input layout, and a few
// control inputs made from known-good records.
//
//   seed_corpus OUT_DIR CAPTURE...
// makes OUT_DIR/dhcp_parse_fuzz, OUT_DIR/frame_fuzz and OUT_DIR/control_fuzz.
#include "tests/support/security_config.h"

#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <string>
#include <vector>

namespace {

namespace fs = std::filesystem;
using Bytes = std::vector<uint8_t>;

constexpr uint32_t kLinkTypeEthernet = 1;
constexpr size_t kGlobalHeaderLen = 24;
constexpr size_t kRecordHeaderLen = 16;

uint32_t readU32(const Bytes &bytes, size_t at, bool swapped)
{
   uint32_t value = 0;
   for (size_t i = 0; i < 4; ++i) {
      const size_t index = swapped ? at + i : at + 3 - i;
      value = value << 8 | bytes[index];
   }
   return value;
}

// The frames of a classic capture file (either byte order, micro- or
// nanosecond stamps), each record bounded by the file's length.
std::vector<Bytes> framesOf(const fs::path &path)
{
   std::ifstream file(path, std::ios::binary);
   const Bytes bytes{std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
   if (bytes.size() < kGlobalHeaderLen) {
      throw std::runtime_error(path.string() + ": too short for a capture");
   }
   const uint32_t magic = readU32(bytes, 0, false);
   bool swapped = false;
   if (magic == 0xd4c3b2a1u || magic == 0x4d3cb2a1u) {
      swapped = true;
   } else if (magic != 0xa1b2c3d4u && magic != 0xa1b23c4du) {
      throw std::runtime_error(path.string() + ": not a capture file");
   }
   if (readU32(bytes, 20, swapped) != kLinkTypeEthernet) {
      throw std::runtime_error(path.string() + ": not Ethernet");
   }
   std::vector<Bytes> frames;
   size_t at = kGlobalHeaderLen;
   while (bytes.size() - at >= kRecordHeaderLen) {
      const uint32_t length = readU32(bytes, at + 8, swapped);
      at += kRecordHeaderLen;
      if (length > bytes.size() - at) {
         throw std::runtime_error(path.string() + ": record past the end");
      }
      frames.emplace_back(bytes.begin() + static_cast<std::ptrdiff_t>(at),
                          bytes.begin() + static_cast<std::ptrdiff_t>(at + length));
      at += length;
   }
   return frames;
}

void write(const fs::path &path, const Bytes &prefix, const Bytes &body)
{
   std::ofstream out(path, std::ios::binary | std::ios::trunc);
   out.write(reinterpret_cast<const char *>(prefix.data()), static_cast<std::streamsize>(prefix.size()));
   out.write(reinterpret_cast<const char *>(body.data()), static_cast<std::streamsize>(body.size()));
}

Bytes textBytes(std::string_view text)
{
   return Bytes(text.begin(), text.end());
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
   write(controlDir / "agent-one", {2, 0}, textBytes("swsec-extra"));
   write(controlDir / "agent-args", {2, 0}, textBytes("a:b,c"));
   std::printf("seed_corpus: %zu frames\n", count);
   return 0;
}
