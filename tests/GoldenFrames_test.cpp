#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "support/Bytes.hpp"
#include "support/CallerIdScope.hpp"
#include "support/GoldenClasses.hpp"
#include "support/GoldenFrame.hpp"
#include "support/MessageProbe.hpp"

#include <cstdint>
#include <filesystem>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <set>
#include <string>
#include <tuple>
#include <typeinfo>
#include <vector>

namespace qel::test {
namespace {

using testing::StrEq;
using testing::ThrowsMessage;
using testing::UnorderedElementsAreArray;

std::unique_ptr<QelMessage> parse(const QelMessageRegistry& registry, const GoldenFrame& golden)
{
    const auto copy = heapCopy(golden.bytes());
    return registry.deserialize(copy.get(), static_cast<unsigned int>(golden.bytes().size()));
}

// --- parsing and building

class GoldenFrames : public testing::TestWithParam<std::string> {
protected:
    const GoldenFrame mGolden = GoldenFrame::load(GetParam());
    const MessageClass& mClass = classOf(mGolden);
};

INSTANTIATE_TEST_SUITE_P(Vectors, GoldenFrames, testing::ValuesIn(GoldenFrame::allNames()), [](const auto& test) {
    std::string name = test.param;
    for (char& c : name) {
        if (c == '-') c = '_';
    }
    return name;
});

TEST_P(GoldenFrames, ParseToTheirClassAndValues)
{
    const QelMessageRegistry publicRegistry;
    const bool isInternal = mClass.home == Home::Internal;
    const QelMessageRegistry& registry = isInternal ? QelInternalMessageRegistry::getInstance() : publicRegistry;
    const std::unique_ptr<QelMessage> message = parse(registry, mGolden);

    const QelMessage& received = *message;
    EXPECT_STREQ(typeid(received).name(), mClass.parsedAs->name());

    EXPECT_EQ(message->getFunction(), mGolden.function());
    EXPECT_EQ(message->getOperation(), mGolden.operation());
    EXPECT_EQ(message->getClassification(), mGolden.classification());
    EXPECT_EQ(message->getFlags(), mGolden.number<unsigned char>("header.mFlags"));
    EXPECT_EQ(message->getCallerId(), callerId(mGolden));
    EXPECT_EQ(message->msgLength(), mGolden.number<unsigned int>("header.mMsgLength"));
    EXPECT_EQ(message->dataLength(), mGolden.number<unsigned int>("header.mDataLength"));
    EXPECT_EQ(message->getStatus(), mGolden.number<unsigned short>("header.mStatus"));
    const bool isNewForm = mGolden.number<unsigned char>("header.mHeaderVersion") == 0x20;
    EXPECT_EQ(mGolden.has("header.mStatusDetail"), isNewForm);
    EXPECT_EQ(message->getStatusDetail(), isNewForm ? mGolden.number<unsigned short>("header.mStatusDetail") : 0);
    EXPECT_EQ(MessageProbe(*message).pGetHeader()->mPadLength, mGolden.number<unsigned char>("header.mPadLength"));

    {
        PayloadCheck payload(mGolden);
        mClass.check(*message, payload);
    }
    if (mClass.capabilities != nullptr) {
        EXPECT_EQ(mClass.capabilities(*message).to_string(), capabilities(mGolden).to_string());
    }
    EXPECT_EQ(frameOf(*message), hex(mGolden.bytes()));
}

/// Gives a new message the status and the header form of the golden frame, which builders do not set.
QelMessageGeneric inTheFormOf(const GoldenFrame& golden, const QelMessage& built)
{
    MessageProbe probe(built);
    if (golden.number<unsigned char>("header.mHeaderVersion") == 0x00) {
        const std::string payload(built.getData() == nullptr ? "" : built.getData(), built.dataLength());
        probe.pGetHeader()->mHeaderVersion = QelMessage::CommonHeader::MessageVersion24;
        probe.pSetData(payload.data(), static_cast<unsigned int>(payload.size()));
    }
    QelMessageGeneric result(probe);
    const auto status = static_cast<QelMessageStatusCodes>(golden.number<unsigned short>("header.mStatus"));
    if (status != QelMessageStatusNoError) {
        const bool hasDetail = golden.has("header.mStatusDetail");
        result.setStatus(status, hasDetail ? golden.number<unsigned short>("header.mStatusDetail") : 0);
    }
    return result;
}

TEST_P(GoldenFrames, AreBuiltFromTheirValues)
{
    // The next new caller id is the golden one.
    const CallerIdScope nextId(callerId(mGolden) - 1);
    const std::unique_ptr<QelMessage> built = mClass.build(mGolden);
    const QelMessageGeneric message = inTheFormOf(mGolden, *built);

    if (mGolden.isBuilt()) {
        EXPECT_EQ(frameOf(message), hex(mGolden.bytes()));
    } else {
        EXPECT_NE(frameOf(message), hex(mGolden.bytes())) << "the file says that builders never make this frame";
    }
}

// --- stories

TEST(GoldenFrameStory, EveryIdentityIsThatOfItsClass)
{
    for (const std::string& name : GoldenFrame::allNames()) {
        const GoldenFrame golden = GoldenFrame::load(name);
        EXPECT_EQ(classOf(golden).identity,
                  std::make_tuple(golden.function(), golden.operation(), golden.classification()))
            << name;
    }
}

TEST(GoldenFrameStory, EveryFrameParsesToAPlainMessageInTheOtherRegistry)
{
    const QelMessageRegistry publicRegistry;
    for (const std::string& name : GoldenFrame::allNames()) {
        const GoldenFrame golden = GoldenFrame::load(name);
        const bool isInternal = classOf(golden).home == Home::Internal;
        const QelMessageRegistry& other = isInternal ? publicRegistry : QelInternalMessageRegistry::getInstance();
        const std::unique_ptr<QelMessage> message = parse(other, golden);

        const QelMessage& received = *message;
        EXPECT_STREQ(typeid(received).name(), typeid(QelMessage).name()) << name;
        EXPECT_EQ(frameOf(received), hex(golden.bytes())) << name;
    }
}

TEST(GoldenFrameStory, ABroadcastIsRelayedWithTheIdentityOfItsSender)
{
    const GoldenFrame request = GoldenFrame::load("QelMessageDaxBroadcastReq");
    const GoldenFrame outbound = GoldenFrame::load("QelMessageDaxBroadcastOutboundAsync");
    const std::unique_ptr<QelMessage> received = parse(QelMessageRegistry(), request);

    const CallerIdScope nextId(callerId(outbound) - 1);
    const QelMessageDaxBroadcastOutboundAsync message(qelMessageCast<QelMessageDaxBroadcastReq>(*received),
                                                      text(outbound, "mSenderToolId"),
                                                      number<std::uint32_t>(outbound, "mSenderToolType"));

    EXPECT_EQ(frameOf(message), hex(outbound.bytes()));
}

TEST(GoldenFrameStory, AStatusIsReportedOnlyWhenAsked)
{
    const std::unique_ptr<QelMessage> message =
        parse(QelMessageRegistry(), GoldenFrame::load("QelMessageVirtualSerialOpenRsp-status"));

    EXPECT_THAT([&] { message->checkStatus(); },
                ThrowsMessage<QelMessageStatusException>(
                    StrEq("QEL message [CID: 0x1B2C3D4E, FN: 0x6002, OP: 0x0402, FL: 0x40, DL: 8, "
                          "ST: 0x00000013:1234] contains a bad status code")));
}

TEST(GoldenFrameStory, AnOldHeaderShowsNoStatusDetail)
{
    const std::unique_ptr<QelMessage> message =
        parse(QelMessageRegistry(), GoldenFrame::load("QelMessageVirtualSerialGetMaxSessionsRsp-old-header"));

    EXPECT_EQ(toString(message->getLogID()), "[CID: 0x5E6F8091, FN: 0x6002, OP: 0x0404, FL: 0x40, DL: 3, "
                                             "ST: 0x00008006]");
}

// --- the files

TEST(GoldenFrameFiles, EveryMessageClassHasOneOfItsOwnName)
{
    std::vector<std::string> plainCases;
    for (const std::string& name : GoldenFrame::allNames()) {
        if (name.find('-') == std::string::npos) plainCases.push_back(name);
    }
    std::vector<std::string> classes;
    for (const MessageClass& known : messageClasses()) {
        classes.push_back(known.name);
    }

    EXPECT_EQ(classes.size(), 36U);
    EXPECT_THAT(plainCases, UnorderedElementsAreArray(classes));
}

TEST(GoldenFrameFiles, AreExactlyThoseOfTheList)
{
    std::vector<std::string> files;
    for (const auto& entry : std::filesystem::directory_iterator(QEL_SOURCE_DIR "/vectors")) {
        if (entry.path().filename() != "README.md") files.push_back(entry.path().filename().string());
    }
    std::vector<std::string> expected;
    for (const std::string& name : GoldenFrame::allNames()) {
        expected.push_back(name + ".txt");
    }

    EXPECT_THAT(files, UnorderedElementsAreArray(expected));
}

TEST(GoldenFrameFiles, HaveDistinctCallerIds)
{
    std::set<unsigned int> ids;
    for (const std::string& name : GoldenFrame::allNames()) {
        EXPECT_TRUE(ids.insert(callerId(GoldenFrame::load(name))).second) << name;
    }
}

TEST(GoldenFrameFiles, HaveDistinctNames)
{
    std::set<std::string> names;
    for (const std::string& name : GoldenFrame::allNames()) {
        EXPECT_TRUE(names.insert(GoldenFrame::load(name).name()).second) << name;
    }
}

} // namespace
} // namespace qel::test
