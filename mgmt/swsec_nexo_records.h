/*
 * The output records of the management nodes, as the host hands them to the
 * get handlers: packed, every text field a zero-terminated text.
 */
#pragma once

#include <cstddef>
#include <cstdint>

/* "Feature summary" of one port. Byte 2435 is padding that nothing writes. */
struct __attribute__((packed)) SwSec_FeatureSummary {
   uint8_t version;
   uint8_t highestSupportedVersion;
   uint8_t lowestSupportedVersion;
   char featuresEnabled[1024];
   char portMode[64];
   char portDbSize[64];
   char numStaticEntries[64];
   char numVmiEntries[64];
   char numAuthVmiEntries[64];
   char numNonAuthVmiEntries[64];
   char dhcpSnoopingDropCnt[128];
   char daiDropCnt[128];
   char ipSrcGuardDropCnt[128];
   char arpRateLimit[64];
   char errRateLimit[64];
   char errRateLimitPeriod[64];
   char txRateLimitDropCnt[128];
   char txRateLimitErr[64];
   char txRateLimitErrEntryCnt[128];
   char rxRateLimitDropCnt[128];
   uint8_t unused;
   /* The frame guard, after the original record. */
   char allowTagged[64];
   char etherTypes[128];
   char taggedDropCnt[128];
   char etherTypeDropCnt[128];
};

static_assert(sizeof(SwSec_FeatureSummary) == 2884);
static_assert(offsetof(SwSec_FeatureSummary, version) == 0);
static_assert(offsetof(SwSec_FeatureSummary, highestSupportedVersion) == 1);
static_assert(offsetof(SwSec_FeatureSummary, lowestSupportedVersion) == 2);
static_assert(offsetof(SwSec_FeatureSummary, featuresEnabled) == 3);
static_assert(offsetof(SwSec_FeatureSummary, portMode) == 1027);
static_assert(offsetof(SwSec_FeatureSummary, portDbSize) == 1091);
static_assert(offsetof(SwSec_FeatureSummary, numStaticEntries) == 1155);
static_assert(offsetof(SwSec_FeatureSummary, numVmiEntries) == 1219);
static_assert(offsetof(SwSec_FeatureSummary, numAuthVmiEntries) == 1283);
static_assert(offsetof(SwSec_FeatureSummary, numNonAuthVmiEntries) == 1347);
static_assert(offsetof(SwSec_FeatureSummary, dhcpSnoopingDropCnt) == 1411);
static_assert(offsetof(SwSec_FeatureSummary, daiDropCnt) == 1539);
static_assert(offsetof(SwSec_FeatureSummary, ipSrcGuardDropCnt) == 1667);
static_assert(offsetof(SwSec_FeatureSummary, arpRateLimit) == 1795);
static_assert(offsetof(SwSec_FeatureSummary, errRateLimit) == 1859);
static_assert(offsetof(SwSec_FeatureSummary, errRateLimitPeriod) == 1923);
static_assert(offsetof(SwSec_FeatureSummary, txRateLimitDropCnt) == 1987);
static_assert(offsetof(SwSec_FeatureSummary, txRateLimitErr) == 2115);
static_assert(offsetof(SwSec_FeatureSummary, txRateLimitErrEntryCnt) == 2179);
static_assert(offsetof(SwSec_FeatureSummary, rxRateLimitDropCnt) == 2307);
static_assert(offsetof(SwSec_FeatureSummary, unused) == 2435);
static_assert(offsetof(SwSec_FeatureSummary, allowTagged) == 2436);
static_assert(offsetof(SwSec_FeatureSummary, etherTypes) == 2500);
static_assert(offsetof(SwSec_FeatureSummary, taggedDropCnt) == 2628);
static_assert(offsetof(SwSec_FeatureSummary, etherTypeDropCnt) == 2756);

/* "Vmi summary" of one port database entry. */
struct __attribute__((packed)) SwSec_VmiSummary {
   char portID[64];
   char vlanId[64];
   char macAddr[64];
   char ipAddr[64];
   uint32_t discoveryMethod;   /* SwSecDiscMethodEnum: a SwSecDiscMethod value */
   char timeRemaining[64];
   char chaddr[64];
   char clientIdLen[64];
   char serverIp[64];
   char leaseTime[64];
};

static_assert(sizeof(SwSec_VmiSummary) == 580);
static_assert(offsetof(SwSec_VmiSummary, portID) == 0);
static_assert(offsetof(SwSec_VmiSummary, vlanId) == 64);
static_assert(offsetof(SwSec_VmiSummary, macAddr) == 128);
static_assert(offsetof(SwSec_VmiSummary, ipAddr) == 192);
static_assert(offsetof(SwSec_VmiSummary, discoveryMethod) == 256);
static_assert(offsetof(SwSec_VmiSummary, timeRemaining) == 260);
static_assert(offsetof(SwSec_VmiSummary, chaddr) == 324);
static_assert(offsetof(SwSec_VmiSummary, clientIdLen) == 388);
static_assert(offsetof(SwSec_VmiSummary, serverIp) == 452);
static_assert(offsetof(SwSec_VmiSummary, leaseTime) == 516);
