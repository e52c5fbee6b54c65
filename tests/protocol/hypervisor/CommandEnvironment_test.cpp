#include "hypervisor/CommandEnvironment.hpp"

#include <cstdlib>
#include <gmock/gmock.h>
#include <pwd.h>
#include <unistd.h>

namespace qel::test {

namespace {

using protocol::commandEnvironment;
using ::testing::ElementsAre;

TEST(CommandEnvironment, HasSevenVariables)
{
    const passwd* const account = ::getpwuid(::geteuid());
    if (account == nullptr) GTEST_SKIP() << "this account has no entry in the user database";
    EXPECT_THAT(commandEnvironment(65535, "xterm-256color"),
                ElementsAre("TERM=xterm-256color", std::string("HOME=") + account->pw_dir,
                            "PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin",
                            std::string("USER=") + account->pw_name, std::string("SHELL=") + account->pw_shell,
                            "LANG=C.UTF-8", "QEL_PARTITION=65535"));
}

TEST(CommandEnvironment, DoesNotDependOnTheEnvironmentOfTheServer)
{
    const auto before = commandEnvironment(1, "vt220");
    const char* const home = std::getenv("HOME");
    const std::string homeBefore = home == nullptr ? "/" : home;
    ::setenv("HOME", "/nowhere", 1);
    const auto after = commandEnvironment(1, "vt220");
    ::setenv("HOME", homeBefore.c_str(), 1);
    EXPECT_EQ(before, after);
}

} // namespace

} // namespace qel::test
