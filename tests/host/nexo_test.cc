// The host's Nexo tree on its own: a branch checked before it is installed,
// paths resolved to nodes and instance keys, parameter lists with their
// limits and fault points, and output records rendered by their definition.
#include "host_unit.h"

#include "host/state.h"

#include <gmock/gmock.h>

#include <array>
#include <cstring>
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

std::vector<int64_t> numbers(const Nexo_ParamList *list)
{
   std::vector<int64_t> out;
   uint32_t count = 0;
   EXPECT_EQ(Nexo_ParamListUsedCount(list, &count), ORR_OK);
   for (uint32_t i = 0; i < count; ++i) {
      int32_t value = 0;
      EXPECT_EQ(Nexo_ParamListGetInt32(list, i, &value), ORR_OK);
      out.push_back(value);
   }
   return out;
}

orr_Status listThree(const Nexo_NodeDef *, const Nexo_ParamList *keys, Nexo_ParamList *list)
{
   seen.calls++;
   seen.keys = numbers(keys);
   for (int64_t i = 10; i < 13; ++i) {
      if (orr_Status status = Nexo_ParamListAddInt(list, i); status != ORR_OK) {
         return status;
      }
   }
   return ORR_OK;
}

orr_Status listMany(const Nexo_NodeDef *, const Nexo_ParamList *, Nexo_ParamList *list)
{
   orr_Status status = ORR_OK;
   for (int64_t i = 0; status == ORR_OK; ++i) {
      status = Nexo_ParamListAddInt(list, i);
   }
   return status;
}

struct __attribute__((packed)) Sample {
   uint8_t small;
   char text[8];
   uint32_t kind;
};

orr_Status getSample(const Nexo_NodeDef *, const Nexo_ParamList *keys, void *output)
{
   seen.calls++;
   seen.keys = numbers(keys);
   auto *sample = static_cast<Sample *>(output);
   sample->small = 200;
   std::strcpy(sample->text, "abc");
   sample->kind = seen.keys.empty() ? 9 : static_cast<uint32_t>(seen.keys.back());
   return ORR_OK;
}

orr_Status getUnterminated(const Nexo_NodeDef *, const Nexo_ParamList *, void *output)
{
   auto *sample = static_cast<Sample *>(output);
   sample->small = 1;
   std::memset(sample->text, 'x', sizeof sample->text);
   sample->kind = 1;
   return ORR_OK;
}

