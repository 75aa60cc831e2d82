// Shared by the replay tests: where the data and the tool are, temporary
// directories, and captures written with per-packet directions.
#pragma once

#include "replay/capture.h"

#include <nlohmann/json.hpp>

#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

namespace swsec::testing {

std::filesystem::path sourceDir();
std::filesystem::path toolPath();

// tests/data/manifest.json: every bundled capture with its expected outcome.
const nlohmann::json &manifest();

// The example capture, its VM's MAC and the enforcing port configuration.
inline const std::string kVmMac = "02:00:5e:c0:00:01";
std::string example();
std::string enforcing();

// A fresh directory removed at the end of the test.
class TempDir {
public:
   TempDir();
   ~TempDir();
   TempDir(const TempDir &) = delete;
   TempDir &operator=(const TempDir &) = delete;
   const std::filesystem::path &path() const { return path_; }
   // Names of the files in it, sorted.
   std::vector<std::string> files() const;

private:
   std::filesystem::path path_;
};

struct CapturedFrame {
   int64_t timeNs = 0;
   std::vector<uint8_t> bytes;
   uint8_t direction = replay::kDirUnknown;   // written as the EPB flags
};

std::vector<CapturedFrame> readCapture(const std::filesystem::path &path);
// A pcapng file: a section, an interface, then a packet block per frame.
std::string pcapngBytes(const std::vector<CapturedFrame> &frames);
void writePcapng(const std::filesystem::path &path, const std::vector<CapturedFrame> &frames);
void put32(std::string &out, uint32_t v);
void writeFile(const std::filesystem::path &path, const std::string &bytes);
std::string slurp(const std::filesystem::path &path);

struct ToolRun {
   int status = 0;
   std::string out;
   std::string err;
};
// Runs the swsec binary with `args` (each quoted for the shell). `shell`
// goes before the command as it is: "umask 077;", "cat 'x' |".
ToolRun runTool(const std::vector<std::string> &args, const std::string &shell = "");

}  // namespace swsec::testing
