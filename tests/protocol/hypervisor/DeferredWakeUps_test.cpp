#include "hypervisor/DeferredWakeUps.hpp"
#include "support/Allocations.hpp"

#include <gtest/gtest.h>
#include <memory>
#include <vector>

namespace qel::test {

namespace {

using protocol::DeferredWakeUps;
using protocol::LinkWriter;

struct CountingWriter : LinkWriter {
    void wake() noexcept override { ++woken; }
    void send() noexcept override { ++sent; }

    unsigned woken = 0;
    unsigned sent = 0;
};

class DeferredWakeUpsTest : public ::testing::Test {
protected:
    std::shared_ptr<CountingWriter> first = std::make_shared<CountingWriter>();
    std::shared_ptr<CountingWriter> second = std::make_shared<CountingWriter>();
};

TEST_F(DeferredWakeUpsTest, WithoutOneAWriterIsWokenAtOnce)
{
    DeferredWakeUps::wake(first);
    EXPECT_EQ(first->woken, 1U);
}

TEST_F(DeferredWakeUpsTest, EachWriterIsWokenOnceAtTheEnd)
{
    {
        const DeferredWakeUps wakeUps;
        for (int i = 0; i < 3; ++i) {
            DeferredWakeUps::wake(first);
            DeferredWakeUps::wake(second);
        }
        EXPECT_EQ(first->woken + second->woken, 0U);
    }
    EXPECT_EQ(first->woken, 1U);
    EXPECT_EQ(second->woken, 1U);
    EXPECT_EQ(first->sent + second->sent, 0U);
    DeferredWakeUps::wake(first);
    EXPECT_EQ(first->woken, 2U);
}

TEST_F(DeferredWakeUpsTest, AnyNumberOfWritersIsWoken)
{
    std::vector<std::shared_ptr<CountingWriter>> writers(254);
    {
        const DeferredWakeUps wakeUps(DeferredWakeUps::How::SendForOne);
        for (auto& writer : writers) {
            writer = std::make_shared<CountingWriter>();
            DeferredWakeUps::wake(writer);
            DeferredWakeUps::wake(writer);
        }
    }
    for (const auto& writer : writers) {
        EXPECT_EQ(writer->woken, 1U);
        EXPECT_EQ(writer->sent, 0U);
    }
}

TEST_F(DeferredWakeUpsTest, ASingleWriterSendsOnThisThreadIfThatWasAskedFor)
{
    {
        const DeferredWakeUps wakeUps(DeferredWakeUps::How::SendForOne);
        DeferredWakeUps::wake(first);
        DeferredWakeUps::wake(first);
        EXPECT_EQ(first->sent, 0U);
    }
    EXPECT_EQ(first->sent, 1U);
    EXPECT_EQ(first->woken, 0U);
}

TEST_F(DeferredWakeUpsTest, HowToWakeMayChangeUntilTheEnd)
{
    {
        DeferredWakeUps wakeUps;
        DeferredWakeUps::wake(first);
        wakeUps.change(DeferredWakeUps::How::SendForOne);
    }
    EXPECT_EQ(first->sent, 1U);
    EXPECT_EQ(first->woken, 0U);
}

TEST_F(DeferredWakeUpsTest, TheOutermostOneCollects)
{
    {
        const DeferredWakeUps outer(DeferredWakeUps::How::SendForOne);
        {
            const DeferredWakeUps inner;
            DeferredWakeUps::wake(first);
        }
        EXPECT_EQ(first->woken + first->sent, 0U);
    }
    EXPECT_EQ(first->sent, 1U);
}

TEST_F(DeferredWakeUpsTest, AWriterIsKeptUntilItWasWoken)
{
    std::weak_ptr<CountingWriter> kept = first;
    {
        const DeferredWakeUps wakeUps;
        DeferredWakeUps::wake(first);
        first.reset();
        EXPECT_FALSE(kept.expired());
    }
    EXPECT_TRUE(kept.expired());
}

TEST_F(DeferredWakeUpsTest, WithoutMemoryAWriterIsWokenAtOnce)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const auto third = std::make_shared<CountingWriter>();
    const DeferredWakeUps wakeUps;
    DeferredWakeUps::wake(first);
    DeferredWakeUps::wake(second);
    Allocations allocations;
    allocations.failAll();
    DeferredWakeUps::wake(third);
    allocations.succeedAgain();
    EXPECT_EQ(third->woken, 1U);
}

} // namespace

} // namespace qel::test
