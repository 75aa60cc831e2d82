// The module's frame path beside hand-written loops making the checks the
// module must make (through the host list, through the host's header calls,
// and over plain bytes: the floor) and libpcap's BPF doing the equivalent
// stateless source check, at 1, 2, 16 and 32 bindings, and the module with
// one and two threads on one port. The common path's port enforces as
// examples/enforcing.json does, ARP rate limiting included.
//
// Each benchmark runs five times, the runs of all benchmarks interleaved in
// random order, and the summary takes the medians. With --count-instructions
// it runs each contender a fixed number of times instead, between callgrind
// client requests (bench/instructions.sh reads the counts).
//
// Frame lists are built by the host before the timed loop. The common path
// (UDP/IPv4 from bound sources) passes every frame, so one list is judged
// again and again. The mix drops frames, which leave the list: its list is
// rebuilt before each iteration with the timer paused.
#include "bpf_source_check.h"
#include "frame_mix.h"
#include "minimal_loop.h"
#include "module_port.h"

#include "host/host.h"
#include "support/ipv6_frames.h"

#include <benchmark/benchmark.h>

// Callgrind's client requests, where valgrind's headers are installed; a
// build without them counts nothing.
#if __has_include(<valgrind/callgrind.h>)
#include <valgrind/callgrind.h>
#else
#define CALLGRIND_ZERO_STATS
#define CALLGRIND_DUMP_STATS_AT(name) (void)(name)
#endif

#include <algorithm>
#include <cstdio>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

extern "C" const orr_ModuleInfo orr_moduleInfo;

namespace swsec::bench {
namespace {

constexpr uint32_t kSeed = 20261122;
constexpr uint32_t kMixFrames = 4096;
constexpr uint32_t kThreadListFrames = 256;
constexpr uint32_t kThreadBindings = 16;
constexpr uint32_t kBindingCounts[] = {1, 2, 16, 32};

// Everything one binding count needs, made once before any timing.
struct Setup {
   uint32_t bindingCount = 0;
   std::vector<Binding> bindings;
   std::vector<MixFrame> mix;
   std::vector<MixFrame> common;
   std::vector<testing::Bytes> mixBytes;
   std::vector<testing::Bytes> commonBytes;
   std::unique_ptr<ModulePort> port;         // the mix: ARP rate limiting off
   std::unique_ptr<ModulePort> commonPort;   // the common path: as enforcing.json
   std::unique_ptr<MinimalLoop> minimal;
   std::unique_ptr<BpfSourceCheck> bpf;
   std::unique_ptr<host::FrameList> moduleCommonList;
   // The IPv6 common path: UDP/IPv6 from bound sources, no extension headers.
   std::unique_ptr<ModulePort> ipv6Port;
   std::unique_ptr<host::FrameList> ipv6CommonList;
   std::unique_ptr<host::FrameList> minimalCommonList;
   std::unique_ptr<host::FrameList> minimalMixList;
   // Per thread, lists of kThreadListFrames common frames.
   std::vector<std::unique_ptr<host::FrameList>> threadLists;
};

std::vector<testing::Bytes> bytesOf(const std::vector<MixFrame> &frames)
{
   std::vector<testing::Bytes> out;
   for (const auto &frame : frames) {
      out.push_back(frame.bytes);
   }
   return out;
}

std::unique_ptr<Setup> makeSetup(host::Host &host, uint32_t bindingCount)
{
   auto setup = std::make_unique<Setup>();
   setup->bindingCount = bindingCount;
   setup->bindings = bindingsFor(bindingCount);
   setup->mix = makeMix(kSeed, kMixFrames, setup->bindings);
   setup->common = onlyKind(setup->mix, FrameKind::Ipv4Bound);
   setup->mixBytes = bytesOf(setup->mix);
   setup->commonBytes = bytesOf(setup->common);
   setup->port = std::make_unique<ModulePort>(host, 100 + bindingCount, setup->bindings, false);
   setup->commonPort = std::make_unique<ModulePort>(host, 200 + bindingCount, setup->bindings, true);
   setup->minimal = std::make_unique<MinimalLoop>(setup->bindings);
   setup->bpf = std::make_unique<BpfSourceCheck>(setup->bindings);
   setup->moduleCommonList = setup->commonPort->makeList(setup->common);
   setup->ipv6Port =
      std::make_unique<ModulePort>(ModulePort::Ipv6{}, host, 300 + bindingCount, setup->bindings, true);
   std::vector<MixFrame> ipv6Common(setup->common.size());
   for (size_t i = 0; i < ipv6Common.size(); ++i) {
      const Binding &binding = setup->bindings[i % setup->bindings.size()];
      ipv6Common[i].bytes = testing::frame6(binding.mac, ModulePort::ipv6Of(binding), testing::a6("2001:db8::1"), 17,
                                            testing::udp6(40000, 53, testing::Bytes(18, 0)));
   }
   setup->ipv6CommonList = setup->ipv6Port->makeList(ipv6Common);
   setup->minimalCommonList = setup->commonPort->makeList(setup->common);
   setup->minimalMixList = setup->port->makeList(setup->mix);
   for (uint32_t thread = 0; thread < 2; ++thread) {
      const auto first = setup->common.begin() + thread * kThreadListFrames;
      const std::vector<MixFrame> slice(first, first + kThreadListFrames);
      setup->threadLists.push_back(setup->commonPort->makeList(slice));
   }
   return setup;
}

void moduleCommon(benchmark::State &state, Setup *setup)
{
   for (auto _ : state) {
      benchmark::DoNotOptimize(setup->commonPort->judge(*setup->moduleCommonList));
   }
   if (setup->moduleCommonList->kept().size() != setup->common.size()) {
      state.SkipWithError("the module dropped a frame of the common path");
   }
   state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * setup->common.size()));
}

