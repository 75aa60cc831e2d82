#include "replay_support.h"

#include <sys/wait.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <stdexcept>

namespace swsec::testing {

const nlohmann::json &manifest()
{
   static const nlohmann::json doc = [] {
      std::ifstream in(sourceDir() / "tests/data/manifest.json");
      return nlohmann::json::parse(in);
   }();
   return doc;
}

std::filesystem::path sourceDir()
{
   const char *dir = std::getenv("SWSEC_SOURCE_DIR");
   return dir != nullptr ? dir : SWSEC_TEST_SOURCE_DIR;
}

std::filesystem::path toolPath()
{
   const char *dir = std::getenv("SWSEC_BINARY_DIR");
   return std::filesystem::path(dir != nullptr ? dir : SWSEC_TEST_BINARY_DIR) / "tools" / "swsec";
}

std::string example()
{
   return (sourceDir() / "examples/example-dhcp-then-spoof.pcap").string();
}

std::string enforcing()
{
   return (sourceDir() / "examples/enforcing.json").string();
}

TempDir::TempDir()
{
   std::string pattern = (std::filesystem::temp_directory_path() / "swsec-replay-XXXXXX").string();
   if (mkdtemp(pattern.data()) == nullptr) {
      throw std::runtime_error("mkdtemp failed");
   }
   path_ = pattern;
}

TempDir::~TempDir()
{
   std::error_code ec;
   std::filesystem::permissions(path_, std::filesystem::perms::owner_all, ec);
   std::filesystem::remove_all(path_, ec);
}

std::vector<std::string> TempDir::files() const
{
   std::vector<std::string> names;
   for (const auto &entry : std::filesystem::directory_iterator(path_)) {
      names.push_back(entry.path().filename().string());
   }
   std::sort(names.begin(), names.end());
   return names;
}

std::vector<CapturedFrame> readCapture(const std::filesystem::path &path)
{
   replay::CaptureReader reader(path.string());
   std::vector<CapturedFrame> frames;
   replay::CaptureFrame frame;
   while (reader.next(frame)) {
      frames.push_back({frame.timeNs, {frame.bytes.begin(), frame.bytes.end()}, frame.recordedDirection});
   }
   return frames;
}

void put32(std::string &out, uint32_t v)
{
   out.append(reinterpret_cast<const char *>(&v), 4);
}

std::string pcapngBytes(const std::vector<CapturedFrame> &frames)
{
   std::string out;
   // A section header (byte-order magic, version 1.0, length unknown), then
   // an Ethernet interface with microsecond timestamps (the default).
   for (uint32_t word : {0x0A0D0D0Au, 28u, 0x1A2B3C4Du, 1u, 0xffffffffu, 0xffffffffu, 28u, 1u, 20u, 1u, 262144u, 20u}) {
      put32(out, word);
   }
   for (const auto &frame : frames) {
      const auto size = static_cast<uint32_t>(frame.bytes.size());
      const uint32_t padded = (size + 3u) & ~3u;
      const bool flags = frame.direction != replay::kDirUnknown;
      const uint32_t length = 32 + padded + (flags ? 12 : 0);
      const auto micros = static_cast<uint64_t>(frame.timeNs / 1000);
      for (uint32_t word : {6u, length, 0u, static_cast<uint32_t>(micros >> 32), static_cast<uint32_t>(micros), size, size}) {
         put32(out, word);
      }
      out.append(reinterpret_cast<const char *>(frame.bytes.data()), size);
      out.append(padded - size, '\0');
      if (flags) {
         // epb_flags: 1 inbound (to the VM), 2 outbound (from it); the end of options.
         for (uint32_t word : {0x00040002u, frame.direction == replay::kDirToVm ? 1u : 2u, 0u}) {
            put32(out, word);
         }
      }
      put32(out, length);
   }
   return out;
}

void writePcapng(const std::filesystem::path &path, const std::vector<CapturedFrame> &frames)
{
   writeFile(path, pcapngBytes(frames));
}

void writeFile(const std::filesystem::path &path, const std::string &bytes)
{
   std::ofstream file(path, std::ios::binary);
   file << bytes;
}

std::string slurp(const std::filesystem::path &path)
{
   std::ifstream in(path, std::ios::binary);
   std::ostringstream text;
   text << in.rdbuf();
   return text.str();
}

ToolRun runTool(const std::vector<std::string> &args, const std::string &shell)
{
   TempDir dir;
   std::string command = shell + " '" + toolPath().string() + "'";
   for (const auto &arg : args) {
      command += " '" + arg + "'";
   }
   command += " >'" + (dir.path() / "out").string() + "' 2>'" + (dir.path() / "err").string() + "'";
   const int raw = std::system(command.c_str());
   ToolRun run;
   run.status = WIFEXITED(raw) ? WEXITSTATUS(raw) : -1;
   run.out = slurp(dir.path() / "out");
   run.err = slurp(dir.path() / "err");
   return run;
}

}  // namespace swsec::testing
