#include "replay_support.h"

#include <sys/wait.h>

#include <fstream>

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

namespace {

void put32(std::string &out, uint32_t v)
{
   out.append(reinterpret_cast<const char *>(&v), 4);
}

void put16(std::string &out, uint16_t v)
{
   out.append(reinterpret_cast<const char *>(&v), 2);
}

}  // namespace

void writePcapng(const std::filesystem::path &path, const std::vector<CapturedFrame> &frames)
{
   std::string out;
   // Section header: byte-order magic, version 1.0, unknown section length.
   put32(out, 0x0A0D0D0A);
   put32(out, 28);
   put32(out, 0x1A2B3C4D);
   put16(out, 1);
   put16(out, 0);
   put32(out, 0xffffffff);
   put32(out, 0xffffffff);
   put32(out, 28);
   // Interface: Ethernet, microsecond timestamps (the default).
   put32(out, 1);
   put32(out, 20);
   put16(out, 1);
   put16(out, 0);
   put32(out, 262144);
   put32(out, 20);
   for (const auto &frame : frames) {
      const uint32_t padded = (static_cast<uint32_t>(frame.bytes.size()) + 3u) & ~3u;
      const bool flags = frame.direction != replay::kDirUnknown;
      const uint32_t length = 32 + padded + (flags ? 12 : 0);
      const uint64_t micros = static_cast<uint64_t>(frame.timeNs / 1000);
      put32(out, 6);
      put32(out, length);
      put32(out, 0);
      put32(out, static_cast<uint32_t>(micros >> 32));
      put32(out, static_cast<uint32_t>(micros));
      put32(out, static_cast<uint32_t>(frame.bytes.size()));
      put32(out, static_cast<uint32_t>(frame.bytes.size()));
      out.append(reinterpret_cast<const char *>(frame.bytes.data()), frame.bytes.size());
      out.append(padded - frame.bytes.size(), '\0');
      if (flags) {
         put16(out, 2);   // epb_flags: 1 inbound (to the VM), 2 outbound (from it)
         put16(out, 4);
         put32(out, frame.direction == replay::kDirToVm ? 1u : 2u);
         put32(out, 0);   // end of options
      }
      put32(out, length);
   }
   writeFile(path, out);
}

void writeFile(const std::filesystem::path &path, const std::string &bytes)
{
   std::ofstream file(path, std::ios::binary);
   file << bytes;
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
   auto slurp = [](const std::filesystem::path &p) {
      std::ifstream in(p);
      std::ostringstream text;
      text << in.rdbuf();
      return text.str();
   };
   run.out = slurp(dir.path() / "out");
   run.err = slurp(dir.path() / "err");
   return run;
}

}  // namespace swsec::testing
