/*
 * The module's branch of the Nexo tree, declared as constant data: the
 * nodes, their handlers and the records and enumeration the host's tools
 * show. The loader installs it with the module and removes it before the
 * module goes.
 */
#include "mgmt/swsec_nexo.h"

#include "fhs/fhs_nexo.h"
#include "mgmt/swsec_nexo_records.h"
#include "swsec/swsec_vmi.h"

#include <cstddef>

template <typename T, size_t N>
constexpr uint32_t SwSecNexoCountOf(const T (&)[N])
{
   return static_cast<uint32_t>(N);
}

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
   .numElements = SwSecNexoCountOf(swsecNexoDiscMethodElements),
};

/* Labels are padded with spaces to one width per record, so that they line up. */
static constexpr Nexo_FieldDef swsecNexoFeatureSummaryFields[] = {
   {.name = "version",
    .label = "version                  ",
    .type = NEXO_FIELD_U8,
    .offset = offsetof(SwSec_FeatureSummary, version),
    .size = sizeof(SwSec_FeatureSummary::version),
    .enumDef = nullptr},
   {.name = "highestSupportedVersion",
    .label = "Highest supported version",
    .type = NEXO_FIELD_U8,
    .offset = offsetof(SwSec_FeatureSummary, highestSupportedVersion),
    .size = sizeof(SwSec_FeatureSummary::highestSupportedVersion),
    .enumDef = nullptr},
   {.name = "lowestSupportedVersion",
    .label = "Lowest supported version ",
    .type = NEXO_FIELD_U8,
    .offset = offsetof(SwSec_FeatureSummary, lowestSupportedVersion),
    .size = sizeof(SwSec_FeatureSummary::lowestSupportedVersion),
    .enumDef = nullptr},
   {.name = "featuresEnabled",
    .label = "Features enabled         ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, featuresEnabled),
    .size = sizeof(SwSec_FeatureSummary::featuresEnabled),
    .enumDef = nullptr},
   {.name = "portMode",
    .label = "IP discovery port mode   ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, portMode),
    .size = sizeof(SwSec_FeatureSummary::portMode),
    .enumDef = nullptr},
   {.name = "portDbSize",
    .label = "Max portDb size          ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, portDbSize),
    .size = sizeof(SwSec_FeatureSummary::portDbSize),
    .enumDef = nullptr},
   {.name = "numStaticEntries",
    .label = "Static entries           ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, numStaticEntries),
    .size = sizeof(SwSec_FeatureSummary::numStaticEntries),
    .enumDef = nullptr},
   {.name = "numVmiEntries",
    .label = "Total portDb entries     ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, numVmiEntries),
    .size = sizeof(SwSec_FeatureSummary::numVmiEntries),
    .enumDef = nullptr},
   {.name = "numAuthVmiEntries",
    .label = "Authoritative entries    ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, numAuthVmiEntries),
    .size = sizeof(SwSec_FeatureSummary::numAuthVmiEntries),
    .enumDef = nullptr},
   {.name = "numNonAuthVmiEntries",
    .label = "Non-authoritative entries",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, numNonAuthVmiEntries),
    .size = sizeof(SwSec_FeatureSummary::numNonAuthVmiEntries),
    .enumDef = nullptr},
   {.name = "dhcpSnoopingDropCnt",
    .label = "DHCP snooping drop count ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, dhcpSnoopingDropCnt),
    .size = sizeof(SwSec_FeatureSummary::dhcpSnoopingDropCnt),
    .enumDef = nullptr},
   {.name = "daiDropCnt",
    .label = "DAI drop count           ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, daiDropCnt),
    .size = sizeof(SwSec_FeatureSummary::daiDropCnt),
    .enumDef = nullptr},
   {.name = "ipSrcGuardDropCnt",
    .label = "IP src guard drop count  ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, ipSrcGuardDropCnt),
    .size = sizeof(SwSec_FeatureSummary::ipSrcGuardDropCnt),
    .enumDef = nullptr},
   {.name = "arpRateLimit",
    .label = "ARP rate limit           ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, arpRateLimit),
    .size = sizeof(SwSec_FeatureSummary::arpRateLimit),
    .enumDef = nullptr},
   {.name = "errRateLimit",
    .label = "Error rate limit         ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, errRateLimit),
    .size = sizeof(SwSec_FeatureSummary::errRateLimit),
    .enumDef = nullptr},
   {.name = "errRateLimitPeriod",
    .label = "Error rate limit period  ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, errRateLimitPeriod),
    .size = sizeof(SwSec_FeatureSummary::errRateLimitPeriod),
    .enumDef = nullptr},
   {.name = "txRateLimitDropCnt",
    .label = "Tx rate limit drop count ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, txRateLimitDropCnt),
    .size = sizeof(SwSec_FeatureSummary::txRateLimitDropCnt),
    .enumDef = nullptr},
   {.name = "txRateLimitErr",
    .label = "In error rate limit state",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, txRateLimitErr),
    .size = sizeof(SwSec_FeatureSummary::txRateLimitErr),
    .enumDef = nullptr},
   {.name = "txRateLimitErrEntryCnt",
    .label = "Error rate limit entered ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, txRateLimitErrEntryCnt),
    .size = sizeof(SwSec_FeatureSummary::txRateLimitErrEntryCnt),
    .enumDef = nullptr},
   {.name = "rxRateLimitDropCnt",
    .label = "Rx rate limit drop count ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_FeatureSummary, rxRateLimitDropCnt),
    .size = sizeof(SwSec_FeatureSummary::rxRateLimitDropCnt),
    .enumDef = nullptr},
};

