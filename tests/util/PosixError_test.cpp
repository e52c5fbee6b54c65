#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/PosixError.hpp>

#include <cerrno>
#include <climits>
#include <cstring>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sstream>
#include <stdexcept>
#include <type_traits>
#include <utility>

namespace qel {
namespace {

using testing::StrEq;
using testing::ThrowsMessage;

std::string printed(const PosixErrorCode& code)
{
    std::ostringstream os;
    os << code;
    return os.str();
}

TEST(PosixErrorCode, PrintsNumberAndDescription)
{
    EXPECT_EQ(printed(PosixErrorCode(2)), "2 (No such file or directory)");
    EXPECT_EQ(printed(PosixErrorCode(5)), "5 (Input/output error)");
    EXPECT_EQ(printed(PosixErrorCode(24)), "24 (Too many open files)");
}

TEST(PosixErrorCode, MessageIsWhatItPrints)
{
    for (const int code : {0, 1, 2, 5, 13, 24, 110, 99999}) {
        EXPECT_EQ(PosixErrorCode(code).message(), printed(PosixErrorCode(code)));
    }
    EXPECT_EQ(PosixErrorCode(13).message(), "13 (Permission denied)");
}

TEST(PosixErrorCode, DefaultIsZeroForAnyErrno)
{
    errno = ENOENT;
    const PosixErrorCode code;
    EXPECT_EQ(code.getCode(), 0);
    EXPECT_EQ(printed(code), "0 (Success)");
}

TEST(PosixErrorCode, ANegativeNumberMeansTheSameAsThePositiveOne)
{
    EXPECT_EQ(PosixErrorCode(-13), PosixErrorCode(13));
    EXPECT_EQ(PosixErrorCode(-5), PosixErrorCode(5));
    EXPECT_EQ(printed(PosixErrorCode(-13)), "13 (Permission denied)");
    EXPECT_EQ(PosixErrorCode(-13).getCode(), 13);
}

TEST(PosixErrorCode, TheSmallestIntegerBecomesTheLargestOne)
{
    EXPECT_EQ(PosixErrorCode(INT_MIN).getCode(), INT_MAX);
    EXPECT_EQ(PosixErrorCode(INT_MIN + 1).getCode(), INT_MAX);
    EXPECT_EQ(PosixErrorCode(INT_MAX).getCode(), INT_MAX);
}

TEST(PosixErrorCode, ComparesByNumber)
{
    EXPECT_TRUE(PosixErrorCode(1) == PosixErrorCode(1));
    EXPECT_FALSE(PosixErrorCode(1) == PosixErrorCode(2));
    EXPECT_FALSE(PosixErrorCode(1) != PosixErrorCode(1));
    EXPECT_TRUE(PosixErrorCode(1) != PosixErrorCode(2));
}

TEST(PosixErrorCode, ComparesWithAnErrorNumber)
{
    const PosixErrorCode code(EINTR);
    EXPECT_TRUE(code == EINTR);
    EXPECT_FALSE(code != EINTR);
    EXPECT_TRUE(code != EAGAIN);
    EXPECT_FALSE(code == EAGAIN);
    EXPECT_TRUE(code == -EINTR);
    EXPECT_TRUE(PosixErrorCode() == 0);
}

TEST(PosixErrorCode, AnIntegerConverts)
{
    const PosixErrorCode code = 24;
    EXPECT_EQ(code.getCode(), 24);
}

TEST(PosixErrorCode, AnUnknownNumberGetsTheDescriptionOfTheLibrary)
{
    EXPECT_EQ(printed(PosixErrorCode(99999)), "99999 (Unknown error 99999)");
}

TEST(PosixErrorCode, IsDecimalOnAStreamLeftInHexadecimal)
{
    std::ostringstream os;
    os << hexFormat(std::uint16_t(1)) << ' ' << PosixErrorCode(110);
    EXPECT_EQ(os.str(), "0x0001 110 (Connection timed out)");
}

TEST(PosixErrorCode, ReturnsTheStream)
{
    std::ostringstream os;
    EXPECT_EQ(&(os << PosixErrorCode(1)), &os);
}

TEST(ErrorDescription, TakesTheTextThatTheGnuFormReturns)
{
    char buffer[8] = "buffer";
    const char* elsewhere = "elsewhere";
    EXPECT_EQ(detail::errorDescription(elsewhere, buffer), elsewhere);
    EXPECT_EQ(detail::errorDescription(static_cast<char*>(buffer), buffer), buffer);
    EXPECT_EQ(detail::errorDescription(static_cast<char*>(nullptr), buffer), nullptr);
}

TEST(ErrorDescription, TakesTheBufferThatThePosixFormFills)
{
    const char buffer[] = "text";
    EXPECT_EQ(detail::errorDescription(0, buffer), buffer);
    EXPECT_EQ(detail::errorDescription(EINVAL, buffer), nullptr);
    EXPECT_EQ(detail::errorDescription(ERANGE, buffer), nullptr);
}

TEST(PosixError, WithoutContextIsTheTextOfTheCode)
{
    const PosixError error(PosixErrorCode(24));
    EXPECT_STREQ(error.what(), "24 (Too many open files)");
    EXPECT_EQ(error.getErrorCode(), PosixErrorCode(24));
}

TEST(PosixError, PutsTheContextBeforeTheText)
{
    const PosixError error(PosixErrorCode(24), "Failed to open socket");
    EXPECT_STREQ(error.what(), "Failed to open socket: 24 (Too many open files)");
    EXPECT_EQ(error.getErrorCode().getCode(), 24);
    EXPECT_STREQ(PosixError(2, "Failed to open log x").what(), "Failed to open log x: 2 (No such file or directory)");
    EXPECT_STREQ(PosixError(-2, "").what(), ": 2 (No such file or directory)");
}

TEST(PosixError, CopyingAndMovingKeepTextAndCode)
{
    PosixError original(PosixErrorCode(5), "context");
    const PosixError copy(original);
    EXPECT_STREQ(copy.what(), "context: 5 (Input/output error)");
    EXPECT_EQ(copy.getErrorCode(), PosixErrorCode(5));

    const PosixError moved(std::move(original));
    EXPECT_STREQ(moved.what(), "context: 5 (Input/output error)");
    EXPECT_EQ(moved.getErrorCode(), PosixErrorCode(5));
    EXPECT_STREQ(original.what(), "context: 5 (Input/output error)"); // a move is a copy

    PosixError assigned(PosixErrorCode(1));
    assigned = copy;
    EXPECT_STREQ(assigned.what(), "context: 5 (Input/output error)");
    EXPECT_EQ(assigned.getErrorCode(), PosixErrorCode(5));
}

TEST(PosixError, CopyingDoesNotThrow)
{
    EXPECT_TRUE(std::is_nothrow_copy_constructible<PosixError>::value);
    EXPECT_TRUE(std::is_nothrow_copy_constructible<FileIOError>::value);
}

TEST(PosixError, ConvertsOnlyFromACode)
{
    EXPECT_TRUE((std::is_convertible<int, PosixErrorCode>::value));
    EXPECT_FALSE((std::is_convertible<PosixErrorCode, PosixError>::value));
}

TEST(FileIOError, ComposesItsTextLikePosixError)
{
    EXPECT_STREQ(FileIOError(PosixErrorCode(2)).what(), "2 (No such file or directory)");
    EXPECT_STREQ(FileIOError(PosixErrorCode(28), "Failed").what(), "Failed: 28 (No space left on device)");
    EXPECT_EQ(FileIOError(PosixErrorCode(28), "Failed").getErrorCode(), PosixErrorCode(28));
}

TEST(FileIOError, IsCaughtAsEachOfItsBases)
{
    const auto fail = [] { throw FileIOError(PosixErrorCode(5), "disk"); };
    const char* text = "disk: 5 (Input/output error)";
    EXPECT_THAT(fail, ThrowsMessage<FileIOError>(StrEq(text)));
    EXPECT_THAT(fail, ThrowsMessage<PosixError>(StrEq(text)));
    EXPECT_THAT(fail, ThrowsMessage<std::runtime_error>(StrEq(text)));
    EXPECT_THAT(fail, ThrowsMessage<std::exception>(StrEq(text)));
}

TEST(FileIOError, DoesNotCatchAPlainPosixError)
{
    try {
        throw PosixError(PosixErrorCode(5));
    } catch (const FileIOError&) {
        FAIL() << "a socket error was caught as a file error";
    } catch (const PosixError& error) {
        EXPECT_STREQ(error.what(), "5 (Input/output error)");
    }
}

} // namespace
} // namespace qel
