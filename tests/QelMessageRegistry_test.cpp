#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "support/Bytes.hpp"
#include "support/CapturedLog.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"
#include "support/RegistryFrames.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <set>
#include <string>
#include <thread>
#include <tuple>
#include <type_traits>
#include <typeinfo>
#include <vector>

namespace qel {
namespace {

using test::bytes;
using test::CapturedLog;
using test::classOf;
using test::deserialize;
using test::frameOf;
using test::frameOfIdentity;
using test::heapCopy;
using test::hex;
using test::RawFrame;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::StrEq;
using testing::ThrowsMessage;

using Classification = QelMessageClassification;
using Identifier = QelMessageRegistry::Identifier;

// --- which class each identity becomes

struct ClassRow {
    const char* name;
    unsigned short function;
    unsigned short operation;
    Classification::Value classification;
    unsigned int payload; // bytes of zeros that its class accepts
    const std::type_info* type;
    Identifier identity; // as the class returns it
};

template <typename T>
ClassRow row(const char* name, unsigned short function, unsigned short operation, Classification::Value classification,
             unsigned int payload)
{
    return {name, function, operation, classification, payload, &typeid(T), T::getMessageID()};
}

#define QEL_ROW(name, ...) row<name>(#name, __VA_ARGS__)

std::vector<ClassRow> registeredClasses()
{
    const auto request = Classification::Request;
    const auto response = Classification::Response;
    const auto async = Classification::Async;
    return {
        QEL_ROW(QelMessageGetEnclTypeAndInterfaceVersionReq, 0x6003, 0x0101, request, 48),
        QEL_ROW(QelMessageGetEnclTypeAndInterfaceVersionRsp, 0x6003, 0x0101, response, 48),
        QEL_ROW(QelMessageInterfaceCmpOpenKrogSessionReq, 0x6003, 0x0102, request, 0),
        QEL_ROW(QelMessageInterfaceCmpOpenKrogSessionRsp, 0x6003, 0x0102, response, 0),
        QEL_ROW(QelMessageInterfaceCmpCloseKrogSessionReq, 0x6003, 0x0103, request, 0),
        QEL_ROW(QelMessageInterfaceCmpCloseKrogSessionRsp, 0x6003, 0x0103, response, 0),
        QEL_ROW(QelMessageExchIntCapabilitiesReq, 0x6003, 0x0104, request, 4),
        QEL_ROW(QelMessageExchIntCapabilitiesRsp, 0x6003, 0x0104, response, 4),
        QEL_ROW(QelMessageGetInterfaceLimitsReq, 0x6003, 0x0105, request, 0),
        QEL_ROW(QelMessageDaxBroadcastReq, 0x6003, 0x0106, request, 46),
        QEL_ROW(QelMessageDaxBroadcastRsp, 0x6003, 0x0106, response, 0),
        QEL_ROW(QelMessageGetQelTodReq, 0x6003, 0x0107, request, 0),
        QEL_ROW(QelMessageSetGlobalModeAttributeReq, 0x6003, 0x0108, request, 4),
        QEL_ROW(QelMessageGetGlobalModeAttributeReq, 0x6003, 0x0109, request, 0),
        QEL_ROW(QelMessageGetGlobalModeAttributeRsp, 0x6003, 0x0109, response, 4),
        QEL_ROW(QelMessageSetGlobalSaveAreaMetadataReq, 0x6003, 0x010A, request, 2),
        QEL_ROW(QelMessageSetGlobalSaveAreaMetadataRsp, 0x6003, 0x010A, response, 0),
        QEL_ROW(QelMessageGetGlobalSaveAreaMetadataReq, 0x6003, 0x010B, request, 0),
        QEL_ROW(QelMessageGetGlobalSaveAreaMetadataRsp, 0x6003, 0x010B, response, 2),
        QEL_ROW(QelMessageVirtualSerialOpenReq, 0x6002, 0x0402, request, 8),
        QEL_ROW(QelMessageVirtualSerialOpenRsp, 0x6002, 0x0402, response, 8),
        QEL_ROW(QelMessageVirtualSerialCloseReq, 0x6002, 0x0403, request, 5),
        QEL_ROW(QelMessageVirtualSerialCloseRsp, 0x6002, 0x0403, response, 0),
        QEL_ROW(QelMessageVirtualSerialGetMaxSessionsReq, 0x6002, 0x0404, request, 0),
        QEL_ROW(QelMessageVirtualSerialGetMaxSessionsRsp, 0x6002, 0x0404, response, 3),
        QEL_ROW(QelMessageVirtualSerialDataToOsAsync, 0x6002, 0x0405, async, 6),
        QEL_ROW(QelMessageVirtualSerialSetupSessionReq, 0x6002, 0x0406, request, 4),
        QEL_ROW(QelMessageVirtualSerialSetupSessionRsp, 0x6002, 0x0406, response, 0),
        QEL_ROW(QelMessageVirtualSerialDataToDaxAsync, 0x7000, 0x0401, async, 6),
        QEL_ROW(QelMessageVirtualSerialSessionClosedAsync, 0x7000, 0xA005, async, 8),
        QEL_ROW(QelMessageKrogConnectionClosedAsync, 0x7000, 0xA009, async, 0),
        QEL_ROW(QelMessageDaxBroadcastOutboundAsync, 0x7000, 0x0B0B, async, 42),
    };
}

/// The classes that are not in the public registry.
std::vector<ClassRow> otherClasses()
{
    return {
        QEL_ROW(QelMessageGetInterfaceLimitsRsp, 0x6003, 0x0105, Classification::Response, 16),
        QEL_ROW(QelMessageGetQelTodRsp, 0x6003, 0x0107, Classification::Response, 8),
        QEL_ROW(QelMessageUpgradeConnectionAsync, 0x6001, 0x0001, Classification::Async, 0),
        QEL_ROW(QelMessageAbortHandshakeAsync, 0x6001, 0x0002, Classification::Async, 0),
    };
}

#undef QEL_ROW

/// A frame that the class of the row accepts: the payload is zero except for the offset of a broadcast.
std::vector<char> acceptedFrame(const ClassRow& row)
{
    std::vector<char> payload(row.payload, '\0');
    if (row.payload > 8 && row.payload != 48) payload[1] = static_cast<char>(row.payload);
    return frameOfIdentity(row.identity).payload(payload).bytes();
}

std::string rowName(const testing::TestParamInfo<ClassRow>& parameter) { return parameter.param.name; }

class RegisteredClass : public testing::TestWithParam<ClassRow> {};

TEST_P(RegisteredClass, HasItsIdentity)
{
    EXPECT_EQ(GetParam().identity, Identifier(GetParam().function, GetParam().operation, GetParam().classification));
}

TEST_P(RegisteredClass, IsParsedFromItsFrames)
{
    const QelMessageRegistry registry;
    const std::vector<char> frame = acceptedFrame(GetParam());
    CapturedLog log;
    const std::unique_ptr<QelMessage> message = deserialize(registry, frame);
    EXPECT_EQ(classOf(*message), *GetParam().type);
    EXPECT_EQ(frameOf(*message), hex(frame));
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_P(RegisteredClass, KeepsItsClassWhenCloned)
{
    const QelMessageRegistry registry;
    const std::unique_ptr<QelMessage> message = deserialize(registry, acceptedFrame(GetParam()));
    const std::unique_ptr<QelMessage> copy = message->clone();
    EXPECT_EQ(classOf(*copy), *GetParam().type);
    EXPECT_EQ(frameOf(*copy), frameOf(*message));
}

TEST_P(RegisteredClass, IsNotParsedWithBothFlags)
{
    const QelMessageRegistry registry;
    const std::unique_ptr<QelMessage> message =
        deserialize(registry, frameOfIdentity(GetParam().identity).flags(0xC0).bytes());
    EXPECT_EQ(classOf(*message), typeid(QelMessage));
}

INSTANTIATE_TEST_SUITE_P(, RegisteredClass, testing::ValuesIn(registeredClasses()), rowName);

class OtherClass : public testing::TestWithParam<ClassRow> {};

TEST_P(OtherClass, HasItsIdentity)
{
    EXPECT_EQ(GetParam().identity, Identifier(GetParam().function, GetParam().operation, GetParam().classification));
}

TEST_P(OtherClass, IsPlainInThePublicRegistry)
{
    const QelMessageRegistry registry;
    const std::vector<char> frame = acceptedFrame(GetParam());
    CapturedLog log;
    const std::unique_ptr<QelMessage> message = deserialize(registry, frame);
    EXPECT_EQ(classOf(*message), typeid(QelMessage));
    EXPECT_EQ(frameOf(*message), hex(frame));
    EXPECT_THAT(log.lines(), IsEmpty());
}

INSTANTIATE_TEST_SUITE_P(, OtherClass, testing::ValuesIn(otherClasses()), rowName);

TEST(QelMessageRegistry, HasExactly32Identities)
{
    std::set<Identifier> known;
    for (const ClassRow& row : registeredClasses())
        known.insert(row.identity);
    EXPECT_EQ(known.size(), 32U);

    const QelMessageRegistry registry;
    for (const unsigned int function : {0x0000U, 0x6001U, 0x6002U, 0x6003U, 0x6004U, 0x7000U, 0x8000U, 0x800AU}) {
        std::set<unsigned int> operations = {0x0000, 0xFFFF, 0xA004, 0xA005, 0xA006, 0xA008,
                                             0xA009, 0xA00A, 0x0B0A, 0x0B0B, 0x0B0C};
        for (unsigned int low = 0; low <= 0x20; ++low) {
            operations.insert({low, 0x0100 + low, 0x0400 + low});
        }
        for (const unsigned int operation : operations) {
            for (const Classification::Value value :
                 {Classification::Request, Classification::Response, Classification::Async}) {
                const Identifier identity(static_cast<unsigned short>(function), static_cast<unsigned short>(operation),
                                          value);
                if (known.count(identity) != 0) continue;
                const std::unique_ptr<QelMessage> message =
                    deserialize(registry, frameOfIdentity(identity).payload(std::vector<char>(64, '\0')).bytes());
                EXPECT_EQ(classOf(*message), typeid(QelMessage)) << function << ' ' << operation << ' ' << value;
            }
        }
    }
}

// --- the overlay

TEST(QelMessageRegistryFastHeader, Has22BytesAndAlignment1)
{
    EXPECT_EQ(sizeof(QelMessageRegistry::FastHeader), 22U);
    EXPECT_EQ(alignof(QelMessageRegistry::FastHeader), 1U);
}

TEST(QelMessageRegistryFastHeader, ReadsOnlyTheIdentityAtAnyAddress)
{
    const std::vector<char> header =
        bytes({0x11, 0x22, 0x33, 0x44, 0x55, 0x66, 0x77, 0x88, 0x99, 0xAA, 0xBB, 0xCC, // ignored
               0x60, 0x03, 0x81,                                                       // function, flags
               0xFF, 0xFF, 0xFF, 0xFF, 0xFF,                                           // ignored
               0x01, 0x0B});
    for (std::size_t offset = 0; offset < 4; ++offset) {
        SCOPED_TRACE(offset);
        std::vector<char> shifted(offset, '\0');
        shifted.insert(shifted.end(), header.begin(), header.end());
        const std::unique_ptr<char[]> buffer = heapCopy(shifted);
        const auto& overlay = *reinterpret_cast<const QelMessageRegistry::FastHeader*>(buffer.get() + offset);
        EXPECT_EQ(overlay.getIdentifier(), Identifier(0x6003, 0x010B, Classification::Request));
        EXPECT_EQ(toString(overlay), "[FN=0x6003 OP=0x010B FL=0x81]");
    }
}

TEST(QelMessageRegistryFastHeader, ClassifiesByTheFlags)
{
    QelMessageRegistry::FastHeader header{};
    const std::pair<unsigned char, Classification::Value> rows[] = {
        {0x00, Classification::Async},   {0x3F, Classification::Async},   {0x40, Classification::Response},
        {0x80, Classification::Request}, {0xBF, Classification::Request}, {0xC0, Classification::Unknown}};
    for (const auto& [flags, classification] : rows) {
        SCOPED_TRACE(static_cast<unsigned int>(flags));
        header.mFlags = flags;
        EXPECT_EQ(std::get<2>(header.getIdentifier()), classification);
    }
}

TEST(QelMessageRegistry, ReadsFramesAtAnyAddress)
{
    const QelMessageRegistry registry;
    const std::vector<char> frame = acceptedFrame(registeredClasses().front());
    for (std::size_t offset = 0; offset < 4; ++offset) {
        SCOPED_TRACE(offset);
        std::vector<char> shifted(offset, '\0');
        shifted.insert(shifted.end(), frame.begin(), frame.end());
        const std::unique_ptr<char[]> buffer = heapCopy(shifted);
        const std::unique_ptr<QelMessage> message =
            registry.deserialize(buffer.get() + offset, static_cast<unsigned int>(frame.size()));
        EXPECT_EQ(classOf(*message), typeid(QelMessageGetEnclTypeAndInterfaceVersionReq));
    }
}

// --- deserialising, step by step

TEST(QelMessageRegistry, RefusesABufferBelow22Bytes)
{
    // The length is checked before the look-up: this factory would be called for a buffer of zeros.
    unsigned int calls = 0;
    const QelMessageRegistry registry({{Identifier(0, 0, Classification::Async), [&calls](const char*, unsigned int) {
                                            ++calls;
                                            return std::make_unique<QelMessage>();
                                        }}});
    for (unsigned int length = 0; length <= 21; ++length) {
        SCOPED_TRACE(length);
        CapturedLog log;
        EXPECT_THAT([&] { deserialize(registry, std::vector<char>(length, '\0')); },
                    ThrowsMessage<QelMessageValidationException>(StrEq("length")));
        EXPECT_THAT(log.lines(), ElementsAre("E: Encountered message with invalid length"));
    }
    EXPECT_EQ(calls, 0U);

    EXPECT_NE(deserialize(registry, std::vector<char>(22, '\0')), nullptr);
    EXPECT_EQ(calls, 1U);
}

TEST(QelMessageRegistry, RefusesANullBuffer)
{
    const QelMessageRegistry registry;
    EXPECT_THAT([&] { registry.deserialize(nullptr, 22); },
                ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer")));
    EXPECT_THAT([&] { registry.deserialize(nullptr, 16384); },
                ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer")));
    EXPECT_THAT([&] { registry.deserialize(nullptr, 21); },
                ThrowsMessage<QelMessageValidationException>(StrEq("length")));
}

TEST(QelMessageRegistry, LogsBothAttemptsForAShortFrameOfAKnownIdentity)
{
    const QelMessageRegistry registry;
    std::vector<char> frame = RawFrame::newForm().function(0x6003).operation(0x0102).flags(0x80).bytes();
    frame.resize(22);
    CapturedLog log;
    EXPECT_THAT([&] { deserialize(registry, frame); },
                ThrowsMessage<QelMessageValidationException>(StrEq("i_length shorter than old header")));
    EXPECT_THAT(log.lines(),
                ElementsAre("E: bad length = 0x00000016",
                            "D: Failed to deserialize message [FN=0x6003 OP=0x0102 FL=0x80]: i_length shorter than old "
                            "header",
                            "E: bad length = 0x00000016",
                            "E: Default message deserialization failed [FN=0x6003 OP=0x0102 FL=0x80]: i_length "
                            "shorter than old header"));
}

TEST(QelMessageRegistry, WritesNoDebugLineUnlessThatLevelIsEnabled)
{
    const QelMessageRegistry registry;
    CapturedLog log(LogLevel::Warn);
    const std::unique_ptr<QelMessage> message =
        deserialize(registry, RawFrame::newForm().function(0x6002).operation(0x0402).flags(0x80).bytes());
    EXPECT_EQ(classOf(*message), typeid(QelMessage));
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(QelMessageRegistry, ReturnsAPlainMessageWhenTheClassRefusesTheFrame)
{
    const QelMessageRegistry registry;
    const std::vector<char> frame =
        RawFrame::newForm().callerId(8).function(0x6002).operation(0x0402).flags(0x81).payload(bytes({1, 2})).bytes();
    CapturedLog log;
    const std::unique_ptr<QelMessage> message = deserialize(registry, frame);
    EXPECT_EQ(classOf(*message), typeid(QelMessage));
    EXPECT_EQ(frameOf(*message), hex(frame));
    EXPECT_THAT(log.lines(), ElementsAre("D: Failed to deserialize message [FN=0x6002 OP=0x0402 FL=0x81]: dataLength "
                                         "shorter than actual data size"));
}

TEST(QelMessageRegistry, ReturnsAPlainMessageForAnUnknownIdentityAndLogsNothing)
{
    const QelMessageRegistry registry;
    const std::vector<char> frame =
        RawFrame::newForm().callerId(8).function(0x6004).operation(0x0001).payload(bytes({1, 2})).bytes();
    CapturedLog log;
    const std::unique_ptr<QelMessage> message = deserialize(registry, frame);
    EXPECT_EQ(classOf(*message), typeid(QelMessage));
    EXPECT_EQ(frameOf(*message), hex(frame));
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(QelMessageRegistry, ReturnsAPlainMessageForATimeOfDayResponse)
{
    const QelMessageRegistry registry;
    const std::vector<char> frame = RawFrame::newForm()
                                        .function(0x6003)
                                        .operation(0x0107)
                                        .flags(0x40)
                                        .payload(bytes({0x20, 0x24, 0x03, 0x05, 0x06, 0x07, 0x08, 0x00}))
                                        .bytes();
    const std::unique_ptr<QelMessage> message = deserialize(registry, frame);
    EXPECT_EQ(classOf(*message), typeid(QelMessage));
    EXPECT_EQ(frameOf(*message), hex(frame));
}

TEST(QelMessageRegistry, RefusesAMalformedFrameOfAnUnknownIdentity)
{
    const QelMessageRegistry registry;
    CapturedLog log;
    EXPECT_THAT([&] { deserialize(registry, RawFrame::newForm().function(0x6004).version(0x10).bytes()); },
                ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer bad header version")));
    EXPECT_THAT(log.lines(),
                ElementsAre("E: bad header version = 0x10",
                            "E: Default message deserialization failed [FN=0x6004 OP=0x0000 FL=0x00]: i_buffer bad "
                            "header version"));
}

TEST(QelMessageRegistry, KeepsOnlyTheFrameOfALongerBuffer)
{
    const QelMessageRegistry registry;
    const std::vector<char> frame = acceptedFrame(registeredClasses().front());
    std::vector<char> longer = frame;
    longer.insert(longer.end(), 100, 'x');
    EXPECT_EQ(frameOf(*deserialize(registry, longer)), hex(frame));
}

TEST(QelMessageRegistry, DeserializesInManyThreadsAtOnce)
{
    const QelMessageRegistry registry;
    const std::vector<ClassRow> rows = registeredClasses();
    std::vector<unsigned int> right(4, 0);
    std::vector<std::thread> threads;
    for (unsigned int& count : right) {
        threads.emplace_back([&] {
            for (const ClassRow& row : rows) {
                if (classOf(*deserialize(registry, acceptedFrame(row))) == *row.type) ++count;
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_THAT(right, testing::Each(rows.size()));
}

// --- across the border of the library

TEST(QelMessageRegistry, ReturnsObjectsThatThisProgramRecognises)
{
    const QelMessageRegistry registry;
    const std::unique_ptr<QelMessage> request =
        deserialize(registry, frameOfIdentity(Identifier(0x6002, 0x0402, Classification::Request))
                                  .payload(bytes({0x00, 0x01, 0x00, 0x02, 0x80, 0x00, 0x00, 0x00}))
                                  .bytes());
    const auto* const open = dynamic_cast<const QelMessageVirtualSerialOpenReq*>(request.get());
    ASSERT_NE(open, nullptr);
    EXPECT_EQ(open->getLpId(), 1);
    EXPECT_EQ(open->getVssConnectionNumber(), 2);
    EXPECT_TRUE(open->isForceOpen());
    EXPECT_EQ(dynamic_cast<const QelMessageVirtualSerialOpenRsp*>(request.get()), nullptr);
}

TEST(QelMessageRegistry, LocalResponsesAreNotConstructibleFromBytes)
{
    static_assert(!std::is_constructible<QelMessageGetInterfaceLimitsRsp, const char*, unsigned int>::value, "");
    static_assert(!std::is_constructible<QelMessageGetQelTodRsp, const char*, unsigned int>::value, "");
}

} // namespace
} // namespace qel
