#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>

#include "support/Allocations.hpp"
#include "support/FileCalls.hpp"
#include "support/TemporaryDirectory.hpp"

#include <cerrno>
#include <cstdlib>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <sstream>
#include <stdexcept>
#include <sys/stat.h>
#include <type_traits>
#include <typeinfo>
#include <unistd.h>

namespace qel {
namespace {

using test::TemporaryDirectory;
using testing::AllOf;
using testing::ElementsAre;
using testing::Property;
using testing::StrEq;
using testing::Throws;
using testing::ThrowsMessage;

/// Matches what a failed file function throws: type, text and code.
auto failsWith(const std::string& text, int code)
{
    return Throws<FileIOError>(
        AllOf(Property(&FileIOError::what, StrEq(text)), Property(&FileIOError::getErrorCode, PosixErrorCode(code))));
}

// ----------------------------------------------------------------------------------------------------- strings

TEST(UtilitiesCase, ChangesLettersOnly)
{
    EXPECT_EQ(Utilities::lowercase("MiXed 123_-"), "mixed 123_-");
    EXPECT_EQ(Utilities::uppercase("MiXed 123_-"), "MIXED 123_-");
    EXPECT_EQ(Utilities::lowercase(""), "");
    EXPECT_EQ(Utilities::uppercase(""), "");
}

TEST(UtilitiesCase, LeavesBytesAbove0x7FAlone)
{
    std::string every;
    for (int value = 0x80; value <= 0xFF; ++value) {
        every += static_cast<char>(static_cast<unsigned char>(value));
    }
    EXPECT_EQ(Utilities::lowercase(every), every);
    EXPECT_EQ(Utilities::uppercase(every), every);
}

TEST(UtilitiesCase, KeepsNullBytes)
{
    EXPECT_EQ(Utilities::lowercase(std::string("A\0B", 3)), std::string("a\0b", 3));
    EXPECT_EQ(Utilities::uppercase(std::string("a\0b", 3)), std::string("A\0B", 3));
}

TEST(UtilitiesStrip, RstripRemovesFromTheEndOnly)
{
    struct Row {
        const char* text;
        const char* chars;
        const char* expected;
    };
    const Row rows[] = {
        {"/var/log//", "/", "/var/log"},  {"///", "/", ""},        {"", "/", ""},        {"plain", "/", "plain"},
        {" text \t\n", " \t\n", " text"}, {"a b a", "ab", "a b "}, {"text", "", "text"}, {"x", "x", ""},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.text);
        EXPECT_EQ(Utilities::rstrip(row.text, row.chars), row.expected);
    }
}

TEST(UtilitiesStrip, StripRemovesFromBothEnds)
{
    struct Row {
        const char* text;
        const char* chars;
        const char* expected;
    };
    const Row rows[] = {
        {"//var/log//", "/", "var/log"},
        {"///", "/", ""},
        {"", " ", ""},
        {" \ttext in here\n", " \t\n", "text in here"},
        {"left ", " ", "left"},
        {" right", " ", "right"},
        {"text", "", "text"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.text);
        EXPECT_EQ(Utilities::strip(row.text, row.chars), row.expected);
    }
}

TEST(UtilitiesSplit, SplitsAtEachSeparatorAndKeepsEmptyPieces)
{
    EXPECT_THAT(Utilities::split("a,b,,c", ',', -1), ElementsAre("a", "b", "", "c"));
    EXPECT_THAT(Utilities::split("a,b,,c", ','), ElementsAre("a", "b", "", "c"));
    EXPECT_THAT(Utilities::split(",a,", ','), ElementsAre("", "a", ""));
    EXPECT_THAT(Utilities::split(",", ','), ElementsAre("", ""));
    EXPECT_THAT(Utilities::split("abc", ','), ElementsAre("abc"));
}

TEST(UtilitiesSplit, AnEmptyTextGivesOneEmptyPiece)
{
    EXPECT_THAT(Utilities::split("", ','), ElementsAre(""));
    EXPECT_THAT(Utilities::split("", ',', 0), ElementsAre(""));
    EXPECT_THAT(Utilities::split("", ',', 5), ElementsAre(""));
}

TEST(UtilitiesSplit, TheLimitCountsSplits)
{
    EXPECT_THAT(Utilities::split("a,b,,c", ',', 0), ElementsAre("a,b,,c"));
    EXPECT_THAT(Utilities::split("a,b,,c", ',', 1), ElementsAre("a", "b,,c"));
    EXPECT_THAT(Utilities::split("a,b,,c", ',', 2), ElementsAre("a", "b", ",c"));
    EXPECT_THAT(Utilities::split("a,b,,c", ',', 3), ElementsAre("a", "b", "", "c"));
    EXPECT_THAT(Utilities::split("a,b,,c", ',', 4), ElementsAre("a", "b", "", "c"));
    EXPECT_THAT(Utilities::split("a,b,,c", ',', -7), ElementsAre("a", "b", "", "c"));
}

TEST(UtilitiesSplit, TheSeparatorMayBeANullByte)
{
    EXPECT_THAT(Utilities::split(std::string("a\0b", 3), '\0'), ElementsAre("a", "b"));
}

// ------------------------------------------------------------------------------------------------------- paths

TEST(UtilitiesPath, BasenameIsTheLastComponentAndDirnameTheRest)
{
    struct Row {
        const char* path;
        const char* directory;
        const char* base;
    };
    const Row rows[] = {
        {"", ".", "."},         {"a", ".", "a"},       {"a/", ".", "a"},          {"a//", ".", "a"},
        {"a/b", "a", "b"},      {"a/b/", "a", "b"},    {"a//b", "a", "b"},        {"a//b//", "a", "b"},
        {"/", "/", "/"},        {"//", "/", "/"},      {"///", "/", "/"},         {"/a", "/", "a"},
        {"/a/", "/", "a"},      {"//a", "/", "a"},     {"/a/b", "/a", "b"},       {"/a//b//", "/a", "b"},
        {"//a//b", "//a", "b"}, {"a/b/c", "a/b", "c"}, {".", ".", "."},           {"..", ".", ".."},
        {"../x", "..", "x"},    {"./x", ".", "x"},     {"a b/c d", "a b", "c d"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.path);
        EXPECT_EQ(Utilities::dirname(row.path), row.directory);
        EXPECT_EQ(Utilities::basename(row.path), row.base);
    }
}

TEST(UtilitiesPath, NormalizeResolvesLinksAndDots)
{
    const TemporaryDirectory directory;
    ASSERT_EQ(::mkdir(directory.file("real").c_str(), 0700), 0);
    ASSERT_EQ(::symlink("real", directory.file("link").c_str()), 0);
    Utilities::writeFile(directory.file("real/file"), "");

    EXPECT_EQ(Utilities::normalizePath(directory.file("link/file")), directory.file("real/file"));
    EXPECT_EQ(Utilities::normalizePath(directory.file("real/./../link//file")), directory.file("real/file"));
    EXPECT_EQ(Utilities::normalizePath(directory.path() + "/"), directory.path());
    EXPECT_EQ(Utilities::normalizePath("/"), "/");
}

TEST(UtilitiesPath, NormalizeMakesARelativePathAbsolute)
{
    const std::unique_ptr<char, decltype(&std::free)> here(::getcwd(nullptr, 0), &std::free);
    ASSERT_NE(here, nullptr);
    EXPECT_EQ(Utilities::normalizePath("."), here.get());
}

TEST(UtilitiesPath, NormalizeOfAMissingPathThrowsPosixError)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("missing");
    try {
        Utilities::normalizePath(path);
        FAIL() << "nothing was thrown";
    } catch (const PosixError& error) {
        EXPECT_EQ(typeid(error), typeid(PosixError)); // and not FileIOError
        EXPECT_EQ("Failed to normalize path " + path + ": 2 (No such file or directory)", error.what());
        EXPECT_EQ(error.getErrorCode(), PosixErrorCode(ENOENT));
    }
}

