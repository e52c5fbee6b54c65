#include "base/Program.hpp"
#include "base/UsageErrors.hpp"

#include <algorithm>
#include <gtest/gtest.h>
#include <vector>

namespace qel::test {

namespace {

using tool::editDistance;

/// A program of two subcommands: "paint", which has options and an argument, and "call", which has subcommands.
class UsageErrors : public ::testing::Test {
protected:
    UsageErrors()
    {
        tool::addStandardFlags(mApp);
        mApp.require_subcommand(1);
        CLI::App& paint = tool::addCommand(mApp, "paint", "Paints");
        paint.add_option("--colour", mText, "")->type_name("NAME");
        paint.add_option("--columns", mText, "");
        CLI::Option* const quick = paint.add_flag("--quick", mFlag, "");
        paint.add_flag("--thorough", mFlag, "")->excludes(quick);
        paint.add_option("wall", mText, "")->required();
        CLI::App& call = tool::addCommand(mApp, "call", "Calls");
        call.add_option("--connect", mText, "");
        call.require_subcommand(1);
        CLI::App& time = tool::addCommand(call, "time", "The time");
        time.fallthrough();
        time.add_flag("--local", mFlag, "");
        tool::addCommand(call, "limits", "The limits").fallthrough();
    }

    /// What is said to the command line.
    std::string said(std::vector<std::string> arguments)
    {
        std::reverse(arguments.begin(), arguments.end()); // the parser takes them from the back
        try {
            mApp.parse(arguments);
        } catch (const CLI::ParseError& error) {
            return tool::usageMessage(mApp, error);
        }
        return "no error";
    }

private:
    CLI::App mApp{"A program", "prog"};
    std::string mText;
    bool mFlag = false;
};

TEST_F(UsageErrors, NamesTheNearestSubcommand)
{
    EXPECT_EQ(said({"piant", "--colour", "red", "north"}), "unknown subcommand \"piant\"; did you mean \"paint\"?");
    EXPECT_EQ(said({"call", "limit"}), "unknown subcommand \"limit\"; did you mean \"limits\"?");
    EXPECT_EQ(said({"call", "--connect", "x", "tiem"}), "unknown subcommand \"tiem\"; did you mean \"time\"?");
}

TEST_F(UsageErrors, NamesNoSubcommandWhenNoneIsNear)
{
    EXPECT_EQ(said({"sculpt"}), "unknown subcommand \"sculpt\"; see \"prog --help\"");
    EXPECT_EQ(said({"call", "nonsense"}), "unknown subcommand \"nonsense\"; see \"prog call --help\"");
}

TEST_F(UsageErrors, NamesTheNearestOption)
{
    EXPECT_EQ(said({"paint", "--color", "red", "north"}), "unknown option \"--color\"; did you mean \"--colour\"?");
    EXPECT_EQ(said({"paint", "--qiuck", "north"}), "unknown option \"--qiuck\"; did you mean \"--quick\"?");
    EXPECT_EQ(said({"--verison"}), "unknown option \"--verison\"; did you mean \"--version\"?");
    EXPECT_EQ(said({"paint", "--nonsense", "north"}), "unknown option \"--nonsense\"; see \"prog paint --help\"");
    EXPECT_EQ(said({"paint", "-x", "north"}), "unknown option \"-x\"; see \"prog paint --help\"");
}

TEST_F(UsageErrors, NamesTheOptionThatAnAbbreviationBegins)
{
    EXPECT_EQ(said({"call", "--conn", "x", "time"}), "unknown option \"--conn\"; did you mean \"--connect\"?");
    EXPECT_EQ(said({"paint", "--col", "red"}), "unknown option \"--col\"; did you mean \"--colour\"?");
}

TEST_F(UsageErrors, NamesAnOptionWithoutItsValue)
{
    EXPECT_EQ(said({"paint", "--color=red", "north"}), "unknown option \"--color\"; did you mean \"--colour\"?");
}

TEST_F(UsageErrors, NamesOptionsOfTheOuterAndTheInnerSubcommand)
{
    EXPECT_EQ(said({"call", "time", "--conect", "x"}), "unknown option \"--conect\"; did you mean \"--connect\"?");
    EXPECT_EQ(said({"call", "time", "--locla"}), "unknown option \"--locla\"; did you mean \"--local\"?");
}

TEST_F(UsageErrors, NamesAnOptionGivenBeforeItsSubcommand)
{
    EXPECT_EQ(said({"--colour", "red", "paint", "north"}),
              "write --colour after \"paint\": it is an option of that subcommand");
    EXPECT_EQ(said({"--connect=x", "call", "time"}),
              "write --connect after \"call\": it is an option of that subcommand");
}

TEST_F(UsageErrors, AnUnknownWordComesBeforeTheErrorsThatItCauses)
{
    // The value of the misspelt option is taken for the argument, or the argument is missing.
    EXPECT_EQ(said({"paint", "--color", "red"}), "unknown option \"--color\"; did you mean \"--colour\"?");
    EXPECT_EQ(said({"paint", "--color"}), "unknown option \"--color\"; did you mean \"--colour\"?");
    EXPECT_EQ(said({"paint", "--color", "--columns"}), "unknown option \"--color\"; did you mean \"--colour\"?");
}

TEST_F(UsageErrors, NamesAnUnexpectedArgument)
{
    EXPECT_EQ(said({"paint", "north", "south"}), "unexpected argument \"south\"; see \"prog paint --help\"");
    EXPECT_EQ(said({"call", "time", "limits"}), "unexpected argument \"limits\"; see \"prog call time --help\"");
    EXPECT_EQ(said({"paint", "--", "north", "--quick"}), "unexpected argument \"--quick\"; see \"prog paint --help\"");
}

TEST_F(UsageErrors, ListsTheSubcommandsWhenNoneIsGiven)
{
    EXPECT_EQ(said({}), "a subcommand is missing: paint, call; see \"prog --help\"");
    EXPECT_EQ(said({"call"}), "a subcommand is missing: time, limits; see \"prog call --help\"");
}

TEST_F(UsageErrors, NamesWhatIsMissing)
{
    EXPECT_EQ(said({"paint"}), "wall is required");
    EXPECT_EQ(said({"paint", "north", "--colour"}), "--colour needs a value: NAME");
}

TEST_F(UsageErrors, NamesAnOptionThatIsRepeated)
{
    EXPECT_EQ(said({"paint", "--colour", "red", "--colour", "blue", "north"}), "--colour is given more than once");
}

TEST_F(UsageErrors, NamesOptionsThatExcludeEachOther)
{
    EXPECT_EQ(said({"paint", "--quick", "--thorough", "north"}), "--quick and --thorough exclude each other");
}

TEST_F(UsageErrors, NamesTheValueThatAFlagDoesNotTake)
{
    EXPECT_EQ(said({"paint", "--quick=perhaps", "north"}), "--quick does not take \"perhaps\"");
}

TEST_F(UsageErrors, StaysOnOneLineWhateverTheArgumentsContain)
{
    EXPECT_EQ(said({"pa\nnt"}), "unknown subcommand \"pa\\x0ant\"; did you mean \"paint\"?");
    EXPECT_EQ(said({"paint", "--quick=\x1B[2J\n"}).find_first_of("\x1B\n"), std::string::npos);
}

TEST(EditDistance, CountsInsertionsDeletionsReplacementsAndSwaps)
{
    EXPECT_EQ(editDistance("", ""), 0U);
    EXPECT_EQ(editDistance("", "abc"), 3U);
    EXPECT_EQ(editDistance("abc", ""), 3U);
    EXPECT_EQ(editDistance("console", "console"), 0U);
    EXPECT_EQ(editDistance("cosole", "console"), 1U);
    EXPECT_EQ(editDistance("consolle", "console"), 1U);
    EXPECT_EQ(editDistance("consule", "console"), 1U);
    EXPECT_EQ(editDistance("cnosole", "console"), 1U);
    EXPECT_EQ(editDistance("serve", "bench"), 4U);
}

} // namespace

} // namespace qel::test
