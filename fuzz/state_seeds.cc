// Writes the restore target's seeds: the saved state of a port after each
// capture of the manifest, replayed as a new port and as an enforcing one.
//
//   state_seeds OUT_DIR MANIFEST ENFORCING_CONFIG
// makes OUT_DIR/restore_state_fuzz/<capture>-<setting>.
#include "session/config_file.h"
#include "replay/engine.h"

#include <nlohmann/json.hpp>

#include <cstdio>
#include <exception>
#include <filesystem>
#include <fstream>

int main(int argc, char **argv)
{
   if (argc != 4) {
      std::fprintf(stderr, "usage: state_seeds OUT_DIR MANIFEST ENFORCING_CONFIG\n");
      return 2;
   }
   namespace fs = std::filesystem;
   const fs::path out = fs::path(argv[1]) / "restore_state_fuzz";
   const fs::path manifest = argv[2];
   fs::create_directories(out);
   size_t count = 0;
   try {
      std::ifstream in(manifest);
      const nlohmann::json entries = nlohmann::json::parse(in);
      const auto enforcing = swsec::session::loadConfigFile(argv[3]);
      for (const auto &entry : entries) {
         const std::string file = entry["file"];
         for (const bool enforce : {false, true}) {
            swsec::replay::ReplayOptions options;
            options.capturePath = (manifest.parent_path() / file).string();
            options.vmMac = swsec::session::parseMac(entry["vmMac"].get<std::string>(), "vmMac");
            if (enforce) {
               options.config = enforcing;
            }
            options.frameRecords = swsec::replay::FrameRecords::none;
            options.saveStatePath =
               (out / (fs::path(file).stem().string() + (enforce ? "-enforcing" : "-learning"))).string();
            (void)swsec::replay::runReplay(options);
            ++count;
         }
      }
   } catch (const std::exception &e) {
      std::fprintf(stderr, "state_seeds: %s\n", e.what());
      return 1;
   }
   std::printf("state_seeds: %zu saved states\n", count);
   return 0;
}