void minimalCommon(benchmark::State &state, Setup *setup)
{
   for (auto _ : state) {
      benchmark::DoNotOptimize(setup->minimal->run(setup->minimalCommonList->list()));
   }
   state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * setup->common.size()));
}

void minimalHeadersCommon(benchmark::State &state, Setup *setup)
{
   for (auto _ : state) {
      benchmark::DoNotOptimize(setup->minimal->runViaHeaders(setup->minimalCommonList->list()));
   }
   state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * setup->common.size()));
}

void floorCommon(benchmark::State &state, Setup *setup)
{
   for (auto _ : state) {
      benchmark::DoNotOptimize(setup->minimal->runBytes(setup->commonBytes));
   }
   state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * setup->common.size()));
}

void bpfCommon(benchmark::State &state, Setup *setup)
{
   for (auto _ : state) {
      benchmark::DoNotOptimize(setup->bpf->run(setup->commonBytes));
   }
   state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * setup->common.size()));
}

void moduleMix(benchmark::State &state, Setup *setup)
{
   std::unique_ptr<host::FrameList> list;
   size_t kept = 0;
   for (auto _ : state) {
      state.PauseTiming();
      list.reset();
      list = setup->port->makeList(setup->mix);
      state.ResumeTiming();
      benchmark::DoNotOptimize(setup->port->judge(*list));
   }
   // Past the loop the timer has stopped.
   kept = list ? list->kept().size() : 0;
   list.reset();
   state.counters["drops"] = static_cast<double>(setup->mix.size() - kept);
   state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * setup->mix.size()));
}

void minimalMix(benchmark::State &state, Setup *setup)
{
   uint32_t drops = 0;
   for (auto _ : state) {
      drops = setup->minimal->run(setup->minimalMixList->list());
      benchmark::DoNotOptimize(drops);
   }
   state.counters["drops"] = drops;
   state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * setup->mix.size()));
}

void bpfMix(benchmark::State &state, Setup *setup)
{
   uint32_t drops = 0;
   for (auto _ : state) {
      drops = setup->bpf->run(setup->mixBytes);
      benchmark::DoNotOptimize(drops);
   }
   state.counters["drops"] = drops;
   state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * setup->mix.size()));
}

