#include <qel/common/LogLevel.hpp>
#include <qel/common/security/SSLException.hpp>

#include "support/CapturedLog.hpp"
#include "support/ThrowingClock.hpp"

#include <array>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <openssl/err.h>
#include <stdexcept>
#include <string>
#include <thread>
#include <type_traits>

namespace qel {
namespace {

using test::CapturedLog;
using test::ThrowingClock;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

static_assert(std::is_base_of<std::runtime_error, SSLException>::value, "");
static_assert(sizeof(SSLException) == sizeof(std::runtime_error), "no members of its own");
static_assert(!std::is_convertible<std::string, SSLException>::value, "a text does not convert to an exception");
static_assert(std::is_nothrow_copy_constructible<SSLException>::value, "as the language asks of exceptions");

void putError(int reason, const char* file, int line) { ERR_put_error(ERR_LIB_USER, 0, reason, file, line); }

// The text that ERR_error_string gives for such an entry; versions of OpenSSL differ in it.
std::string errorText(int reason)
{
    std::array<char, 256> text{};
    ERR_error_string_n(ERR_PACK(ERR_LIB_USER, 0, reason), text.data(), text.size());
    return text.data();
}

TEST(SSLException, KeepsItsMessage)
{
    EXPECT_STREQ(SSLException(std::string("no such key")).what(), "no such key");
    EXPECT_STREQ(SSLException(std::string()).what(), "");
}

TEST(SSLException, NamesFileAndLineOfTheError)
{
    EXPECT_STREQ(SSLException("common/security/Some.cpp", 1234567).what(),
                 "An SSL error occurred at common/security/Some.cpp:1234567");
    EXPECT_STREQ(SSLException("", 0).what(), "An SSL error occurred at :0");
}

TEST(SSLException, IsCaughtAsARuntimeError)
{
    EXPECT_THROW(throw SSLException("a.cpp", 1), std::runtime_error);
    EXPECT_THROW(throw SSLException(std::string("a")), SSLException);
}

TEST(SSLErrorQueue, LogsEveryEntryTheOldestFirst)
{
    const CapturedLog log;
    putError(1, "first.c", 11);
    putError(2, "crypto/second.c", 65535);
    putError(3, "third.c", 8);
    SSLException::flushErrorQueue();
    EXPECT_THAT(log.lines(), ElementsAre("E: [libssl] first.c:11: " + errorText(1),
                                         "E: [libssl] crypto/second.c:65535: " + errorText(2),
                                         "E: [libssl] third.c:8: " + errorText(3)));
    EXPECT_EQ(ERR_peek_error(), 0UL);
}

TEST(SSLErrorQueue, LogsAKnownReasonInWords)
{
    const CapturedLog log;
    ERR_put_error(ERR_LIB_SYS, 0, ERR_R_MALLOC_FAILURE, "real.c", 5);
    SSLException::flushErrorQueue();
    ASSERT_EQ(log.lines().size(), 1U);
    EXPECT_THAT(log.lines().front(), testing::MatchesRegex("E: \\[libssl\\] real\\.c:5: error:[0-9A-F]+:.*"));
}

TEST(SSLErrorQueue, LogsNothingWhenEmpty)
{
    ASSERT_EQ(ERR_peek_error(), 0UL);
    const CapturedLog log;
    SSLException::flushErrorQueue();
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(SSLErrorQueue, IsEmptiedWithoutALineWhenTheLevelIsDisabled)
{
    const CapturedLog log(LogLevel::Critical);
    putError(1, "first.c", 11);
    putError(2, "second.c", 12);
    SSLException::flushErrorQueue();
    EXPECT_THAT(log.lines(), IsEmpty());
    EXPECT_EQ(ERR_peek_error(), 0UL);
}

TEST(SSLErrorQueue, IsEmptiedWhenItWasFull)
{
    constexpr int kMoreThanItHolds = 100;
    const CapturedLog log;
    for (int i = 1; i <= kMoreThanItHolds; ++i)
        putError(i, "many.c", i);
    SSLException::flushErrorQueue();
    EXPECT_EQ(ERR_peek_error(), 0UL);
    ASSERT_FALSE(log.lines().empty());
    EXPECT_EQ(log.lines().back(), "E: [libssl] many.c:100: " + errorText(kMoreThanItHolds));
}

TEST(SSLErrorQueue, IsLoggedAndEmptiedWhenTheClockFails)
{
    const CapturedLog log;
    ThrowingClock clock;
    putError(1, "first.c", 11);
    putError(2, "second.c", 12);
    clock.failAfter(0);
    EXPECT_NO_THROW(SSLException::flushErrorQueue());
    EXPECT_EQ(ERR_peek_error(), 0UL);
    EXPECT_THAT(log.lines(),
                ElementsAre("E: [libssl] first.c:11: " + errorText(1), "E: [libssl] second.c:12: " + errorText(2)));
}

TEST(SSLErrorQueue, OfAnotherThreadIsNotTouched)
{
    const CapturedLog log;
    putError(1, "mine.c", 1);
    std::thread([] {
        putError(2, "theirs.c", 2);
        SSLException::flushErrorQueue();
    }).join();
    EXPECT_THAT(log.lines(), ElementsAre("E: [libssl] theirs.c:2: " + errorText(2)));
    EXPECT_NE(ERR_peek_error(), 0UL);

    SSLException::flushErrorQueue();
    EXPECT_THAT(log.lines(),
                ElementsAre("E: [libssl] theirs.c:2: " + errorText(2), "E: [libssl] mine.c:1: " + errorText(1)));
}

} // namespace
} // namespace qel
