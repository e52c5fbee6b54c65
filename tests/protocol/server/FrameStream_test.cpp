#include <qel/common/io/BufferedStream.hpp>

#include "protocol/server/RecordingStream.hpp"
#include "server/FrameStream.hpp"

#include <gmock/gmock.h>
#include <string>

namespace qel::test {

namespace {

using protocol::FrameStream;
using std::chrono::milliseconds;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr milliseconds kFrame(700);

std::string take(FrameStream& stream, std::size_t length)
{
    std::string bytes(length, '\0');
    stream.fill(&bytes[0], length);
    return bytes;
}

TEST(FrameStream, ReadsAFrameThatHasArrivedWithOneCallAndNoDeadline)
{
    RecordingStream below;
    below.chunks = {"headbody", "headbody"};
    BufferedStream ahead(below);
    FrameStream stream(ahead);
    stream.limitFrames(kFrame);
    for (int frame = 0; frame < 2; ++frame) {
        stream.beginFrame();
        EXPECT_EQ(take(stream, 4), "head");
        EXPECT_EQ(take(stream, 4), "body");
    }
    EXPECT_THAT(below.deadlines, ElementsAre(-1, -1));
}

TEST(FrameStream, ReadsAheadSeveralFrames)
{
    RecordingStream below;
    below.chunks = {"111122223333"};
    BufferedStream ahead(below);
    FrameStream stream(ahead);
    EXPECT_EQ(take(stream, 4), "1111");
    EXPECT_EQ(take(stream, 4), "2222");
    EXPECT_EQ(take(stream, 4), "3333");
    EXPECT_EQ(below.lengths.size(), 1U);
}

TEST(FrameStream, TheRestOfAFrameHasADeadlineAndTheNextFrameHasNone)
{
    for (const bool readsAhead : {false, true}) {
        RecordingStream below;
        below.chunks = {"he", "ad", "b", "ody", "x"};
        BufferedStream ahead(below);
        FrameStream stream(readsAhead ? static_cast<Stream&>(ahead) : below);
        stream.limitFrames(kFrame);
        stream.beginFrame();
        EXPECT_EQ(take(stream, 4), "head");
        EXPECT_EQ(take(stream, 4), "body");
        EXPECT_TRUE(stream.isInFrame());
        stream.beginFrame();
        EXPECT_FALSE(stream.isInFrame());
        EXPECT_EQ(take(stream, 1), "x");
        EXPECT_THAT(below.deadlines, ElementsAre(-1, 700, 700, 700, -1));
    }
}

TEST(FrameStream, ABeginningThatWasReadAheadIsWithinItsFrame)
{
    RecordingStream below;
    below.chunks = {"headbodyhe", "ad"};
    BufferedStream ahead(below);
    FrameStream stream(ahead);
    stream.limitFrames(kFrame);
    stream.beginFrame();
    EXPECT_EQ(take(stream, 8), "headbody");
    stream.beginFrame();
    EXPECT_EQ(take(stream, 4), "head");
    EXPECT_THAT(below.deadlines, ElementsAre(-1, 700));
}

TEST(FrameStream, ABeginningThatWasReadAheadHasATimeOfItsOwn)
{
    RecordingStream below;
    below.chunks = {"he", "adhe", "ad"};
    BufferedStream ahead(below);
    FrameStream stream(ahead);
    stream.limitFrames(kFrame);
    for (int frame = 0; frame < 2; ++frame) {
        stream.beginFrame();
        EXPECT_EQ(take(stream, 4), "head");
    }
    EXPECT_THAT(below.settings, ElementsAre(-1, 700, -1, 700));
}

TEST(FrameStream, BeforeTheLimitTheDeadlinesBelowAreLeftAlone)
{
    RecordingStream below;
    below.chunks = {"h", "e", "x"};
    BufferedStream ahead(below);
    FrameStream stream(ahead);
    stream.beginFrame();
    EXPECT_EQ(take(stream, 2), "he");
    stream.limitFrames(kFrame);
    stream.beginFrame();
    EXPECT_EQ(take(stream, 1), "x");
    EXPECT_THAT(below.deadlines, ElementsAre(10000, 10000, -1));
}

TEST(FrameStream, TheEndOfTheStreamIsItsEnd)
{
    RecordingStream below;
    FrameStream stream(below);
    char byte = 0;
    EXPECT_EQ(stream.read(&byte, 1), 0U);
    EXPECT_EQ(stream.read(&byte, 1), 0U);
    EXPECT_FALSE(stream.isInFrame());
}

TEST(FrameStream, ReadingNothingAsksForNothing)
{
    RecordingStream below;
    BufferedStream ahead(below);
    FrameStream stream(ahead);
    char byte = 0;
    EXPECT_EQ(stream.read(&byte, 0), 0U);
    EXPECT_THAT(below.lengths, IsEmpty());
}

TEST(FrameStream, PassesTheRestThrough)
{
    RecordingStream below;
    FrameStream stream(below);
    stream.write("out", 3);
    stream.setWriteDeadline(milliseconds(5));
    stream.setReadDeadline(milliseconds(6));
    char byte = 0;
    static_cast<void>(stream.read(&byte, 1));
    stream.close();
    EXPECT_EQ(below.written, "out");
    EXPECT_EQ(below.writeDeadline(), 5);
    EXPECT_THAT(below.deadlines, ElementsAre(6));
    EXPECT_TRUE(below.isClosed);
}

} // namespace

} // namespace qel::test
