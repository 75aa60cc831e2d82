// One verdict: every frame of every bundled capture, under every bundled
// configuration, judged by the module alone and by the kernel fast path with
// the module behind it, must get the same verdict and drop counters; the two
// port databases, and the program's map, must agree after the last frame
// and after the bindings have had time to age.
#include "support/host_fixture.h"
#include "twin.h"

#include "replay/capture.h"
#include "session/config_file.h"

#include <nlohmann/json.hpp>

#include <filesystem>
#include <fstream>

namespace swsec::testing {
namespace {

namespace fs = std::filesystem;
const fs::path kSource = SWSEC_TEST_SOURCE_DIR;

// A manifest entry (the capture, each frame's direction) and a configuration file.
using Case = std::pair<nlohmann::json, fs::path>;

std::vector<Case> allCases()
{
   std::vector<Case> cases;
   for (const auto &entry : nlohmann::json::parse(std::ifstream(kSource / "tests/data/manifest.json"))) {
      for (const auto &file : fs::directory_iterator(kSource / "examples")) {
         if (file.path().extension() == ".json") {
            cases.emplace_back(entry, file.path());
         }
      }
      // Every capture, and the stacked tags above all, under a frame guard with an ethertype list;
      // the IPv6 agent alone, the IPv4 agent's features off.
      cases.emplace_back(entry, kSource / "tests/fastpath/frame-guard.json");
      cases.emplace_back(entry, kSource / "tests/fastpath/ipv6-only.json");
   }
   return cases;
}

class OneVerdict : public ModuleTest, public ::testing::WithParamInterface<Case> {};

TEST_P(OneVerdict, the_fast_path_and_the_module_alone_agree_on_every_frame)
{
   if (const auto why = fastpath::unavailable()) {
      GTEST_SKIP() << "BPF programs cannot be loaded here: " << *why;
   }
   Twin twin(host(), 1);
   const auto &[entry, config] = GetParam();
   ASSERT_TRUE(twin.configure(session::loadConfigFile(config)));
   replay::CaptureReader capture(kSource / "tests/data" / entry["file"].get<std::string>());
   replay::CaptureFrame frame;
   // The port is configured half a second before the first frame, as replay does.
   std::optional<int64_t> originNs;
   size_t i = 0;
   for (; capture.next(frame); ++i) {
      ASSERT_LT(i, entry["frames"].size());
      originNs = originNs.value_or(frame.timeNs - 500'000'000);
      const auto due = std::chrono::microseconds((frame.timeNs - *originNs) / 1000);
      twin.advance(std::max(due - host().clock().now(), std::chrono::microseconds(0)));
      const uint32_t direction = entry["frames"][i]["fromVm"] ? SWSEC_FP_DIR_FROM_VM : SWSEC_FP_DIR_TO_VM;
      ASSERT_EQ(twin.judge(frame.bytes, direction), "") << "frame " << i + 1;
   }
   ASSERT_EQ(i, entry["frames"].size());
   ASSERT_EQ(twin.databases(), "") << "after the last frame";
   // Lifetimes the module renewed on traffic the program punted show here.
   twin.advance(std::chrono::seconds(150));
   EXPECT_EQ(twin.databases(), "") << "150 s later";
}

INSTANTIATE_TEST_SUITE_P(Captures, OneVerdict, ::testing::ValuesIn(allCases()), [](const auto &param) {
   std::string name = param.param.first["file"].template get<std::string>() + "_" + param.param.second.stem().string();
   std::replace_if(name.begin(), name.end(), [](char c) { return !std::isalnum(static_cast<unsigned char>(c)); }, '_');
   return name;
});

}  // namespace
}  // namespace swsec::testing
