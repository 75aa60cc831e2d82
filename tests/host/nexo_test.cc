// The host's Nexo tree on its own: a branch checked before it is installed,
// paths resolved to nodes and instance keys, parameter lists with their
// limits, and output records rendered by their definition.
#include "host_unit.h"

#include "host/state.h"

#include <gmock/gmock.h>

#include <cstring>
#include <functional>
#include <string>
#include <vector>

using ::testing::ElementsAre;
using ::testing::HasSubstr;

namespace swsec::testing {
namespace {

// What the handlers below saw in their last call.
struct Seen {
   std::vector<int64_t> keys;
   std::vector<std::string> input;
   int calls = 0;
};
Seen seen;

void note(const Nexo_ParamList *keys)
{
   seen.calls++;
   seen.keys.clear();
   for (uint32_t i = 0; i < keys->entries.size(); ++i) {
      int32_t value = 0;
      EXPECT_EQ(Nexo_ParamListGetInt32(keys, i, &value), ORR_OK);
      seen.keys.push_back(value);
   }
}

// Lists 10, 11, 12; under key 0, as many as the list takes.
orr_Status listItems(const Nexo_NodeDef *, const Nexo_ParamList *keys, Nexo_ParamList *list)
{
   note(keys);
   const int64_t end = seen.keys == std::vector<int64_t>{0} ? INT64_MAX : 13;
   for (int64_t i = 10; i < end; ++i) {
      if (orr_Status status = Nexo_ParamListAddInt(list, i); status != ORR_OK) {
         return status;
      }
   }
   return ORR_OK;
}

struct __attribute__((packed)) Sample {
   uint8_t small;
   char text[8];
   uint32_t kind;
};

// Under key 99, a text without its terminator.
orr_Status getSample(const Nexo_NodeDef *, const Nexo_ParamList *keys, void *output)
{
   note(keys);
   auto *sample = static_cast<Sample *>(output);
   sample->small = 200;
   std::strcpy(sample->text, "abc");
   sample->kind = static_cast<uint32_t>(seen.keys.back());
   if (sample->kind == 99) {
      std::memset(sample->text, 'x', sizeof sample->text);
   }
   return ORR_OK;
}

orr_Status setRecord(const Nexo_NodeDef *, const Nexo_ParamList *keys, const Nexo_ParamList *input)
{
   note(keys);
   seen.input.clear();
   for (uint32_t i = 0; i < input->entries.size(); ++i) {
      const char *text = nullptr;
      EXPECT_EQ(Nexo_ParamListGetString(input, i, &text), ORR_OK);
      seen.input.push_back(text);
   }
   return ORR_TRY_AGAIN;
}

constexpr Nexo_EnumElement kKinds[] = {{1, "KindOne", "One"}, {2, "KindTwo", "Two"}};
constexpr Nexo_EnumDef kKind = {"Kind", "Kind of sample", kKinds, 2};
constexpr Nexo_FieldDef kSampleFields[] = {
   {"small", "Small  ", NEXO_FIELD_U8, offsetof(Sample, small), 1, nullptr},
   {"text", "Text   ", NEXO_FIELD_CHARS, offsetof(Sample, text), 8, nullptr},
   {"kind", "Kind   ", NEXO_FIELD_ENUM32, offsetof(Sample, kind), 4, &kKind},
};
constexpr Nexo_RecordDef kSample = {"Sample", "A sample", sizeof(Sample), kSampleFields, 3};
constexpr const Nexo_RecordDef *kRecords[] = {&kSample};

// root -> item (list) -> detail (leaf), sub (leaf list); root -> action
constexpr Nexo_NodeDef kNodes[] = {
   {1, "root", NEXO_NO_PARENT, NEXO_NODE_BRANCH, nullptr, nullptr, nullptr, 0, 0, nullptr},
   {2, "item", 1, NEXO_NODE_LIST, listItems, nullptr, nullptr, 0, 0, nullptr},
   {3, "detail", 2, NEXO_NODE_LEAF, nullptr, getSample, setRecord, 0, 2, &kSample},
   {4, "sub", 2, NEXO_NODE_LEAF_LIST, listItems, getSample, nullptr, 0, 0, &kSample},
   {5, "action", 1, NEXO_NODE_LEAF, nullptr, Nexo_NULL_Get, setRecord, 1, 3, nullptr},
};
constexpr Nexo_Tree kTree = {kNodes, 5, kRecords, 1};

class NexoHostTest : public HostUnitTest {
public:
   NexoHostTest()
   {
      seen = {};
      nexo().install(&kTree);
   }
   ~NexoHostTest() override { nexo().remove(); }
   host::NexoRegistry &nexo() { return host.state().nexo; }
};

TEST_F(NexoHostTest, PathsPassTheirInstanceKeysOutermostFirstAndOthersAreRefusedWithoutACall)
{
   std::vector<int64_t> instances;
   host::NexoRecord record;
   const std::function<void()> refused[] = {
      [&] { (void)host.nexo().list("/nothing", &instances); },
      [&] { (void)host.nexo().get("/item/detail", &record); },   // key missing
      [&] { (void)host.nexo().get("/item/4294967296/detail", &record); },
      [&] { (void)host.nexo().list("/action", &instances); },    // not a list
      [&] { (void)host.nexo().list("/item/3", &instances); },    // an instance
      [&] { (void)host.nexo().set("/item/1/sub/1", {}); },       // no set handler
      [&] { (void)host.nexo().get("/item", &record); },
   };
   for (const auto &call : refused) {
      EXPECT_THROW(call(), std::invalid_argument);
   }
   EXPECT_EQ(host.nexo().set("/action", {}), ORR_BAD_PARAM) << "fewer arguments than the node takes";
   EXPECT_EQ(host.nexo().set("/action", {"1", "2", "3", "4"}), ORR_BAD_PARAM);
   EXPECT_EQ(seen.calls, 0);

   EXPECT_EQ(host.nexo().list("/item", &instances), ORR_OK);
   EXPECT_EQ(instances, (std::vector<int64_t>{10, 11, 12}));
   EXPECT_EQ(host.nexo().list("/item/11/sub", &instances), ORR_OK);
   EXPECT_EQ(seen.keys, (std::vector<int64_t>{11}));
   EXPECT_EQ(host.nexo().get("/item/-5/sub/2", &record), ORR_OK);
   EXPECT_EQ(seen.keys, (std::vector<int64_t>{-5, 2}));
   EXPECT_EQ(record.value("kind"), "Two");
   // A key above INT32_MAX keeps its 32-bit pattern.
   EXPECT_EQ(host.nexo().set("/item/4294967295/detail", {}), ORR_TRY_AGAIN);
   EXPECT_EQ(seen.keys, (std::vector<int64_t>{-1}));
   EXPECT_EQ(host.nexo().set("/action", {"a", "b c"}), ORR_TRY_AGAIN);
   EXPECT_EQ(seen.input, (std::vector<std::string>{"a", "b c"}));
   EXPECT_EQ(host.nexo().list("/item/0/sub", &instances), ORR_LIMIT_EXCEEDED);
   EXPECT_EQ(instances.size(), NEXO_PARAM_LIST_CAPACITY) << "a filled list refuses the next entry";
}

TEST_F(NexoHostTest, RecordsRenderAsLabelledTextAndByFieldName)
{
   host::NexoRecord record;
   ASSERT_EQ(host.nexo().get("/item/1/detail", &record), ORR_OK);
   EXPECT_EQ(record.name, "Sample");
   EXPECT_EQ(record.text(), "A sample\n   Small  : 200\n   Text   : abc\n   Kind   : One\n");
   EXPECT_EQ(record.values(), (std::map<std::string, std::string, std::less<>>{
                                 {"small", "200"}, {"text", "abc"}, {"kind", "One"}}));
   EXPECT_THROW((void)record.value("nope"), std::out_of_range);
   ASSERT_EQ(host.nexo().get("/item/1/sub/7", &record), ORR_OK);
   EXPECT_EQ(record.value("kind"), "unknown (7)");
   ASSERT_EQ(host.nexo().get("/item/1/sub/99", &record), ORR_OK);
   EXPECT_EQ(record.value("text"), "xxxxxxxx");
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("'text' is not terminated")));
}

