// The layer every front end stands on: the module loaded once into a host,
// switch-security ports of the built-in agent made on one virtual switch,
// configured through the security property as the management plane would,
// and read back through the management nodes and the port database's
// notifications. It knows the module only through the platform contract.
#pragma once

#include "session/config_file.h"

#include "host/host.h"

#include "contract/fhs_binding.h"

#include <chrono>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <span>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

namespace swsec::session {

inline constexpr const char *kAgent = "sifra-generic-tarlin-swsec";
inline constexpr const char *kSecurityProperty = "sifra-generic-tarlin-swsec.security";
inline constexpr const char *kPortset = "vs0";
// The IPv6 first-hop security agent, made on request through the
// agent-creation property, and its own security property.
inline constexpr const char *kIpv6Agent = "sifra-generic-tarlin-fhs";
inline constexpr const char *kIpv6SecurityProperty = "sifra-generic-tarlin-fhs.security";
inline constexpr const char *kAgentCreationProperty = "com.tarlin.common.switch-security";

// The six drop counters of the feature summary, in its order.
inline constexpr const char *kDropCounterFields[] = {"dhcpSnoopingDropCnt", "daiDropCnt",
                                                     "ipSrcGuardDropCnt",   "txRateLimitDropCnt",
                                                     "rxRateLimitDropCnt",  "txRateLimitErrEntryCnt",
                                                     "taggedDropCnt",       "etherTypeDropCnt"};

// The IPv6 agent's counters of its "summary" node: a drop counter per
// reason, the times the port entered the ND error state and the bindings
// evicted for the cap.
inline constexpr const char *kIpv6CounterFields[] = {
#define SWSEC_SESSION_IPV6_FIELD(name, text) #name,
   FHS_DROP_LIST(SWSEC_SESSION_IPV6_FIELD)
#undef SWSEC_SESSION_IPV6_FIELD
   "ndRateLimitErrEntryCnt", "bindingsEvictedCnt"};

// One port database entry as the "vmi" node renders it ("N/A" where a field
// does not apply).
struct PortDbEntry {
   uint16_t vlan = 0;
   std::string mac;
   std::string ip;
   std::string method;        // "DHCP Snooping", "Static", "ARP Snooping", ...
   std::string timeRemaining; // "118 sec", "N/A"
   std::string chaddr;
   std::string clientIdLen;
   std::string serverIp;
   std::string leaseTime;
};

// The drop counters as the "featureSummary" node shows them, by field name.
using DropCounters = std::map<std::string, uint64_t, std::less<>>;

// One IPv6 binding as the "bindings" node renders it.
struct Ipv6Binding {
   uint16_t vlan = 0;
   std::string mac;
   std::string ip;
   std::string method;          // "DHCPv6", "Static", "First come first served"
   std::string timeRemaining;   // seconds; "never" for a static binding
};

// What the IPv6 agent's nodes show of a port that has it.
struct Ipv6PortState {
   std::map<std::string, std::string, std::less<>> summary;   // the "summary" node's fields
   std::string summaryText;
   DropCounters counters;
   std::vector<Ipv6Binding> bindings;
};

// What the management nodes show of one port.
struct PortState {
   // The "featureSummary" node's fields; none when the port has no IP
   // discovery (the node then does not exist).
   std::optional<std::map<std::string, std::string, std::less<>>> featureSummary;
   std::string featureSummaryText;
   DropCounters counters;   // drop counters the port keeps
   std::vector<PortDbEntry> portDb;
   std::optional<Ipv6PortState> ipv6;   // none: the port has no IPv6 agent
};

// A portdb.entry.added / portdb.entry.removed message, or the IPv6 agent's
// fhs.binding.added / fhs.binding.removed (an IPv6 `ip`; authoritative:
// learned by DHCPv6 or static), decoded.
struct PortDbNotification {
   uint32_t portID = 0;
   std::string name;
   uint16_t vlan = 0;
   std::string mac;
   std::string ip;
   bool authoritative = false;
};

// The module refused something (a configuration, a clear): `what()` is the
// module's own message, from its error log lines.
class Refused : public std::runtime_error {
public:
   using std::runtime_error::runtime_error;
};

// A posted message decoded, when it is a port database notification whose
// payload is whole.
std::optional<PortDbNotification> decodePortDbMessage(const host::PostedMessage &message);

// The host with the module loaded and the ports made on it. Management
// calls may come from any thread; frames go straight to the host's
// thread-safe processPackets through `host()`.
class ModuleSession {
public:
   // Loads the module from the image at `modulePath`, or, with none, the
   // one linked into the program (`linkedModule`, null: the built image),
   // and makes the virtual switch. Throws InputError when the image cannot
   // be opened, std::runtime_error when the module does not load.
   ModuleSession(const std::string &modulePath, const orr_ModuleInfo *linkedModule,
                 host::ViolationHandler violations);
   // Destroys the ports still there and unloads.
   ~ModuleSession();
   ModuleSession(const ModuleSession &) = delete;
   ModuleSession &operator=(const ModuleSession &) = delete;

