// The host hands the module's records back to it; a record of another kind,
// a released one or none at all is refused before anything is touched.
#include "module_checks.h"
#include "support/host_fixture.h"

#include <cstring>
#include <functional>
#include <string>
#include <vector>

namespace swsec::testing {
namespace {

using Ops = orr_SifraFastPathOps;

struct BadRecordCase {
   const char *name;
   const char *magic;     // the kind of record the operation takes
   orr_Status expected;
   std::function<orr_Status(const Ops &, void *)> call;
};

orr_SifraSlowPath outSlowPath;
orr_SifraFilter outFilter;
uint64_t outLength;
uint8_t buffer[64];

std::vector<BadRecordCase> badRecordCases()
{
   return {
      {"registerSlowPath", "sifgfast", ORR_BAD_PARAM,
       [](const Ops &ops, void *r) { return ops.registerSlowPath(r, 7, &outSlowPath); }},
      {"unregisterSlowPath", "sifgslow", ORR_OK,
       [](const Ops &ops, void *r) { return ops.unregisterSlowPath(r); }},
      {"createFilter", "sifgfast", ORR_BAD_PARAM,
       [](const Ops &ops, void *r) { return ops.createFilter(r, nullptr, &outFilter, 0); }},
      {"destroyFilter", "sifgfilt", ORR_OK, [](const Ops &ops, void *r) { return ops.destroyFilter(r); }},
      {"prefetchSavedState", "sifgfilt", ORR_OK,
       [](const Ops &ops, void *r) { return ops.prefetchSavedState(r), ORR_OK; }},
      {"getSavedStateLen", "sifgfilt", ORR_BAD_PARAM,
       [](const Ops &ops, void *r) { return ops.getSavedStateLen(r, &outLength); }},
      {"saveState", "sifgfilt", ORR_BAD_PARAM,
       [](const Ops &ops, void *r) { return ops.saveState(r, buffer, &(outLength = 64)); }},
      {"restoreState", "sifgfilt", ORR_BAD_PARAM,
       [](const Ops &ops, void *r) { return ops.restoreState(r, buffer, sizeof(buffer)); }},
      {"processPackets", "sifgfilt", ORR_BAD_PARAM,
       [](const Ops &ops, void *r) { return ops.processPackets(r, nullptr, ORR_SIFRA_DIR_TX); }},
      {"processSlowPathPackets", "sifgfilt", ORR_BAD_PARAM,
       [](const Ops &ops, void *r) { return ops.processSlowPathPackets(r, nullptr, ORR_SIFRA_DIR_RX); }},
      {"processFilterIoctl", "sifgfilt", ORR_BAD_PARAM,
       [](const Ops &ops, void *r) { return ops.processFilterIoctl(r, 5, buffer, 4); }},
      {"processSlowPathIoctl", "sifgslow", ORR_BAD_PARAM,
       [](const Ops &ops, void *r) { return ops.processSlowPathIoctl(r, 5, buffer, 4); }},
      {"configurationChanged", "sifgfilt", ORR_BAD_PARAM,
       [](const Ops &ops, void *r) { return ops.configurationChanged(r); }},
   };
}

class BadRecordTest : public ModuleTest, public ::testing::WithParamInterface<BadRecordCase> {};

TEST_P(BadRecordTest, refuses_every_record_but_a_live_one_of_its_kind)
{
   const BadRecordCase &c = GetParam();
   const std::string own = c.magic;
   const std::string message = own == "sifgfast"   ? "Bad magic for fastPath"
                               : own == "sifgfilt" ? "Bad magic for filter"
                                                   : "Bad magic for slowPath";
   const Ops &ops = *host().sifra().fastPaths().at(0).ops;

   // Other kinds of records, the released record of this kind, no record.
   std::vector<std::vector<uint8_t>> records;
   for (const char *magic : {"sifgfast", "sifgfilt", "sifgslow", "sifgsave"}) {
      if (own != magic) {
         records.emplace_back(magic, magic + 8);
      }
   }
   records.emplace_back(own.begin(), own.end());
   for (auto &byte : records.back()) {
      byte = static_cast<uint8_t>(~byte);
   }
   for (auto &record : records) {
      record.resize(512);
   }

   for (auto &record : records) {
      host().log().clear();
      EXPECT_EQ(c.call(ops, record.data()), c.expected);
      EXPECT_TRUE(loggedWithPrefix(host(), message, ORR_LOG_ERROR));
   }
   host().log().clear();
   EXPECT_EQ(c.call(ops, nullptr), c.expected);
   EXPECT_TRUE(loggedWithPrefix(host(), message, ORR_LOG_ERROR));
}

INSTANTIATE_TEST_SUITE_P(EachOperation, BadRecordTest, ::testing::ValuesIn(badRecordCases()),
                         [](const auto &test) { return std::string(test.param.name); });

}  // namespace
}  // namespace swsec::testing
