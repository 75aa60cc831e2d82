/*
 * The pending DHCP requests: the list in arrival order and the index that
 * finds a client's request, or the request a server's answer is for, in
 * constant time however many clients a VM claims to be.
 */
#include "swsec/swsec_dhcp_req_index.h"

#include "framework/sifra_generic.h"
#include "framework/sifra_generic_list.h"
#include "platform/orr_text.h"
#include "platform/orr_time.h"
#include "swsec/swsec_ip_discovery.h"
#include "swsec/swsec_port_db_links.h"

#include <cstddef>
#include <cstdint>

namespace {

/*
 * Up to this many pending requests a lookup walks the list: a port with a
 * few clients (nearly every port) carries no index and allocates nothing
 * beyond its requests. Past it the index is built, with a bucket per
 * request, and doubled whenever there are two requests per bucket.
 */
constexpr uint32_t INDEX_MIN_REQUESTS = 8;
constexpr uint32_t MAX_LOAD = 2;
/* Two heads per bucket must fit one u32 allocation. */
constexpr uint32_t MAX_BUCKETS = 1u << 26;
constexpr uint32_t MAC_LEN = 6;

SwSecDhcpReq *ReqOfClientLinks(orr_ListLinks *links)
{
   return reinterpret_cast<SwSecDhcpReq *>(reinterpret_cast<uint8_t *>(links) -
                                           offsetof(SwSecDhcpReq, clientLinks));
}

SwSecDhcpReq *ReqOfAnswerLinks(orr_ListLinks *links)
{
   return reinterpret_cast<SwSecDhcpReq *>(reinterpret_cast<uint8_t *>(links) -
                                           offsetof(SwSecDhcpReq, answerLinks));
}

uint64_t Mix(uint64_t h)
{
   h ^= h >> 29;
   h *= 0xbf58'476d'1ce4'e5b9ull;
   return h ^ (h >> 32);
}

uint64_t Load64(const uint8_t *bytes, uint32_t length)
{
   uint64_t value = 0;
   orr_Memcpy(&value, bytes, length);
   return value;
}

/*
 * The client identity is the VM's to choose, so the hash is keyed with a
 * seed drawn when the index is made: a VM cannot aim all its identities
 * at one bucket without knowing it.
 */
uint64_t ClientHash(const SwSecDhcpReqIndex *index, uint16_t vlanId, const uint8_t *chaddr,
                    uint32_t clientIdLen, const uint8_t *clientId)
{
   uint64_t h = Mix(index->seed ^ (static_cast<uint64_t>(clientIdLen) << 16 | vlanId));
   if (clientIdLen == 0) {
      return Mix(h ^ Load64(chaddr, MAC_LEN));
   }
   uint32_t at = 0;
   for (; at + 8 <= clientIdLen; at += 8) {
      h = Mix(h ^ Load64(clientId + at, 8));
   }
   if (at < clientIdLen) {
      h = Mix(h ^ Load64(clientId + at, clientIdLen - at));
   }
   return h;
}

uint64_t AnswerHash(const SwSecDhcpReqIndex *index, uint16_t vlanId, uint32_t xid,
                    const uint8_t *chaddr)
{
   const uint64_t head = Mix(index->seed ^ (static_cast<uint64_t>(xid) << 16 | vlanId));
   return Mix(head ^ Load64(chaddr, MAC_LEN));
}

orr_ListLinks *ClientBucket(SwSecDhcpReqIndex *index, const SwSecDhcpReq *req)
{
   return &index->byClient[ClientHash(index, req->vlanId, req->chaddr, req->clientIdLen,
                                      req->clientIdStr) &
                           index->bucketMask];
}

orr_ListLinks *AnswerBucket(SwSecDhcpReqIndex *index, const SwSecDhcpReq *req)
{
   return &index->byAnswer[AnswerHash(index, req->vlanId, req->xid, req->chaddr) &
                           index->bucketMask];
}

/*
 * Files a request under its answer key, behind every request of the bucket
 * that came before it. A new request is the latest and goes to the tail at
 * once; a re-keyed one walks back past the later arrivals in its bucket.
 */
void FileByAnswer(SwSecDhcpReqIndex *index, SwSecDhcpReq *req)
{
   orr_ListLinks *bucket = AnswerBucket(index, req);
   orr_ListLinks *before = bucket->prev;
   while (before != bucket && ReqOfAnswerLinks(before)->arrival > req->arrival) {
      before = before->prev;
   }
   /* Appending in front of `before`'s successor puts it right behind `before`. */
   SifraGenericListAppend(before->next, &req->answerLinks);
}

bool AnswerMatches(const SwSecDhcpReq *req, uint16_t vlanId, uint32_t xid, const uint8_t *chaddr)
{
   return req->vlanId == vlanId && req->xid == xid && orr_Memcmp(req->chaddr, chaddr, MAC_LEN) == 0;
}

bool ClientMatches(const SwSecDhcpReq *req, uint16_t vlanId, const uint8_t *chaddr,
                   uint32_t clientIdLen, const uint8_t *clientId)
{
   return req->vlanId == vlanId && SwSecDhcpClientIdCmp(req, chaddr, clientIdLen, clientId) == 0;
}

/*
 * Makes an index of `numBuckets` and files every request in it, in list
 * order, so each answer bucket starts in arrival order. An allocation that
 * fails keeps the index there was (or none): lookups stay right, only
 * slower, and the next growth tries again.
 */
void Rebuild(SwSecContext *ctx, uint32_t numBuckets)
{
   auto *heads = static_cast<orr_ListLinks *>(
      SifraGenericAlloc(static_cast<uint32_t>(2 * numBuckets * sizeof(orr_ListLinks))));
   if (heads == nullptr) {
      return;
   }
   SwSecDhcpReqIndex *index = &ctx->dhcpReqIndex;
   if (index->byClient != nullptr) {
      SifraGenericFree(index->byClient);
   } else {
      index->seed = Mix(orr_GetTimerCycles() ^ reinterpret_cast<uintptr_t>(heads));
   }
   for (uint32_t i = 0; i < 2 * numBuckets; i++) {
      SifraGenericListInit(&heads[i]);
   }
   index->byClient = heads;
   index->byAnswer = heads + numBuckets;
   index->bucketMask = numBuckets - 1;
   for (orr_ListLinks *l = ctx->dhcpReqList.next; l != &ctx->dhcpReqList; l = l->next) {
      SwSecDhcpReq *req = SwSecDhcpReqFromLinks(l);
      SifraGenericListAppend(ClientBucket(index, req), &req->clientLinks);
      SifraGenericListAppend(AnswerBucket(index, req), &req->answerLinks);
   }
}

void GrowIfLoaded(SwSecContext *ctx)
{
   const SwSecDhcpReqIndex *index = &ctx->dhcpReqIndex;
   const uint32_t count = ctx->numDhcpReqs;
   if (count <= INDEX_MIN_REQUESTS) {
      return;
   }
   const uint32_t numBuckets = index->byClient != nullptr ? index->bucketMask + 1 : 0;
   if (numBuckets != 0 && (count <= MAX_LOAD * numBuckets || numBuckets >= MAX_BUCKETS)) {
      return;
   }
   uint32_t wanted = 16;
   while (wanted < count && wanted < MAX_BUCKETS) {
      wanted *= 2;
   }
   Rebuild(ctx, wanted);
}

}  // namespace

