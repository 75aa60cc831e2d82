/*
 * The module's branch of the Nexo tree, declared as constant data: the
 * nodes, their handlers and the records and enumeration the host's tools
 * show. The loader installs it with the module and removes it before the
 * module goes.
 */
#include "mgmt/swsec_nexo.h"

#include "fhs/fhs_nexo.h"
#include "framework/sifra_generic_nexo.h"
#include "mgmt/swsec_nexo_records.h"
#include "swsec/swsec_vmi.h"

static constexpr Nexo_EnumElement swsecNexoDiscMethodElements[] = {
   {.value = SwSecDiscDhcpSnooping, .name = "SwSecDiscDhcpSnooping", .label = "DHCP Snooping"},
   {.value = SwSecDiscStatic, .name = "SwSecDiscStatic", .label = "Static"},
   {.value = SwSecDiscTofu, .name = "SwSecDiscTofu", .label = "TOFU"},
   {.value = SwSecDiscApSnooping, .name = "SwSecDiscApSnooping", .label = "ARP Snooping"},
};

static constexpr Nexo_EnumDef swsecNexoDiscMethodEnum = {
   .name = "SwSecDiscMethodEnum",
   .label = "IP Discovery Method",
   .elements = swsecNexoDiscMethodElements,
   .numElements = SifraGenericCountOf(swsecNexoDiscMethodElements),
};

/* Labels are padded with spaces to one width per record, so that they line up. */
static constexpr Nexo_FieldDef swsecNexoFeatureSummaryFields[] = {
   SIFRAGENERIC_NEXO_FIELD(SwSec_FeatureSummary, version, "version                  ", NEXO_FIELD_U8, nullptr),
   SIFRAGENERIC_NEXO_FIELD(SwSec_FeatureSummary, highestSupportedVersion, "Highest supported version", NEXO_FIELD_U8,
      nullptr),
   SIFRAGENERIC_NEXO_FIELD(SwSec_FeatureSummary, lowestSupportedVersion, "Lowest supported version ", NEXO_FIELD_U8,
      nullptr),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, featuresEnabled, "Features enabled         "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, portMode, "IP discovery port mode   "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, portDbSize, "Max portDb size          "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, numStaticEntries, "Static entries           "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, numVmiEntries, "Total portDb entries     "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, numAuthVmiEntries, "Authoritative entries    "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, numNonAuthVmiEntries, "Non-authoritative entries"),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, dhcpSnoopingDropCnt, "DHCP snooping drop count "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, daiDropCnt, "DAI drop count           "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, ipSrcGuardDropCnt, "IP src guard drop count  "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, arpRateLimit, "ARP rate limit           "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, errRateLimit, "Error rate limit         "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, errRateLimitPeriod, "Error rate limit period  "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, txRateLimitDropCnt, "Tx rate limit drop count "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, txRateLimitErr, "In error rate limit state"),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, txRateLimitErrEntryCnt, "Error rate limit entered "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, rxRateLimitDropCnt, "Rx rate limit drop count "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, allowTagged, "Tagged frames from VM    "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, etherTypes, "Ethertypes from VM       "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, taggedDropCnt, "Tagged drop count        "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_FeatureSummary, etherTypeDropCnt, "Ethertype drop count     "),
};

static constexpr Nexo_RecordDef swsecNexoFeatureSummaryRecord =
   SIFRAGENERIC_NEXO_RECORD(SwSec_FeatureSummary, "SwSec_FeatureSummary", "Feature summary",
      swsecNexoFeatureSummaryFields);

static constexpr Nexo_FieldDef swsecNexoVmiSummaryFields[] = {
   SIFRAGENERIC_NEXO_CHARS(SwSec_VmiSummary, portID, "PortID                    "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_VmiSummary, vlanId, "VlanId                    "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_VmiSummary, macAddr, "Etherenet MAC             "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_VmiSummary, ipAddr, "IP Address                "),
   SIFRAGENERIC_NEXO_FIELD(SwSec_VmiSummary, discoveryMethod, "Discovery Method          ", NEXO_FIELD_ENUM32,
      &swsecNexoDiscMethodEnum),
   SIFRAGENERIC_NEXO_CHARS(SwSec_VmiSummary, timeRemaining, "Expires in                "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_VmiSummary, chaddr, "DHCP client h/w address   "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_VmiSummary, clientIdLen, "DHCP clientId len         "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_VmiSummary, serverIp, "DHCP server IP            "),
   SIFRAGENERIC_NEXO_CHARS(SwSec_VmiSummary, leaseTime, "DHCP Lease Time           "),
};

static constexpr Nexo_RecordDef swsecNexoVmiSummaryRecord =
   SIFRAGENERIC_NEXO_RECORD(SwSec_VmiSummary, "SwSec_VmiSummary", "Vmi summary", swsecNexoVmiSummaryFields);

static_assert(SifraGenericCountOf(swsecNexoFeatureSummaryFields) == 24);
static_assert(SifraGenericCountOf(swsecNexoVmiSummaryFields) == 10);
static_assert(sizeof(SwSec_VmiSummary::discoveryMethod) == 4);

constexpr uint32_t SwSecNexoId(SwSecNexoNodeId id)
{
   return static_cast<uint32_t>(id);
}

/*
 * Parents before children; children in the order they are listed. The set
 * handlers of "createAgent" and "clearVmi" judge their own argument counts
 * (an absent name is the parameter list's status, a wrong clear count has
 * its message), so the host hands them any count its lists can hold.
 */