orr_Status setRecord(const Nexo_NodeDef *, const Nexo_ParamList *keys, const Nexo_ParamList *input)
{
   seen.calls++;
   seen.keys = numbers(keys);
   seen.input.clear();
   uint32_t count = 0;
   EXPECT_EQ(Nexo_ParamListUsedCount(input, &count), ORR_OK);
   for (uint32_t i = 0; i < count; ++i) {
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

// root -> item (list) -> detail (leaf), sub (leaf list); root -> action, broken
constexpr Nexo_NodeDef kNodes[] = {
   {1, "root", NEXO_NO_PARENT, NEXO_NODE_BRANCH, nullptr, nullptr, nullptr, 0, 0, nullptr},
   {2, "item", 1, NEXO_NODE_LIST, listThree, nullptr, nullptr, 0, 0, nullptr},
   {3, "detail", 2, NEXO_NODE_LEAF, nullptr, getSample, setRecord, 0, 2, &kSample},
   {4, "sub", 2, NEXO_NODE_LEAF_LIST, listThree, getSample, nullptr, 0, 0, &kSample},
   {5, "action", 1, NEXO_NODE_LEAF, nullptr, Nexo_NULL_Get, setRecord, 1, 3, nullptr},
   {6, "broken", 1, NEXO_NODE_LEAF, nullptr, getUnterminated, nullptr, 0, 0, &kSample},
   {7, "many", 1, NEXO_NODE_LIST, listMany, nullptr, nullptr, 0, 0, nullptr},
};
constexpr Nexo_Tree kTree = {kNodes, 7, kRecords, 1};

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

TEST_F(NexoHostTest, paths_pass_their_instance_keys_outermost_first)
{
   std::vector<int64_t> instances;
   EXPECT_EQ(host.nexo().list("/item", &instances), ORR_OK);
   EXPECT_EQ(instances, (std::vector<int64_t>{10, 11, 12}));
   EXPECT_TRUE(seen.keys.empty());

   EXPECT_EQ(host.nexo().list("/item/11/sub", &instances), ORR_OK);
   EXPECT_EQ(seen.keys, (std::vector<int64_t>{11}));

   host::NexoRecord record;
   EXPECT_EQ(host.nexo().get("/item/-5/sub/2", &record), ORR_OK);
   EXPECT_EQ(seen.keys, (std::vector<int64_t>{-5, 2}));
   EXPECT_EQ(record.value("kind"), "Two");

   // A key above INT32_MAX keeps its 32-bit pattern.
   EXPECT_EQ(host.nexo().set("/item/4294967295/detail", {}), ORR_TRY_AGAIN);
   EXPECT_EQ(seen.keys, (std::vector<int64_t>{-1}));
}

TEST_F(NexoHostTest, paths_that_name_no_node_or_operation_are_refused_without_a_call)
{
   std::vector<int64_t> instances;
   host::NexoRecord record;
   EXPECT_THROW((void)host.nexo().list("/nothing", &instances), std::invalid_argument);
   EXPECT_THROW((void)host.nexo().get("/item/detail", &record), std::invalid_argument);    // key missing
   EXPECT_THROW((void)host.nexo().get("/item/4294967296/detail", &record), std::invalid_argument);
   EXPECT_THROW((void)host.nexo().list("/action", &instances), std::invalid_argument);     // not a list
   EXPECT_THROW((void)host.nexo().list("/item/3", &instances), std::invalid_argument);     // an instance
   EXPECT_THROW((void)host.nexo().set("/item/1/sub/1", {}), std::invalid_argument);       // no set handler
   EXPECT_THROW((void)host.nexo().get("/item", &record), std::invalid_argument);
   EXPECT_EQ(seen.calls, 0);
}

TEST_F(NexoHostTest, set_arguments_arrive_as_text_within_the_nodes_count_rule)
{
   EXPECT_EQ(host.nexo().set("/action", {"a", "b c"}), ORR_TRY_AGAIN);
   EXPECT_EQ(seen.input, (std::vector<std::string>{"a", "b c"}));
   EXPECT_EQ(host.nexo().set("/action", {}), ORR_BAD_PARAM);
   EXPECT_EQ(host.nexo().set("/action", {"1", "2", "3", "4"}), ORR_BAD_PARAM);
   EXPECT_EQ(seen.calls, 1);
}

TEST_F(NexoHostTest, records_render_as_labelled_text_and_by_field_name)
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
}

TEST_F(NexoHostTest, a_text_field_without_its_terminator_is_a_violation)
{
   host::NexoRecord record;
   ASSERT_EQ(host.nexo().get("/broken", &record), ORR_OK);
   EXPECT_EQ(record.value("text"), "xxxxxxxx");
   EXPECT_THAT(takeViolations(), ElementsAre(HasSubstr("'text' is not terminated")));
}

TEST_F(NexoHostTest, a_filled_list_refuses_the_next_entry)
{
   std::vector<int64_t> instances;
   EXPECT_EQ(host.nexo().list("/many", &instances), ORR_LIMIT_EXCEEDED);
   EXPECT_EQ(instances.size(), NEXO_PARAM_LIST_CAPACITY);
   EXPECT_EQ(instances.back(), NEXO_PARAM_LIST_CAPACITY - 1);
}

TEST_F(NexoHostTest, parameter_reads_refuse_absent_and_mistyped_arguments)
{
   Nexo_ParamList list;
   list.entries.push_back({.isText = true, .number = 0, .text = "7"});
   list.entries.push_back({.isText = false, .number = 0x1'0000'0000, .text = {}});
   list.entries.push_back({.isText = false, .number = -3, .text = {}});
   int32_t i32 = 0;
   uint32_t u32 = 0;
   const char *text = nullptr;
   EXPECT_EQ(Nexo_ParamListGetInt32(&list, 0, &i32), ORR_BAD_PARAM);    // text
   EXPECT_EQ(Nexo_ParamListGetInt32(&list, 1, &i32), ORR_BAD_PARAM);    // past 32 bits
   EXPECT_EQ(Nexo_ParamListGetInt32(&list, 3, &i32), ORR_NOT_FOUND);
   EXPECT_EQ(Nexo_ParamListGetUInt32(&list, 2, &u32), ORR_OK);
   EXPECT_EQ(u32, 0xfffffffdu);
   EXPECT_EQ(Nexo_ParamListGetString(&list, 2, &text), ORR_BAD_PARAM);
   EXPECT_EQ(Nexo_ParamListGetString(&list, 9, &text), ORR_NOT_FOUND);
   ASSERT_EQ(Nexo_ParamListGetString(&list, 0, &text), ORR_OK);
   EXPECT_STREQ(text, "7");
}

TEST_F(NexoHostTest, every_parameter_operation_is_a_fault_point)
{
   Nexo_ParamList list;
   list.entries.push_back({.isText = false, .number = 1, .text = {}});
   list.entries.push_back({.isText = true, .number = 0, .text = "t"});
   int32_t i32 = 0;
   uint32_t u32 = 0;
   const char *text = nullptr;
   struct Case {
      const char *op;
      std::function<orr_Status()> call;
   };
   const std::vector<Case> cases = {
      {"Nexo_ParamListGetInt32", [&] { return Nexo_ParamListGetInt32(&list, 0, &i32); }},
      {"Nexo_ParamListGetUInt32", [&] { return Nexo_ParamListGetUInt32(&list, 0, &u32); }},
      {"Nexo_ParamListGetString", [&] { return Nexo_ParamListGetString(&list, 1, &text); }},
      {"Nexo_ParamListUsedCount", [&] { return Nexo_ParamListUsedCount(&list, &u32); }},
      {"Nexo_ParamListAddInt", [&] { return Nexo_ParamListAddInt(&list, 5); }},
      {"Nexo_NULL_Get", [&] { return Nexo_NULL_Get(nullptr, &list, nullptr); }},
      {"Nexo_NULL_Set", [&] { return Nexo_NULL_Set(nullptr, &list, &list); }},
   };
   for (const Case &c : cases) {
      host.faults().failOnce(c.op, ORR_NOT_READY);
      EXPECT_EQ(c.call(), ORR_NOT_READY) << c.op;
      EXPECT_EQ(c.call(), ORR_OK) << c.op;
   }
}

TEST_F(NexoHostTest, a_removed_branch_takes_no_more_calls)
{
   nexo().remove();
   EXPECT_FALSE(host.nexo().installed());
   EXPECT_TRUE(host.nexo().paths().empty());
   EXPECT_THROW((void)host.nexo().set("/action", {"x"}), std::invalid_argument);
   nexo().install(&kTree);
   EXPECT_EQ(host.nexo().paths(), (std::vector<std::string>{"/", "/item", "/item/<key>/detail",
                                                            "/item/<key>/sub", "/action", "/broken", "/many"}));
}

TEST(NexoTreeCheck, malformed_branches_are_refused_before_install)
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
   const Nexo_NodeDef root = {1, "root", NEXO_NO_PARENT, NEXO_NODE_BRANCH, nullptr, nullptr, nullptr, 0, 0, nullptr};
   const std::vector<Case> cases = {
      {"two roots", {root, {2, "other", NEXO_NO_PARENT, NEXO_NODE_BRANCH, nullptr, nullptr, nullptr, 0, 0, nullptr}}},
      {"repeated ID", {root, {1, "again", 1, NEXO_NODE_LEAF, nullptr, Nexo_NULL_Get, nullptr, 0, 0, nullptr}}},
      {"child first", {{2, "leaf", 1, NEXO_NODE_LEAF, nullptr, Nexo_NULL_Get, nullptr, 0, 0, nullptr}, root}},
      {"list without handler", {root, {2, "l", 1, NEXO_NODE_LIST, nullptr, nullptr, nullptr, 0, 0, nullptr}}},
      {"branch with get", {root, {2, "b", 1, NEXO_NODE_BRANCH, nullptr, Nexo_NULL_Get, nullptr, 0, 0, nullptr}}},
      {"name with slash", {root, {2, "a/b", 1, NEXO_NODE_LEAF, nullptr, Nexo_NULL_Get, nullptr, 0, 0, nullptr}}},
      {"min above max", {root, {2, "s", 1, NEXO_NODE_LEAF, nullptr, nullptr, Nexo_NULL_Set, 2, 1, nullptr}}},
      {"field past its record", {root, {2, "g", 1, NEXO_NODE_LEAF, nullptr, Nexo_NULL_Get, nullptr, 0, 0, &tooSmall}}},
      {"enum field without its definition", {root}, {&badEnum}},
   };
   for (const Case &c : cases) {
      const Nexo_Tree tree = {c.nodes.data(), static_cast<uint32_t>(c.nodes.size()), c.records.data(),
                              static_cast<uint32_t>(c.records.size())};
      EXPECT_THROW(host::NexoRegistry::validate(tree), std::runtime_error) << c.what;
   }
   EXPECT_NO_THROW(host::NexoRegistry::validate(kTree));
}

TEST_F(NexoHostTest, mac_texts_parse_as_six_hex_groups)
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
   host.faults().failOnce("Net_StrToMac", ORR_NO_MEMORY);
   uint8_t mac[6];
   EXPECT_EQ(Net_StrToMac("02:00:00:01:02:03", mac), ORR_NO_MEMORY);
}

}  // namespace
}  // namespace swsec::testing