TEST(UtilitiesPath, NormalizeReportsItsErrorForLongPaths)
{
    const TemporaryDirectory directory;
    std::string missing = directory.path();
    while (missing.size() < 3500) {
        missing += "/" + std::string(200, 'x');
    }
    EXPECT_THAT([&] { Utilities::normalizePath(missing); },
                ThrowsMessage<PosixError>("Failed to normalize path " + missing + ": 2 (No such file or directory)"));

    const std::string tooLong = directory.file(std::string(5000, 'x'));
    EXPECT_THAT([&] { Utilities::normalizePath(tooLong); },
                ThrowsMessage<PosixError>("Failed to normalize path " + tooLong + ": 36 (File name too long)"));

    EXPECT_THAT([] { Utilities::normalizePath(""); },
                ThrowsMessage<PosixError>(StrEq("Failed to normalize path : 2 (No such file or directory)")));
}

/// @return the number that a failed function reports although composing the text of the error changes errno
template <typename Function>
int numberReportedBy(Function function)
{
    try {
        const test::Allocations allocations; // the text is too long for a string without an allocation
        function();
    } catch (const PosixError& error) {
        return error.getErrorCode().getCode();
    }
    return -1;
}

TEST(UtilitiesPath, NormalizeReportsItsErrorAfterErrnoHasChanged)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    EXPECT_EQ(numberReportedBy([] { Utilities::normalizePath("/missing"); }), ENOENT);
}

