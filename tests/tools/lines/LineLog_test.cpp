#include <qel/common/util/PosixError.hpp>

#include "lines/LineLogs.hpp"
#include "support/CapturedLog.hpp"
#include "support/FileCalls.hpp"
#include "support/SettableClock.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cerrno>
#include <cstdio>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <sstream>
#include <sys/stat.h>
#include <unistd.h>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using tool::LineLog;
using tool::PlainLines;
using tool::RotatingFile;

std::string contentsOf(const std::string& file)
{
    std::ostringstream text;
    text << std::ifstream(file).rdbuf();
    return text.str();
}

bool exists(const std::string& file) { return std::ifstream(file).good(); }

// Plain lines.

struct PlainRow {
    const char* name;
    std::string bytes;
    std::vector<std::string> lines;
};

const std::vector<PlainRow>& plainRows()
{
    static const std::vector<PlainRow> rows{
        {"line feed", "one\ntwo\n", {"one", "two"}},
        {"carriage return and line feed", "one\r\ntwo\r\n", {"one", "two"}},
        {"two carriage returns and a line feed", "one\r\r\ntwo\r\n", {"one", "two"}},
        {"empty lines", "\r\none\r\n\r\n\ntwo\n", {"", "one", "", "", "two"}},
        {"carriage returns alone", "10%\r20%\r\n", {"10%", "20%"}},
        {"colours", "\x1B[1;31mred\x1B[0m and \x1B[38;5;200mpink\x1B[m\n", {"red and pink"}},
        {"a title", "\x1B]0;title\x07text\n\x1B]2;other\x1B\\more\n", {"text", "more"}},
        {"a device control string", "a\x1BPq#0;2\x1B\\b\n", {"ab"}},
        {"character sets and keypad modes",
         "\x1B(Ba\x1B=\x1B>b\x1B"
         "7\n",
         {"ab"}},
        {"private modes", "\x1B[?25l\x1B[?1049hx\x1B[2J\x1B[H\n", {"x"}},
        {"control characters",
         "a\x07\b\x7F\x0E\x0F"
         "b\tc\n",
         {"ab\tc"}},
        {"a zero byte", std::string("a\0b\n", 4), {"ab"}},
        {"upper control characters",
         "a\x9B"
         "2Jb\x80\x9F"
         "c\n",
         {"a2Jbc"}},
        {"upper control characters in UTF-8",
         "a\xC2\x9B"
         "2J\xC2\x80\xC2\x9F"
         "b\xC2\xA0"
         "c\n",
         {"a2Jb\xC2\xA0"
          "c"}},
        {"UTF-8 whose later bytes look like them",
         "\xC3\x9F\xE2\x82\x9B\xF0\x9F\x98\x80\n",
         {"\xC3\x9F\xE2\x82\x9B\xF0\x9F\x98\x80"}},
        {"a character too many", "\xC3\x9F\x9B\n", {"\xC3\x9F"}},
        {"UTF-8", "gr\xC3\xBC\xC3\x9F\n", {"gr\xC3\xBC\xC3\x9F"}},
        {"a torn sequence does not swallow the next line",
         "\x1B[12\nnext\n\x1B]0;torn\nlast\n",
         {"", "next", "", "last"}},
        {"a cancelled sequence", "\x1B[12\x18kept\n", {"kept"}},
        {"an escape in a sequence begins another one", "\x1B[1\x1B[0mx\n", {"x"}},
    };
    return rows;
}

TEST(PlainLines, LeaveControlSequencesOutHoweverTheyAreCut)
{
    for (const PlainRow& row : plainRows()) {
        for (const std::size_t step : {std::size_t{1}, std::size_t{2}, row.bytes.size()}) {
            SCOPED_TRACE(std::string(row.name) + ", " + std::to_string(step));
            std::vector<std::string> lines;
            PlainLines plain([&](const std::string& line) { lines.push_back(line); });
            for (std::size_t at = 0; at < row.bytes.size(); at += step)
                plain.feed(row.bytes.data() + at, std::min(step, row.bytes.size() - at), [] {});
            EXPECT_EQ(lines, row.lines);
        }
    }
}

