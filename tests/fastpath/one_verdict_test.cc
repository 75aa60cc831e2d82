// One verdict: every frame of every bundled capture, under every bundled
// configuration, judged by the module alone and by the kernel fast path with
// the module behind it, must get the same verdict and drop counters; the two
// port databases, and the program's map, must agree after the last frame
// and after the bindings have had time to age.
#include "support/host_fixture.h"
#include "twin.h"

#include <nlohmann/json.hpp>
#include <pcap/pcap.h>

#include <cstring>
#include <filesystem>
#include <fstream>

namespace swsec::testing {
namespace {

using nlohmann::json;
namespace fs = std::filesystem;

fs::path sourceDir()
{
   return SWSEC_TEST_SOURCE_DIR;
}

json readJson(const fs::path &path)
{
   std::ifstream in(path);
   return json::parse(in);
}

// The configuration file as the security property's record.
std::vector<uint8_t> configRecord(const json &config)
{
   static const std::map<std::string, uint32_t> kFeatures = {
      {"bpdu-filter", 0x1}, {"block-dhcp-server", 0x2}, {"ip-discovery", 0x4}, {"dai", 0x8}, {"ip-source-guard", 0x10}};
   const json statics = config.value("static", json::array());
   std::vector<uint8_t> record(26 + 12 * statics.size());
   uint32_t features = 0;
   for (const auto &name : config.value("features", json::array())) {
      features |= kFeatures.at(name.get<std::string>());
   }
   const uint32_t header[] = {config.value("portDbSize", 32u), static_cast<uint32_t>(statics.size()),
                              config.value("arpRateLimit", 0u), config.value("errRateLimit", 0u),
                              config.value("errRateLimitPeriod", 0u)};
   record[0] = 1;
   std::memcpy(&record[1], &features, 4);
   record[5] = config.value("trusted", true) ? 1 : 0;
   std::memcpy(&record[6], header, sizeof header);
   for (size_t i = 0; i < statics.size(); ++i) {
      uint8_t *entry = &record[26 + 12 * i];
      const uint16_t vlan = statics[i]["vlan"];
      std::memcpy(entry, &vlan, 2);
      std::sscanf(statics[i]["mac"].get<std::string>().c_str(), "%hhx:%hhx:%hhx:%hhx:%hhx:%hhx", entry + 2, entry + 3,
                  entry + 4, entry + 5, entry + 6, entry + 7);
      std::sscanf(statics[i]["ip"].get<std::string>().c_str(), "%hhu.%hhu.%hhu.%hhu", entry + 8, entry + 9, entry + 10,
                  entry + 11);
   }
   return record;
}

struct Frame {
   std::chrono::microseconds time;
   std::vector<uint8_t> bytes;
};

std::vector<Frame> readCapture(const fs::path &path)
{
   char error[PCAP_ERRBUF_SIZE];
   pcap_t *pcap = pcap_open_offline(path.c_str(), error);
   if (pcap == nullptr) {
      throw std::runtime_error(error);
   }
   std::vector<Frame> frames;
   pcap_pkthdr *header = nullptr;
   const u_char *data = nullptr;
   while (pcap_next_ex(pcap, &header, &data) == 1) {
      frames.push_back({std::chrono::seconds(header->ts.tv_sec) + std::chrono::microseconds(header->ts.tv_usec),
                        std::vector<uint8_t>(data, data + header->caplen)});
   }
   pcap_close(pcap);
   return frames;
}

struct Case {
   std::string capture;
   std::string config;
};

void PrintTo(const Case &c, std::ostream *out)
{
   *out << c.capture << " under " << c.config;
}

std::vector<Case> allCases()
{
   std::vector<Case> cases;
   for (const auto &entry : readJson(sourceDir() / "tests/data/manifest.json")) {
      for (const auto &file : fs::directory_iterator(sourceDir() / "examples")) {
         if (file.path().extension() == ".json") {
            cases.push_back({entry["file"], file.path().filename().string()});
         }
      }
   }
   return cases;
}

class OneVerdict : public ModuleTest, public ::testing::WithParamInterface<Case> {};

TEST_P(OneVerdict, the_fast_path_and_the_module_alone_agree_on_every_frame)
{
   std::optional<Twin> twin;
   try {
      twin.emplace(host(), 1);
   } catch (const fastpath::Error &error) {
      if (error.error() == EPERM || error.error() == EACCES || error.error() == ENOSYS) {
         GTEST_SKIP() << "BPF programs cannot be loaded here: " << error.what();
      }
      throw;
   }
   const json manifest = readJson(sourceDir() / "tests/data/manifest.json");
   const auto entry = std::find_if(manifest.begin(), manifest.end(),
                                   [](const json &e) { return e["file"] == GetParam().capture; });
   ASSERT_TRUE(twin->configure(configRecord(readJson(sourceDir() / "examples" / GetParam().config))));
   const auto frames = readCapture(sourceDir() / "tests/data" / GetParam().capture);
   ASSERT_EQ(frames.size(), (*entry)["frames"].size());

   // The port is configured half a second before the first frame, as replay does.
   auto clock = frames.front().time - std::chrono::milliseconds(500);
   for (size_t i = 0; i < frames.size(); ++i) {
      twin->advance(std::max(frames[i].time - clock, std::chrono::microseconds(0)));
      clock = std::max(clock, frames[i].time);
      const uint32_t direction = (*entry)["frames"][i]["fromVm"].get<bool>() ? SWSEC_FP_DIR_FROM_VM : SWSEC_FP_DIR_TO_VM;
      const std::string difference = twin->judge(frames[i].bytes, direction);
      ASSERT_EQ(difference, "") << "frame " << i + 1 << " of " << GetParam().capture;
   }
   ASSERT_EQ(twin->databases(), "") << "after the last frame";
   twin->advance(std::chrono::seconds(150));
   EXPECT_EQ(twin->databases(), "") << "150 s later";
   twin->advance(std::chrono::seconds(100));
   EXPECT_EQ(twin->databases(), "") << "250 s later";
   RecordProperty("decidedInKernel", std::to_string(twin->decidedInKernel()));
}

INSTANTIATE_TEST_SUITE_P(Captures, OneVerdict, ::testing::ValuesIn(allCases()),
                         [](const ::testing::TestParamInfo<Case> &param) {
                            std::string name = param.param.capture + "_" + param.param.config;
                            for (char &c : name) {
                               c = std::isalnum(static_cast<unsigned char>(c)) ? c : '_';
                            }
                            return name;
                         });

}  // namespace
}  // namespace swsec::testing
