#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/TypeInfo.hpp>

#include "fault/FrameModel.hpp"
#include "support/Bytes.hpp"
#include "support/CapturedLog.hpp"
#include "support/GoldenFrame.hpp"
#include "support/MessageProbe.hpp"

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <exception>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <set>
#include <string>
#include <vector>

/// Broken frames of every kind. The library and an independent model of the wire format (FrameModel.hpp) judge each of
/// them. The two must agree on whether it is a message, of which class and with which values, and otherwise on the
/// reason and on the lines in the log. The bytes lie in heap blocks of exactly their size, so that the address
/// sanitizer reports every read past the end.

namespace qel::test {
namespace {

using testing::StartsWith;

/// The last part of the dump: 16 bytes to a line, a blank before every second byte.
std::string rawContents(const std::string& frame)
{
    std::string dump = "Current raw message contents:\n";
    for (std::size_t i = 0; i < frame.size(); ++i) {
        if (i != 0 && i % 16 == 0) dump += '\n';
        if (i % 2 == 0) dump += ' ';
        dump += hex(frame.substr(i, 1));
    }
    return dump + "\n\n";
}

bool endsWith(const std::string& text, const std::string& end)
{
    return text.size() >= end.size() && text.compare(text.size() - end.size(), end.size(), end) == 0;
}

void expectHeader(const QelMessage& message, const std::string& frame)
{
    EXPECT_EQ(message.msgLength(), frame.size());
    EXPECT_EQ(message.getCallerId(), numberAt(frame, 8, 4));
    EXPECT_EQ(message.getFunction(), numberAt(frame, 12, 2));
    EXPECT_EQ(message.getFlags(), numberAt(frame, 14, 1));
    EXPECT_EQ(message.dataLength(), numberAt(frame, 16, 4));
    EXPECT_EQ(message.getOperation(), numberAt(frame, 20, 2));
    EXPECT_EQ(message.getStatus(), numberAt(frame, 22, 2));
    EXPECT_EQ(message.getStatusDetail(), headerLength(frame) == 32 ? numberAt(frame, 24, 2) : 0);
    const std::uint64_t upperFlags = numberAt(frame, 14, 1) >> 6;
    const QelMessageClassification::Value expected[] = {
        QelMessageClassification::Async, QelMessageClassification::Response, QelMessageClassification::Request,
        QelMessageClassification::Unknown};
    EXPECT_EQ(message.getClassification(), expected[upperFlags]);
    if (message.getStatus() == 0) {
        EXPECT_NO_THROW(message.checkStatus());
    } else {
        EXPECT_THROW(message.checkStatus(), QelMessageStatusException);
    }
}

/// Compares everything that a message returns with the model.
void expectMessage(const QelMessage& message, const Verdict& verdict, const std::string& bytes)
{
    const std::string frame = bytes.substr(0, numberAt(bytes, 4, 4));
    ASSERT_EQ(frameOf(message), hex(frame));
    ASSERT_EQ(TypeInfo::getTypeName(message), "qel::" + verdict.className);
    expectHeader(message, frame);
    if (verdict.payload.empty()) {
        EXPECT_EQ(message.getData(), nullptr);
    } else {
        EXPECT_EQ(message.getData(), message.serialize() + headerLength(frame));
    }

    const PayloadRules& rules = rulesOf(verdict.className);
    EXPECT_EQ(rules.actual(message).str(), rules.expected(verdict.payload).str());

    const std::string id = "[CID: " + hexNumber(numberAt(frame, 8, 4), 8) + ", FN: ";
    EXPECT_THAT(toString(message.getLogID()), StartsWith(id));
    EXPECT_TRUE(endsWith(toString(message.debug()), rawContents(frame)));

    const std::unique_ptr<QelMessage> clone = message.clone();
    EXPECT_EQ(TypeInfo::getTypeName(*clone), "qel::" + verdict.className);
    EXPECT_EQ(frameOf(*clone), hex(frame));
    EXPECT_EQ(frameOf(QelMessageGeneric(message)), hex(frame));

    if (verdict.className == "QelMessageDaxBroadcastReq") {
        const auto& request = qelMessageCast<QelMessageDaxBroadcastReq>(message);
        const QelMessageDaxBroadcastOutboundAsync outbound(request, "sender", 7);
        EXPECT_EQ(hex(outbound.getDaxPacket(), outbound.getBroadcastMsgLen()),
                  hex(request.getDaxPacket(), request.getBroadcastMsgLen()));
    }
}

void expectLines(const std::vector<std::string>& lines, const std::vector<std::string>& beginnings)
{
    ASSERT_EQ(lines.size(), beginnings.size());
    for (std::size_t i = 0; i < lines.size(); ++i) {
        EXPECT_THAT(lines[i], StartsWith(beginnings[i]));
    }
}

class CorruptFrames : public testing::Test {
protected:
    /// Passes the bytes to the receiver from an even and from an odd address, and compares the result with the model.
    void tryBytes(const Receiver& receiver, const std::string& bytes)
    {
        ++mTried;
        const Verdict verdict = judge(receiver, bytes);
        for (const std::size_t shift : {std::size_t{0}, std::size_t{1}}) {
            const std::string shifted = std::string(shift, '\x55') + bytes;
            const std::unique_ptr<char[]> block = heapCopy(shifted);
            mLog.clear();
            pTryBlock(receiver, block.get() + shift, bytes, verdict);
            EXPECT_EQ(hex(block.get(), shifted.size()), hex(shifted)) << "the input was modified";
            expectLines(mLog.lines(), verdict.lines);
            if (HasFailure()) {
                ADD_FAILURE() << "the bytes, " << (shift == 0 ? "even" : "odd") << " address: " << hex(bytes);
                return;
            }
        }
        ++(verdict.thrown.empty() ? mTaken : mRefused);
    }

