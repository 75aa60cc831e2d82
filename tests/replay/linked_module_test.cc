// swsec runs the module linked into the program unless --module names an
// image, which the host's loader opens as the hypervisor would. Both are
// the same module sources: on every bundled capture, under both manifest
// settings, with frames one at a time (a list each), the two must report
// the same JSON (verdicts, notifications, database, counters, log and the
// host's checks), byte for byte but for addresses in log lines.
#include "replay_support.h"

#include "replay_capture.h"

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
   std::ifstream in(sourceDir() / "tests/data/manifest.json");
   const json manifest = json::parse(in);
   TempDir dir;
   for (const auto &entry : manifest) {
      const std::string file = entry["file"];
      // The manifest's directions, so that no frame depends on a MAC guess.
      auto frames = readCapture(sourceDir() / "tests/data" / file);
      ASSERT_EQ(frames.size(), entry["frames"].size()) << file;
      for (size_t i = 0; i < frames.size(); ++i) {
         frames[i].direction = entry["frames"][i]["fromVm"].get<bool>() ? replay::kDirFromVm : replay::kDirToVm;
      }
      const auto capture = dir.path() / "directed.pcapng";
      writePcapng(capture, frames);

      for (const std::string config : {"", "enforcing"}) {
         for (const std::string batch : {"1"}) {
            std::vector<std::string> args{"replay", "--json", "--batch", batch, "--until", "300"};
            if (!config.empty()) {
               args.insert(args.end(), {"--config", (sourceDir() / "examples/enforcing.json").string()});
            }
            args.push_back(capture.string());
            const ToolRun linked = runTool(args);
            args.insert(args.begin() + 1, {"--module", moduleImage()});
            const ToolRun image = runTool(args);
            SCOPED_TRACE(file + " config '" + config + "' batch " + batch);
            EXPECT_EQ(linked.status, 0) << linked.err;
            EXPECT_EQ(image.status, linked.status) << image.err;
            EXPECT_EQ(withoutAddresses(image.out), withoutAddresses(linked.out));
            EXPECT_FALSE(json::parse(linked.out)["frames"].empty());
         }
      }
   }
}

TEST(LinkedModule, a_named_image_is_really_opened)
{
   const ToolRun run = runTool({"info", "--module", "/nonexistent/swsec.so"});
   EXPECT_NE(run.status, 0);
   EXPECT_NE((run.out + run.err).find("/nonexistent/swsec.so"), std::string::npos) << run.err;
}

}  // namespace
}  // namespace swsec::testing
