// The repair of what an interrupted rotation left.

#include "LogBackendRotatingTest.hpp"
#include "support/FileCalls.hpp"

#include <cerrno>
#include <gmock/gmock.h>
#include <ostream>
#include <unistd.h>

namespace qel::test {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

struct RepairCase {
    const char* name;
    // In place of content: "<directory>"; "<link>", to nowhere; ">name", a link to that; "=name", a second name of
    // that.
    Files before;
    Files after; // with the current file created when it is missing
};

void PrintTo(const RepairCase& repair, std::ostream* os) { *os << repair.name; }

class LogBackendRotatingRepair : public LogBackendRotatingTest, public ::testing::WithParamInterface<RepairCase> {
protected:
    void arrange(const Files& wanted)
    {
        for (const auto& [name, content] : wanted) {
            if (content == "<directory>") {
                ASSERT_EQ(::mkdir(path(name).c_str(), 0755), 0);
            } else if (content == "<link>") {
                ASSERT_EQ(::symlink("nowhere/at/all", path(name).c_str()), 0);
            } else if (content[0] == '>') {
                ASSERT_EQ(::symlink(content.c_str() + 1, path(name).c_str()), 0);
            } else if (content[0] == '=') {
                ASSERT_EQ(::link(path(content.substr(1)).c_str(), path(name).c_str()), 0);
            } else {
                write(name, content);
            }
        }
    }
};

TEST_P(LogBackendRotatingRepair, ClosesGaps)
{
    arrange(GetParam().before);
    const auto backend = make();
    EXPECT_EQ(files(), GetParam().after);
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

std::string nameOfCase(const ::testing::TestParamInfo<RepairCase>& repair) { return repair.param.name; }

INSTANTIATE_TEST_SUITE_P(
    Cases, LogBackendRotatingRepair,
    ::testing::Values(
        RepairCase{"NothingThere", {}, {{"log", ""}}},
        RepairCase{"NoGap",
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "2"}, {"log.3", "3"}, {"log.4", "4"}},
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "2"}, {"log.3", "3"}, {"log.4", "4"}}},
        RepairCase{"CurrentOnly", {{"log", "0"}}, {{"log", "0"}}},
        RepairCase{"GapInTheMiddle",
                   {{"log", "0"}, {"log.2", "2"}, {"log.3", "3"}},
                   {{"log", "0"}, {"log.1", "2"}, {"log.2", "3"}}},
        RepairCase{"CurrentMissing", {{"log.1", "1"}}, {{"log", "1"}}},
        RepairCase{"CurrentMissingOfAll",
                   {{"log.1", "1"}, {"log.2", "2"}, {"log.3", "3"}, {"log.4", "4"}},
                   {{"log", "1"}, {"log.1", "2"}, {"log.2", "3"}, {"log.3", "4"}}},
        RepairCase{"OldestOnly", {{"log.4", "4"}}, {{"log", "4"}}},
        RepairCase{"CurrentAndOldest", {{"log", "0"}, {"log.4", "4"}}, {{"log", "0"}, {"log.1", "4"}}},
        RepairCase{"SeveralGaps", {{"log.1", "1"}, {"log.3", "3"}}, {{"log", "1"}, {"log.1", "3"}}},
        RepairCase{"LeavesAFileWithAHigherNumberAlone", {{"log", "0"}, {"log.5", "5"}}, {{"log", "0"}, {"log.5", "5"}}},
        RepairCase{"LeavesFilesOfOtherNamesAlone",
                   {{"logs", "x"}, {"log.1x", "y"}},
                   {{"log", ""}, {"logs", "x"}, {"log.1x", "y"}}},
        RepairCase{"SecondNameOfTheCurrentFile",
                   {{"log", "0"}, {"log.1", "=log"}, {"log.2", "2"}},
                   {{"log", "0"}, {"log.1", "2"}}},
        RepairCase{"SecondNameOfTheOldestFile",
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "2"}, {"log.3", "3"}, {"log.4", "=log.3"}},
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "2"}, {"log.3", "3"}}},
        RepairCase{"SecondNameAfterAGap",
                   {{"log.1", "1"}, {"log.2", "=log.1"}, {"log.3", "3"}},
                   {{"log", "1"}, {"log.1", "3"}}},
        RepairCase{
            "SecondNameAcrossAGap", {{"log", "0"}, {"log.2", "=log"}, {"log.3", "3"}}, {{"log", "0"}, {"log.1", "3"}}},
        RepairCase{"ThirdName",
                   {{"log", "0"}, {"log.1", "=log"}, {"log.2", "=log"}, {"log.3", "3"}},
                   {{"log", "0"}, {"log.1", "3"}}},
        RepairCase{"KeepsASecondNameThatIsNotANeighbour",
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "=log"}},
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "0"}}},
        RepairCase{"ASymbolicLinkIsAGap",
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "<link>"}, {"log.3", "3"}},
                   {{"log", "0"}, {"log.1", "1"}, {"log.2", "3"}}},
        RepairCase{"ASymbolicLinkToAFileIsAGap",
                   {{"log", "0"}, {"log.1", ">other"}, {"log.2", "2"}, {"other", "x"}},
                   {{"log", "0"}, {"log.1", "2"}, {"other", "x"}}},
        RepairCase{"ASymbolicLinkToTheCurrentFileIsNotASecondName",
                   {{"log", "0"}, {"log.1", ">log"}},
                   {{"log", "0"}, {"log.1", "<link>"}}},
        RepairCase{
            "ASymbolicLinkInPlaceOfTheCurrentFileIsReplaced", {{"log", "<link>"}, {"log.1", "1"}}, {{"log", "1"}}},
        RepairCase{"ASymbolicLinkWithNothingAfterItStays",
                   {{"log", "0"}, {"log.1", "<link>"}},
                   {{"log", "0"}, {"log.1", "<link>"}}},
        RepairCase{"ADirectoryIsAGapThatEndsTheRepair",
                   {{"log", "0"}, {"log.1", "<directory>"}, {"log.2", "2"}, {"log.4", "4"}},
                   {{"log", "0"}, {"log.1", "<directory>"}, {"log.2", "2"}, {"log.4", "4"}}},
        RepairCase{"SkipsADirectoryAfterAGap",
                   {{"log", "0"}, {"log.2", "<directory>"}, {"log.3", "3"}},
                   {{"log", "0"}, {"log.1", "3"}, {"log.2", "<directory>"}}}),
    nameOfCase);