TEST(UtilitiesPath, NormalizeOfALinkLoopThrows)
{
    const TemporaryDirectory directory;
    const std::string loop = directory.file("loop");
    ASSERT_EQ(::symlink("loop", loop.c_str()), 0);
    EXPECT_THAT([&] { Utilities::normalizePath(loop); },
                Throws<PosixError>(Property(&PosixError::getErrorCode, PosixErrorCode(ELOOP))));
}

// ------------------------------------------------------------------------------------------------------- files

TEST(UtilitiesFile, WritesAndReadsEveryByteUnchanged)
{
    const TemporaryDirectory directory;
    std::string content;
    for (int value = 0; value <= 0xFF; ++value) {
        content += static_cast<char>(static_cast<unsigned char>(value));
    }
    content += "\r\n\n\r";
    Utilities::writeFile(directory.file("f"), content);
    EXPECT_EQ(Utilities::readFile(directory.file("f")), content);
}

TEST(UtilitiesFile, WritesAndReadsMoreThanAnyBuffer)
{
    const TemporaryDirectory directory;
    std::string content;
    for (int i = 0; content.size() < 300000; ++i) {
        content += std::to_string(i) + "\n";
    }
    Utilities::writeFile(directory.file("f"), content);
    EXPECT_EQ(Utilities::readFile(directory.file("f")), content);
}

TEST(UtilitiesFile, WritingReplacesTheWholeContent)
{
    const TemporaryDirectory directory;
    Utilities::writeFile(directory.file("f"), "a long first content");
    Utilities::writeFile(directory.file("f"), "short");
    EXPECT_EQ(Utilities::readFile(directory.file("f")), "short");
    Utilities::writeFile(directory.file("f"), "");
    EXPECT_EQ(Utilities::readFile(directory.file("f")), "");
}

TEST(UtilitiesFile, WritingAnEmptyContentCreatesTheFile)
{
    const TemporaryDirectory directory;
    Utilities::writeFile(directory.file("f"), "");
    struct stat status = {};
    ASSERT_EQ(::stat(directory.file("f").c_str(), &status), 0);
    EXPECT_EQ(status.st_size, 0);
}

TEST(UtilitiesFile, ReadingADirectoryGivesTheEmptyText)
{
    const TemporaryDirectory directory;
    EXPECT_EQ(Utilities::readFile(directory.path()), "");
}

TEST(UtilitiesFile, ReadingAnEmptyFileGivesTheEmptyText)
{
    const TemporaryDirectory directory;
    Utilities::writeFile(directory.file("f"), "");
    EXPECT_EQ(Utilities::readFile(directory.file("f")), "");
    EXPECT_EQ(Utilities::readFile("/dev/null"), "");
}

TEST(UtilitiesFile, AFailedReadThrowsAfterAnyNumberOfGoodOnes)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("f");
    Utilities::writeFile(path, std::string(100000, 'x'));
    for (const unsigned reads : {0U, 1U, 2U, 5U}) {
        SCOPED_TRACE(reads);
        test::FileCalls calls;
        calls.fail(test::FileCalls::Read, EIO, 1, reads);
        EXPECT_THAT([&] { Utilities::readFile(path); },
                    failsWith("Failed to read contents of file " + path + ": 5 (Input/output error)", EIO));
    }
    EXPECT_EQ(Utilities::readFile(path).size(), 100000U);
}

TEST(UtilitiesFile, EisdirInTheMiddleOfAFileThrows)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("f");
    Utilities::writeFile(path, std::string(100000, 'x'));
    test::FileCalls calls;
    calls.fail(test::FileCalls::Read, EISDIR, 1, 1);
    EXPECT_THAT([&] { Utilities::readFile(path); },
                failsWith("Failed to read contents of file " + path + ": 21 (Is a directory)", EISDIR));
}

TEST(UtilitiesFile, ReadingMemoryThatIsNotMappedThrows)
{
    // Page 0 of a process is never mapped.
    EXPECT_THAT([] { Utilities::readFile("/proc/self/mem"); },
                failsWith("Failed to read contents of file /proc/self/mem: 5 (Input/output error)", EIO));
}

