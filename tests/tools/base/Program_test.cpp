#include "Commands.hpp"
#include "base/Program.hpp"
#include "support/Allocations.hpp"

#include <array>
#include <gmock/gmock.h>
#include <iostream>
#include <stdexcept>
#include <string>

namespace qel::test {

namespace {

using ::testing::MatchesRegex;

struct Outcome {
    int exitStatus;
    std::string errors;
};

/// Runs "qel --version" with the commands of the program.
/// @param allocations  how many succeed before all further ones fail
Outcome runWithout(std::size_t allocations)
{
    const std::array<const char*, 2> arguments{"qel", "--version"};
    ::testing::internal::CaptureStdout();
    ::testing::internal::CaptureStderr();
    int status = -1;
    {
        Allocations limit;
        limit.failAfter(allocations);
        status = tool::runProgram(tool::addCommands, static_cast<int>(arguments.size()), arguments.data());
    }
    ::testing::internal::GetCapturedStdout();
    return {status, ::testing::internal::GetCapturedStderr()};
}

TEST(Program, AWantOfMemoryOnTheCommandLineIsASentenceAndExitStatus4)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    constexpr std::size_t kStep = 37; // the command line takes some thousand allocations
    std::size_t count = 0;
    for (Outcome outcome = runWithout(0); outcome.exitStatus != 0; outcome = runWithout(count)) {
        ASSERT_EQ(outcome.exitStatus, 4) << count;
        ASSERT_EQ(outcome.errors, "qel: out of memory\n") << count;
        count += kStep;
    }
    EXPECT_GT(count, 1000U);
}

TEST(Program, AFailureWhileTheCommandsAreAddedIsReported)
{
    const std::array<const char*, 1> arguments{"qel"};
    const auto fail = [](CLI::App&, tool::Action&) { throw std::runtime_error("the reason"); };
    ::testing::internal::CaptureStderr();
    EXPECT_EQ(tool::runProgram(fail, static_cast<int>(arguments.size()), arguments.data()), 4);
    EXPECT_EQ(::testing::internal::GetCapturedStderr(), "qel: the reason\n");
}

} // namespace

} // namespace qel::test