TEST_F(NexoHostTest, ArgumentsReadOnlyAsTheirTypeAndMacTextsAsSixHexGroups)
{
   Nexo_ParamList list;
   list.entries = {{.isText = true, .number = 0, .text = "7"}, {.isText = false, .number = 0x1'0000'0000, .text = {}},
                   {.isText = false, .number = -3, .text = {}}};
   int32_t i32 = 0;
   uint32_t u32 = 0;
   const char *text = nullptr;
   EXPECT_EQ(Nexo_ParamListGetInt32(&list, 0, &i32), ORR_BAD_PARAM);   // text
   EXPECT_EQ(Nexo_ParamListGetInt32(&list, 1, &i32), ORR_BAD_PARAM);   // past 32 bits
   EXPECT_EQ(Nexo_ParamListGetUInt32(&list, 2, &u32), ORR_OK);
   EXPECT_EQ(u32, 0xfffffffdu);
   EXPECT_EQ(Nexo_ParamListGetString(&list, 2, &text), ORR_BAD_PARAM);
   EXPECT_EQ(Nexo_ParamListGetString(&list, 3, &text), ORR_NOT_FOUND);
   ASSERT_EQ(Nexo_ParamListGetString(&list, 0, &text), ORR_OK);
   EXPECT_STREQ(text, "7");
   uint8_t mac[6] = {};
   for (const char *bad : {"02:00:00:01:02", "02:00:00:01:02:033", "02-00-00-01-02-03"}) {
      EXPECT_EQ(Net_StrToMac(bad, mac), ORR_BAD_PARAM) << bad;
   }
   ASSERT_EQ(Net_StrToMac("2:0:0:A:bc:FF", mac), ORR_OK);
   EXPECT_EQ(std::vector<uint8_t>(mac, mac + 6), (std::vector<uint8_t>{2, 0, 0, 0xa, 0xbc, 0xff}));
}

}  // namespace
}  // namespace swsec::testing