// Each thread judges its own list of common frames on the same port.
void moduleThreads(benchmark::State &state, Setup *setup)
{
   host::FrameList &list = *setup->threadLists.at(static_cast<size_t>(state.thread_index()));
   for (auto _ : state) {
      benchmark::DoNotOptimize(setup->commonPort->judge(list));
   }
   state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * kThreadListFrames));
}

// The same lists through the minimal loop making the module's header calls:
// whether two threads scale when the module's own work is taken away.
void minimalHeadersThreads(benchmark::State &state, Setup *setup)
{
   host::FrameList &list = *setup->threadLists.at(static_cast<size_t>(state.thread_index()));
   for (auto _ : state) {
      benchmark::DoNotOptimize(setup->minimal->runViaHeaders(list.list()));
   }
   state.SetItemsProcessed(static_cast<int64_t>(state.iterations() * kThreadListFrames));
}

// Keeps frames per second of every run by name and thread count, for the ratios.
class RateCollector : public benchmark::ConsoleReporter {
public:
   void ReportRuns(const std::vector<Run> &runs) override
   {
      ConsoleReporter::ReportRuns(runs);
      for (const auto &run : runs) {
         // With repetitions the median stands for the run; a single run
         // stands for itself.
         const bool median = run.run_type == Run::RT_Aggregate && run.aggregate_name == "median";
         if (run.error_occurred || (run.run_type == Run::RT_Aggregate && !median)) {
            continue;
         }
         const auto rate = run.counters.find("items_per_second");
         if (rate != run.counters.end()) {
            rates_[{run.run_name.function_name, run.threads}] = rate->second.value;
         }
      }
   }

   // Nanoseconds a frame, or 0 when the run is missing.
   double nsPerFrame(const std::string &name, int threads = 1) const
   {
      const auto found = rates_.find({name, threads});
      return found == rates_.end() || found->second <= 0 ? 0 : 1e9 / found->second;
   }
   double rate(const std::string &name, int threads = 1) const
   {
      const auto found = rates_.find({name, threads});
      return found == rates_.end() ? 0 : found->second;
   }

private:
   std::map<std::pair<std::string, int>, double> rates_;
};

const char *verdict(bool met)
{
   return met ? "met" : "MISSED";
}

