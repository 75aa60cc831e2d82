// The host's Nexo tree on its own: a branch checked before it is installed,
// paths resolved to nodes and instance keys, parameter lists with their
// limits and fault points, and output records rendered by their definition.
#include "host_unit.h"

#include "host/state.h"

#include <gmock/gmock.h>

#include <array>
#include <cstring>
#include <functional>
#include <string>
#include <tuple>
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

TEST_F(NexoHostTest, ParameterReadsRefuseAbsentAndMistypedArgumentsAndAreFaultPoints)
{
   Nexo_ParamList list;
   list.entries.push_back({.isText = true, .number = 0, .text = "7"});
   list.entries.push_back({.isText = false, .number = 0x1'0000'0000, .text = {}});
   list.entries.push_back({.isText = false, .number = -3, .text = {}});
   int32_t i32 = 0;
   uint32_t u32 = 0;
   const char *text = nullptr;
   EXPECT_EQ(Nexo_ParamListGetInt32(&list, 0, &i32), ORR_BAD_PARAM);   // text
   EXPECT_EQ(Nexo_ParamListGetInt32(&list, 1, &i32), ORR_BAD_PARAM);   // past 32 bits
   EXPECT_EQ(Nexo_ParamListGetInt32(&list, 3, &i32), ORR_NOT_FOUND);
   EXPECT_EQ(Nexo_ParamListGetUInt32(&list, 2, &u32), ORR_OK);
   EXPECT_EQ(u32, 0xfffffffdu);
   EXPECT_EQ(Nexo_ParamListGetString(&list, 2, &text), ORR_BAD_PARAM);
   EXPECT_EQ(Nexo_ParamListGetString(&list, 9, &text), ORR_NOT_FOUND);
   const std::pair<const char *, std::function<orr_Status()>> points[] = {
      {"Nexo_ParamListGetInt32", [&] { return Nexo_ParamListGetInt32(&list, 2, &i32); }},
      {"Nexo_ParamListGetUInt32", [&] { return Nexo_ParamListGetUInt32(&list, 2, &u32); }},
      {"Nexo_ParamListGetString", [&] { return Nexo_ParamListGetString(&list, 0, &text); }},
      {"Nexo_ParamListUsedCount", [&] { return Nexo_ParamListUsedCount(&list, &u32); }},
      {"Nexo_ParamListAddInt", [&] { return Nexo_ParamListAddInt(&list, 5); }},
      {"Nexo_NULL_Get", [&] { return Nexo_NULL_Get(nullptr, &list, nullptr); }},
      {"Nexo_NULL_Set", [&] { return Nexo_NULL_Set(nullptr, &list, &list); }},
   };
   for (const auto &[op, call] : points) {
      host.faults().failOnce(op, ORR_NOT_READY);
      EXPECT_EQ(call(), ORR_NOT_READY) << op;
      EXPECT_EQ(call(), ORR_OK) << op;
   }
   EXPECT_STREQ(text, "7");
   EXPECT_EQ(u32, 3u) << "the used count";
}

TEST_F(NexoHostTest, ARemovedBranchTakesNoMoreCalls)
{
   nexo().remove();
   EXPECT_FALSE(host.nexo().installed());
   EXPECT_TRUE(host.nexo().paths().empty());
   EXPECT_THROW((void)host.nexo().set("/action", {"x"}), std::invalid_argument);
   nexo().install(&kTree);
   EXPECT_EQ(host.nexo().paths(),
             (std::vector<std::string>{"/", "/item", "/item/<key>/detail", "/item/<key>/sub", "/action"}));
}

TEST(NexoTreeCheck, MalformedBranchesAreRefusedBeforeInstall)
{
   struct Case {
      const char *what;
      std::vector<Nexo_NodeDef> nodes;
      std::vector<const Nexo_RecordDef *> records = {};
   };
   const Nexo_FieldDef outside[] = {{"f", "F", NEXO_FIELD_CHARS, 4, 8, nullptr}};
   const Nexo_RecordDef tooSmall = {"R", "R", 10, outside, 1};
   const Nexo_FieldDef enumWithoutDef[] = {{"e", "E", NEXO_FIELD_ENUM32, 0, 4, nullptr}};
   const Nexo_RecordDef badEnum = {"R", "R", 10, enumWithoutDef, 1};
   const Nexo_NodeDef root = kNodes[0];
   auto node = [](uint32_t id, const char *name, uint32_t parent, Nexo_NodeKind kind, Nexo_GetFn get = Nexo_NULL_Get,
                  uint32_t min = 0, uint32_t max = 0, const Nexo_RecordDef *output = nullptr) {
      return Nexo_NodeDef{id, name, parent, kind, nullptr, get, min > 0 ? Nexo_NULL_Set : nullptr, min, max, output};
   };
   const std::vector<Case> cases = {
      {"two roots", {root, node(2, "other", NEXO_NO_PARENT, NEXO_NODE_BRANCH, nullptr)}},
      {"repeated ID", {root, node(1, "again", 1, NEXO_NODE_LEAF)}},
      {"child first", {node(2, "leaf", 1, NEXO_NODE_LEAF), root}},
      {"list without handler", {root, node(2, "l", 1, NEXO_NODE_LIST, nullptr)}},
      {"branch with get", {root, node(2, "b", 1, NEXO_NODE_BRANCH)}},
      {"name with slash", {root, node(2, "a/b", 1, NEXO_NODE_LEAF)}},
      {"min above max", {root, node(2, "s", 1, NEXO_NODE_LEAF, nullptr, 2, 1)}},
      {"field past its record", {root, node(2, "g", 1, NEXO_NODE_LEAF, Nexo_NULL_Get, 0, 0, &tooSmall)}},
      {"enum field without its definition", {root}, {&badEnum}},
   };
   for (const Case &c : cases) {
      const Nexo_Tree tree = {c.nodes.data(), static_cast<uint32_t>(c.nodes.size()), c.records.data(),
                              static_cast<uint32_t>(c.records.size())};
      EXPECT_THROW(host::NexoRegistry::validate(tree), std::runtime_error) << c.what;
   }
   EXPECT_NO_THROW(host::NexoRegistry::validate(kTree));
}

TEST_F(NexoHostTest, MacTextsParseAsSixHexGroups)
{
   using Mac6 = std::array<uint8_t, 6>;
   const Mac6 untouched = {9, 9, 9, 9, 9, 9};
   const std::tuple<const char *, orr_Status, Mac6> cases[] = {
      {"02:00:00:01:02:03", ORR_OK, {2, 0, 0, 1, 2, 3}},
      {"2:0:0:A:bc:FF", ORR_OK, {2, 0, 0, 0xa, 0xbc, 0xff}},
      {"02:00:00:01:02", ORR_BAD_PARAM, untouched},
      {"02:00:00:01:02:03:04", ORR_BAD_PARAM, untouched},
      {"02:00:00:01:02:033", ORR_BAD_PARAM, untouched},
      {"02-00-00-01-02-03", ORR_BAD_PARAM, untouched},
      {"g2:00:00:01:02:03", ORR_BAD_PARAM, untouched},
      {"", ORR_BAD_PARAM, untouched},
   };
   for (const auto &[text, status, expected] : cases) {
      Mac6 mac = untouched;
      EXPECT_EQ(Net_StrToMac(text, mac.data()), status) << text;
      EXPECT_EQ(mac, expected) << text;
   }
}

}  // namespace
}  // namespace swsec::testing