static constexpr Nexo_RecordDef swsecNexoFeatureSummaryRecord = {
   .name = "SwSec_FeatureSummary",
   .label = "Feature summary",
   .size = sizeof(SwSec_FeatureSummary),
   .fields = swsecNexoFeatureSummaryFields,
   .numFields = SwSecNexoCountOf(swsecNexoFeatureSummaryFields),
};

static constexpr Nexo_FieldDef swsecNexoVmiSummaryFields[] = {
   {.name = "portID",
    .label = "PortID                    ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_VmiSummary, portID),
    .size = sizeof(SwSec_VmiSummary::portID),
    .enumDef = nullptr},
   {.name = "vlanId",
    .label = "VlanId                    ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_VmiSummary, vlanId),
    .size = sizeof(SwSec_VmiSummary::vlanId),
    .enumDef = nullptr},
   {.name = "macAddr",
    .label = "Etherenet MAC             ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_VmiSummary, macAddr),
    .size = sizeof(SwSec_VmiSummary::macAddr),
    .enumDef = nullptr},
   {.name = "ipAddr",
    .label = "IP Address                ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_VmiSummary, ipAddr),
    .size = sizeof(SwSec_VmiSummary::ipAddr),
    .enumDef = nullptr},
   {.name = "discoveryMethod",
    .label = "Discovery Method          ",
    .type = NEXO_FIELD_ENUM32,
    .offset = offsetof(SwSec_VmiSummary, discoveryMethod),
    .size = sizeof(SwSec_VmiSummary::discoveryMethod),
    .enumDef = &swsecNexoDiscMethodEnum},
   {.name = "timeRemaining",
    .label = "Expires in                ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_VmiSummary, timeRemaining),
    .size = sizeof(SwSec_VmiSummary::timeRemaining),
    .enumDef = nullptr},
   {.name = "chaddr",
    .label = "DHCP client h/w address   ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_VmiSummary, chaddr),
    .size = sizeof(SwSec_VmiSummary::chaddr),
    .enumDef = nullptr},
   {.name = "clientIdLen",
    .label = "DHCP clientId len         ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_VmiSummary, clientIdLen),
    .size = sizeof(SwSec_VmiSummary::clientIdLen),
    .enumDef = nullptr},
   {.name = "serverIp",
    .label = "DHCP server IP            ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_VmiSummary, serverIp),
    .size = sizeof(SwSec_VmiSummary::serverIp),
    .enumDef = nullptr},
   {.name = "leaseTime",
    .label = "DHCP Lease Time           ",
    .type = NEXO_FIELD_CHARS,
    .offset = offsetof(SwSec_VmiSummary, leaseTime),
    .size = sizeof(SwSec_VmiSummary::leaseTime),
    .enumDef = nullptr},
};

static constexpr Nexo_RecordDef swsecNexoVmiSummaryRecord = {
   .name = "SwSec_VmiSummary",
   .label = "Vmi summary",
   .size = sizeof(SwSec_VmiSummary),
   .fields = swsecNexoVmiSummaryFields,
   .numFields = SwSecNexoCountOf(swsecNexoVmiSummaryFields),
};

static_assert(SwSecNexoCountOf(swsecNexoFeatureSummaryFields) == 20);
static_assert(SwSecNexoCountOf(swsecNexoVmiSummaryFields) == 10);
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

static_assert(SwSecNexoCountOf(swsecNexoNodes) == 12);

static constexpr const Nexo_RecordDef *swsecNexoRecords[] = {
   &swsecNexoFeatureSummaryRecord,
   &swsecNexoVmiSummaryRecord,
   &fhsNexoSummaryRecord,
   &fhsNexoBindingRecord,
};

constinit const Nexo_Tree swsecNexoTree = {
   .nodes = swsecNexoNodes,
   .numNodes = SwSecNexoCountOf(swsecNexoNodes),
   .records = swsecNexoRecords,
   .numRecords = SwSecNexoCountOf(swsecNexoRecords),
};
