// Splitting the agent-creation text into names.
#include "framework/sifra_generic_agent.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace swsec::testing {
namespace {

struct Recorder {
   std::vector<std::string> names;
   size_t failAt = 0;   // the name (1-based) whose registration fails; 0: none
};

orr_Status record(char *name, void *context)
{
   auto *recorder = static_cast<Recorder *>(context);
   recorder->names.emplace_back(name);
   return recorder->names.size() == recorder->failAt ? ORR_LIMIT_EXCEEDED : ORR_OK;
}

struct SplitCase {
   const char *name;
   std::string text;
   size_t failAt;
   std::vector<std::string> handedOver;
};

class AgentNamesTest : public ::testing::TestWithParam<SplitCase> {};

TEST_P(AgentNamesTest, hands_over_each_name_in_order_until_one_fails)
{
   const SplitCase &c = GetParam();
   std::string text = c.text;
   Recorder recorder{{}, c.failAt};
   EXPECT_EQ(SifraGenericForEachAgentName(text.data(), record, &recorder),
             c.failAt != 0 ? ORR_LIMIT_EXCEEDED : ORR_OK);
   EXPECT_EQ(recorder.names, c.handedOver);
}

INSTANTIATE_TEST_SUITE_P(
   Texts, AgentNamesTest,
   ::testing::Values(SplitCase{"empty", "", 0, {}},
                     SplitCase{"three", "x y z", 0, {"x", "y", "z"}},
                     SplitCase{"trailing_space_repeats_the_last", "x ", 0, {"x", "x"}},
                     SplitCase{"single_space", " ", 0, {"", ""}},
                     SplitCase{"leading_space", " x", 0, {"", "x"}},
                     SplitCase{"double_space", "a  b", 0, {"a", "", "b"}},
                     SplitCase{"colons_and_tabs_are_kept", "a:b c\td", 0, {"a:b", "c\td"}},
                     SplitCase{"failure_stops_the_walk", "x y z", 2, {"x", "y"}},
                     SplitCase{"failure_of_the_last", "x y z", 3, {"x", "y", "z"}},
                     SplitCase{"failure_before_the_repeat", "x ", 1, {"x"}},
                     SplitCase{"failure_of_the_repeat", "x ", 2, {"x", "x"}}),
   [](const auto &test) { return std::string(test.param.name); });

}  // namespace
}  // namespace swsec::testing
