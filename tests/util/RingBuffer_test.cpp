#include <qel/common/util/RingBuffer.hpp>

#include <algorithm>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <iterator>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

namespace qel {
namespace {

using testing::ElementsAre;

template <typename T, std::size_t N>
std::vector<T> contents(const RingBuffer<T, N>& ring)
{
    return std::vector<T>(ring.begin(), ring.end());
}

/// Counts its living objects and can throw when constructed; not copyable, not movable, without a default constructor.
class Tracked {
public:
    Tracked(int& living, int number) : mLiving(living), mNumber(number)
    {
        if (number < 0) throw std::runtime_error("refused");
        ++mLiving;
    }
    ~Tracked() { --mLiving; }
    Tracked(const Tracked&) = delete;
    Tracked& operator=(const Tracked&) = delete;
    int number() const { return mNumber; }

private:
    int& mLiving;
    int mNumber;
};

template <std::size_t N>
std::vector<int> numbers(const RingBuffer<Tracked, N>& ring)
{
    std::vector<int> result;
    for (const Tracked& element : ring) {
        result.push_back(element.number());
    }
    return result;
}

TEST(RingBuffer, IsEmptyAtFirst)
{
    const RingBuffer<int, 3> ring;
    EXPECT_TRUE(ring.empty());
    EXPECT_EQ(ring.size(), 0U);
    EXPECT_TRUE(ring.begin() == ring.end());
}

TEST(RingBuffer, IteratesFromTheNewestElementToTheOldest)
{
    RingBuffer<int, 3> ring;
    ring.push(1);
    EXPECT_THAT(contents(ring), ElementsAre(1));
    EXPECT_FALSE(ring.empty());
    ring.push(2);
    EXPECT_THAT(contents(ring), ElementsAre(2, 1));
    ring.push(3);
    EXPECT_THAT(contents(ring), ElementsAre(3, 2, 1));
    EXPECT_EQ(ring.size(), 3U);
}

TEST(RingBuffer, OverwritesTheOldestElementWhenFull)
{
    RingBuffer<int, 3> ring;
    for (int i = 1; i <= 20; ++i) {
        ring.push(i);
        EXPECT_EQ(ring.head(), i);
        EXPECT_EQ(ring.size(), static_cast<std::size_t>(std::min(i, 3)));
    }
    EXPECT_THAT(contents(ring), ElementsAre(20, 19, 18));
}

TEST(RingBuffer, MayHoldASingleElement)
{
    RingBuffer<int, 1> ring;
    ring.push(1);
    ring.push(2);
    EXPECT_THAT(contents(ring), ElementsAre(2));
}

TEST(RingBuffer, ConstructsFromSeveralArgumentsOrNone)
{
    RingBuffer<std::string, 2> ring;
    ring.push(3U, 'x');
    ring.push();
    EXPECT_THAT(contents(ring), ElementsAre("", "xxx"));
}

TEST(RingBuffer, TakesMovableArguments)
{
    RingBuffer<std::unique_ptr<int>, 2> ring;
    ring.push(std::make_unique<int>(5));
    EXPECT_EQ(*ring.head(), 5);
}

TEST(RingBuffer, PushReturnsTheNewElementAndHeadCanBeChanged)
{
    RingBuffer<int, 2> ring;
    int& pushed = ring.push(1);
    EXPECT_EQ(&pushed, &ring.head());
    ring.head() = 7;
    EXPECT_THAT(contents(ring), ElementsAre(7));
    const RingBuffer<int, 2>& constant = ring;
    EXPECT_EQ(&constant.head(), &ring.head());
}

TEST(RingBuffer, ConstructsInPlaceAndDestroysTheReplacedElement)
{
    int living = 0;
    {
        RingBuffer<Tracked, 2> ring;
        EXPECT_EQ(living, 0);
        ring.push(living, 1);
        ring.push(living, 2);
        EXPECT_EQ(living, 2);
        ring.push(living, 3);
        EXPECT_EQ(living, 2);
        EXPECT_THAT(numbers(ring), ElementsAre(3, 2));
    }
    EXPECT_EQ(living, 0);
}

TEST(RingBuffer, AFailedConstructionKeepsTheOtherElements)
{
    int living = 0;
    {
        RingBuffer<Tracked, 3> ring;
        EXPECT_THROW(ring.push(living, -1), std::runtime_error);
        EXPECT_TRUE(ring.empty());

        ring.push(living, 1);
        ring.push(living, 2);
        EXPECT_THROW(ring.push(living, -1), std::runtime_error);
        EXPECT_THAT(numbers(ring), ElementsAre(2, 1));

        ring.push(living, 3);
        EXPECT_THROW(ring.push(living, -1), std::runtime_error);
        EXPECT_THAT(numbers(ring), ElementsAre(3, 2)); // the oldest was replaced first
        EXPECT_EQ(living, 2);

        ring.push(living, 4);
        EXPECT_THAT(numbers(ring), ElementsAre(4, 3, 2));
        ring.push(living, 5);
        EXPECT_THAT(numbers(ring), ElementsAre(5, 4, 3));
        EXPECT_EQ(living, 3);
    }
    EXPECT_EQ(living, 0);
}

TEST(RingBuffer, CopiesHoldTheSameElements)
{
    RingBuffer<std::string, 2> ring;
    ring.push("a");
    ring.push("b");
    ring.push("c");
    RingBuffer<std::string, 2> copy(ring);
    copy.push("d");
    EXPECT_THAT(contents(ring), ElementsAre("c", "b"));
    EXPECT_THAT(contents(copy), ElementsAre("d", "c"));
    ring = copy;
    EXPECT_THAT(contents(ring), ElementsAre("d", "c"));
}

TEST(RingBuffer, ItsIteratorIsAForwardIterator)
{
    using Iterator = RingBuffer<std::string, 3>::ConstIterator;
    EXPECT_TRUE((std::is_same<std::iterator_traits<Iterator>::iterator_category, std::forward_iterator_tag>::value));
    EXPECT_TRUE((std::is_same<std::iterator_traits<Iterator>::reference, const std::string&>::value));

    RingBuffer<std::string, 3> ring;
    ring.push("first");
    ring.push("second");
    Iterator iterator;
    EXPECT_TRUE(iterator == Iterator());
    iterator = ring.begin();
    EXPECT_EQ(iterator->size(), 6U);
    EXPECT_EQ(*iterator++, "second");
    EXPECT_EQ(*iterator, "first");
    EXPECT_TRUE(iterator != ring.end());
    EXPECT_EQ(&++iterator, &iterator);
    EXPECT_TRUE(iterator == ring.end());
    EXPECT_EQ(std::distance(ring.begin(), ring.end()), 2);
    EXPECT_EQ(std::find(ring.begin(), ring.end(), "first"), std::next(ring.begin()));
}

TEST(RingBuffer, IteratorsOfDifferentRingsDiffer)
{
    RingBuffer<int, 2> first;
    RingBuffer<int, 2> second;
    first.push(1);
    second.push(1);
    EXPECT_TRUE(first.begin() != second.begin());
    EXPECT_TRUE(first.begin() == first.begin());
}

} // namespace
} // namespace qel
