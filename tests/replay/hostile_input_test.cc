// Captures and command lines as an attacker writes them: lengths that
// claim more than the file holds, timestamps that overflow or go back,
// outputs that point at the input, a device or each other, and long idle
// spans. Each fails cleanly (exit status 2, one line naming the culprit,
// nothing written) or is replayed with a warning naming the frame.
#include "replay_support.h"

#include "replay/describe.h"
#include "replay/engine.h"
#include "replay/json.h"
#include "session/config_file.h"
#include "session/error.h"
#include "session/ports_session.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <tuple>

namespace swsec::testing {
namespace {

// A pcap file of one link type with records (seconds, bytes).
std::string pcapFile(uint32_t linkType, const std::vector<std::pair<uint32_t, std::vector<uint8_t>>> &records)
{
   std::string out;
   for (uint32_t word : {0xa1b2c3d4u, 0x00040002u, 0u, 0u, 65535u, linkType}) {
      put32(out, word);
   }
   for (const auto &[seconds, bytes] : records) {
      for (uint32_t word : {seconds, 0u, static_cast<uint32_t>(bytes.size()), static_cast<uint32_t>(bytes.size())}) {
         put32(out, word);
      }
      out.append(bytes.begin(), bytes.end());
   }
   return out;
}

std::vector<uint8_t> firstExampleFrame()
{
   return readCapture(example()).front().bytes;
}

// ---------------------------------------------------------------- reading

// 248 bytes: a section, an interface and a packet block that says it is
// `length` bytes long (refused from a file in BadUsage).
std::string longBlockCapture(uint32_t length)
{
   std::string bytes = pcapngBytes({{.timeNs = 1000, .bytes = std::vector<uint8_t>(156, 0x11), .direction = replay::kDirFromVm}});
   std::memcpy(bytes.data() + 28 + 20 + 4, &length, 4);
   return bytes;
}

// Within the file but past the block limit, and in a pipe where the file's
// size is unknown.
TEST(HostileCapture, a_piped_pcapng_block_past_the_block_limit_is_refused)
{
   TempDir dir;
   writeFile(dir.path() / "huge.pcapng", longBlockCapture(0xFFFFFFF0u));
   const ToolRun piped = runTool({"replay", "-"}, "cat '" + (dir.path() / "huge.pcapng").string() + "' |");
   EXPECT_EQ(piped.status, 2);
   EXPECT_NE(piped.err.find("-: corrupt pcapng block at offset 48 (length 4294967280)"), std::string::npos)
      << piped.err;
}

TEST(HostileCapture, timestamps_that_overflow_go_back_or_lie_before_1970_are_warned_with_the_frame)
{
   TempDir dir;
   const auto frame = firstExampleFrame();
   // Frame 2's timestamp (2^62 microseconds, its high word set in the
   // bytes) overflows nanoseconds; frame 4 goes back 2 s.
   std::vector<CapturedFrame> frames;
   for (int64_t seconds : {10, 0, 13, 11}) {
      frames.push_back({.timeNs = seconds * 1'000'000'000, .bytes = frame, .direction = replay::kDirFromVm});
   }
   std::string bytes = pcapngBytes(frames);
   const uint32_t high = 1u << 30;
   std::memcpy(bytes.data() + 48 + (bytes.size() - 48) / 4 + 12, &high, 4);
   writeFile(dir.path() / "times.pcapng", bytes);
   ToolRun run = runTool({"replay", (dir.path() / "times.pcapng").string()});
   EXPECT_EQ(run.status, 0) << run.err;
   EXPECT_NE(run.err.find("times.pcapng: frame 2: timestamp out of range"), std::string::npos) << run.err;
   EXPECT_NE(run.err.find("times.pcapng: frame 4: timestamp 2.000000 s before the frame before's"),
             std::string::npos)
      << run.err;
   EXPECT_EQ(run.err.find("frame 3"), std::string::npos) << run.err;

   // libpcap reads a pcap record's seconds as signed: 0xfffffff0 is 16 s before 1970.
   writeFile(dir.path() / "old.pcap", pcapFile(1, {{0xfffffff0u, frame}}));
   run = runTool({"replay", "--json", "--vm-mac", kVmMac, (dir.path() / "old.pcap").string()});
   EXPECT_EQ(run.status, 0) << run.err;
   EXPECT_NE(run.err.find("old.pcap: frame 1: timestamp before 1970 (-16 s)"), std::string::npos) << run.err;
   EXPECT_EQ(nlohmann::json::parse(run.out)["warnings"].size(), 1u);
}

// Every frame recorded as inbound: the flags win over the VM's MAC.
TEST(HostileCapture, a_piped_pcapng_keeps_its_direction_flags)
{
   TempDir dir;
   auto frames = readCapture(example());
   for (auto &frame : frames) {
      frame.direction = replay::kDirToVm;
   }
   writePcapng(dir.path() / "in.pcapng", frames);
   for (const std::string &shell : {std::string("cat '") + (dir.path() / "in.pcapng").string() + "' |",
                                    std::string("<'") + (dir.path() / "in.pcapng").string() + "'"}) {
      const ToolRun run = runTool({"replay", "--json", "--vm-mac", kVmMac, "-"}, shell);
      ASSERT_EQ(run.status, 0) << run.err;
      const auto doc = nlohmann::json::parse(run.out);
      ASSERT_EQ(doc["frames"].size(), frames.size());
      for (const auto &frame : doc["frames"]) {
         EXPECT_EQ(frame["direction"], "to-vm");
      }
   }
}

// ---------------------------------------------------------------- command line

// Bad usage and bad input, on the command line and in the files it names,
// in every subcommand: exit status 2 (1 for a configuration the module
// refuses), one short line on stderr naming the problem, nothing on stdout
// and nothing written. EXAMPLE, BRIDGE and DIR stand for the example
// capture, the bridge capture and an empty directory; a case's file is
// written to DIR/in first.
std::string pcapRecord(uint32_t caplen, uint32_t len, size_t present)
{
   std::string r = pcapFile(1, {});
   for (uint32_t word : {1u, 0u, caplen, len}) {
      put32(r, word);
   }
   return r.substr(24) + std::string(present, '\x02');
}

TEST(BadUsage, is_named_in_one_short_line_with_status_2_and_nothing_written)
{
   const std::string bridge = (sourceDir() / "tests/data/bridge-three-vms.pcap").string();
   const std::string a = "a=02:00:5e:c0:00:11";
   const std::vector<std::string> config = {"replay", "--vm-mac", kVmMac, "--config", "DIR/in", "--write-passed",
                                            "DIR/passed.pcap", "EXAMPLE"};
   const std::vector<std::string> capture = {"replay", "--vm-mac", kVmMac, "--write-passed", "DIR/p.pcap",
                                             "--write-dropped", "DIR/d.pcap", "DIR/in"};
   const std::string pcap = pcapFile(1, {});
   const std::string exampleBytes = slurp(example());
   const auto frame = firstExampleFrame();
   const std::vector<std::string> fifoOut = {"replay", "--vm-mac", kVmMac, "--write-dropped", "DIR/fifo", "EXAMPLE"};
   const std::vector<std::string> fifoIn = {"replay", "--vm-mac", kVmMac, "--config", "DIR/fifo", "EXAMPLE"};
   const auto makeFifo = [](const std::filesystem::path &dir) { ASSERT_EQ(mkfifo((dir / "fifo").c_str(), 0600), 0); };
   struct Case {
      std::vector<std::string> args;
      const char *message;
      std::optional<std::string> file = std::nullopt;
      int status = 2;
      void (*prepare)(const std::filesystem::path &dir) = nullptr;
   };
   const Case cases[] = {
      {{"replay", "--vm-mac", kVmMac, "--until", "1e15", "EXAMPLE"},
       "--until: expected seconds from 0 to 10000000000, got \"1e15\""},
      {{"replay", "--vm-mac", kVmMac, "--until", "nan", "EXAMPLE"}, "got \"nan\""},
      {{"replay", "--vm-mac", kVmMac, "--until", "-1", "EXAMPLE"}, "got \"-1\""},
      {{"replay", "--vm-mac", kVmMac, "--module", "/nonexistent.so", "EXAMPLE"}, "--module /nonexistent.so: "},
      {{"replay", "--vm-mac", "02:00:5e:c0:00:zz", "EXAMPLE"}, "--vm-mac: malformed MAC address \"02:00:5e:c0:00:zz\""},
      {{"replay", "--vm-mac", kVmMac, "DIR/nope.pcap"}, "nope.pcap: cannot read capture"},
      {{"replay", "--vm-mac", kVmMac, "--write-dropped", "DIR/no-such-dir/out.pcap", "EXAMPLE"},
       "out.pcap: cannot write"},
      {{"replay", "EXAMPLE"}, "--vm-mac"},
      {{"replay", "--port", "vm1", "BRIDGE"}, "--port \"vm1\": expected NAME=VALUE"},
      {{"replay", "--port", "v m=02:00:5e:c0:00:11", "BRIDGE"}, "expected NAME=VALUE"},
      {{"replay", "--port", "vm1=02:00:5e:c0:00:1", "BRIDGE"}, "--port vm1: malformed MAC address"},
      {{"replay", "--port", a, "--port", "a=02:00:5e:c0:00:12", "BRIDGE"}, "given twice"},
      {{"replay", "--port", a, "--port", "b=02:00:5e:c0:00:11", "BRIDGE"}, "is already another port's MAC"},
      {{"replay", "--port", a, "--port-config", "b=x.json", "BRIDGE"}, "--port-config b: no --port of that name"},
      {{"replay", "--vm-mac", "02:00:5e:c0:00:11", "--port", a, "BRIDGE"},
       "--vm-mac: give the VM's MAC in its --port instead"},
      {{"replay", "--port", a, "--network-mac", "02:00:5e:c0:00:11", "BRIDGE"}, "is a port's MAC"},
      {{"replay", "--json", "--json-lines", "--port", a, "BRIDGE"}, "give one"},
      {{"info", "--module", "/nonexistent.so"}, "/nonexistent.so"},
      {{"info", "--param", "=1"}, "--param \"=1\": expected NAME=VALUE"},
      {{"info", "--param", "SIFRAGENERIC_HEAP_MAX_SIZE=big"}, "value is not an integer"},
      {{"inline", "--bridge", "br0", "--port", "vm1"}, "--port \"vm1\": expected NAME=VALUE"},
      {{"ctl", "--ctl", "DIR/ctl.sock", "frobnicate"}, "unknown command 'frobnicate' (ports, bindings, summary"},
      {{"ctl", "--ctl", "DIR/ctl.sock", "clear", "vm1", "0", "02:00:5e:c0:00:01"}, "expected clear PORT [VLAN MAC IP]"},
      {{"state", "show", "DIR/missing.state"}, "missing.state"},
      {{"frobnicate", "EXAMPLE"}, "unknown subcommand \"frobnicate\""},
      // Configuration files.
      {config, "bad JSON", R"({"features": [)"},
      {config, "unknown feature \"firewall\"", R"({"features": ["dai", "firewall"]})"},
      {config, "unknown key \"trustd\"", R"({"trustd": true})"},
      {config, "malformed MAC address", R"({"static": [{"vlan": 0, "mac": "02:00:5e:c0:00", "ip": "10.0.0.1"}]})"},
      {config, "malformed IPv4 address", R"({"static": [{"vlan": 0, "mac": "02:00:5e:c0:00:01", "ip": "10.0.0"}]})"},
      {config, "malformed IPv6 address", R"({"static": [{"vlan": 0, "mac": "02:00:5e:c0:00:01", "ip": "2001:db8::g"}]})"},
      {config, "0 to 4095", R"({"static": [{"vlan": 4096, "mac": "02:00:5e:c0:00:01", "ip": "10.0.0.1"}]})"},
      {config, "unsigned 32-bit", R"({"ipv6BindingLimit": "64"})"},
      {config, "unsigned 32-bit", R"({"arpRateLimit": -1})"},
      {config, "number overflow", R"({"portDbSize": 1e400})"},
      {config, "nested deeper than 64 levels",
       R"({"features": )" + std::string(100'000, '[') + "\"dai\"" + std::string(100'000, ']') + "}"},
      {config, "etherTypes[1]: 1500 is not an ethertype", R"({"etherTypes": ["ipv4", 1500]})"},
      {config, "must list 1 to 8 ethertypes", R"({"etherTypes": []})"},
      // The module's own rule: inspection on a trusted port is refused, in its words.
      {config, "Invalid config: featuresEnabled = 0xc trusted = 1",
       R"({"features": ["dai", "ip-discovery"], "trusted": true})", 1},
      {config, "\"ndRateLimit\" 4 with \"errRateLimit\" 4", R"({"ndRateLimit": 4, "errRateLimit": 4, "errRateLimitPeriod": 10})", 1},
      // Captures.
      {capture, "cannot read capture", "hello, this is text\n"},
      {capture, "cannot read capture", ""},
      {capture, "corrupt capture after frame 1", pcap + pcapRecord(60, 60, 60) + pcapRecord(60, 60, 20)},
      {capture, "frame 2 is truncated (40 of 60 bytes captured)",
       pcap + pcapRecord(60, 60, 60) + pcapRecord(40, 60, 40)},
      {capture, "corrupt pcapng block at offset 48 (length 1000, 200 bytes left", longBlockCapture(1000)},
      {capture, "not an Ethernet capture (link type IEEE802_11)", pcapFile(105, {{1, frame}})},
      {capture, "not an Ethernet capture (link type 4000)", pcapFile(4000, {{1, frame}})},
      // Outputs that are the input, a link to it, each other, a FIFO or a directory.
      {{"replay", "--vm-mac", kVmMac, "--write-passed", "DIR/in", "DIR/in"}, "in: cannot write: it is the input capture",
       exampleBytes},
      {{"replay", "--vm-mac", kVmMac, "--write-dropped", "DIR/in.link", "DIR/in"},
       "in.link: cannot write: it is the input capture", exampleBytes, 2,
       [](const std::filesystem::path &dir) { std::filesystem::create_symlink(dir / "in", dir / "in.link"); }},
      {{"replay", "--vm-mac", kVmMac, "--write-passed", "DIR/out.pcap", "--write-dropped", "DIR/./out.pcap", "EXAMPLE"},
       "out.pcap: cannot write: it is also the --write-passed file"},
      {fifoOut, "fifo: cannot write: not a regular file", std::nullopt, 2, makeFifo},
      {{"replay", "--vm-mac", kVmMac, "--write-passed", "DIR/.", "EXAMPLE"}, "/.: cannot write: not a regular file"},
      // A FIFO as the configuration, refused without waiting for a writer.
      {fifoIn, "fifo: not a regular file", std::nullopt, 2, makeFifo},
      {{"ctl", "--ctl", "DIR/ctl.sock", "config", "vm1", "DIR/fifo"}, "fifo: not a regular file", std::nullopt, 2, makeFifo},
      // Files past their size limit are refused before they are read (sparse: nothing is written).
      {{"replay", "--vm-mac", kVmMac, "--config", "DIR/big", "EXAMPLE"}, "1048577 bytes is too large", std::nullopt, 2,
       [](const std::filesystem::path &dir) { writeFile(dir / "big", ""), std::filesystem::resize_file(dir / "big", (1u << 20) + 1); }},
      {{"state", "show", "DIR/big"}, "16777217 bytes is too large", std::nullopt, 2,
       [](const std::filesystem::path &dir) { writeFile(dir / "big", ""), std::filesystem::resize_file(dir / "big", (16u << 20) + 1); }},
   };
   for (const Case &c : cases) {
      TempDir dir;
      std::vector<std::string> args = c.args;
      for (auto &arg : args) {
         if (arg == "EXAMPLE" || arg == "BRIDGE") {
            arg = arg == "EXAMPLE" ? example() : bridge;
         } else if (arg.rfind("DIR/", 0) == 0) {
            arg = (dir.path() / arg.substr(4)).string();
         }
      }
      if (c.file) {
         writeFile(dir.path() / "in", *c.file);
      }
      if (c.prepare != nullptr) {
         c.prepare(dir.path());
      }
      const auto before = dir.files();
      const ToolRun run = runTool(args, "timeout 10");
      SCOPED_TRACE(args[0] + " " + args[1] + " ...: " + c.message + ": " + run.err);
      EXPECT_EQ(run.status, c.status);
      EXPECT_EQ(run.out, "");
      EXPECT_NE(run.err.find(c.message), std::string::npos);
      if (c.file) {
         EXPECT_NE(run.err.find((dir.path() / "in").string()), std::string::npos) << "the file is named";
      }
      EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1);
      EXPECT_LT(run.err.size(), c.file ? 300u : 200u);
      EXPECT_EQ(dir.files(), before);
      if (c.file) {
         EXPECT_EQ(slurp(dir.path() / "in"), *c.file) << "the input is left as it was";
      }
   }
}

// A port takes both agents' records or neither: an IPv6 half refused by
// the tool's check or by the module leaves the IPv4 half as it was.
TEST(ConfigRefusal, a_refused_ipv6_half_leaves_the_ipv4_half_and_no_ipv6_agent)
{
   const std::tuple<const char *, const char *, const char *> cases[] = {
      {R"({"features": ["ip-discovery", "dai"], "trusted": false, "ipv6BindingLimit": 2000})", "", "\"ipv6BindingLimit\" 2000"},
      {R"({"features": ["ip-discovery", "dai", "ra-guard"], "trusted": false})", "orr_SifraRegisterFastPath",
       "previous IPv4 configuration is applied again"},
   };
   for (const auto &[config, failing, message] : cases) {
      session::ModuleSession module(std::getenv("SWSEC_MODULE_PATH"), nullptr, [](const std::string &v) { ADD_FAILURE() << v; });
      const host::FilterId port = module.addPort(1, "vm1", "");
      const auto before = module.readState(1).featureSummary;
      if (*failing != '\0') {
         module.host().faults().failOnce(failing, ORR_NO_MEMORY);
      }
      try {
         module.configure(port, session::parseConfig(config, "after"));
         ADD_FAILURE() << "taken: " << config;
      } catch (const session::Refused &e) {
         EXPECT_NE(std::string(e.what()).find(message), std::string::npos) << e.what();
      }
      EXPECT_EQ(module.readState(1).featureSummary, before) << config;
      EXPECT_FALSE(module.readState(1).ipv6) << config;
   }
}

TEST(Help, every_subcommand_says_its_exit_status_and_examples)
{
   for (const char *command : {"info", "replay", "inline", "ctl", "state"}) {
      const ToolRun run = runTool({command, "--help"});
      EXPECT_EQ(run.status, 0) << command << run.err;
      EXPECT_NE(run.out.find("EXIT STATUS\n  0  "), std::string::npos) << run.out;
      EXPECT_NE(run.out.find("EXAMPLES\n  swsec " + std::string(command)), std::string::npos) << run.out;
   }
   EXPECT_EQ(runTool({"--version"}).out.rfind("swsec ", 0), 0u);
}

TEST(HostileCommandLine, until_takes_decimal_and_exponent_seconds)
{
   const ToolRun run = runTool({"replay", "--json", "--vm-mac", kVmMac, "--until", "2e2", example()});
   ASSERT_EQ(run.status, 0) << run.err;
   EXPECT_TRUE(nlohmann::json::parse(run.out)["ports"][0]["portDb"].empty());
}

// ---------------------------------------------------------------- outputs

TEST(ReplayOutputPaths, a_new_file_honours_the_umask_and_a_replaced_one_keeps_its_mode)
{
   TempDir dir;
   const auto fresh = dir.path() / "fresh.pcap";
   const auto kept = dir.path() / "kept.pcap";
   writeFile(kept, "");
   std::filesystem::permissions(kept, std::filesystem::perms(0604));
   // A mask giving neither the usual 0644 nor an owner-only 0600.
   const ToolRun run = runTool({"replay", "--vm-mac", kVmMac, "--write-passed", fresh.string(), "--write-dropped",
                                kept.string(), example()},
                               "umask 027;");
   ASSERT_EQ(run.status, 0) << run.err;
   struct stat st {};
   ASSERT_EQ(stat(fresh.c_str(), &st), 0);
   EXPECT_EQ(st.st_mode & 0777, 0640u);
   ASSERT_EQ(stat(kept.c_str(), &st), 0);
   EXPECT_EQ(st.st_mode & 0777, 0604u);
}

// ---------------------------------------------------------------- idle time

// The example, then its first frames again after `gap` seconds of silence:
// bindings learned before the gap age out in it, in expiry order.
std::filesystem::path exampleWithGap(const std::filesystem::path &dir, int64_t gapSeconds)
{
   auto frames = readCapture(example());
   for (size_t i = 0; i < 6; ++i) {
      CapturedFrame again = frames[i];
      again.timeNs += gapSeconds * 1'000'000'000;
      frames.push_back(again);
   }
   for (size_t i = 0; i < frames.size(); ++i) {
      const bool fromVm = replay::macText(frames[i].bytes.data() + 6) == kVmMac;
      frames[i].direction = fromVm ? replay::kDirFromVm : replay::kDirToVm;
   }
   const auto path = dir / "gap.pcapng";
   writePcapng(path, frames);
   return path;
}

TEST(ReplayIdleTime, skipping_idle_ticks_gives_what_firing_every_tick_gives)
{
   TempDir dir;
   const auto capture = exampleWithGap(dir.path(), 100'000);
   // The learning port keeps an ARP-snooped binding (180 s) beside the
   // lease (120 s); the enforcing port a static one that never expires.
   TempDir configs;
   writeFile(configs.path() / "static.json",
             R"({"features":["ip-discovery","dai","ip-source-guard"],"trusted":false,)"
             R"("static":[{"vlan":0,"mac":"02:00:5e:c0:00:09","ip":"192.0.2.9"}]})");
   for (const std::optional<std::string> &config : {std::optional<std::string>{},
                                                   std::optional<std::string>{(configs.path() / "static.json").string()}}) {
      for (double until : {0.0, 250'000.0}) {
         replay::ReplayOptions options;
         options.capturePath = capture.string();
         options.untilSeconds = until;
         if (config) {
            options.config = session::loadConfigFile(*config);
         }
         options.skipIdleTime = false;
         const auto ticked = replay::replayJson(replay::runReplay(options));
         options.skipIdleTime = true;
         const auto skipped = replay::replayJson(replay::runReplay(options));
         EXPECT_EQ(ticked, skipped) << "until " << until;
         EXPECT_GE(ticked["ports"][0]["notifications"].size(), 3u);
      }
   }
}

TEST(ReplayIdleTime, a_gap_of_a_billion_seconds_is_crossed_at_once)
{
   TempDir dir;
   const auto capture = exampleWithGap(dir.path(), 1'000'000'000);
   replay::ReplayOptions options;
   options.capturePath = capture.string();
   options.untilSeconds = 1e10;
   const auto start = std::chrono::steady_clock::now();
   const auto result = replay::runReplay(options);
   EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
   // The renewed lease and the ARP entry learned after the gap aged out at the end.
   EXPECT_TRUE(result.ports[0].portDb.empty());
   EXPECT_EQ(result.frames.size(), 24u);
}

}  // namespace
}  // namespace swsec::testing