void SwSecLinkDhcpReq(SwSecContext *ctx, SwSecDhcpReq *req)
{
   SwSecDhcpReqIndex *index = &ctx->dhcpReqIndex;
   req->arrival = index->nextArrival++;
   SifraGenericListAppend(&ctx->dhcpReqList, &req->links);
   ctx->numDhcpReqs++;
   if (index->byClient != nullptr) {
      SifraGenericListAppend(ClientBucket(index, req), &req->clientLinks);
      SifraGenericListAppend(AnswerBucket(index, req), &req->answerLinks);
   }
   GrowIfLoaded(ctx);
}

void SwSecUnlinkDhcpReq(SwSecContext *ctx, SwSecDhcpReq *req)
{
   SwSecDhcpReqIndex *index = &ctx->dhcpReqIndex;
   SifraGenericListUnlink(&req->links);
   ctx->numDhcpReqs--;
   if (index->byClient == nullptr) {
      return;
   }
   SifraGenericListUnlink(&req->clientLinks);
   SifraGenericListUnlink(&req->answerLinks);
   /* The last request gone: the port holds nothing more for it. */
   if (ctx->numDhcpReqs == 0) {
      SifraGenericFree(index->byClient);
      index->byClient = nullptr;
      index->byAnswer = nullptr;
      index->bucketMask = 0;
   }
}