    std::size_t mTried = 0;
    std::size_t mTaken = 0;
    std::size_t mRefused = 0;

private:
    static void pTryBlock(const Receiver& receiver, const char* block, const std::string& bytes, const Verdict& verdict)
    {
        std::string thrown;
        try {
            const std::unique_ptr<QelMessage> message =
                receiver.registry.deserialize(block, static_cast<unsigned int>(bytes.size()));
            ASSERT_NE(message, nullptr);
            ASSERT_LE(message->msgLength(), bytes.size());
            if (verdict.thrown.empty()) expectMessage(*message, verdict, bytes);
        } catch (const QelMessageValidationException& failure) {
            thrown = failure.what();
        } catch (const std::exception& failure) {
            FAIL() << "another exception: " << TypeInfo::getTypeName(failure) << " " << failure.what();
        }
        EXPECT_EQ(thrown, verdict.thrown);
    }

    CapturedLog mLog;
};

std::vector<GoldenFrame> goldenFrames()
{
    std::vector<GoldenFrame> frames;
    for (const std::string& name : GoldenFrame::allNames()) {
        frames.push_back(GoldenFrame::load(name));
    }
    return frames;
}

std::string at(const GoldenFrame& golden, std::size_t offset)
{
    return golden.fileName() + " at offset " + std::to_string(offset);
}

// --- tests

TEST_F(CorruptFrames, ValidFramesAreAccepted)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        SCOPED_TRACE(golden.fileName());
        tryBytes(publicReceiver(), golden.bytes());
        tryBytes(internalReceiver(), golden.bytes());
        if (HasFailure()) return;
    }
    EXPECT_EQ(mTaken, mTried);
}

TEST_F(CorruptFrames, EveryTruncationIsRefused)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        for (std::size_t length = 0; length < golden.bytes().size(); ++length) {
            SCOPED_TRACE(at(golden, length));
            tryBytes(publicReceiver(), golden.bytes().substr(0, length));
            if (HasFailure()) return;
        }
    }
    EXPECT_EQ(mRefused, mTried);
}

TEST_F(CorruptFrames, BytesAfterAFrameAreIgnored)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        SCOPED_TRACE(golden.fileName());
        tryBytes(publicReceiver(), golden.bytes() + '\xEE');
        tryBytes(publicReceiver(), golden.bytes() + golden.bytes());
        if (HasFailure()) return;
    }
    EXPECT_EQ(mTaken, mTried);
}

/// The values that one byte is replaced with.
std::set<char> replacements(char original)
{
    const auto byte = static_cast<unsigned char>(original);
    std::set<char> values = {'\x00', '\xFF', static_cast<char>(byte ^ 0x01), static_cast<char>(byte ^ 0x80),
                             static_cast<char>(byte + 1)};
    values.erase(original);
    return values;
}

TEST_F(CorruptFrames, AnyReplacedByteIsJudgedAsTheModelDoes)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        for (std::size_t offset = 0; offset < golden.bytes().size(); ++offset) {
            for (const char value : replacements(golden.bytes()[offset])) {
                SCOPED_TRACE(at(golden, offset));
                std::string bytes = golden.bytes();
                bytes[offset] = value;
                tryBytes(publicReceiver(), bytes);
                if (HasFailure()) return;
            }
        }
    }
    EXPECT_GT(mTaken, mRefused) << "most bytes are payload or ids, and no value of those makes a frame invalid";
    EXPECT_GT(mRefused, 0U);
}

