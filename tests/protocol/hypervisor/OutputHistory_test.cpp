#include "hypervisor/OutputHistory.hpp"
#include "support/Allocations.hpp"

#include <algorithm>
#include <gtest/gtest.h>
#include <new>
#include <string>

namespace qel::test {

namespace {

using protocol::OutputHistory;

void add(OutputHistory& history, const std::string& text)
{
    history.reserve(text.size());
    history.append(text.data(), text.size());
}

/// What is kept from an offset on.
std::string contents(const OutputHistory& history, std::uint64_t from, std::size_t most = 100000)
{
    std::string text;
    for (;;) {
        const OutputHistory::Piece piece = history.piece(from, most);
        if (piece.length == 0) return text;
        text.append(piece.data, piece.length);
        from += piece.length;
    }
}
std::string contents(const OutputHistory& history) { return contents(history, history.begin()); }

TEST(OutputHistory, TakesNoMemoryWhileItIsEmpty)
{
    const OutputHistory history(16 * 1024 * 1024);
    EXPECT_EQ(history.capacity(), 0U);
    EXPECT_EQ(history.begin(), 0U);
    EXPECT_EQ(history.end(), 0U);
    EXPECT_EQ(contents(history), "");
}

TEST(OutputHistory, GrowsAsOutputComesUpToItsLimit)
{
    OutputHistory history(10000);
    add(history, "x");
    EXPECT_EQ(history.capacity(), 4096U);
    add(history, std::string(4096, 'y'));
    EXPECT_EQ(history.capacity(), 8192U);
    add(history, std::string(100000, 'z'));
    EXPECT_EQ(history.capacity(), 10000U);
    EXPECT_EQ(contents(history), std::string(10000, 'z'));
}

TEST(OutputHistory, KeepsEverythingUpToTheLimitAndThenTheNewest)
{
    OutputHistory history(5);
    add(history, "abc");
    add(history, "de");
    EXPECT_EQ(contents(history), "abcde");
    EXPECT_EQ(history.begin(), 0U);
    add(history, "f");
    EXPECT_EQ(contents(history), "bcdef");
    EXPECT_EQ(history.begin(), 1U);
    EXPECT_EQ(history.end(), 6U);
    add(history, "0123456789");
    EXPECT_EQ(contents(history), "56789");
    EXPECT_EQ(history.end(), 16U);
}

TEST(OutputHistory, AgreesWithAStringForEveryLimitAndLength)
{
    for (std::size_t limit = 1; limit <= 9; ++limit) {
        for (std::size_t step = 1; step <= 11; ++step) {
            SCOPED_TRACE(std::to_string(limit) + ", " + std::to_string(step));
            OutputHistory history(limit);
            std::string all;
            for (char next = 'a'; next <= 'z'; ++next) {
                const std::string text(step, next);
                add(history, text);
                all += text;
                const std::size_t kept = std::min(limit, all.size());
                ASSERT_EQ(contents(history), all.substr(all.size() - kept));
                ASSERT_EQ(history.end(), all.size());
                ASSERT_EQ(contents(history, history.end() - kept / 2), all.substr(all.size() - kept / 2));
                ASSERT_EQ(contents(history, history.begin(), 1), all.substr(all.size() - kept));
            }
        }
    }
}

TEST(OutputHistory, CountsWhatItCannotKeepWithoutMemory)
{
    OutputHistory history(100);
    history.append("lost", 4); // nothing was reserved
    EXPECT_EQ(history.begin(), 4U);
    EXPECT_EQ(history.end(), 4U);
    EXPECT_EQ(contents(history), "");
    add(history, "kept");
    EXPECT_EQ(contents(history), "kept");
}

TEST(OutputHistory, AReserveThatFailsChangesNothing)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    OutputHistory history(10000);
    add(history, "kept");
    Allocations allocations;
    allocations.failAll();
    bool failed = false;
    try {
        history.reserve(8192);
    } catch (const std::bad_alloc&) {
        failed = true;
    }
    allocations.succeedAgain();
    EXPECT_TRUE(failed);
    EXPECT_EQ(contents(history), "kept");
    EXPECT_EQ(history.capacity(), 4096U);
}

TEST(OutputHistory, AChangedLimitKeepsTheNewest)
{
    OutputHistory history(6);
    add(history, "0123456789");
    history.setLimit(3);
    EXPECT_EQ(contents(history), "789");
    EXPECT_EQ(history.begin(), 7U);
    EXPECT_EQ(history.end(), 10U);
    add(history, "a");
    EXPECT_EQ(contents(history), "89a");
    history.setLimit(5);
    add(history, "bcd");
    EXPECT_EQ(contents(history), "9abcd");
}

} // namespace

} // namespace qel::test
