// The first-hop security agent on ports of the loaded module, beside the
// switch-security agent on the same port: guards, learning, claims across
// ports, the binding cap, the ND limiter and failures.
#include "fhs/fhs_context.h"
#include "fhs/fhs_notify.h"
#include "framework/sifra_generic_filter.h"
#include "support/host_fixture.h"
#include "support/ipv6_frames.h"
#include "support/security_config.h"

#include <chrono>

namespace swsec::testing {
namespace {

using namespace std::chrono_literals;
constexpr const char *kFhs = "sifra-generic-tarlin-fhs";
constexpr uint32_t kVmPort = 7, kOtherPort = 8, kTx = ORR_SIFRA_DIR_TX, kRx = ORR_SIFRA_DIR_RX;
const Mac kVm = Mac::parse("02:00:00:00:00:07"), kIntruder = Mac::parse("02:00:00:00:00:08");
const Addr6 kLinkLocal = a6("fe80::7"), kAny{}, kAllNodes = a6("ff02::1"), kGateway = a6("fe80::1");
const Bytes kDuid{0, 3, 0, 1, 2, 0, 0, 0, 0, 7};

FhsBindingKey key(const Mac &mac, const Addr6 &addr)
{
   FhsBindingKey k{};
   std::memcpy(k.mac, mac.bytes.data(), 6);
   std::memcpy(k.addr, addr.data(), 16);
   return k;
}

class FhsPortTest : public ModuleTest {
protected:
   void SetUp() override
   {
      ModuleTest::SetUp();
      host().portsets().addPortset("vs0");
      host().portsets().addPort("vs0", kVmPort);
      host().portsets().addPort("vs0", kOtherPort);
      ASSERT_EQ(host().plex().write("com.tarlin.common.switch-security", kFhs), ORR_OK);
      swsec_ = create("sifra-generic-tarlin-swsec", kVmPort);
      vm_ = create(kFhs, kVmPort);
      other_ = create(kFhs, kOtherPort);
      ASSERT_EQ(host().sifra().writeProperty("sifra-generic-tarlin-swsec.security", swsec_,
                                             configRecord(enforcingConfig())), ORR_OK);
      ASSERT_EQ(configure(vm_, {.statics = {key(kVm, kLinkLocal)}}), ORR_OK);
      ASSERT_EQ(configure(other_, {}), ORR_OK);
   }
   void TearDown() override
   {
      for (const auto &filter : host().sifra().filters()) {
         EXPECT_EQ(host().sifra().destroyFilterAsHypervisor(filter.id).status, ORR_OK);
      }
      ModuleTest::TearDown();
   }
   host::FilterId create(const char *agent, uint32_t port)
   {
      host::FilterId id = 0;
      EXPECT_EQ(host().sifra().createFilter(agent, port, {}, &id), ORR_OK);
      return id;
   }
   orr_Status configure(host::FilterId id, const FhsPortConfig &config)
   {
      return host().sifra().writeProperty(std::string(kFhs) + ".security", id, fhsConfigBytes(config));
   }
   FhsContext *ctx(host::FilterId id)
   {
      return static_cast<FhsContext *>(static_cast<SifraGenericFilter *>(host().sifra().filter(id)->record)->agentData);
   }
   size_t kept(uint32_t port, uint32_t direction, const std::vector<Bytes> &frames)
   {
      std::vector<host::FrameSpec> specs;
      for (const Bytes &frame : frames) {
         specs.push_back({.bytes = frame});
      }
      return host().sifra().processPort(port, direction, specs).kept.size();
   }
   bool passes(uint32_t port, uint32_t direction, const Bytes &frame) { return kept(port, direction, {frame}) == 1; }
   bool claim(uint32_t port, const Mac &mac, const Addr6 &addr)
   {
      return passes(port, kTx, frame6(mac, kAny, a6("ff02::1:ff00:7"), 58, nd(135, addr)));
   }
   Bytes udpFrom(const Mac &mac, const Addr6 &src) { return frame6(mac, src, kGateway, 17, udp6(5000, 53, Bytes(8, 1))); }
   Bytes dhcpFrom(const Bytes &message) { return frame6(kVm, kLinkLocal, a6("ff02::1:2"), 17, udp6(546, 547, message)); }
   Bytes dhcpTo(const Bytes &message) { return frame6(kIntruder, kGateway, kLinkLocal, 17, udp6(547, 546, message)); }