TEST_F(CorruptFrames, AnyReplacedByteOfTheHandshakeIsJudgedAsTheModelDoes)
{
    for (const char* const name : {"QelMessageUpgradeConnectionAsync", "QelMessageAbortHandshakeAsync"}) {
        const GoldenFrame golden = GoldenFrame::load(name);
        for (std::size_t offset = 0; offset < golden.bytes().size(); ++offset) {
            for (const char value : replacements(golden.bytes()[offset])) {
                SCOPED_TRACE(at(golden, offset));
                std::string bytes = golden.bytes();
                bytes[offset] = value;
                tryBytes(internalReceiver(), bytes);
                if (HasFailure()) return;
            }
        }
    }
    EXPECT_GT(mTaken, 0U);
    EXPECT_GT(mRefused, 0U);
}

bool isLength(const std::string& field)
{
    return endsWith(field, "Len") || endsWith(field, "Length") || endsWith(field, "mOffset");
}

/// Each limit and both its neighbours, if they fit a field of that many bytes.
std::set<std::uint64_t> bothSidesOf(const std::vector<std::uint64_t>& limits, std::size_t fieldLength)
{
    const std::uint64_t largest = (std::uint64_t{1} << 8 * fieldLength) - 1;
    std::set<std::uint64_t> values;
    for (const std::uint64_t limit : limits) {
        for (const std::uint64_t value : {limit - 1, limit, limit + 1}) {
            if (value <= largest) values.insert(value);
        }
    }
    return values;
}

/// The length field values that end exactly with a payload of this length, for each offset of a variable part.
std::vector<std::uint64_t> endsOfPayload(std::uint64_t payload)
{
    std::vector<std::uint64_t> ends;
    for (const std::uint64_t begin : {0U, 2U, 4U, 6U, 16U, 32U, 42U, 46U}) {
        if (begin <= payload) ends.push_back(payload - begin);
    }
    return ends;
}

/// Values at both sides of every limit of a length field of this frame, and those at which sums wrap.
std::set<std::uint64_t> boundaries(const GoldenFrame& golden, const GoldenFrame::Place& field)
{
    const std::uint64_t current = numberAt(golden.bytes(), field.offset, field.length);
    std::vector<std::uint64_t> limits = endsOfPayload(numberAt(golden.bytes(), 16, 4));
    limits.insert(limits.end(), {0, 4, 8, 16, 24, 32, 40, 42, 46, 0x80, 0x100, 0x8000, 0x10000, 0x80000000});
    limits.insert(limits.end(), {current, golden.bytes().size()});
    const std::uint64_t largest = (std::uint64_t{1} << 8 * field.length) - 1;
    for (const std::uint64_t below : {0U, 3U, 15U, 23U, 31U, 41U, 45U}) {
        limits.push_back(largest - below);
    }

    std::set<std::uint64_t> values = bothSidesOf(limits, field.length);
    values.erase(current);
    return values;
}

TEST_F(CorruptFrames, AnyBoundaryValueOfALengthFieldIsJudgedAsTheModelDoes)
{
    std::set<std::string> fields;
    for (const GoldenFrame& golden : goldenFrames()) {
        for (const GoldenFrame::Place& field : golden.places()) {
            if (!isLength(field.field)) continue;
            fields.insert(field.field);
            for (const std::uint64_t value : boundaries(golden, field)) {
                SCOPED_TRACE(at(golden, field.offset) + " = " + hexNumber(value, 1));
                std::string bytes = golden.bytes();
                setNumberAt(bytes, field.offset, field.length, value);
                tryBytes(publicReceiver(), bytes);
                if (HasFailure()) return;
            }
        }
    }
    EXPECT_THAT(fields, testing::UnorderedElementsAre(
                            "header.mMsgLength", "header.mDataLength", "header.mPadLength", "payload.mBroadcastMsgLen",
                            "payload.mCapabilityLen", "payload.mDataLength", "payload.mMTMSLen", "payload.mMetadataLen",
                            "payload.mOffset", "payload.mSenderToolIdLen", "payload.mSysMachineTypeLen",
                            "payload.mSysSerialNumLen", "payload.mToolIdLen", "payload.mToolIdLength"));
    EXPECT_GT(mTaken, 0U);
    EXPECT_GT(mRefused, 0U);
}

/// Payload length and pad that add up to the frame length only modulo 2^32.
TEST_F(CorruptFrames, LengthsThatWrapTogetherAreRefused)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        const std::uint64_t header = headerLength(golden.bytes());
        for (const std::uint64_t msgLength : {header, header + 8, std::uint64_t{golden.bytes().size()}}) {
            // The smallest pad with which the payload length still fits its field, and larger ones.
            for (const std::uint64_t pad : {msgLength - header + 1, std::uint64_t{0x80}, std::uint64_t{0xFF}}) {
                if (pad <= msgLength - header || pad > 0xFF) continue;
                SCOPED_TRACE(golden.fileName() + " with " + std::to_string(msgLength) + " bytes and a pad of " +
                             std::to_string(pad));
                std::string bytes = golden.bytes();
                bytes.resize(std::max<std::size_t>(bytes.size(), msgLength));
                setNumberAt(bytes, 4, 4, msgLength);
                setNumberAt(bytes, 15, 1, pad);
                setNumberAt(bytes, 16, 4, (std::uint64_t{1} << 32) + msgLength - header - pad);
                tryBytes(publicReceiver(), bytes);
                if (HasFailure()) return;
            }
        }
    }
    EXPECT_EQ(mRefused, mTried);
}

