// The files that a session is written to.

#include <qel/common/util/PosixError.hpp>
#include <qel/common/util/UniqueFd.hpp>

#include "console/FileSender.hpp"
#include "console/LogFile.hpp"
#include "console/Recording.hpp"
#include "support/SettableClock.hpp"
#include "support/TemporaryDirectory.hpp"

#include <fcntl.h>
#include <fstream>
#include <gmock/gmock.h>
#include <iterator>
#include <nlohmann/json.hpp>
#include <string>
#include <sys/stat.h>
#include <vector>

namespace qel::test {

namespace {

using ::testing::HasSubstr;
using ::testing::StartsWith;
using tool::FileSender;
using tool::LogFile;
using tool::Recording;
using tool::TimeStamps;

void show(tool::SessionTap& tap, const std::string& text) { tap.onOutput(text.data(), text.size()); }

class SessionFilesTest : public ::testing::Test {
protected:
    std::string content() const
    {
        std::ifstream file(path);
        return {std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
    }
    std::vector<nlohmann::json> lines() const
    {
        std::ifstream file(path);
        std::vector<nlohmann::json> all;
        for (std::string line; std::getline(file, line);)
            all.push_back(nlohmann::json::parse(line));
        return all;
    }

    const TemporaryDirectory directory;
    const std::string path = directory.file("file");
    SettableClock clock;
};

TEST_F(SessionFilesTest, ARawLogHasEveryByteAndIsAppendedTo)
{
    std::ofstream(path) << "before ";
    LogFile log(path, LogFile::Content::Raw, TimeStamps::Style::Iso);
    show(log, std::string("\x1B[1mbold\0\r\n", 11));
    EXPECT_EQ(content(), "before " + std::string("\x1B[1mbold\0\r\n", 11));
}

TEST_F(SessionFilesTest, AStrippedLogIsReadableAndStamped)
{
    LogFile log(path, LogFile::Content::Stripped, TimeStamps::Style::Iso);
    show(log, "\x1B[1mbo");
    show(log, "ld\x1B[0m\r\nnext");
    EXPECT_EQ(content(), "[2024-01-02T03:04:05.000Z] bold\n[2024-01-02T03:04:05.000Z] next");
}

TEST_F(SessionFilesTest, AGapIsMarkedInTheLog)
{
    LogFile log(path, LogFile::Content::Raw);
    show(log, "$ ");
    log.onGap("connection lost");
    show(log, "$ ");
    EXPECT_EQ(content(), "$ \n[qel: connection lost]\n$ ");
}

TEST_F(SessionFilesTest, ALogThatIsOffWritesNothing)
{
    LogFile log(path, LogFile::Content::Raw);
    log.toggle();
    EXPECT_FALSE(log.isOn());
    show(log, "secret");
    log.toggle();
    show(log, "public");
    EXPECT_EQ(content(), "public");
}

TEST_F(SessionFilesTest, OnlyItsOwnerMayReadALog)
{
    const LogFile log(path, LogFile::Content::Raw);
    struct stat status {};
    ASSERT_EQ(::stat(path.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

TEST_F(SessionFilesTest, ALogThatCannotBeOpenedIsAnError)
{
    EXPECT_THROW(LogFile(directory.file("none/file"), LogFile::Content::Raw), FileIOError);
}

TEST_F(SessionFilesTest, AFullDiskEndsTheLogAndIsReportedOnce)
{
    LogFile log("/dev/full", LogFile::Content::Raw);
    EXPECT_EQ(log.takeFailure(), "");
    show(log, "x");
    EXPECT_FALSE(log.isOn());
    EXPECT_EQ(log.takeFailure(), "cannot write the log /dev/full: 28 (No space left on device)");
    EXPECT_EQ(log.takeFailure(), "");
    show(log, "y");
    EXPECT_EQ(log.takeFailure(), "");
}

TEST_F(SessionFilesTest, ARecordingHasAHeaderAndTheTimesOfTheOutput)
{
    Recording recording(path, "partition 1", {100, 40});
    show(recording, "$ \x1B[1m\"\r\n");
    clock.advance(std::chrono::microseconds(1234567));
    recording.onResize({80, 24});
    recording.onGap("connection lost");
    const auto all = lines();
    ASSERT_EQ(all.size(), 4U);
    EXPECT_EQ(all[0]["version"], 2);
    EXPECT_EQ(all[0]["width"], 100);
    EXPECT_EQ(all[0]["height"], 40);
    EXPECT_EQ(all[0]["timestamp"], 1704164645);
    EXPECT_EQ(all[0]["title"], "partition 1");
    EXPECT_EQ(all[1], nlohmann::json::parse(R"([0.0, "o", "$ \u001b[1m\"\r\n"])"));
    EXPECT_EQ(all[2], nlohmann::json::parse(R"([1.234567, "r", "80x24"])"));
    EXPECT_EQ(all[3], nlohmann::json::parse(R"([1.234567, "m", "connection lost"])"));
    EXPECT_THAT(content(), HasSubstr("\n[0.000000, \"o\","));
}

TEST_F(SessionFilesTest, ACharacterThatComesInPiecesIsRecordedAsOne)
{
    Recording recording(path, "", {});
    for (const char* const piece : {"a\xE2", "\x82", "\xAC", "\xF0\x9F\x98", "\x80z"})
        show(recording, piece);
    const auto all = lines();
    ASSERT_EQ(all.size(), 4U);
    EXPECT_EQ(all[1][2], "a");
    EXPECT_EQ(all[2][2], "\xE2\x82\xAC");
    EXPECT_EQ(all[3][2], "\xF0\x9F\x98\x80z");
}

TEST_F(SessionFilesTest, BytesThatAreNoTextAreReplacedInARecording)
{
    Recording recording(path, "", {});
    show(recording, "\xFF\x80 x");
    const auto all = lines();
    ASSERT_EQ(all.size(), 2U);
    EXPECT_EQ(all[1][2], "\xEF\xBF\xBD\xEF\xBF\xBD x");
}

TEST_F(SessionFilesTest, AFullDiskEndsTheRecordingAndIsReportedOnce)
{
    Recording recording("/dev/full", "", {});
    EXPECT_EQ(recording.takeFailure(), "cannot write the recording /dev/full: 28 (No space left on device)");
    show(recording, "x");
    EXPECT_EQ(recording.takeFailure(), "");
}

TEST_F(SessionFilesTest, AFileIsReadInPieces)
{
    const std::string text(10000, 'x');
    std::ofstream(path) << text;
    FileSender sender(path);
    EXPECT_EQ(sender.size(), text.size());
    std::string all;
    for (std::string piece = sender.next(); !piece.empty(); piece = sender.next()) {
        EXPECT_LE(piece.size(), 4096U);
        all += piece;
        EXPECT_EQ(sender.sent(), all.size());
    }
    EXPECT_EQ(all, text);
}

TEST_F(SessionFilesTest, AFileThatIsNotThereOrIsADirectoryIsAnError)
{
    EXPECT_THROW(FileSender(directory.file("none")), FileIOError);
    EXPECT_THROW(FileSender("/"), FileIOError);
}

TEST_F(SessionFilesTest, AGapEndsAControlSequenceThatHasBegun)
{
    LogFile log(path, LogFile::Content::Stripped);
    show(log, "$ \x1B]title");
    log.onGap("connection lost");
    log.onGap("connected again");
    show(log, "new\n");
    EXPECT_EQ(content(), "$ \n[qel: connection lost]\n[qel: connected again]\nnew\n");
}

TEST_F(SessionFilesTest, APipeThatNobodyReadsEndsTheLogAndNotTheSession)
{
    ASSERT_EQ(::mkfifo(path.c_str(), 0600), 0);
    EXPECT_THROW(LogFile(path, LogFile::Content::Raw), FileIOError);
    EXPECT_THROW(Recording(path, "", {}), FileIOError);
    const UniqueFd reader(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC));
    LogFile log(path, LogFile::Content::Raw);
    Recording recording(path, "", {});
    const std::string much(1000000, 'x');
    show(log, much);
    EXPECT_EQ(log.takeFailure(), "cannot write the log " + path + ": 11 (Resource temporarily unavailable)");
    show(recording, much);
    EXPECT_EQ(recording.takeFailure(),
              "cannot write the recording " + path + ": 11 (Resource temporarily unavailable)");
}

TEST_F(SessionFilesTest, ACharacterThatIsNotCompletedIsRecordedAllTheSame)
{
    {
        Recording recording(path, "", {});
        show(recording, "a\xE2\x82");
        recording.onGap("connection lost");
        show(recording, "b\xE2");
    }
    const auto all = lines();
    ASSERT_EQ(all.size(), 6U);
    EXPECT_EQ(all[2], nlohmann::json::parse("[0.0, \"o\", \"\xEF\xBF\xBD\"]"));
    EXPECT_EQ(all[3][1], "m");
    EXPECT_EQ(all[5][2], "\xEF\xBF\xBD");
}

} // namespace

} // namespace qel::test