   host::FilterId swsec_ = 0, vm_ = 0, other_ = 0;
};

// The guard cases the IPv6 captures cannot show: the DHCPv6 server messages
// (the switch-security agent drops them first there), a chain too long, an
// empty ND option; the trusted port and the other direction.
TEST_F(FhsPortTest, each_guard_drops_from_the_vm_with_its_reason_and_a_trusted_port_passes)
{
   const auto reply = [](uint8_t type) { return frame6(kVm, kLinkLocal, kAllNodes, 17, udp6(546, 546, dhcp6(type, 1, kDuid))); };
   const struct {
      const char *name;
      Bytes frame;
      uint64_t FhsDropCounters::*counter;
   } cases[] = {
      {"nine_extension_headers", frame6(kVm, kLinkLocal, kGateway, 60, cat(cat(cat(ext(60), ext(60)), cat(ext(60), ext(60))), cat(cat(ext(60), ext(60)), cat(cat(ext(60), ext(60)), cat(ext(17), Bytes(8, 0)))))), &FhsDropCounters::headerChainDropCnt},
      {"dhcpv6_advertise", reply(2), &FhsDropCounters::dhcpv6GuardDropCnt},
      {"dhcpv6_reply", reply(7), &FhsDropCounters::dhcpv6GuardDropCnt},
      {"dhcpv6_reconfigure", reply(10), &FhsDropCounters::dhcpv6GuardDropCnt},
      {"dhcpv6_relay_reply", frame6(kVm, kLinkLocal, kAllNodes, 17, udp6(546, 547, Bytes{13, 0, 0, 0})), &FhsDropCounters::dhcpv6GuardDropCnt},
      {"ns_with_an_empty_option", frame6(kVm, kLinkLocal, kGateway, 58, cat(nd(135, kGateway), Bytes{1, 0, 0, 0, 0, 0, 0, 0})), &FhsDropCounters::ndInspectionDropCnt},
   };
   ASSERT_EQ(configure(other_, {.trusted = 1}), ORR_OK);
   for (const auto &c : cases) {
      SCOPED_TRACE(c.name);
      const FhsDropCounters before = ctx(vm_)->counters;
      EXPECT_FALSE(passes(kVmPort, kTx, c.frame));
      FhsDropCounters expected = before;
      expected.*c.counter += 1;
      EXPECT_EQ(std::memcmp(&ctx(vm_)->counters, &expected, sizeof(expected)), 0) << "only its reason counts";
      EXPECT_TRUE(passes(kOtherPort, kTx, c.frame)) << "a trusted port";
      EXPECT_TRUE(passes(kVmPort, kRx, c.frame)) << "towards the VM";
   }
   EXPECT_FALSE(passes(kVmPort, kTx, udpFrame({.src = kVm, .ipSrc = Ip4{{10, 9, 9, 9}}}))) << "IPv4 stays the other agent's";
}

TEST_F(FhsPortTest, dhcpv6_reply_to_a_pending_request_binds_each_address_for_its_valid_lifetime)
{
   const Addr6 leased = a6("2001:db8::7"), withdrawn = a6("2001:db8::8");
   host().clock().advance(5s);   // between two ticks of the port timer
   ASSERT_TRUE(passes(kVmPort, kTx, dhcpFrom(dhcp6(3, 0x10, kDuid))));
   host().portsets().takePosted();
   ASSERT_TRUE(passes(kVmPort, kRx, dhcpTo(dhcp6(7, 0x10, kDuid, {{leased, 3600}, {withdrawn, 0}}))));
   const auto posted = host().portsets().takePosted();
   ASSERT_EQ(posted.size(), 1u);
   EXPECT_EQ(posted[0].name, "fhs.binding.added");
   FhsBindingMsgPayload added{};
   ASSERT_EQ(posted[0].payload.size(), sizeof(added));
   std::memcpy(&added, posted[0].payload.data(), sizeof(added));
   const FhsBindingKey expected = key(kVm, leased);
   EXPECT_EQ(std::memcmp(posted[0].payload.data() + offsetof(FhsBindingMsgPayload, key), &expected, sizeof(expected)), 0);
   EXPECT_EQ(added.method, FhsBindDhcpv6);
   EXPECT_EQ(added.lifetime, 3600u);
   EXPECT_TRUE(passes(kVmPort, kTx, udpFrom(kVm, leased)));
   EXPECT_FALSE(passes(kVmPort, kTx, udpFrom(kVm, withdrawn)));

   host().clock().advance(3601s);
   EXPECT_TRUE(claim(kOtherPort, kIntruder, leased)) << "a lease past its lifetime holds no claim";
   host().clock().advance(10s);
   EXPECT_FALSE(passes(kVmPort, kTx, udpFrom(kVm, leased))) << "the lease ran out";
}

TEST_F(FhsPortTest, first_claim_wins_across_ports_while_its_owner_keeps_using_it)
{
   const Addr6 slaac = a6("2001:db8::a");
   ASSERT_TRUE(claim(kVmPort, kVm, slaac));
   EXPECT_FALSE(claim(kOtherPort, kIntruder, slaac));
   EXPECT_EQ(ctx(other_)->counters.claimRefusedDropCnt, 1u);
   EXPECT_TRUE(logged("Claim of 2001:db8:0:0:0:0:0:a (VLAN 0) refused: bound to another port"));
   for (int i = 0; i < 12; i++) {
      host().clock().advance(100s);
      ASSERT_TRUE(passes(kVmPort, kTx, udpFrom(kVm, slaac))) << "refreshed by its own traffic";
   }
   EXPECT_FALSE(claim(kOtherPort, kIntruder, slaac));
   host().clock().advance(1300s);
   EXPECT_TRUE(claim(kOtherPort, kIntruder, slaac)) << "the silent owner's binding expired";
   EXPECT_FALSE(passes(kVmPort, kTx, udpFrom(kVm, slaac)));
}

TEST_F(FhsPortTest, a_full_port_evicts_its_oldest_dynamic_binding)
{
   ASSERT_EQ(configure(vm_, {.bindingLimit = 3, .statics = {key(kVm, kLinkLocal)}}), ORR_OK);
   const Addr6 first = a6("2001:db8::1"), second = a6("2001:db8::2"), third = a6("2001:db8::3");
   for (const Addr6 &addr : {first, second, third}) {
      ASSERT_TRUE(claim(kVmPort, kVm, addr));
   }
   EXPECT_TRUE(logged("Binding limit 3 reached: evicted 2001:db8:0:0:0:0:0:1 (VLAN 0)"));
   EXPECT_EQ(ctx(vm_)->counters.bindingsEvictedCnt, 1u);
   EXPECT_FALSE(passes(kVmPort, kTx, udpFrom(kVm, first)));
   EXPECT_TRUE(passes(kVmPort, kTx, udpFrom(kVm, kLinkLocal))) << "a static binding is never evicted";
}

TEST_F(FhsPortTest, an_nd_flood_enters_the_error_state_for_its_period)
{
   ASSERT_EQ(configure(vm_, {.ndRateLimit = 5, .errRateLimit = 2, .errRateLimitPeriod = 10, .statics = {key(kVm, kLinkLocal)}}), ORR_OK);
   const Bytes ns = frame6(kVm, kLinkLocal, kGateway, 58, nd(135, kGateway, kVm));
   EXPECT_EQ(kept(kVmPort, kTx, std::vector<Bytes>(6, ns)), 5u);
   host().clock().advance(10s);
   EXPECT_EQ(kept(kVmPort, kTx, std::vector<Bytes>(4, udpFrom(kVm, kLinkLocal))), 2u) << "every frame counts until a tick past the period";
   host().clock().advance(10s);
   EXPECT_EQ(kept(kVmPort, kTx, std::vector<Bytes>(4, udpFrom(kVm, kLinkLocal))), 4u);
}

TEST_F(FhsPortTest, configurations_are_checked_before_anything_changes)
{
   const struct {
      const char *name;
      Bytes bytes;
   } refused[] = {
      {"version", [] { Bytes b = fhsConfigBytes({}); b[0] = 2; return b; }()},
      {"length", cat(fhsConfigBytes({}), Bytes{0})},
      {"limit", fhsConfigBytes({.bindingLimit = FHS_BINDING_LIMIT_MAX + 1})},
      {"statics_over_the_limit", fhsConfigBytes({.bindingLimit = 1, .statics = {key(kVm, kLinkLocal), key(kVm, kGateway)}})},
      {"multicast_static", fhsConfigBytes({.statics = {key(kVm, kAllNodes)}})},
      {"error_rate_not_below_nd_rate", fhsConfigBytes({.ndRateLimit = 4, .errRateLimit = 4, .errRateLimitPeriod = 10})},
   };
   for (const auto &c : refused) {
      EXPECT_EQ(host().sifra().writeProperty(std::string(kFhs) + ".security", vm_, c.bytes), ORR_BAD_PARAM) << c.name;
   }
   EXPECT_TRUE(passes(kVmPort, kTx, udpFrom(kVm, kLinkLocal))) << "the static binding stayed";
   EXPECT_EQ(host().sifra().writeProperty("sifra-generic-tarlin-swsec.security", vm_, configRecord(learningConfig())),
             ORR_INVALID_HANDLE) << "another agent's property";
}

TEST_F(FhsPortTest, saved_bindings_keep_their_remaining_lifetimes_on_another_filter)
{
   const Addr6 leased = a6("2001:db8::7"), slaac = a6("2001:db8::a");
   ASSERT_TRUE(passes(kVmPort, kTx, dhcpFrom(dhcp6(3, 0x10, kDuid))));
   ASSERT_TRUE(passes(kVmPort, kRx, dhcpTo(dhcp6(7, 0x10, kDuid, {{leased, 3600}}))));
   host().clock().advance(1000s);
   ASSERT_TRUE(claim(kVmPort, kVm, slaac));
   host().clock().advance(100s);
   ASSERT_TRUE(passes(kVmPort, kTx, udpFrom(kVm, slaac))) << "a claim in use is saved with a whole lifetime";
   ctx(vm_)->counters.raGuardDropCnt = 5;
   std::vector<uint8_t> blob;
   ASSERT_EQ(host().migration().saveAsHypervisor(vm_, &blob), ORR_OK);
   ASSERT_EQ(host().sifra().destroyFilter(vm_), ORR_OK);

   const std::vector<size_t> cuts = {blob.size() - 1, 48 + 104 + 30 + 24 + 10, 48 + 103};
   for (size_t cut : cuts) {
      vm_ = create(kFhs, kVmPort);
      EXPECT_NE(host().migration().restore(vm_, std::span(blob).first(cut)), ORR_OK) << cut;
      EXPECT_TRUE(passes(kVmPort, kTx, udpFrom(kVm, a6("2001:db8::66")))) << "nothing restored";
      ASSERT_EQ(host().sifra().destroyFilter(vm_), ORR_OK);
   }
   vm_ = create(kFhs, kVmPort);
   ASSERT_EQ(host().migration().restore(vm_, blob), ORR_OK);
   EXPECT_EQ(ctx(vm_)->counters.raGuardDropCnt, 5u);
   EXPECT_FALSE(passes(kVmPort, kTx, udpFrom(kVm, a6("2001:db8::66")))) << "the configuration came along";
   for (const auto &[index, addr, left] : {std::tuple{"0", "fe80:0:0:0:0:0:0:7", "never"},
                                           {"1", "2001:db8:0:0:0:0:0:7", "2500"}, {"2", "2001:db8:0:0:0:0:0:a", "600"}}) {
      host::NexoRecord binding;
      ASSERT_EQ(host().nexo().get(std::string("/ipv6/7/bindings/") + index, &binding), ORR_OK);
      EXPECT_EQ(std::tie(binding.value("addr"), binding.value("timeRemaining")), std::tie(addr, left)) << index;
   }
}

TEST_F(FhsPortTest, nodes_show_the_summary_and_bindings_and_clear_them)
{
   ASSERT_TRUE(claim(kVmPort, kVm, a6("2001:db8::a")));
   ASSERT_TRUE(claim(kVmPort, kVm, a6("2001:db8::b")));
   ASSERT_FALSE(passes(kVmPort, kTx, udpFrom(kVm, a6("2001:db8::66"))));
   std::vector<int64_t> ports;
   ASSERT_EQ(host().nexo().list("/ipv6", &ports), ORR_OK);
   EXPECT_EQ(ports, (std::vector<int64_t>{kVmPort, kOtherPort}));
   host::NexoRecord summary;
   ASSERT_EQ(host().nexo().get("/ipv6/7/summary", &summary), ORR_OK);
   EXPECT_EQ(summary.value("numBindings"), "3");
   EXPECT_EQ(summary.value("numFcfs"), "2");
   EXPECT_EQ(summary.value("sourceGuardDropCnt"), "1");
   EXPECT_EQ(summary.value("portMode"), "untrusted");
   host::NexoRecord binding;
   ASSERT_EQ(host().nexo().get("/ipv6/7/bindings/1", &binding), ORR_OK);
   EXPECT_EQ(binding.value("addr"), "2001:db8:0:0:0:0:0:a");
   EXPECT_EQ(binding.value("mac"), "02:00:00:00:00:07");
   EXPECT_EQ(binding.value("timeRemaining"), "600");

   EXPECT_EQ(host().nexo().set("/ipv6/7/clear", {"2001:db8::a"}), ORR_OK);
   EXPECT_FALSE(passes(kVmPort, kTx, udpFrom(kVm, a6("2001:db8::a"))));
   EXPECT_TRUE(passes(kVmPort, kTx, udpFrom(kVm, a6("2001:db8::b"))));
   EXPECT_EQ(host().nexo().set("/ipv6/7/clear", {"2001:db8::a::"}), ORR_BAD_PARAM);
   EXPECT_EQ(host().nexo().set("/ipv6/7/clear", {}), ORR_OK);
   EXPECT_FALSE(passes(kVmPort, kTx, udpFrom(kVm, a6("2001:db8::b"))));
   EXPECT_TRUE(passes(kVmPort, kTx, udpFrom(kVm, kLinkLocal))) << "static bindings stay";
   EXPECT_EQ(host().nexo().get("/ipv6/9/summary", &summary), ORR_NOT_FOUND);
}

TEST_F(FhsPortTest, exported_queries_select_bindings_by_authority_and_a_held_buffer_keeps_the_module)
{
   const char *ns = "switchSecurity#1.0";
   auto *getNum = reinterpret_cast<orr_Status (*)(uint32_t, uint32_t, uint32_t *)>(host().resolveExport(ns, "Fhs_BindingsGetNumEntries"));
   auto *get = reinterpret_cast<orr_Status (*)(uint32_t, uint32_t, void **, uint32_t *, void **)>(host().resolveExport(ns, "Fhs_BindingsGetEntries"));
   auto *release = reinterpret_cast<orr_Status (*)(void *)>(host().resolveExport(ns, "Fhs_BindingsReleaseBuf"));
   ASSERT_TRUE(getNum && get && release);
   ASSERT_TRUE(claim(kVmPort, kVm, a6("2001:db8::a")));
   uint32_t count = 9;
   void *entries = nullptr, *buffer = nullptr;
   for (const auto &[selector, expected] : {std::pair{0u, 1u}, {1u, 1u}, {2u, 2u}, {3u, 0u}}) {
      ASSERT_EQ(getNum(kVmPort, selector, &count), ORR_OK);
      EXPECT_EQ(count, expected) << selector;
   }
   EXPECT_EQ(getNum(9, 2, &count), ORR_NOT_FOUND);
   EXPECT_EQ(get(kVmPort, 2, nullptr, &count, &buffer), ORR_BAD_PARAM);
   ASSERT_EQ(get(kVmPort, 2, &entries, &count, &buffer), ORR_OK);
   ASSERT_EQ(count, 2u);
   FhsBindingEntry got[2];
   std::memcpy(got, entries, sizeof(got));
   const FhsBindingKey expected[] = {key(kVm, kLinkLocal), key(kVm, a6("2001:db8::a"))};
   EXPECT_EQ(std::memcmp(&got[0].key, &expected[0], sizeof(FhsBindingKey)), 0);
   EXPECT_EQ(std::memcmp(&got[1].key, &expected[1], sizeof(FhsBindingKey)), 0);
   EXPECT_EQ((std::array{got[0].method, got[0].authoritative, got[1].method, got[1].authoritative}),
             (std::array<uint8_t, 4>{FhsBindStatic, 1, FhsBindFcfs, 0}));
   EXPECT_EQ((std::array{got[0].timeRemaining, got[1].timeRemaining}), (std::array{0u, 600u}));
   EXPECT_EQ(host().useCount(), 1u);
   EXPECT_EQ(release(buffer), ORR_OK);
   EXPECT_EQ(host().useCount(), 0u);
}

// Fails the n-th allocation (then lock, timer) of a port's creation until it succeeds, then a claim's.
TEST_F(FhsPortTest, every_failure_of_creation_and_learning_is_undone)
{
   for (const char *point : {"orr_HeapAllocWithRA", "orr_SpinlockCreate", "orr_TimerAdd"}) {
      for (uint64_t n = 1;; n++) {
         SCOPED_TRACE(std::string(point) + " " + std::to_string(n));
         const uint64_t before = host().faults().calls(point);
         host().faults().failOnce(point, ORR_NO_MEMORY, n);
         host::FilterId id = 0;
         const orr_Status status = host().sifra().createFilter(kFhs, kOtherPort, {}, &id);
         const bool hit = host().faults().calls(point) - before >= n;
         host().faults().clear();
         if (status == ORR_OK) {
            host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY, 1);
            EXPECT_FALSE(claim(kOtherPort, kIntruder, a6("fe80::9"))) << "unbound, so not inspected through";
            host().faults().clear();
            EXPECT_FALSE(passes(kOtherPort, kTx, udpFrom(kIntruder, a6("fe80::9"))));
            EXPECT_EQ(host().sifra().destroyFilter(id), ORR_OK);
            break;
         }
         ASSERT_TRUE(hit) << "refused without a failure";
      }
   }
}

}  // namespace
}  // namespace swsec::testing