/// The same header with another payload and consistent lengths and pad.
std::string withPayload(const GoldenFrame& golden, const std::string& payload)
{
    std::string bytes = golden.bytes().substr(0, headerLength(golden.bytes()));
    const bool isOld = bytes.size() == 24;
    std::uint64_t pad = numberAt(bytes, 15, 1);
    if (isOld) pad = payload.size() < 16 ? 16 - payload.size() : 0;
    setNumberAt(bytes, 4, 4, bytes.size() + payload.size() + pad);
    setNumberAt(bytes, 15, 1, pad);
    setNumberAt(bytes, 16, 4, payload.size());
    return bytes + payload + std::string(pad, '\0');
}

TEST_F(CorruptFrames, AShorterPayloadIsNeverRefused)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        const std::string payload =
            golden.bytes().substr(headerLength(golden.bytes()), numberAt(golden.bytes(), 16, 4));
        for (std::size_t length = 0; length <= payload.size(); ++length) {
            SCOPED_TRACE(at(golden, length));
            tryBytes(publicReceiver(), withPayload(golden, payload.substr(0, length)));
            if (HasFailure()) return;
        }
    }
    EXPECT_EQ(mTaken, mTried) << "a frame with a refused payload becomes a plain message";
}

TEST_F(CorruptFrames, ALongerPayloadIsAccepted)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        const std::string payload =
            golden.bytes().substr(headerLength(golden.bytes()), numberAt(golden.bytes(), 16, 4));
        for (const std::size_t more : {1U, 2U, 17U, 300U}) {
            SCOPED_TRACE(at(golden, more));
            const std::string bytes = withPayload(golden, payload + std::string(more, '\xEE'));
            tryBytes(publicReceiver(), bytes);
            const bool isKnown = publicReceiver().classes.count({golden.function(), golden.operation(),
                                                                 golden.number<unsigned char>("header.mFlags")}) != 0;
            EXPECT_EQ(judge(publicReceiver(), bytes).className, isKnown ? golden.className() : "QelMessage");
            if (HasFailure()) return;
        }
    }
    EXPECT_EQ(mTaken, mTried);
}

/// Every payload length combined with every boundary value of every length field in it.
TEST_F(CorruptFrames, AShorterPayloadWithAnyLengthFieldIsJudgedAsTheModelDoes)
{
    for (const GoldenFrame& golden : goldenFrames()) {
        const std::size_t header = headerLength(golden.bytes());
        const std::string whole = golden.bytes().substr(header, numberAt(golden.bytes(), 16, 4));
        if (whole.size() > 64) continue; // the one long payload would take most of the time and has no further fields
        for (const GoldenFrame::Place& field : golden.places()) {
            if (!isLength(field.field) || field.offset < header) continue;
            for (std::size_t length = field.offset - header + field.length; length <= whole.size(); ++length) {
                std::vector<std::uint64_t> limits = endsOfPayload(length);
                limits.insert(limits.end(), {0, 16, 32, 42, 46});
                for (const std::uint64_t value : bothSidesOf(limits, field.length)) {
                    SCOPED_TRACE(at(golden, field.offset) + " = " + hexNumber(value, 1) + " in " +
                                 std::to_string(length) + " bytes");
                    std::string payload = whole.substr(0, length);
                    setNumberAt(payload, field.offset - header, field.length, value);
                    tryBytes(publicReceiver(), withPayload(golden, payload));
                    if (HasFailure()) return;
                }
            }
        }
    }
    EXPECT_EQ(mTaken, mTried);
}

TEST_F(CorruptFrames, AnEmptyBufferIsRefused)
{
    tryBytes(publicReceiver(), "");
    EXPECT_EQ(mRefused, 1U);

    EXPECT_THAT([] { publicReceiver().registry.deserialize(nullptr, 0); },
                testing::ThrowsMessage<QelMessageValidationException>(testing::StrEq("length")));
    EXPECT_THAT([] { publicReceiver().registry.deserialize(nullptr, 40); },
                testing::ThrowsMessage<QelMessageValidationException>(testing::StrEq("i_buffer")));
}

} // namespace
} // namespace qel::test