static constexpr Nexo_NodeDef swsecNexoNodes[] = {
   {.id = SwSecNexoId(SwSecNexoNodeId::Root), .name = "root", .parentId = NEXO_NO_PARENT,
    .kind = NEXO_NODE_BRANCH, .list = nullptr, .get = nullptr, .set = nullptr, .minArgs = 0, .maxArgs = 0,
    .output = nullptr},
   {.id = SwSecNexoId(SwSecNexoNodeId::CreateAgent), .name = "createAgent",
    .parentId = SwSecNexoId(SwSecNexoNodeId::Root), .kind = NEXO_NODE_LEAF, .list = nullptr,
    .get = Nexo_NULL_Get, .set = SwSecNexoCreateAgent, .minArgs = 0, .maxArgs = NEXO_PARAM_LIST_CAPACITY,
    .output = nullptr},
   {.id = SwSecNexoId(SwSecNexoNodeId::Security), .name = "security",
    .parentId = SwSecNexoId(SwSecNexoNodeId::Root), .kind = NEXO_NODE_LIST, .list = SwSecNexoListPortIds,
    .get = nullptr, .set = nullptr, .minArgs = 0, .maxArgs = 0, .output = nullptr},
   {.id = SwSecNexoId(SwSecNexoNodeId::FeatureSummary), .name = "featureSummary",
    .parentId = SwSecNexoId(SwSecNexoNodeId::Security), .kind = NEXO_NODE_LEAF, .list = nullptr,
    .get = SwSecNexoFeatureSummaryGet, .set = Nexo_NULL_Set, .minArgs = 0, .maxArgs = 0,
    .output = &swsecNexoFeatureSummaryRecord},
   {.id = SwSecNexoId(SwSecNexoNodeId::ClearVmi), .name = "clearVmi",
    .parentId = SwSecNexoId(SwSecNexoNodeId::Security), .kind = NEXO_NODE_LEAF, .list = nullptr,
    .get = Nexo_NULL_Get, .set = SwSecNexoClearVmi, .minArgs = 0, .maxArgs = NEXO_PARAM_LIST_CAPACITY,
    .output = nullptr},
   {.id = SwSecNexoId(SwSecNexoNodeId::Vmi), .name = "vmi", .parentId = SwSecNexoId(SwSecNexoNodeId::Security),
    .kind = NEXO_NODE_LEAF_LIST, .list = SwSecNexoListVmi, .get = SwSecNexoVmiSummaryGet, .set = Nexo_NULL_Set,
    .minArgs = 0, .maxArgs = 0, .output = &swsecNexoVmiSummaryRecord},
   {.id = SwSecNexoId(SwSecNexoNodeId::StartTest), .name = "startTest",
    .parentId = SwSecNexoId(SwSecNexoNodeId::Root), .kind = NEXO_NODE_LEAF, .list = nullptr,
    .get = Nexo_NULL_Get, .set = SwSecNexoStartTest, .minArgs = 0, .maxArgs = 0, .output = nullptr},
   {.id = SwSecNexoId(SwSecNexoNodeId::StopTest), .name = "stopTest",
    .parentId = SwSecNexoId(SwSecNexoNodeId::Root), .kind = NEXO_NODE_LEAF, .list = nullptr,
    .get = Nexo_NULL_Get, .set = SwSecNexoStopTest, .minArgs = 0, .maxArgs = 0, .output = nullptr},
   /* The IPv6 first-hop security agent's ports. */
   {.id = SwSecNexoId(SwSecNexoNodeId::Ipv6), .name = "ipv6", .parentId = SwSecNexoId(SwSecNexoNodeId::Root),
    .kind = NEXO_NODE_LIST, .list = FhsNexoListPorts, .get = nullptr, .set = nullptr, .minArgs = 0, .maxArgs = 0,
    .output = nullptr},
   {.id = SwSecNexoId(SwSecNexoNodeId::Ipv6Summary), .name = "summary", .parentId = SwSecNexoId(SwSecNexoNodeId::Ipv6),
    .kind = NEXO_NODE_LEAF, .list = nullptr, .get = FhsNexoSummaryGet, .set = Nexo_NULL_Set, .minArgs = 0,
    .maxArgs = 0, .output = &fhsNexoSummaryRecord},
   {.id = SwSecNexoId(SwSecNexoNodeId::Ipv6Bindings), .name = "bindings",
    .parentId = SwSecNexoId(SwSecNexoNodeId::Ipv6), .kind = NEXO_NODE_LEAF_LIST, .list = FhsNexoListBindings,
    .get = FhsNexoBindingGet, .set = Nexo_NULL_Set, .minArgs = 0, .maxArgs = 0, .output = &fhsNexoBindingRecord},
   {.id = SwSecNexoId(SwSecNexoNodeId::Ipv6Clear), .name = "clear", .parentId = SwSecNexoId(SwSecNexoNodeId::Ipv6),
    .kind = NEXO_NODE_LEAF, .list = nullptr, .get = Nexo_NULL_Get, .set = FhsNexoClear, .minArgs = 0, .maxArgs = 1,
    .output = nullptr},
};

static_assert(SifraGenericCountOf(swsecNexoNodes) == 12);

static constexpr const Nexo_RecordDef *swsecNexoRecords[] = {
   &swsecNexoFeatureSummaryRecord,
   &swsecNexoVmiSummaryRecord,
   &fhsNexoSummaryRecord,
   &fhsNexoBindingRecord,
};

constinit const Nexo_Tree swsecNexoTree = {
   .nodes = swsecNexoNodes,
   .numNodes = SifraGenericCountOf(swsecNexoNodes),
   .records = swsecNexoRecords,
   .numRecords = SifraGenericCountOf(swsecNexoRecords),
};
