// swsec runs the module linked into the program unless --module names an
// image, which the host's loader opens as the hypervisor would. Both are
// the same module sources: over every bundled capture, under both manifest
// settings, with frames one at a time (a list each), the two must report
// the same JSON (verdicts, notifications, database, counters, log and the
// host's checks), byte for byte but for addresses in log lines.
#include "replay_support.h"

#include "replay/capture.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <cstdlib>
#include <fstream>
#include <regex>

namespace swsec::testing {
namespace {

using nlohmann::json;

std::string moduleImage()
{
   const char *path = std::getenv("SWSEC_MODULE_PATH");
   return path != nullptr ? path : "";
}

// A log line may show an address (of the frame's bytes), which differs from run to run.
std::string withoutAddresses(const std::string &text)
{
   static const std::regex address("0x[0-9a-f]{8,}");
   return std::regex_replace(text, address, "0x(address)");
}

TEST(LinkedModule, reports_what_the_module_image_reports_on_every_bundled_capture)
{
   ASSERT_FALSE(moduleImage().empty()) << "SWSEC_MODULE_PATH names the built image";
   // Every capture, one after another (an idle hour between two, so that
   // leases and requests age out), with the manifest's directions so that
   // no frame depends on a MAC guess: one run a module and a setting keeps
   // the test quick under the sanitizers.
   std::vector<CapturedFrame> all;
   int64_t base = 0;
   for (const auto &entry : manifest()) {
      const std::string file = entry["file"];
      auto frames = readCapture(sourceDir() / "tests/data" / file);
      ASSERT_EQ(frames.size(), entry["frames"].size()) << file;
      ASSERT_FALSE(frames.empty()) << file;
      const int64_t first = frames.front().timeNs;
      for (size_t i = 0; i < frames.size(); ++i) {
         frames[i].direction = entry["frames"][i]["fromVm"].get<bool>() ? replay::kDirFromVm : replay::kDirToVm;
         frames[i].timeNs = base + (frames[i].timeNs - first);
      }
      base = frames.back().timeNs + int64_t{3600} * 1'000'000'000;
      all.insert(all.end(), frames.begin(), frames.end());
   }
   TempDir dir;
   const auto capture = dir.path() / "all.pcapng";
   writePcapng(capture, all);

   for (const std::string config : {"", "enforcing"}) {
      std::vector<std::string> args{"replay", "--json", "--batch", "1", "--until", "300"};
      if (!config.empty()) {
         args.insert(args.end(), {"--config", (sourceDir() / "examples/enforcing.json").string()});
      }
      args.push_back(capture.string());
      const ToolRun linked = runTool(args);
      args.insert(args.begin() + 1, {"--module", moduleImage()});
      const ToolRun image = runTool(args);
      SCOPED_TRACE("config '" + config + "'");
      EXPECT_EQ(linked.status, 0) << linked.err;
      EXPECT_EQ(image.status, linked.status) << image.err;
      EXPECT_EQ(withoutAddresses(image.out), withoutAddresses(linked.out));
      // The run did judge and learn: a frame record each, bindings announced.
      EXPECT_EQ(json::parse(linked.out)["frames"].size(), all.size());
      EXPECT_NE(linked.out.find("portdb.entry.added"), std::string::npos);
   }
}

}  // namespace
}  // namespace swsec::testing