TEST(PlainLines, CutALineThatDoesNotEnd)
{
    std::vector<std::string> lines;
    PlainLines plain([&](const std::string& line) { lines.push_back(line); });
    const std::string text(PlainLines::kLongest + 3, 'x');
    plain.feed(text.data(), text.size(), [] {});
    EXPECT_THAT(lines, ElementsAre(std::string(PlainLines::kLongest, 'x')));
    plain.flush();
    EXPECT_EQ(lines.at(1), "xxx");
    plain.flush();
    EXPECT_EQ(lines.size(), 2U);
}

// Files that rotate.

class RotatingFileTest : public ::testing::Test {
protected:
    std::string name(int age) const { return directory.file("f") + (age == 0 ? "" : "." + std::to_string(age)); }

    const TemporaryDirectory directory;
};

TEST_F(RotatingFileTest, GoesOnWhereItStopped)
{
    EXPECT_EQ(RotatingFile(name(0), 100).append("one"), 0);
    RotatingFile file(name(0), 100);
    EXPECT_EQ(file.append(" two"), 0);
    EXPECT_EQ(contentsOf(name(0)), "one two");
    struct stat status {};
    ASSERT_EQ(::stat(name(0).c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 0777U, 0600U);
}

TEST_F(RotatingFileTest, RotatesWhatDoesNotFitAndKeepsFourOlderFiles)
{
    RotatingFile file(name(0), 4);
    for (const char* text : {"a", "bcd", "e", "fghi", "jklmno", "p", "q", "rstu", "v"})
        EXPECT_EQ(file.append(text), 0);
    EXPECT_EQ(contentsOf(name(0)), "v");
    EXPECT_EQ(contentsOf(name(1)), "rstu");
    EXPECT_EQ(contentsOf(name(2)), "pq");
    EXPECT_EQ(contentsOf(name(3)), "jklmno");
    EXPECT_EQ(contentsOf(name(4)), "fghi");
    EXPECT_FALSE(exists(name(5)));
}

TEST_F(RotatingFileTest, RotatesOnRequestUnlessItIsEmpty)
{
    RotatingFile file(name(0), 100);
    EXPECT_EQ(file.rotate(), 0);
    EXPECT_FALSE(exists(name(1)));
    EXPECT_EQ(file.append("old"), 0);
    EXPECT_EQ(file.rotate(), 0);
    EXPECT_EQ(file.append("new"), 0);
    EXPECT_EQ(contentsOf(name(0)), "new");
    EXPECT_EQ(contentsOf(name(1)), "old");
}

TEST_F(RotatingFileTest, AWriteThatFailsLeavesNoPart)
{
    RotatingFile file(name(0), 100);
    EXPECT_EQ(file.append("whole\n"), 0);
    {
        FileCalls calls;
        calls.shortenNextWrite(3);
        calls.fail(FileCalls::Writev, ENOSPC, 1, 1);
        EXPECT_EQ(file.append("torn\n"), ENOSPC);
    }
    EXPECT_EQ(file.append("next\n"), 0);
    EXPECT_EQ(contentsOf(name(0)), "whole\nnext\n");
}

TEST_F(RotatingFileTest, AnInterruptedOrShortWriteGoesOn)
{
    RotatingFile file(name(0), 100);
    FileCalls calls;
    calls.fail(FileCalls::Writev, EINTR);
    calls.shortenNextWrite(2);
    EXPECT_EQ(file.append("whole"), 0);
    EXPECT_EQ(contentsOf(name(0)), "whole");
}

TEST_F(RotatingFileTest, AFileThatCannotBeOpenedAgainKeepsTheOldOne)
{
    RotatingFile file(name(0), 100);
    EXPECT_EQ(file.append("a"), 0);
    {
        FileCalls calls;
        calls.fail(FileCalls::Open, EMFILE);
        EXPECT_EQ(file.rotate(), EMFILE);
    }
    EXPECT_EQ(file.append("b"), 0);
    EXPECT_EQ(contentsOf(name(1)), "ab");
}

TEST_F(RotatingFileTest, AttemptsThatFailCostNoOlderFile)
{
    RotatingFile file(name(0), 4);
    for (const char* text : {"old4", "old3", "old2", "old1", "last"})
        EXPECT_EQ(file.append(text), 0);
    {
        FileCalls calls;
        calls.fail(FileCalls::Open, EMFILE, 6);
        for (int attempt = 0; attempt < 6; ++attempt)
            EXPECT_EQ(file.append("lost"), EMFILE);
    }
    EXPECT_EQ(file.append("new"), 0);
    EXPECT_EQ(contentsOf(name(0)), "new");
    EXPECT_EQ(contentsOf(name(1)), "last");
    EXPECT_EQ(contentsOf(name(2)), "old1");
    EXPECT_EQ(contentsOf(name(3)), "old2");
    EXPECT_EQ(contentsOf(name(4)), "old3");
}

TEST_F(RotatingFileTest, AFileThatSomebodyElseHasMovedAwayIsBegunAnew)
{
    RotatingFile file(name(0), 100);
    ASSERT_EQ(std::rename(name(0).c_str(), directory.file("moved").c_str()), 0);
    EXPECT_EQ(file.rotate(), 0);
    EXPECT_EQ(file.append("new"), 0);
    EXPECT_EQ(contentsOf(name(0)), "new");
    EXPECT_EQ(contentsOf(directory.file("moved")), "");
    EXPECT_FALSE(exists(name(1)));
}

TEST_F(RotatingFileTest, AFailureAfterSomebodyElseHasCutTheFileDoesNotExtendIt)
{
    RotatingFile file(name(0), 100);
    EXPECT_EQ(file.append("many bytes\n"), 0);
    ASSERT_EQ(::truncate(name(0).c_str(), 0), 0);
    {
        FileCalls calls;
        calls.shortenNextWrite(3);
        calls.fail(FileCalls::Writev, ENOSPC, 1, 1);
        EXPECT_EQ(file.append("torn\n"), ENOSPC);
    }
    EXPECT_EQ(contentsOf(name(0)), "");
}

TEST_F(RotatingFileTest, ADirectoryThatIsNotThereIsReported)
{
    EXPECT_THROW(RotatingFile(directory.file("none") + "/f", 100), FileIOError);
}

// The log of a line.

class LineLogTest : public ::testing::Test {
protected:
    LineLogTest() { begin(); }

    void begin(std::uint64_t limit = 100000)
    {
        line.reset();
        line = std::make_unique<LineLog>(directory.path(), "web1", limit);
    }
    void putOut(const std::string& bytes) { line->onOutput(1, bytes.data(), bytes.size()); }
    std::string raw() const { return contentsOf(directory.file("web1.raw")); }
    std::string text() const { return contentsOf(directory.file("web1.log")); }

    CapturedLog log{LogLevel::Info};
    SettableClock clock;
    const TemporaryDirectory directory;
    std::unique_ptr<LineLog> line;
};

constexpr const char* kBegin = "2024-01-02T03:04:05.000Z [qel: the log begins]\n";

TEST_F(LineLogTest, HasTheBytesAndTheLinesWithTheTimeTheyBegan)
{
    putOut("log");
    clock.advance(std::chrono::milliseconds(1234));
    putOut("in: \x1B[1mroot\x1B[m\r\nnext");
    clock.advance(std::chrono::seconds(1));
    line->onEvent(1, "the command exited with status 3");
    EXPECT_EQ(raw(), "login: \x1B[1mroot\x1B[m\r\nnext");
    EXPECT_EQ(text(), std::string(kBegin) + "2024-01-02T03:04:05.000Z login: root\n"
                                            "2024-01-02T03:04:06.234Z next\n"
                                            "2024-01-02T03:04:07.234Z [qel: the command exited with status 3]\n");
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_F(LineLogTest, OutputCannotPassForALineOfTheServer)
{
    putOut("[qel: the log ends]\r\n\\[qel: x]\r\n[qem: y]\r\n");
    EXPECT_EQ(text(), std::string(kBegin) + "2024-01-02T03:04:05.000Z \\[qel: the log ends]\n"
                                            "2024-01-02T03:04:05.000Z \\[qel: x]\n"
                                            "2024-01-02T03:04:05.000Z [qem: y]\n");
}

TEST_F(LineLogTest, SaysWhereItBeginsAndEnds)
{
    putOut("prompt> ");
    line.reset();
    EXPECT_EQ(text(), std::string(kBegin) + "2024-01-02T03:04:05.000Z prompt> \n"
                                            "2024-01-02T03:04:05.000Z [qel: the log ends]\n");
}

TEST_F(LineLogTest, AFullDiskCostsLinesAndTheFilesSayHowMany)
{
    {
        FileCalls calls;
        calls.fail(FileCalls::Writev, ENOSPC, 100);
        putOut("lost\r\n");
        putOut("gone\r\n");
    }
    clock.advance(std::chrono::seconds(1));
    putOut("kept\r\n");
    EXPECT_EQ(raw(), "\r\n[qel: 12 bytes lost: No space left on device]\r\nkept\r\n");
    EXPECT_EQ(text(), std::string(kBegin) + "2024-01-02T03:04:06.000Z [qel: 60 bytes lost: No space left on device]\n"
                                            "2024-01-02T03:04:06.000Z kept\n");
    const std::string rawFile = directory.file("web1.raw");
    const std::string textFile = directory.file("web1.log");
    EXPECT_THAT(log.lines(),
                ElementsAre("W: [qel] cannot write the line log " + rawFile + ": No space left on device",
                            "W: [qel] cannot write the line log " + textFile + ": No space left on device",
                            "I: [qel] the line log " + rawFile + " is written again; 12 bytes are missing",
                            "I: [qel] the line log " + textFile + " is written again; 60 bytes are missing"));
}

TEST_F(LineLogTest, BothFilesRotate)
{
    putOut("old\r\n");
    line->rotate();
    putOut("new\r\n");
    EXPECT_EQ(raw(), "new\r\n");
    EXPECT_EQ(contentsOf(directory.file("web1.raw.1")), "old\r\n");
    EXPECT_EQ(text(), "2024-01-02T03:04:05.000Z new\n");
    EXPECT_EQ(contentsOf(directory.file("web1.log.1")), std::string(kBegin) + "2024-01-02T03:04:05.000Z old\n");
}

TEST(LineLogs, OpenNothingWithoutADirectory)
{
    tool::LineLogs logs(100000);
    EXPECT_EQ(logs.open(1, "", ""), nullptr);
    logs.rotate();
}

TEST(LineLogs, OpenALogForEachPartitionAndRotateThemAll)
{
    const SettableClock clock;
    const TemporaryDirectory directory;
    tool::LineLogs logs(100000);
    const auto first = logs.open(1, "", directory.path());
    auto second = logs.open(2, "web1", directory.path());
    EXPECT_EQ(logs.open(2, "web1", directory.path()), second); // as after a reload
    const TemporaryDirectory elsewhere;
    EXPECT_NE(logs.open(2, "web1", elsewhere.path()), second);
    EXPECT_NE(first, second);
    first->onOutput(1, "a", 1);
    logs.rotate();
    EXPECT_EQ(contentsOf(directory.file("partition-1.raw.1")), "a");
    EXPECT_TRUE(exists(directory.file("web1.log.1")));
    second.reset(); // its partition has been removed
    EXPECT_EQ(contentsOf(directory.file("web1.log")), "2024-01-02T03:04:05.000Z [qel: the log ends]\n");
    EXPECT_NE(logs.open(2, "web1", directory.path()), nullptr);
}

TEST(LineLogName, IsThatOfThePartitionInCharactersThatFilesMayHave)
{
    EXPECT_EQ(LineLog::fileName(3, ""), "partition-3");
    EXPECT_EQ(LineLog::fileName(3, "web-1.example_x"), "web-1.example_x");
    EXPECT_EQ(LineLog::fileName(3, "../etc/passwd"), "partition-3");
    EXPECT_EQ(LineLog::fileName(3, "a/b c\xC3\xA4"), "a_b_c__");
}

} // namespace

} // namespace qel::test