void printSummary(const RateCollector &rates, const std::vector<std::unique_ptr<Setup>> &setups,
                  uint64_t fullPortHeapBytes, const std::string &module)
{
   std::printf("\n== frame path summary, %s (ns a frame, medians; ratios)\n", module.c_str());
   std::printf("%-9s %8s %8s %12s %8s %8s %15s %11s %11s %8s\n", "bindings", "module", "minimal", "minimal-hdr",
               "floor", "bpf", "module/minimal", "bpf/module", "mix:module", "mix:bpf");
   for (const auto &setup : setups) {
      const std::string n = std::to_string(setup->bindingCount);
      const double moduleNs = rates.nsPerFrame("module/common/" + n);
      const double minimal = rates.nsPerFrame("minimal/common/" + n);
      const double bpf = rates.nsPerFrame("bpf/common/" + n);
      std::printf("%-9s %8.1f %8.1f %12.1f %8.1f %8.1f %15.2f %11.2f %11.1f %8.1f\n", n.c_str(), moduleNs, minimal,
                  rates.nsPerFrame("minimal-hdr/common/" + n), rates.nsPerFrame("floor/common/" + n), bpf,
                  minimal > 0 ? moduleNs / minimal : 0, moduleNs > 0 ? bpf / moduleNs : 0,
                  rates.nsPerFrame("module/mix/" + n), rates.nsPerFrame("bpf/mix/" + n));
   }

   double worstMinimalRatio = 0;
   for (const auto &setup : setups) {
      const std::string n = std::to_string(setup->bindingCount);
      const double minimal = rates.nsPerFrame("minimal/common/" + n);
      if (minimal > 0) {
         worstMinimalRatio = std::max(worstMinimalRatio, rates.nsPerFrame("module/common/" + n) / minimal);
      }
   }
   auto bpfOverModule = [&rates](const char *n) {
      const double moduleNs = rates.nsPerFrame(std::string("module/common/") + n);
      return moduleNs > 0 ? rates.nsPerFrame(std::string("bpf/common/") + n) / moduleNs : 0;
   };
   const double module1 = rates.nsPerFrame("module/common/1");
   const double scaling = module1 > 0 ? rates.nsPerFrame("module/common/32") / module1 : 0;
   const double one = rates.rate("module/threads256", 1);
   const double threadGain = one > 0 ? rates.rate("module/threads256", 2) / one : 0;

   std::printf("\nIPv4 common path, module / minimal loop (worst over binding counts): %.2f (target <= 2.0: %s)\n",
               worstMinimalRatio, verdict(worstMinimalRatio > 0 && worstMinimalRatio <= 2.0));
   std::printf("BPF / module at 16 bindings: %.2f (target >= 1.5: %s)\n", bpfOverModule("16"),
               verdict(bpfOverModule("16") >= 1.5));
   std::printf("BPF / module at 32 bindings: %.2f (target >= 2.0: %s)\n", bpfOverModule("32"),
               verdict(bpfOverModule("32") >= 2.0));
   std::printf("module at 32 bindings / at 1: %.2f (target <= 1.3: %s)\n", scaling,
               verdict(scaling > 0 && scaling <= 1.3));
   std::printf("two threads / one thread, lists of %u frames: %.2f (target >= 1.8: %s)\n", kThreadListFrames,
               threadGain, verdict(threadGain >= 1.8));
   const double oneHeaders = rates.rate("minimal-hdr/threads256", 1);
   std::printf("  (the minimal loop through the same header calls: two threads / one: %.2f)\n",
               oneHeaders > 0 ? rates.rate("minimal-hdr/threads256", 2) / oneHeaders : 0);
   std::printf("module heap of one port with a full database (32 entries): %llu bytes\n",
               static_cast<unsigned long long>(fullPortHeapBytes));
}

// Runs each contender on the common path `kCountRounds` times between
// callgrind's zeroing and a dump named "NAME frames=F": the dump's total
// divided by F is the contender's instructions a frame.
constexpr uint32_t kCountRounds = 10;

template <typename Run>
void countInstructions(const std::string &name, size_t frames, Run run)
{
   run();   // warm: first-touch costs belong to no contender
   CALLGRIND_ZERO_STATS;
   for (uint32_t round = 0; round < kCountRounds; ++round) {
      run();
   }
   const std::string label = name + " frames=" + std::to_string(frames * kCountRounds);
   CALLGRIND_DUMP_STATS_AT(label.c_str());
}

void countAll(const std::vector<std::unique_ptr<Setup>> &setups)
{
   for (const auto &setup : setups) {
      Setup *s = setup.get();
      const std::string n = std::to_string(s->bindingCount);
      const size_t frames = s->common.size();
      countInstructions("module/common/" + n, frames,
                        [s] { benchmark::DoNotOptimize(s->commonPort->judge(*s->moduleCommonList)); });
      countInstructions("ipv6/common/" + n, frames,
                        [s] { benchmark::DoNotOptimize(s->ipv6Port->judge(*s->ipv6CommonList)); });
      countInstructions("minimal/common/" + n, frames,
                        [s] { benchmark::DoNotOptimize(s->minimal->run(s->minimalCommonList->list())); });
      countInstructions("minimal-hdr/common/" + n, frames,
                        [s] { benchmark::DoNotOptimize(s->minimal->runViaHeaders(s->minimalCommonList->list())); });
      countInstructions("floor/common/" + n, frames,
                        [s] { benchmark::DoNotOptimize(s->minimal->runBytes(s->commonBytes)); });
      countInstructions("bpf/common/" + n, frames, [s] { benchmark::DoNotOptimize(s->bpf->run(s->commonBytes)); });
   }
}

}  // namespace
}  // namespace swsec::bench