void SwSecSetDhcpReqXid(SwSecContext *ctx, SwSecDhcpReq *req, uint32_t xid)
{
   SwSecDhcpReqIndex *index = &ctx->dhcpReqIndex;
   if (index->byClient == nullptr || req->xid == xid) {
      req->xid = xid;
      return;
   }
   SifraGenericListUnlink(&req->answerLinks);
   req->xid = xid;
   FileByAnswer(index, req);
}

SwSecDhcpReq *SwSecFindDhcpReqByClient(SwSecContext *ctx, uint16_t vlanId, const uint8_t *chaddr,
                                       uint32_t clientIdLen, const uint8_t *clientId)
{
   SwSecDhcpReqIndex *index = &ctx->dhcpReqIndex;
   if (index->byClient == nullptr) {
      for (orr_ListLinks *l = ctx->dhcpReqList.next; l != &ctx->dhcpReqList; l = l->next) {
         SwSecDhcpReq *req = SwSecDhcpReqFromLinks(l);
         if (ClientMatches(req, vlanId, chaddr, clientIdLen, clientId)) {
            return req;
         }
      }
      return nullptr;
   }
   orr_ListLinks *bucket =
      &index->byClient[ClientHash(index, vlanId, chaddr, clientIdLen, clientId) & index->bucketMask];
   for (orr_ListLinks *l = bucket->next; l != bucket; l = l->next) {
      SwSecDhcpReq *req = ReqOfClientLinks(l);
      if (ClientMatches(req, vlanId, chaddr, clientIdLen, clientId)) {
         return req;
      }
   }
   return nullptr;
}

SwSecDhcpReq *SwSecFindDhcpReqByAnswer(SwSecContext *ctx, uint16_t vlanId, uint32_t xid,
                                       const uint8_t *chaddr)
{
   SwSecDhcpReqIndex *index = &ctx->dhcpReqIndex;
   if (index->byClient == nullptr) {
      for (orr_ListLinks *l = ctx->dhcpReqList.next; l != &ctx->dhcpReqList; l = l->next) {
         SwSecDhcpReq *req = SwSecDhcpReqFromLinks(l);
         if (AnswerMatches(req, vlanId, xid, chaddr)) {
            return req;
         }
      }
      return nullptr;
   }
   orr_ListLinks *bucket =
      &index->byAnswer[AnswerHash(index, vlanId, xid, chaddr) & index->bucketMask];
   for (orr_ListLinks *l = bucket->next; l != bucket; l = l->next) {
      SwSecDhcpReq *req = ReqOfAnswerLinks(l);
      if (AnswerMatches(req, vlanId, xid, chaddr)) {
         return req;
      }
   }
   return nullptr;
}

bool SwSecDhcpReqIndexBuilt(const SwSecContext *ctx)
{
   return ctx->dhcpReqIndex.byClient != nullptr;
}