TEST_F(LogBackendRotatingTest, AppendsToTheYoungestOlderFileWhenTheCurrentOneIsMissing)
{
    write("log.1", "1\n");
    const auto backend = make();
    log(*backend, "next");
    EXPECT_EQ(files(), (Files{{"log", "1\nnext\n"}}));
}

TEST_F(LogBackendRotatingTest, ADirectoryInPlaceOfTheCurrentFileEndsTheRepairAndIsReportedByTheOpening)
{
    ASSERT_EQ(::mkdir(path("log").c_str(), 0755), 0);
    write("log.1", "1");
    const auto backend = make();
    EXPECT_EQ(files(), (Files{{"log", "<directory>"}, {"log.1", "1"}}));
    EXPECT_THAT(mSystemLog.take(), ElementsAre(error("Failed to open log " + path("log"), "21 (Is a directory)")))
        << "what stopped the repair is not reported";
}

TEST_F(LogBackendRotatingTest, AFailedMoveEndsTheRepairSilently)
{
    write("log", "0");
    write("log.2", "2");
    write("log.3", "3");
    FileCalls calls;
    calls.fail(FileCalls::Rename, EACCES);
    const auto backend = make();
    EXPECT_EQ(files(), (Files{{"log", "0"}, {"log.2", "2"}, {"log.3", "3"}}));
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, AFailedRemovalEndsTheRepairSilently)
{
    write("log", "0");
    ASSERT_EQ(::link(path("log").c_str(), path("log.1").c_str()), 0);
    write("log.3", "3");
    FileCalls calls;
    calls.fail(FileCalls::Unlink, EACCES);
    const auto backend = make();
    EXPECT_EQ(files(), (Files{{"log", "0"}, {"log.1", "0"}, {"log.3", "3"}}));
    EXPECT_THAT(mSystemLog.take(), IsEmpty());
}

TEST_F(LogBackendRotatingTest, RepairsBeforeItOpens)
{
    write("log.1", "1");
    FileCalls calls;
    const auto backend = make();
    EXPECT_EQ(calls.take().front(), "rename log.1 log");
}

TEST_F(LogBackendRotatingTest, DoesNotRepairOnRotation)
{
    const auto backend = make(2);
    log(*backend, "a");
    log(*backend, "b");
    log(*backend, "c");
    ASSERT_EQ(::unlink(path("log.1").c_str()), 0);
    log(*backend, "d");
    EXPECT_EQ(files(), (Files{{"log", "d\n"}, {"log.1", "c\n"}, {"log.3", "a\n"}}));
}

} // namespace
} // namespace qel::test
