#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamDeadline.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include "support/ScriptedStream.hpp"

#include <chrono>
#include <cstddef>
#include <cstring>
#include <exception>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <stdexcept>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

using namespace std::chrono_literals;
using qel::InputStream;
using qel::OutputStream;
using qel::Stream;
using qel::StreamBase;
using qel::StreamDeadline;
using qel::StreamIOException;
using qel::test::ScriptedStream;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::StrEq;
using testing::ThrowsMessage;

namespace {

std::vector<char> text(const std::string& characters) { return {characters.begin(), characters.end()}; }

// A stream that implements only the pure virtual operations.
class PlainStream : public Stream {
public:
    explicit PlainStream(bool* destroyed = nullptr) : mDestroyed(destroyed) {}
    ~PlainStream() override
    {
        if (mDestroyed != nullptr) *mDestroyed = true;
    }
    void close() override { ++mCloseCount; }
    std::size_t read(char*, std::size_t) override { return 0; }
    void write(const char*, std::size_t) override {}

    int mCloseCount = 0;

private:
    bool* mDestroyed;
};

// Streams of one direction.
class PlainInput : public InputStream {
public:
    void close() override {}
    std::size_t read(char*, std::size_t) override { return 0; }
};

class PlainOutput : public OutputStream {
public:
    void close() override {}
    void write(const char*, std::size_t) override {}
};

// Counts how often it is read.
class CountingInput : public InputStream {
public:
    void close() override {}
    std::size_t read(char*, std::size_t) override
    {
        ++mCalls;
        return 0;
    }
    int mCalls = 0;
};

template <typename Base, typename Derived, typename = void>
struct CanCastDown : std::false_type {};
template <typename Base, typename Derived>
struct CanCastDown<Base, Derived, std::void_t<decltype(static_cast<Derived*>(std::declval<Base*>()))>>
    : std::true_type {};

// The slot of a virtual operation. Under the C++ ABI of our platforms a pointer to a virtual member function begins
// with the byte offset in the table (plus one on some platforms).
template <typename Member>
std::size_t slotOf(Member member)
{
    std::ptrdiff_t offset = 0;
    std::memcpy(&offset, &member, sizeof(offset));
    return static_cast<std::size_t>(offset) / sizeof(void*);
}

TEST(StreamInterfaces, KeepTheOrderOfTheirVirtualOperations)
{
    // The destructor has the first two slots: one form destroys, the other also releases the memory.
    EXPECT_EQ(slotOf(&StreamBase::close), 2U);
    EXPECT_EQ(slotOf(&InputStream::setReadDeadline), 3U);
    EXPECT_EQ(slotOf(&InputStream::read), 4U);
    EXPECT_EQ(slotOf(&InputStream::fill), 5U);
    EXPECT_EQ(slotOf(&OutputStream::setWriteDeadline), 3U);
    EXPECT_EQ(slotOf(&OutputStream::write), 4U);
}

TEST(StreamInterfaces, InputSideIsThePrimaryInterfaceOfAStream)
{
    PlainStream stream;
    EXPECT_EQ(static_cast<void*>(static_cast<InputStream*>(&stream)),
              static_cast<void*>(static_cast<Stream*>(&stream)));
}

TEST(StreamInterfaces, AreAbstractAndNotCopied)
{
    EXPECT_TRUE(std::is_abstract<StreamBase>::value);
    EXPECT_TRUE(std::is_abstract<InputStream>::value);
    EXPECT_TRUE(std::is_abstract<OutputStream>::value);
    EXPECT_TRUE(std::is_abstract<Stream>::value);
    EXPECT_FALSE(std::is_copy_constructible<PlainStream>::value);
    EXPECT_FALSE(std::is_copy_assignable<PlainStream>::value);
    EXPECT_FALSE(std::is_move_constructible<PlainStream>::value);
    EXPECT_FALSE(std::is_move_assignable<PlainStream>::value);
}

TEST(StreamInterfaces, AStreamHasOneSharedBase)
{
    PlainStream stream;
    StreamBase* byInput = static_cast<InputStream*>(&stream);
    StreamBase* byOutput = static_cast<OutputStream*>(&stream);
    EXPECT_EQ(byInput, byOutput);
    byInput->close();
    EXPECT_EQ(stream.mCloseCount, 1);
}

TEST(StreamInterfaces, ADynamicCastLeadsFromTheSharedBaseToTheStream)
{
    EXPECT_FALSE((CanCastDown<StreamBase, InputStream>::value)); // inherited virtually
    EXPECT_FALSE((CanCastDown<StreamBase, OutputStream>::value));
    EXPECT_FALSE((CanCastDown<StreamBase, Stream>::value));
    EXPECT_TRUE((CanCastDown<InputStream, Stream>::value));
    EXPECT_TRUE((CanCastDown<OutputStream, Stream>::value));

    PlainStream stream;
    StreamBase& base = stream;
    EXPECT_EQ(dynamic_cast<Stream*>(&base), &stream);
    EXPECT_EQ(dynamic_cast<InputStream*>(&base), &stream);
    EXPECT_EQ(dynamic_cast<OutputStream*>(&base), &stream);
    EXPECT_EQ(dynamic_cast<PlainInput*>(&base), nullptr);
}

TEST(StreamInterfaces, DestroyingThroughAnyInterfaceDestroysTheStream)
{
    bool destroyed = false;
    std::unique_ptr<StreamBase>(new PlainStream(&destroyed)).reset();
    EXPECT_TRUE(destroyed);
    destroyed = false;
    std::unique_ptr<InputStream>(new PlainStream(&destroyed)).reset();
    EXPECT_TRUE(destroyed);
    destroyed = false;
    std::unique_ptr<OutputStream>(new PlainStream(&destroyed)).reset();
    EXPECT_TRUE(destroyed);
    destroyed = false;
    std::unique_ptr<Stream>(new PlainStream(&destroyed)).reset();
    EXPECT_TRUE(destroyed);
}

TEST(StreamDefaults, DeadlinesAreNotSupported)
{
    PlainStream stream;
    PlainInput input;
    PlainOutput output;
    for (const auto timeout : {0ms, 100ms, -1ms}) {
        SCOPED_TRACE(timeout.count());
        const auto notSupported = [](auto&& call) {
            EXPECT_THAT(call, ThrowsMessage<std::invalid_argument>(StrEq("Not supported")));
        };
        notSupported([&] { stream.setReadDeadline(timeout); });
        notSupported([&] { stream.setWriteDeadline(timeout); });
        notSupported([&] { input.setReadDeadline(timeout); });
        notSupported([&] { output.setWriteDeadline(timeout); });
    }
}

TEST(StreamDefaults, ClearingADeadlineThatIsNotSupportedThrows)
{
    PlainStream stream;
    EXPECT_THAT([&] { stream.clearReadDeadline(); }, ThrowsMessage<std::invalid_argument>(StrEq("Not supported")));
    EXPECT_THAT([&] { stream.clearWriteDeadline(); }, ThrowsMessage<std::invalid_argument>(StrEq("Not supported")));
}

TEST(StreamDefaults, ClearingADeadlineSetsInfiniteForItsDirection)
{
    ScriptedStream stream;
    stream.clearReadDeadline();
    EXPECT_THAT(stream.readDeadlines(), ElementsAre(StreamDeadline::Infinite));
    EXPECT_THAT(stream.writeDeadlines(), IsEmpty());
    stream.clearWriteDeadline();
    EXPECT_THAT(stream.readDeadlines(), ElementsAre(StreamDeadline::Infinite));
    EXPECT_THAT(stream.writeDeadlines(), ElementsAre(StreamDeadline::Infinite));
}

TEST(StreamDefaults, ClearingADeadlineIsNotVirtual)
{
    class Replacing : public ScriptedStream {
    public:
        void clearReadDeadline() { mReplaced = true; }
        void clearWriteDeadline() { mReplaced = true; }
        bool mReplaced = false;
    };
    Replacing stream;
    static_cast<InputStream&>(stream).clearReadDeadline();
    static_cast<OutputStream&>(stream).clearWriteDeadline();
    EXPECT_FALSE(stream.mReplaced);
    EXPECT_THAT(stream.readDeadlines(), ElementsAre(StreamDeadline::Infinite));
    EXPECT_THAT(stream.writeDeadlines(), ElementsAre(StreamDeadline::Infinite));
}

TEST(StreamFill, ReadsOnceWhenAllBytesHaveArrived)
{
    ScriptedStream stream;
    stream.deliver(text("12345678"));
    char buffer[8];
    stream.fill(buffer, sizeof(buffer));
    EXPECT_EQ(std::string(buffer, sizeof(buffer)), "12345678");
    EXPECT_THAT(stream.reads(), ElementsAre(8U));
}

TEST(StreamFill, ReadsTheRestUntilAllBytesHaveArrived)
{
    ScriptedStream stream;
    stream.deliver(text("123")).deliver(text("4")).deliver(text("5678"));
    char buffer[10] = {0, 0, 0, 0, 0, 0, 0, 0, '<', '>'};
    stream.fill(buffer, 8);
    EXPECT_EQ(std::string(buffer, sizeof(buffer)), "12345678<>");
    EXPECT_THAT(stream.reads(), ElementsAre(8U, 5U, 4U));
}

TEST(StreamFill, ReadsNoMoreThanTheLength)
{
    ScriptedStream stream;
    stream.deliver(text("12345678abc"));
    char buffer[8];
    stream.fill(buffer, sizeof(buffer));
    EXPECT_EQ(stream.bytesRead(), 8U);
    stream.fill(buffer, 3);
    EXPECT_EQ(std::string(buffer, 3), "abc");
}

TEST(StreamFill, EndOfStreamBeforeTheLastByteIsEOF)
{
    for (std::size_t there = 0; there < 8; ++there) {
        SCOPED_TRACE(there);
        ScriptedStream stream;
        if (there > 0) stream.deliver(text(std::string("12345678", there)));
        stream.end();
        char buffer[8];
        EXPECT_THAT([&] { stream.fill(buffer, sizeof(buffer)); }, ThrowsMessage<StreamIOException>(StrEq("EOF")));
        EXPECT_EQ(stream.bytesRead(), there);
        EXPECT_EQ(std::string(buffer, there), std::string("12345678", there));
    }
}

TEST(StreamFill, DoesNotReachAnEndOfStreamAfterTheLastByte)
{
    ScriptedStream stream;
    stream.deliver(text("12345678")).end();
    char buffer[8];
    EXPECT_NO_THROW(stream.fill(buffer, sizeof(buffer)));
}

TEST(StreamFill, LengthZeroReturnsWithoutARead)
{
    CountingInput input;
    EXPECT_NO_THROW(input.fill(nullptr, 0));
    EXPECT_EQ(input.mCalls, 0);
}

TEST(StreamFill, PassesFailuresOfTheStreamUnchanged)
{
    ScriptedStream stream;
    stream.deliver(text("123")).fail("the cable is out");
    char buffer[8];
    EXPECT_THAT([&] { stream.fill(buffer, sizeof(buffer)); },
                ThrowsMessage<StreamIOException>(StrEq("the cable is out")));
}

TEST(StreamIOExceptionTest, IsARuntimeErrorWithTheGivenText)
{
    EXPECT_TRUE((std::is_base_of<std::runtime_error, StreamIOException>::value));
    EXPECT_STREQ(StreamIOException("EOF").what(), "EOF");
    EXPECT_STREQ(StreamIOException(std::string("I/O deadline")).what(), "I/O deadline");
    const StreamIOException original("copied");
    const StreamIOException copy(original);
    EXPECT_STREQ(copy.what(), "copied");
}

TEST(StreamIOExceptionTest, CarriesANestedCause)
{
    EXPECT_FALSE(std::is_final<StreamIOException>::value);
    bool caught = false;
    try {
        try {
            throw std::out_of_range("the cause");
        } catch (const std::out_of_range&) {
            std::throw_with_nested(StreamIOException("the failure"));
        }
    } catch (const StreamIOException& failure) {
        caught = true;
        EXPECT_STREQ(failure.what(), "the failure");
        EXPECT_THAT([&] { std::rethrow_if_nested(failure); }, ThrowsMessage<std::out_of_range>(StrEq("the cause")));
    }
    EXPECT_TRUE(caught);
}

TEST(StreamIOExceptionTest, WithoutACauseHasNothingNested)
{
    EXPECT_NO_THROW(std::rethrow_if_nested(StreamIOException("EOF")));
}

} // namespace
