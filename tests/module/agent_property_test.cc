// Agents created by writing names to the agent-creation client-port property.
#include "module_checks.h"
#include "support/host_fixture.h"

#include "framework/sifra_generic_agent.h"

#include <algorithm>
#include <string>
#include <thread>
#include <vector>

namespace swsec::testing {
namespace {

using Strings = std::vector<std::string>;
const std::string kAgent = "sifra-generic-tarlin-swsec";

class AgentPropertyTest : public ModuleTest {
protected:
   orr_Status write(std::string_view names)
   {
      return host().plex().write("com.tarlin.common.switch-security", names);
   }

   // The agents after the built-in one, in registration order.
   Strings created()
   {
      Strings names;
      for (const auto &fastPath : host().sifra().fastPaths()) {
         names.push_back(fastPath.name);
      }
      EXPECT_FALSE(names.empty() || names[0] != kAgent) << "the built-in agent comes first";
      names.erase(names.begin());
      return names;
   }

   const SifraGenericFastPathAgent *agent(const std::string &name)
   {
      auto fastPath = host().sifra().fastPath(name);
      return fastPath ? SifraGenericAgentFromHandle(fastPath->agent) : nullptr;
   }

   size_t agentLocks()
   {
      const auto locks = host().locks().live();
      return static_cast<size_t>(std::ranges::count(locks, std::string("sifg.fastpath"), &host::LockInfo::name));
   }
};

TEST_F(AgentPropertyTest, names_are_created_in_order_each_with_its_lock_its_arguments_after_a_colon_and_no_property)
{
   EXPECT_EQ(write("a:b"), ORR_OK);
   EXPECT_TRUE(loggedWithPrefix(host(), "Registering new fastpath 'a:b'", ORR_LOG_INFO,
                                "SifraGenericRegisterFastpath"));
   const SifraGenericFastPathAgent *a = agent("a");
   ASSERT_NE(a, nullptr);
   EXPECT_STREQ(a->agentArgs, "b");
   EXPECT_EQ(a->namePtr, a->name);
   EXPECT_EQ(a->agentArgsPtr, a->agentArgs);
   EXPECT_EQ(a->propHandle, nullptr) << "only the built-in agent has a security property";

   EXPECT_EQ(write("a:c"), ORR_OK);
   EXPECT_TRUE(loggedWithPrefix(host(), "Agent a already exists. Not recreating", ORR_LOG_INFO,
                                "SifraGenericRegisterFastpath"));
   EXPECT_STREQ(agent("a")->agentArgs, "b");

   EXPECT_EQ(write("x y z"), ORR_OK);
   EXPECT_EQ(created(), (Strings{"a", "x", "y", "z"}));
   EXPECT_EQ(agentLocks(), 5u);
   // Fields creation sets itself (the host hands out uncleared blocks).
   const SifraGenericFastPathAgent *x = agent("x");
   ASSERT_NE(x, nullptr);
   EXPECT_STREQ(x->agentArgs, "");
   EXPECT_EQ(x->attachTimer + x->attachRescan, 0u);
   EXPECT_EQ(host().sifra().properties(), Strings{kAgent + ".security"});
}

TEST_F(AgentPropertyTest, a_refused_name_stops_the_write_and_keeps_earlier_agents)
{
   const uint64_t before = host().faults().calls("orr_SifraRegisterFastPath");
   host().faults().failOnce("orr_SifraRegisterFastPath", ORR_LIMIT_EXCEEDED, 2);

   EXPECT_EQ(write("x y z"), ORR_LIMIT_EXCEEDED);

   EXPECT_EQ(created(), Strings{"x"});
   EXPECT_TRUE(loggedWithPrefix(host(), "y: Failed to register agent " + statusText(ORR_LIMIT_EXCEEDED),
                                ORR_LOG_ERROR));
   EXPECT_EQ(host().log().count("'z'"), 0u) << "z is never looked at";
   EXPECT_EQ(host().faults().calls("orr_SifraRegisterFastPath") - before, 2u);
   EXPECT_EQ(agentLocks(), 2u) << "y's lock is destroyed again";
}

struct TextCase {
   const char *name;
   std::string text;
   Strings created;
   size_t emptyNames;     // "Registering new fastpath ''" messages
   size_t alreadyThere;   // "already exists" messages
};

class AgentTextTest : public AgentPropertyTest, public ::testing::WithParamInterface<TextCase> {};

TEST_P(AgentTextTest, every_single_space_ends_a_name)
{
   const TextCase &c = GetParam();
   EXPECT_EQ(write(c.text), ORR_OK);
   EXPECT_EQ(created(), c.created);
   EXPECT_EQ(host().log().count("Registering new fastpath ''"), c.emptyNames);
   EXPECT_EQ(host().log().count("already exists. Not recreating"), c.alreadyThere);
}

INSTANTIATE_TEST_SUITE_P(
   Texts, AgentTextTest,
   ::testing::Values(TextCase{"trailing_space_offers_the_name_again", "x ", {"x"}, 0, 1},
                     TextCase{"zero_bytes", "", {}, 0, 0},
                     TextCase{"single_space_names_nothing_twice", " ", {}, 2, 0},
                     TextCase{"two_spaces_name_nothing_between", "a  b", {"a", "b"}, 1, 0},
                     TextCase{"colon_first_names_nothing", ":args", {}, 0, 0},
                     TextCase{"a_tab_is_part_of_a_name", "a\tb", {"a\tb"}, 0, 0},
                     TextCase{"a_name_given_twice_is_made_once", "x x", {"x"}, 0, 1},
                     TextCase{"builtin_name_exists", kAgent, {}, 0, 1},
                     TextCase{"text_ends_at_the_first_zero_byte", std::string("x\0y", 3), {"x"}, 0, 0}),
   [](const auto &test) { return std::string(test.param.name); });

TEST_F(AgentPropertyTest, long_names_and_arguments_are_cut_to_fit_their_fields)
{
   const std::string name99(99, 'n'), name100(100, 'm'), name150(150, 'l'), args200(200, 'a');

   EXPECT_EQ(write(name99 + " " + name100 + " " + name150 + ":" + args200), ORR_OK);
   EXPECT_EQ(created(), (Strings{name99, name100.substr(0, 99), name150.substr(0, 99)}));
   EXPECT_EQ(std::string(agent(name150.substr(0, 99))->agentArgs), args200.substr(0, 127));

   // The same long name again finds the agent that was made from it.
   EXPECT_EQ(write(name150), ORR_OK);
   EXPECT_EQ(created().size(), 3u);
   EXPECT_EQ(host().log().count("already exists. Not recreating"), 1u);
}

TEST_F(AgentPropertyTest, no_memory_for_the_text_fails_the_write)
{
   host().faults().failOnce("orr_HeapAllocWithRA", ORR_NO_MEMORY);
   EXPECT_EQ(write("x"), ORR_FAILURE);
   EXPECT_TRUE(loggedWithPrefix(host(), "Failed to allocate memory for agent names", ORR_LOG_ERROR));
   EXPECT_TRUE(created().empty());
}

// Two writers naming the same agents at once: looking a name up and
// creating it is one step, so neither is refused by the host for a name
// the other has just registered.
TEST_F(AgentPropertyTest, concurrent_writes_create_each_name_once)
{
   std::string names = "c0";
   for (int i = 1; i < 300; i++) {
      names += " c" + std::to_string(i);
   }
   orr_Status first = ORR_FAILURE;
   std::thread writer([&] { first = write(names); });
   const orr_Status second = write(names);
   writer.join();

   EXPECT_EQ(first, ORR_OK);
   EXPECT_EQ(second, ORR_OK);
   EXPECT_EQ(created().size(), 300u);
   EXPECT_EQ(agentLocks(), 301u);
}

}  // namespace
}  // namespace swsec::testing