TEST(UtilitiesFile, ReadingAMissingFileThrows)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("missing");
    EXPECT_THAT([&] { Utilities::readFile(path); },
                failsWith("Failed to read contents of file " + path + ": 2 (No such file or directory)", ENOENT));
}

TEST(UtilitiesFile, ReadingReportsItsError)
{
    const TemporaryDirectory directory;
    Utilities::writeFile(directory.file("f"), "");
    const std::string below = directory.file("f/below");
    EXPECT_THAT([&] { Utilities::readFile(below); },
                failsWith("Failed to read contents of file " + below + ": 20 (Not a directory)", ENOTDIR));
    const std::string tooLong = directory.file(std::string(5000, 'x'));
    EXPECT_THAT([&] { Utilities::readFile(tooLong); },
                failsWith("Failed to read contents of file " + tooLong + ": 36 (File name too long)", ENAMETOOLONG));
}

TEST(UtilitiesFile, ReadingAndWritingReportTheirErrorAfterErrnoHasChanged)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    EXPECT_EQ(numberReportedBy([] { Utilities::readFile("/missing"); }), ENOENT);
    EXPECT_EQ(numberReportedBy([] { Utilities::writeFile("/missing/file", ""); }), ENOENT);
    EXPECT_EQ(numberReportedBy([] { Utilities::writeFile("/dev/full", "x"); }), ENOSPC);
}

TEST(UtilitiesFile, WritingInAMissingDirectoryThrows)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("missing/f");
    EXPECT_THAT([&] { Utilities::writeFile(path, "x"); },
                failsWith("Failed to write contents of file " + path + ": 2 (No such file or directory)", ENOENT));
}

TEST(UtilitiesFile, WritingToADirectoryThrows)
{
    const TemporaryDirectory directory;
    EXPECT_THAT([&] { Utilities::writeFile(directory.path(), "x"); },
                failsWith("Failed to write contents of file " + directory.path() + ": 21 (Is a directory)", EISDIR));
}

TEST(UtilitiesFile, WritingToAFullDeviceThrowsForShortAndLongContent)
{
    const std::string text = "Failed to write contents of file /dev/full: 28 (No space left on device)";
    EXPECT_THAT([] { Utilities::writeFile("/dev/full", "x"); }, failsWith(text, ENOSPC));
    EXPECT_THAT([] { Utilities::writeFile("/dev/full", std::string(300000, 'x')); }, failsWith(text, ENOSPC));
}

TEST(UtilitiesFile, WritingNothingToAFullDeviceSucceeds) { EXPECT_NO_THROW(Utilities::writeFile("/dev/full", "")); }

// ------------------------------------------------------------------------------------------------ truth values

TEST(UtilitiesParseBool, AcceptsItsWordsInAnyCase)
{
    for (const char* text : {"y", "yes", "true", "1", "Y", "YES", "TRUE", "Yes", "tRuE"}) {
        SCOPED_TRACE(text);
        EXPECT_TRUE(Utilities::parseBool(text));
    }
    for (const char* text : {"n", "no", "false", "0", "N", "NO", "FALSE", "No", "fAlSe"}) {
        SCOPED_TRACE(text);
        EXPECT_FALSE(Utilities::parseBool(text));
    }
}

TEST(UtilitiesParseBool, RefusesOtherTextsAndQuotesThemUnchanged)
{
    for (const char* text : {"maybe", "MAYBE", "", " true", "true ", "yess", "10", "01", "t", "f", "on", "off"}) {
        SCOPED_TRACE(text);
        EXPECT_THAT([&] { Utilities::parseBool(text); },
                    ThrowsMessage<std::invalid_argument>(std::string(text) + " is not convertible to bool"));
    }
}

// -------------------------------------------------------------------------------------------------- references

TEST(UtilitiesRef, LetsATemporaryStreamBeWrittenTo)
{
    std::ostream& written = (Utilities::ref(std::ostringstream()) << "text " << 5);
    static_cast<void>(written); // the stream itself no longer exists
    EXPECT_EQ(static_cast<std::ostringstream&>(Utilities::ref(std::ostringstream()) << "text " << 5).str(), "text 5");
}

TEST(UtilitiesRef, ReturnsItsArgumentItself)
{
    int number = 1;
    EXPECT_EQ(&Utilities::ref(number), &number);
    Utilities::ref(number) = 2;
    EXPECT_EQ(number, 2);
    EXPECT_TRUE((std::is_same<decltype(Utilities::ref(std::string())), std::string&>::value));
    EXPECT_EQ(Utilities::ref(std::string("a")) += "b", "ab");
}

} // namespace
} // namespace qel
