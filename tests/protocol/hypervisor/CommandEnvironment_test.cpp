#include "hypervisor/CommandEnvironment.hpp"

#include <cstdlib>
#include <gmock/gmock.h>
#include <pwd.h>
#include <unistd.h>

namespace qel::test {

namespace {

using protocol::commandEnvironment;
using ::testing::ElementsAre;

TEST(CommandEnvironment, HasSixVariables)
{
    const passwd* const account = ::getpwuid(::geteuid());
    if (account == nullptr) GTEST_SKIP() << "this account has no entry in the user database";
    EXPECT_THAT(commandEnvironment("xterm-256color"),
                ElementsAre("TERM=xterm-256color", std::string("HOME=") + account->pw_dir,
                            "PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin",
                            std::string("USER=") + account->pw_name, std::string("SHELL=") + account->pw_shell,
                            "LANG=C.UTF-8"));
}

TEST(CommandEnvironment, DoesNotDependOnTheEnvironmentOfTheServer)
{
    const auto before = commandEnvironment("vt220");
    const char* const home = std::getenv("HOME");
    const std::string homeBefore = home == nullptr ? "/" : home;
    ::setenv("HOME", "/nowhere", 1);
    const auto after = commandEnvironment("vt220");
    ::setenv("HOME", homeBefore.c_str(), 1);
    EXPECT_EQ(before, after);
}

TEST(CommandEnvironment, FurtherVariablesAreAddedOrReplaceThoseOfTheSameName)
{
    const auto plain = commandEnvironment("vt220");
    const auto more = commandEnvironment("vt220", {"LANG=C", "A=1", "TER=x", "A=2=3"});
    ASSERT_EQ(more.size(), 8U);
    EXPECT_EQ(std::vector<std::string>(more.begin(), more.begin() + 5),
              std::vector<std::string>(plain.begin(), plain.begin() + 5));
    EXPECT_EQ(more[5], "LANG=C");
    EXPECT_EQ(more[6], "A=2=3");
    EXPECT_EQ(more[7], "TER=x");
}

} // namespace

} // namespace qel::test