int main(int argc, char **argv)
{
   using namespace swsec::bench;
   std::vector<char *> args(argv, argv + argc);
   // --module IMAGE: the image as deployed, opened by the host's loader;
   // by default the module linked into this program.
   swsec::host::LoadOptions load;
   load.linkedModule = &orr_moduleInfo;
   std::string moduleName = "module linked into the program";
   bool countMode = false;
   for (auto arg = args.begin() + 1; arg != args.end();) {
      if (std::string_view(*arg) == "--module" && arg + 1 != args.end()) {
         load.modulePath = *(arg + 1);
         load.linkedModule = nullptr;
         moduleName = "module image " + load.modulePath;
         arg = args.erase(arg, arg + 2);
      } else if (std::string_view(*arg) == "--count-instructions") {
         countMode = true;
         arg = args.erase(arg);
      } else {
         ++arg;
      }
   }
   // This machine is shared and its speed wanders by a third from run to
   // run: unless told otherwise, each benchmark runs five times, the runs of
   // all benchmarks interleaved, and the summary takes the medians.
   std::string repetitions = "--benchmark_repetitions=5";
   std::string aggregatesOnly = "--benchmark_report_aggregates_only=true";
   std::string interleave = "--benchmark_enable_random_interleaving=true";
   const bool chosen = std::any_of(args.begin() + 1, args.end(), [](const char *arg) {
      return std::string_view(arg).starts_with("--benchmark_repetitions");
   });
   if (!chosen) {
      args.push_back(repetitions.data());
      args.push_back(aggregatesOnly.data());
      args.push_back(interleave.data());
   }
   int argCount = static_cast<int>(args.size());
   benchmark::Initialize(&argCount, args.data());

   swsec::host::Host host;
   if (host.load(load) != 0) {
      std::fprintf(stderr, "frame path bench: the module failed to load\n");
      return 1;
   }
   uint64_t fullPortHeapBytes = 0;
   std::vector<std::unique_ptr<Setup>> setups;
   for (const uint32_t count : kBindingCounts) {
      setups.push_back(makeSetup(host, count));
      if (count == 32) {
         fullPortHeapBytes = setups.back()->port->heapBytes();
      }
   }

   if (countMode) {
      countAll(setups);
   } else {
      for (const auto &setup : setups) {
         Setup *s = setup.get();
         const std::string n = std::to_string(s->bindingCount);
         benchmark::RegisterBenchmark(("module/common/" + n).c_str(), moduleCommon, s);
         benchmark::RegisterBenchmark(("minimal/common/" + n).c_str(), minimalCommon, s);
         benchmark::RegisterBenchmark(("minimal-hdr/common/" + n).c_str(), minimalHeadersCommon, s);
         benchmark::RegisterBenchmark(("floor/common/" + n).c_str(), floorCommon, s);
         benchmark::RegisterBenchmark(("bpf/common/" + n).c_str(), bpfCommon, s);
         benchmark::RegisterBenchmark(("module/mix/" + n).c_str(), moduleMix, s);
         benchmark::RegisterBenchmark(("minimal/mix/" + n).c_str(), minimalMix, s);
         benchmark::RegisterBenchmark(("bpf/mix/" + n).c_str(), bpfMix, s);
      }
      for (const auto &setup : setups) {
         if (setup->bindingCount == kThreadBindings) {
            benchmark::RegisterBenchmark("module/threads256", moduleThreads, setup.get())
               ->Threads(1)
               ->Threads(2)
               ->UseRealTime();
            benchmark::RegisterBenchmark("minimal-hdr/threads256", minimalHeadersThreads, setup.get())
               ->Threads(1)
               ->Threads(2)
               ->UseRealTime();
         }
      }
      RateCollector reporter;
      benchmark::RunSpecifiedBenchmarks(&reporter);
      printSummary(reporter, setups, fullPortHeapBytes, moduleName);
   }
   benchmark::Shutdown();

   setups.clear();
   host.log().clear();
   return host.unload() == ORR_OK ? 0 : 1;
}
