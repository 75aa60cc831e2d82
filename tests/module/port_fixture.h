// Ports of the built-in agent on the loaded module, driven as the hypervisor
// and the management plane drive them: filters on the ports of portset
// "vs0", configurations written to the security property or sent with the
// set-features ioctl, frame lists handed over. Filters still there at the
// end are destroyed as the hypervisor does, so a reference that a handler
// failed to drop fails the test.
#pragma once

#include "framework/sifra_generic_filter.h"
#include "module_checks.h"
#include "swsec/swsec_context.h"
#include "support/frames.h"
#include "support/host_fixture.h"
#include "support/scene.h"
#include "support/security_config.h"

#include <cstring>
#include <vector>

namespace swsec::testing {

inline constexpr const char *kAgent = "sifra-generic-tarlin-swsec";
inline constexpr uint32_t kPort = 7;
inline constexpr uint32_t kOtherPort = 8;
inline constexpr uint32_t kTx = ORR_SIFRA_DIR_TX;   // from the VM
inline constexpr uint32_t kRx = ORR_SIFRA_DIR_RX;   // to the VM

inline void put32(Bytes &bytes, uint32_t value)
{
   for (int i = 0; i < 4; i++) {
      bytes.push_back(static_cast<uint8_t>(value >> (8 * i)));
   }
}

inline uint32_t get32(const Bytes &bytes, size_t offset)
{
   uint32_t value = 0;
   std::memcpy(&value, bytes.data() + offset, 4);
   return value;
}

// An ioctl payload of the message type alone.
inline Bytes typeOnly(uint32_t type)
{
   Bytes bytes;
   put32(bytes, type);
   return bytes;
}

// A set-features payload: the type, then the record as the property takes it.
inline Bytes setFeaturesPayload(const PortConfig &config)
{
   Bytes bytes = typeOnly(7);
   const Bytes record = configRecord(config);
   bytes.insert(bytes.end(), record.begin(), record.end());
   return bytes;
}

inline StaticBinding binding(uint16_t vlanId, const Mac &mac, const Ip4 &ip)
{
   return {vlanId, mac.bytes, ip.bytes};
}

// An ARP request from `mac` claiming `ip`, for 10.0.0.254.
inline Bytes arpRequest(const Mac &mac, const Ip4 &ip)
{
   return arpFrame(mac, kBroadcastMac, {.op = 1, .senderMac = mac, .senderIp = ip, .targetIp = Ip4{{10, 0, 0, 254}}});
}

// A DHCP binding as a VM and its server make it.
struct DhcpLease {
   Mac mac;
   Ip4 ip;
   Ip4 server;
   uint32_t lease = 3600;
   std::optional<Bytes> clientId;
};

class PortTest : public ModuleTest {
protected:
   void SetUp() override
   {
      ModuleTest::SetUp();
      host().portsets().addPortset("vs0");
      host().portsets().addPort("vs0", kPort);
      host().portsets().addPort("vs0", kOtherPort);
   }

   void TearDown() override
   {
      for (const auto &filter : host().sifra().filters()) {
         EXPECT_EQ(host().sifra().destroyFilterAsHypervisor(filter.id).status, ORR_OK);
      }
      ModuleTest::TearDown();
   }

   host::FilterId create(host::FilterConfig config = {}, uint32_t port = kPort)
   {
      host::FilterId id = 0;
      EXPECT_EQ(host().sifra().createFilter(kAgent, port, config, &id), ORR_OK);
      return id;
   }

   SifraGenericFilter *record(host::FilterId id)
   {
      return static_cast<SifraGenericFilter *>(host().sifra().filter(id)->record);
   }
   SwSecContext *context(host::FilterId id) { return static_cast<SwSecContext *>(record(id)->agentData); }

   // The VM's DHCPREQUEST and the server's DHCPACK, each passed.
   void bindByDhcp(host::FilterId id, const DhcpLease &l)
   {
      const Dhcp request{.xid = 0x5eed, .chaddr = l.mac, .type = kDhcpRequest, .clientId = l.clientId};
      ASSERT_TRUE(passes(id, kTx, dhcpFrame({.src = l.mac, .dhcp = request})));
      const Dhcp ack{.op = 2, .xid = 0x5eed, .yiaddr = l.ip, .siaddr = l.server, .chaddr = l.mac,
                     .type = kDhcpAck, .leaseTime = l.lease};
      ASSERT_TRUE(passes(id, kRx, dhcpFrame({.dst = l.mac, .ipSrc = l.server, .ipDst = l.ip, .fromServer = true,
                                             .dhcp = ack})));
   }

   orr_Status writeConfig(host::FilterId id, const PortConfig &config)
   {
      return host().sifra().writeProperty("sifra-generic-tarlin-swsec.security", id, configRecord(config));
   }

   // Sends a set-features request; the reply's result (1 accepted, 0 refused).
   uint32_t setFeatures(host::FilterId id, const PortConfig &config)
   {
      return setFeaturesRaw(id, setFeaturesPayload(config));
   }
   uint32_t setFeaturesRaw(host::FilterId id, const Bytes &payload)
   {
      host().sifra().clearIoctlReplies();
      EXPECT_EQ(host().sifra().sendIoctl(id, 77, payload), ORR_OK);
      const auto replies = host().sifra().ioctlReplies();
      if (replies.size() != 1 || replies[0].requestId != 77 || replies[0].bytes.size() != 8 ||
          get32(replies[0].bytes, 0) != 8) {
         ADD_FAILURE() << "no set-features reply";
         return 99;
      }
      return get32(replies[0].bytes, 4);
   }

   // Hands the frames to the port as one list.
   host::PacketsResult send(host::FilterId id, uint32_t direction, const std::vector<Bytes> &frames)
   {
      std::vector<host::FrameSpec> specs;
      for (const Bytes &frame : frames) {
         specs.push_back({.bytes = frame});
      }
      return host().sifra().processPackets(id, direction, specs);
   }
   bool passes(host::FilterId id, uint32_t direction, const Bytes &frame)
   {
      return send(id, direction, {frame}).kept.size() == 1;
   }
};

}  // namespace swsec::testing
