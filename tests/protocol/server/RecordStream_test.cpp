#include "protocol/server/RecordingStream.hpp"
#include "server/RecordStream.hpp"

#include <gmock/gmock.h>
#include <memory>
#include <string>
#include <utility>

namespace qel::test {

namespace {

using protocol::RecordStream;
using std::chrono::milliseconds;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

constexpr milliseconds kRecord(700);

/// A record with so many bytes in it.
std::string record(std::size_t length)
{
    std::string bytes("\x17\x03\x03", 3);
    bytes += static_cast<char>(length >> 8U);
    bytes += static_cast<char>(length & 0xFFU);
    return bytes + std::string(length, 'x');
}

class RecordStreamTest : public ::testing::Test {
protected:
    RecordStreamTest()
    {
        auto owned = std::make_unique<RecordingStream>();
        below = owned.get();
        stream = std::make_unique<RecordStream>(std::move(owned));
        stream->clearReadDeadline();
        stream->limitRecords(kRecord);
    }

    /// Reads until the script has ended, as TLS does. @return the deadlines of the reads, without that of the end
    std::vector<long> readAll()
    {
        std::vector<char> buffer(8192);
        while (stream->read(buffer.data(), buffer.size()) > 0)
            continue;
        below->deadlines.pop_back();
        return below->deadlines;
    }

    RecordingStream* below;
    std::unique_ptr<RecordStream> stream;
};

TEST_F(RecordStreamTest, BetweenRecordsThereIsNoDeadline)
{
    below->chunks = {record(1), record(300), record(5) + record(6), record(0), record(1)};
    EXPECT_THAT(readAll(), ElementsAre(-1, -1, -1, -1, -1));
}

TEST_F(RecordStreamTest, WithinARecordThereIsOne)
{
    const std::string whole = record(0x0102);
    for (std::size_t cut = 1; cut < whole.size(); ++cut) {
        SCOPED_TRACE(cut);
        below->deadlines.clear();
        below->chunks = {whole.substr(0, cut), whole.substr(cut), record(1)};
        EXPECT_THAT(readAll(), ElementsAre(-1, 700, -1));
    }
}

TEST_F(RecordStreamTest, ARecordThatTakesManyReadsHasOneTime)
{
    below->settings.clear();
    below->chunks = {record(9).substr(0, 4), record(9).substr(4, 3), record(9).substr(7, 2), record(9).substr(9)};
    EXPECT_THAT(readAll(), ElementsAre(-1, 700, 700, 700));
    EXPECT_THAT(below->settings, ElementsAre(700, -1));
}

TEST_F(RecordStreamTest, ABeginningAfterAWholeRecordIsWithinARecord)
{
    below->chunks = {record(20) + record(30).substr(0, 2), record(30).substr(2)};
    EXPECT_THAT(readAll(), ElementsAre(-1, 700));
}

TEST_F(RecordStreamTest, ADeadlineFromAboveTakesPrecedence)
{
    stream->setReadDeadline(milliseconds(50));
    below->chunks = {record(9).substr(0, 4), record(9).substr(4)};
    EXPECT_THAT(readAll(), ElementsAre(50, 50));
}

TEST_F(RecordStreamTest, WhenTheDeadlineFromAboveEndsWithinARecordItsOwnBegins)
{
    stream->setReadDeadline(milliseconds(50));
    below->chunks = {record(9).substr(0, 4)};
    EXPECT_THAT(readAll(), ElementsAre(50));
    stream->clearReadDeadline();
    below->deadlines.clear();
    below->chunks = {record(9).substr(4), record(9)};
    EXPECT_THAT(readAll(), ElementsAre(700, -1));
}

TEST_F(RecordStreamTest, WithoutALimitItOnlyFollows)
{
    stream->limitRecords(milliseconds(0));
    below->settings.clear();
    below->chunks = {record(9).substr(0, 4), record(9).substr(4)};
    EXPECT_THAT(readAll(), ElementsAre(-1, -1));
    EXPECT_THAT(below->settings, IsEmpty());
}

TEST_F(RecordStreamTest, PassesTheRestThrough)
{
    stream->write("out", 3);
    stream->setWriteDeadline(milliseconds(5));
    stream->close();
    EXPECT_EQ(below->written, "out");
    EXPECT_EQ(below->writeDeadline(), 5);
    EXPECT_TRUE(below->isClosed);
}

} // namespace

} // namespace qel::test