   host::Host &host() { return host_; }

   // Makes a port of the built-in agent with this port ID; throws
   // std::runtime_error with the module's status when it cannot.
   host::FilterId addPort(uint32_t portID, const std::string &name, const std::string &vmUuid);
   // Destroys the port (its IPv6 filter first, if it has one) as the
   // hypervisor does (again while the module is busy).
   orr_Status removePort(host::FilterId filter);

   // Writes the security property; throws Refused with the module's words.
   void configure(host::FilterId filter, const std::vector<uint8_t> &record);
   // Writes both agents' properties: the IPv4 record, then, when the
   // configuration has IPv6 keys, the IPv6 agent's record, giving the port
   // the IPv6 agent first if it has none. A port that has the agent and a
   // configuration without IPv6 keys gets a new IPv6 port's defaults.
   // All or nothing: an IPv6 record its agent would refuse is refused
   // before anything is written; when the module refuses the IPv6 half,
   // the port's IPv4 record from before is written back (and an IPv6
   // agent made for it removed), which the message says.
   // Throws Refused with the module's words.
   void configure(host::FilterId filter, const PortSecurityConfig &config);
   // The port's IPv6 filter, made if it has none; throws std::runtime_error
   // when the module refuses.
   host::FilterId ipv6Filter(host::FilterId filter);
   // The port's IPv6 filter, or none.
   std::optional<host::FilterId> findIpv6Filter(host::FilterId filter);
   // Hands the frames to the port's filters in order (the IPv4 agent's,
   // then the IPv6 agent's with what the first kept), as the port's filter
   // chain does. Thread-safe, as processPackets is.
   host::PacketsResult judge(host::FilterId filter, uint32_t direction, std::span<const host::FrameView> frames);
   // The "clearVmi" node: all entries, or one VLAN/MAC/IP. Throws Refused.
   void clear(uint32_t portID, const std::optional<std::vector<std::string>> &key);
   PortState readState(uint32_t portID);
   // The IPv6 agent's nodes of the port; none when it has no IPv6 agent.
   std::optional<Ipv6PortState> readIpv6State(uint32_t portID);
   // The drop counters alone (none without IP discovery), with the IPv6
   // agent's beside them.
   DropCounters dropCounters(uint32_t portID);
   // The time left to the binding that expires first (none: no binding
   // expires); 0 when a node cannot be read.
   std::optional<std::chrono::seconds> soonestExpiry(uint32_t portID);

   // Port database notifications posted since the last call, in order.
   std::vector<PortDbNotification> takeNotifications();
   // The module's log lines written since the last call (severity 1 information, 2 error).
   std::vector<host::LogRecord> takeLog();

   // Destroys the ports left and unloads; every finding of the host (leaks,
   // a port that would not go) so far comes back as text, each also given
   // to the handler as it was found. Later calls only return the list.
   std::vector<std::string> finish();

private:
   void drainLogLocked();
   void writeProperty(const char *property, host::FilterId filter, const std::vector<uint8_t> &record);
   host::FilterId ipv6FilterLocked(host::FilterId filter);
   orr_Status removeIpv6FilterLocked(host::FilterId filter);

   struct PortInfo {
      uint32_t portID = 0;
      std::string name;
      std::string vmUuid;
      host::FilterId ipv6 = 0;   // 0: none
   };
   std::string errorsSince(size_t mark);
   void report(const std::string &violation);

   host::ViolationHandler forward_;
   host::Host host_;
   std::vector<host::FilterId> filters_;    // every filter, in creation order
   std::map<host::FilterId, PortInfo> ports_;   // by the port's IPv4 filter
   mutable std::mutex portsMutex_;          // ports_, for the frame path
   std::mutex mutex_;                       // management calls and the log sink
   std::vector<host::LogRecord> logTail_;   // records drained from the host, not yet taken
   std::mutex violationsMutex_;             // violations come from any thread
   std::vector<std::string> violations_;
   bool finished_ = false;
};

std::string withoutNewline(std::string text);

}  // namespace swsec::session
