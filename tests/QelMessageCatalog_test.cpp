// What all message classes have in common: identity, the frames they refuse, copies, caller ids, and from what they can
// be constructed.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include "support/Allocations.hpp"
#include "support/Bytes.hpp"
#include "support/CallerIdScope.hpp"
#include "support/CapturedLog.hpp"
#include "support/CatalogFrames.hpp"

#include <algorithm>
#include <ctime>
#include <functional>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <memory>
#include <stdexcept>
#include <string>
#include <tuple>
#include <type_traits>
#include <typeinfo>
#include <vector>

namespace qel {
namespace {

using test::Allocations;
using test::CallerIdScope;
using test::CapturedLog;
using test::hex;
using test::OddBytes;
using test::Payload;
using test::RawFrame;
using testing::IsEmpty;
using testing::StrEq;
using testing::ThrowsMessage;

const std::type_info& typeOf(const QelMessage& message) { return typeid(message); }

// --- the table of the classes ----------------------------------------------------------------------------------------

struct MessageClass {
    std::string name;
    std::tuple<unsigned short, unsigned short, QelMessageClassification::Value> id; // as the class returns it
    unsigned int function;
    unsigned int operation;
    unsigned int flags;
    Payload payload; // the shortest one that the class accepts
    std::function<std::unique_ptr<QelMessage>(const char*, unsigned int)> receive;
    const std::type_info* type;
};

template <typename T>
MessageClass messageClass(const char* name, unsigned int function, unsigned int operation, unsigned int flags,
                          const Payload& shortest = Payload())
{
    return {name,
            T::getMessageID(),
            function,
            operation,
            flags,
            shortest,
            [](const char* buffer, unsigned int length) { return std::make_unique<T>(buffer, length); },
            &typeid(T)};
}

constexpr unsigned int kRequest = 0x80;
constexpr unsigned int kResponse = 0x40;
constexpr unsigned int kAsync = 0x00;

#define MESSAGE_CLASS(name, ...) messageClass<QelMessage##name>(#name, __VA_ARGS__)

/// All classes that can be constructed from bytes.
const std::vector<MessageClass>& receivedClasses()
{
    static const std::vector<MessageClass> kClasses = {
        MESSAGE_CLASS(UpgradeConnectionAsync, 0x6001, 0x0001, kAsync),
        MESSAGE_CLASS(AbortHandshakeAsync, 0x6001, 0x0002, kAsync),
        MESSAGE_CLASS(GetEnclTypeAndInterfaceVersionReq, 0x6003, 0x0101, kRequest, Payload().zeros(16)),
        MESSAGE_CLASS(GetEnclTypeAndInterfaceVersionRsp, 0x6003, 0x0101, kResponse, Payload().zeros(32)),
        MESSAGE_CLASS(InterfaceCmpOpenKrogSessionReq, 0x6003, 0x0102, kRequest),
        MESSAGE_CLASS(InterfaceCmpOpenKrogSessionRsp, 0x6003, 0x0102, kResponse),
        MESSAGE_CLASS(InterfaceCmpCloseKrogSessionReq, 0x6003, 0x0103, kRequest),
        MESSAGE_CLASS(InterfaceCmpCloseKrogSessionRsp, 0x6003, 0x0103, kResponse),
        MESSAGE_CLASS(ExchIntCapabilitiesReq, 0x6003, 0x0104, kRequest, Payload().zeros(4)),
        MESSAGE_CLASS(ExchIntCapabilitiesRsp, 0x6003, 0x0104, kResponse, Payload().zeros(4)),
        MESSAGE_CLASS(GetInterfaceLimitsReq, 0x6003, 0x0105, kRequest),
        MESSAGE_CLASS(DaxBroadcastReq, 0x6003, 0x0106, kRequest, Payload().u16(46).zeros(44)),
        MESSAGE_CLASS(DaxBroadcastRsp, 0x6003, 0x0106, kResponse),
        MESSAGE_CLASS(GetQelTodReq, 0x6003, 0x0107, kRequest),
        MESSAGE_CLASS(SetGlobalModeAttributeReq, 0x6003, 0x0108, kRequest, Payload().zeros(4)),
        MESSAGE_CLASS(GetGlobalModeAttributeReq, 0x6003, 0x0109, kRequest),
        MESSAGE_CLASS(GetGlobalModeAttributeRsp, 0x6003, 0x0109, kResponse, Payload().zeros(4)),
        MESSAGE_CLASS(SetGlobalSaveAreaMetadataReq, 0x6003, 0x010A, kRequest, Payload().zeros(2)),
        MESSAGE_CLASS(SetGlobalSaveAreaMetadataRsp, 0x6003, 0x010A, kResponse),
        MESSAGE_CLASS(GetGlobalSaveAreaMetadataReq, 0x6003, 0x010B, kRequest),
        MESSAGE_CLASS(GetGlobalSaveAreaMetadataRsp, 0x6003, 0x010B, kResponse, Payload().zeros(2)),
        MESSAGE_CLASS(VirtualSerialOpenReq, 0x6002, 0x0402, kRequest, Payload().zeros(8)),
        MESSAGE_CLASS(VirtualSerialOpenRsp, 0x6002, 0x0402, kResponse, Payload().zeros(8)),
        MESSAGE_CLASS(VirtualSerialCloseReq, 0x6002, 0x0403, kRequest, Payload().zeros(5)),
        MESSAGE_CLASS(VirtualSerialCloseRsp, 0x6002, 0x0403, kResponse),
        MESSAGE_CLASS(VirtualSerialGetMaxSessionsReq, 0x6002, 0x0404, kRequest),
        MESSAGE_CLASS(VirtualSerialGetMaxSessionsRsp, 0x6002, 0x0404, kResponse, Payload().zeros(3)),
        MESSAGE_CLASS(VirtualSerialDataToOsAsync, 0x6002, 0x0405, kAsync, Payload().zeros(6)),
        MESSAGE_CLASS(VirtualSerialSetupSessionReq, 0x6002, 0x0406, kRequest, Payload().zeros(4)),
        MESSAGE_CLASS(VirtualSerialSetupSessionRsp, 0x6002, 0x0406, kResponse),
        MESSAGE_CLASS(VirtualSerialDataToDaxAsync, 0x7000, 0x0401, kAsync, Payload().zeros(6)),
        MESSAGE_CLASS(VirtualSerialSessionClosedAsync, 0x7000, 0xA005, kAsync, Payload().zeros(8)),
        MESSAGE_CLASS(KrogConnectionClosedAsync, 0x7000, 0xA009, kAsync),
        MESSAGE_CLASS(DaxBroadcastOutboundAsync, 0x7000, 0x0B0B, kAsync, Payload().u16(42).zeros(40)),
    };
    return kClasses;
}

class ReceivedClass : public testing::TestWithParam<MessageClass> {
protected:
    /// A frame of the class with its shortest payload.
    static RawFrame frame(RawFrame form = RawFrame::newForm())
    {
        return form.callerId(0x01020304)
            .function(GetParam().function)
            .operation(GetParam().operation)
            .flags(GetParam().flags)
            .payload(GetParam().payload.bytes());
    }

    static std::unique_ptr<QelMessage> receive(const RawFrame& raw)
    {
        const OddBytes bytes(raw.bytes());
        return GetParam().receive(bytes.data(), bytes.length());
    }

    static std::string refusal(const RawFrame& raw)
    {
        try {
            receive(raw);
        } catch (const QelMessageValidationException& exception) {
            return exception.what();
        }
        return "accepted";
    }
};

INSTANTIATE_TEST_SUITE_P(Catalog, ReceivedClass, testing::ValuesIn(receivedClasses()),
                         [](const testing::TestParamInfo<MessageClass>& row) { return row.param.name; });

TEST_P(ReceivedClass, HasTheIdentityOfItsMessage)
{
    EXPECT_EQ(std::get<0>(GetParam().id), GetParam().function);
    EXPECT_EQ(std::get<1>(GetParam().id), GetParam().operation);
    EXPECT_EQ(std::get<2>(GetParam().id),
              QelMessageClassification::fromFlags(static_cast<QelMessageFlags>(GetParam().flags)));
}

TEST_P(ReceivedClass, KeepsTheWholeFrameInEitherForm)
{
    for (const RawFrame& form : {RawFrame::newForm(), RawFrame::oldForm()}) {
        const std::vector<char> bytes = frame(form).status(0x0013).bytes();
        SCOPED_TRACE(hex(bytes));
        const std::unique_ptr<QelMessage> message = receive(frame(form).status(0x0013));
        EXPECT_EQ(typeOf(*message), *GetParam().type);
        EXPECT_EQ(hex(message->serialize(), message->msgLength()), hex(bytes));
        EXPECT_EQ(message->getCallerId(), 0x01020304U);
        EXPECT_EQ(message->getStatus(), QelMessageStatusConnectionNotAvailable);
    }
}

TEST_P(ReceivedClass, AcceptsALongerPayload)
{
    std::vector<char> longer = GetParam().payload.bytes();
    longer.insert(longer.end(), 5, '\xEE');
    EXPECT_EQ(refusal(frame().payload(longer)), "accepted");
}

TEST_P(ReceivedClass, IgnoresBytesAfterTheFrame)
{
    std::vector<char> bytes = frame().bytes();
    const std::string whole = hex(bytes);
    bytes.insert(bytes.end(), 3, '\xEE');
    const OddBytes received(bytes);
    const std::unique_ptr<QelMessage> message = GetParam().receive(received.data(), received.length());
    EXPECT_EQ(hex(message->serialize(), message->msgLength()), whole);
}

TEST_P(ReceivedClass, RefusesAShorterPayload)
{
    const std::size_t shortest = GetParam().payload.bytes().size();
    for (std::size_t length = 0; length < shortest; ++length) {
        SCOPED_TRACE(length);
        EXPECT_EQ(refusal(frame().payload(Payload(GetParam().payload).resize(length).bytes())),
                  GetParam().name.rfind("VirtualSerial", 0) == 0 ? "dataLength shorter than actual data size"
                                                                 : "dataLength smaller than minimum acceptable size");
    }
}

TEST_P(ReceivedClass, RefusesAnotherIdentity)
{
    EXPECT_EQ(refusal(frame().function(GetParam().function ^ 1U)), "bad operation");
    EXPECT_EQ(refusal(frame().operation(GetParam().operation ^ 1U)), "bad operation");
    for (const unsigned int flags : {kRequest, kResponse, kAsync, kRequest | kResponse}) {
        SCOPED_TRACE(flags);
        EXPECT_EQ(refusal(frame().flags(flags)), flags == GetParam().flags ? "accepted" : "bad operation");
    }
}

TEST_P(ReceivedClass, IgnoresMeaninglessFlagBits)
{
    EXPECT_EQ(refusal(frame().flags(GetParam().flags | 0x3FU)), "accepted");
}

TEST_P(ReceivedClass, ChecksTheFrameFirst)
{
    EXPECT_EQ(refusal(frame().function(0x1234).payload({}).eyecatcher(0xDE, 0xCA, 0xFE)), "i_buffer bad eyecatcher");
    EXPECT_EQ(refusal(frame().function(0x1234).payload({}).msgLength(33)),
              "i_length shorter than total message length");
}

TEST_P(ReceivedClass, ChecksTheIdentityBeforeThePayload)
{
    EXPECT_EQ(refusal(frame().function(0x1234).payload({})), "bad operation");
}

TEST_P(ReceivedClass, LogsNothingWhenItRefusesIdentityOrPayload)
{
    const CapturedLog log;
    EXPECT_EQ(refusal(frame().function(0x1234)), "bad operation");
    if (!GetParam().payload.bytes().empty()) {
        EXPECT_NE(refusal(frame().payload({'x'})), "accepted");
    }
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST_P(ReceivedClass, RefusesANullBuffer)
{
    EXPECT_THAT([] { GetParam().receive(nullptr, 100); },
                ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer")));
}

TEST_P(ReceivedClass, ClonesToItsOwnClass)
{
    const std::unique_ptr<QelMessage> message = receive(frame());
    const std::unique_ptr<QelMessage> clone = message->clone();
    EXPECT_EQ(typeOf(*clone), *GetParam().type);
    EXPECT_NE(clone->serialize(), message->serialize());
    EXPECT_EQ(hex(clone->serialize(), clone->msgLength()), hex(message->serialize(), message->msgLength()));
    EXPECT_EQ(typeOf(*clone->clone()), *GetParam().type);
}

TEST_P(ReceivedClass, DrawsNoCallerIdToParseAndToCopy)
{
    const CallerIdScope ids(100);
    receive(frame())->clone();
    EXPECT_EQ(ids.last(), 100U);
}

TEST(CatalogTable, NamesEveryClassOnce)
{
    EXPECT_EQ(receivedClasses().size(), 34U);
    std::vector<std::string> names;
    for (const MessageClass& row : receivedClasses())
        names.push_back(row.name);
    std::sort(names.begin(), names.end());
    EXPECT_EQ(std::unique(names.begin(), names.end()), names.end());
}

TEST(CatalogTable, LocalResponsesHaveTheirIdentity)
{
    EXPECT_EQ(QelMessageGetInterfaceLimitsRsp::getMessageID(),
              std::make_tuple(0x6003, 0x0105, QelMessageClassification::Response));
    EXPECT_EQ(QelMessageGetQelTodRsp::getMessageID(),
              std::make_tuple(0x6003, 0x0107, QelMessageClassification::Response));
}

TEST(CatalogTable, LocalResponsesCloneToTheirOwnClass)
{
    const QelMessageGetInterfaceLimitsRsp limits;
    EXPECT_EQ(typeOf(*limits.clone()), typeid(QelMessageGetInterfaceLimitsRsp));
    const QelMessageGetQelTodRsp timeOfDay(0, std::time_t{0});
    EXPECT_EQ(typeOf(*timeOfDay.clone()), typeid(QelMessageGetQelTodRsp));
}

// --- messages without a payload --------------------------------------------------------------------------------------

template <typename T>
class BareMessage : public testing::Test {};

using BareMessages = testing::Types<
    QelMessageInterfaceCmpOpenKrogSessionReq, QelMessageInterfaceCmpOpenKrogSessionRsp,
    QelMessageInterfaceCmpCloseKrogSessionReq, QelMessageInterfaceCmpCloseKrogSessionRsp,
    QelMessageGetInterfaceLimitsReq, QelMessageDaxBroadcastRsp, QelMessageGetQelTodReq,
    QelMessageGetGlobalModeAttributeReq, QelMessageSetGlobalSaveAreaMetadataRsp, QelMessageGetGlobalSaveAreaMetadataReq,
    QelMessageVirtualSerialCloseRsp, QelMessageVirtualSerialGetMaxSessionsReq, QelMessageVirtualSerialSetupSessionRsp,
    QelMessageKrogConnectionClosedAsync, QelMessageUpgradeConnectionAsync, QelMessageAbortHandshakeAsync>;
TYPED_TEST_SUITE(BareMessage, BareMessages, test::ClassNames);

TYPED_TEST(BareMessage, IsBuiltAsAHeaderWithANewCallerId)
{
    const CallerIdScope ids(0x01020303);
    const TypeParam message;
    EXPECT_EQ(hex(message.serialize(), message.msgLength()),
              hex(test::newFrame<TypeParam>(Payload()).callerId(0x01020304).bytes()));
    EXPECT_EQ(message.getData(), nullptr);
    EXPECT_EQ(ids.last(), 0x01020304U);
}

TYPED_TEST(BareMessage, CarriesTheCallerIdOfARequest)
{
    const CallerIdScope ids(100);
    const TypeParam message(0xAABBCCDD);
    EXPECT_EQ(hex(message.serialize(), message.msgLength()),
              hex(test::newFrame<TypeParam>(Payload()).callerId(0xAABBCCDD).bytes()));
    EXPECT_EQ(ids.last(), 100U);
}

TYPED_TEST(BareMessage, PrintsNoPayloadFields)
{
    EXPECT_EQ(test::detailsOf(TypeParam()), "    <no additional details>");
    EXPECT_EQ(test::detailsOf(test::received<TypeParam>(Payload().text("payload"))), "    <no additional details>");
}

TYPED_TEST(BareMessage, IsConstructibleFromACallerIdAndFromBytesOnly)
{
    static_assert(std::is_default_constructible<TypeParam>::value, "");
    static_assert(std::is_constructible<TypeParam, unsigned int>::value, "");
    static_assert(!std::is_convertible<unsigned int, TypeParam>::value, "a number must not convert to a message");
    static_assert(std::is_constructible<TypeParam, const char*, unsigned int>::value, "");
    static_assert(!std::is_constructible<TypeParam, const QelMessage&>::value, "a message of any type is not one");
    static_assert(!std::is_constructible<TypeParam, unsigned int, unsigned int>::value, "");
}

// --- what cannot be made ---------------------------------------------------------------------------------------------

template <typename T>
class PayloadMessage : public testing::Test {};

using PayloadMessages =
    testing::Types<QelMessageGetEnclTypeAndInterfaceVersionReq, QelMessageGetEnclTypeAndInterfaceVersionRsp,
                   QelMessageExchIntCapabilitiesReq, QelMessageExchIntCapabilitiesRsp, QelMessageDaxBroadcastReq,
                   QelMessageSetGlobalModeAttributeReq, QelMessageGetGlobalModeAttributeRsp,
                   QelMessageSetGlobalSaveAreaMetadataReq, QelMessageGetGlobalSaveAreaMetadataRsp,
                   QelMessageVirtualSerialOpenReq, QelMessageVirtualSerialOpenRsp, QelMessageVirtualSerialCloseReq,
                   QelMessageVirtualSerialGetMaxSessionsRsp, QelMessageVirtualSerialDataToOsAsync,
                   QelMessageVirtualSerialDataToDaxAsync, QelMessageVirtualSerialSetupSessionReq,
                   QelMessageVirtualSerialSessionClosedAsync, QelMessageDaxBroadcastOutboundAsync>;
TYPED_TEST_SUITE(PayloadMessage, PayloadMessages, test::ClassNames);

TYPED_TEST(PayloadMessage, IsNotConstructibleWithoutItsPayload)
{
    static_assert(!std::is_default_constructible<TypeParam>::value, "its accessors need a payload");
    static_assert(!std::is_constructible<TypeParam, unsigned int>::value, "its accessors need a payload");
    static_assert(!std::is_constructible<TypeParam, const QelMessage&>::value, "a message of any type is not one");
    static_assert(std::is_constructible<TypeParam, const char*, unsigned int>::value, "");
    static_assert(std::is_copy_constructible<TypeParam>::value, "");
    static_assert(std::has_virtual_destructor<TypeParam>::value, "");
}

TEST(CatalogConstruction, LocalResponsesAreNotConstructibleFromBytes)
{
    static_assert(!std::is_constructible<QelMessageGetInterfaceLimitsRsp, const char*, unsigned int>::value, "");
    static_assert(!std::is_constructible<QelMessageGetInterfaceLimitsRsp, char*, unsigned int>::value, "");
    static_assert(!std::is_constructible<QelMessageGetQelTodRsp, const char*, unsigned int>::value, "");
    static_assert(!std::is_constructible<QelMessageGetQelTodRsp, char*, unsigned int>::value, "");
    static_assert(!std::is_default_constructible<QelMessageGetQelTodRsp>::value, "");
    static_assert(std::has_virtual_destructor<QelMessageGetInterfaceLimitsRsp>::value, "");
    static_assert(std::has_virtual_destructor<QelMessageGetQelTodRsp>::value, "");
}

TEST(CatalogConstruction, OneArgumentNeverConvertsImplicitly)
{
    static_assert(!std::is_convertible<unsigned int, QelMessageGetInterfaceLimitsRsp>::value, "");
    static_assert(!std::is_convertible<std::time_t, QelMessageGetQelTodRsp>::value, "");
    static_assert(!std::is_convertible<QelCapabilities, QelMessageExchIntCapabilitiesReq>::value, "");
    static_assert(!std::is_convertible<std::string, QelMessageSetGlobalSaveAreaMetadataReq>::value, "");
    static_assert(!std::is_convertible<std::string, QelMessageGetGlobalSaveAreaMetadataRsp>::value, "");
}

TEST(CatalogConstruction, SharedPayloadBasesAreNotConstructible)
{
    using Capabilities =
        QelMessageExchIntCapabilitiesBase<QelMessageExchIntCapabilitiesReq, QelMessageClassification::Request>;
    using Mode =
        QelMessageGlobalModeAttributeBase<QelMessageSetGlobalModeAttributeReq, QelMessageOpSetGlobalModeAttribute,
                                          QelMessageClassification::Request>;
    using Metadata =
        QelMessageGlobalSaveAreaMetadataBase<QelMessageSetGlobalSaveAreaMetadataReq,
                                             QelMessageOpSetGlobalSaveAreaMetadata, QelMessageClassification::Request>;
    using Serial =
        QelMessageVirtualSerialDataAsync<QelMessageVirtualSerialDataToOsAsync, QelMessageFunctionVirtualSerial,
                                         QelMessageOpSendVirtualSerialDataToOs>;
    static_assert(std::is_base_of<Capabilities, QelMessageExchIntCapabilitiesReq>::value, "");
    static_assert(std::is_base_of<Mode, QelMessageSetGlobalModeAttributeReq>::value, "");
    static_assert(std::is_base_of<Metadata, QelMessageSetGlobalSaveAreaMetadataReq>::value, "");
    static_assert(std::is_base_of<Serial, QelMessageVirtualSerialDataToOsAsync>::value, "");
    static_assert(!std::is_constructible<Capabilities, const char*, unsigned int>::value, "");
    static_assert(!std::is_constructible<Mode, const char*, unsigned int>::value, "");
    static_assert(!std::is_constructible<Metadata, const char*, unsigned int>::value, "");
    static_assert(!std::is_constructible<Serial, const char*, unsigned int>::value, "");
    static_assert(!std::is_copy_constructible<Capabilities>::value, "");
    static_assert(!std::is_copy_constructible<Mode>::value, "");
    static_assert(!std::is_copy_constructible<Metadata>::value, "");
    static_assert(!std::is_copy_constructible<Serial>::value, "");
}

// --- builders --------------------------------------------------------------------------------------------------------

struct Builder {
    std::string name;
    std::function<unsigned int()> callerIdOfNew; // builds one and returns its caller id
};

const std::string kText = "text";
const std::time_t kTime = 1709618828;

template <typename T, typename... Arguments>
Builder builder(const char* name, const Arguments&... arguments)
{
    return {name, [=] { return T(arguments...).getCallerId(); }};
}

/// The builders that draw a new caller id.
const std::vector<Builder>& buildersWithNewId()
{
    static const QelMessageDaxBroadcastReq kRequestToForward(0, 4, 0, kText, kText.data());
    static const std::vector<Builder> kBuilders = {
        builder<QelMessageGetEnclTypeAndInterfaceVersionReq>("VersionReq", 1U, 2U, std::uint16_t{3}, std::uint16_t{4},
                                                             kText),
        builder<QelMessageDaxBroadcastReq>("BroadcastReq", std::uint8_t{0}, std::uint16_t{4}, 1U, kText, kText.data()),
        builder<QelMessageGetInterfaceLimitsRsp>("LimitsRsp"),
        builder<QelMessageGetQelTodRsp>("TodRsp", kTime),
        builder<QelMessageSetGlobalModeAttributeReq>("SetModeReq", std::uint8_t{1}, kText),
        builder<QelMessageGetGlobalModeAttributeRsp>("GetModeRsp", std::uint8_t{1}, kText),
        builder<QelMessageSetGlobalSaveAreaMetadataReq>("SetMetadataReq", kText),
        builder<QelMessageGetGlobalSaveAreaMetadataRsp>("GetMetadataRsp", kText),
        builder<QelMessageExchIntCapabilitiesReq>("CapabilitiesReq", QelCapabilities()),
        builder<QelMessageExchIntCapabilitiesRsp>("CapabilitiesRsp", 4U, QelCapabilities()),
        builder<QelMessageVirtualSerialOpenReq>("OpenReq", std::uint16_t{1}, std::uint16_t{2}, true),
        builder<QelMessageVirtualSerialCloseReq>("CloseReq", std::uint16_t{1}, std::uint16_t{2}, true),
        builder<QelMessageVirtualSerialSetupSessionReq>("SetupReq", std::uint16_t{1}, std::uint16_t{2}),
        builder<QelMessageVirtualSerialSessionClosedAsync>(
            "SessionClosed", std::uint16_t{1}, std::uint16_t{2},
            QelMessageVirtualSerialSessionClosedAsync::CloseReasonForceClose),
        builder<QelMessageVirtualSerialDataToOsAsync>("DataToOs", std::uint16_t{1}, std::uint16_t{2}, std::uint16_t{4},
                                                      kText.data()),
        builder<QelMessageVirtualSerialDataToDaxAsync>("DataToDax", std::uint16_t{1}, std::uint16_t{2},
                                                       std::uint16_t{4}, kText.data()),
        builder<QelMessageDaxBroadcastOutboundAsync>("Outbound", std::uint16_t{4}, 1U, kText, kText.data()),
        builder<QelMessageDaxBroadcastOutboundAsync>("OutboundForwarded", kRequestToForward, kText, 1U),
    };
    return kBuilders;
}

/// The builders with the caller id of a request, always 0xAABBCCDD here.
const std::vector<Builder>& buildersWithGivenId()
{
    constexpr unsigned int kId = 0xAABBCCDD;
    static const std::vector<Builder> kBuilders = {
        builder<QelMessageGetEnclTypeAndInterfaceVersionRsp>("VersionRsp", kId, 'F', std::uint16_t{1}, std::uint16_t{2},
                                                             kText, kText),
        builder<QelMessageGetInterfaceLimitsRsp>("LimitsRsp", kId),
        builder<QelMessageGetQelTodRsp>("TodRsp", kId, kTime),
        builder<QelMessageGetGlobalModeAttributeRsp>("GetModeRsp", kId, std::uint8_t{1}, kText),
        builder<QelMessageGetGlobalSaveAreaMetadataRsp>("GetMetadataRsp", kId, kText),
        builder<QelMessageExchIntCapabilitiesRsp>("CapabilitiesRsp", kId, 4U, QelCapabilities()),
        builder<QelMessageVirtualSerialOpenRsp>("OpenRsp", kId, std::uint16_t{1}, std::uint16_t{2}),
        builder<QelMessageVirtualSerialGetMaxSessionsRsp>("MaxSessionsRsp", kId, std::uint16_t{1}, std::uint8_t{2}),
    };
    return kBuilders;
}

TEST(CatalogBuilders, DrawExactlyOneCallerIdUnlessOneIsGiven)
{
    const std::vector<Builder>& builders = buildersWithNewId(); // constructed first: one of them builds a message
    const CallerIdScope ids(100);
    unsigned int expected = 100;
    for (const Builder& row : builders) {
        SCOPED_TRACE(row.name);
        EXPECT_EQ(row.callerIdOfNew(), ++expected);
        EXPECT_EQ(ids.last(), expected);
    }
}

TEST(CatalogBuilders, DrawNoCallerIdWhenOneIsGiven)
{
    const CallerIdScope ids(100);
    for (const Builder& row : buildersWithGivenId()) {
        SCOPED_TRACE(row.name);
        EXPECT_EQ(row.callerIdOfNew(), 0xAABBCCDDU);
        EXPECT_EQ(ids.last(), 100U);
    }
}

TEST(CatalogBuilders, AllocateOneBlockOfTheFinalSize)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    for (const auto* builders : {&buildersWithNewId(), &buildersWithGivenId()}) {
        for (const Builder& row : *builders) {
            SCOPED_TRACE(row.name);
            std::size_t blocks = 0;
            {
                const Allocations allocations;
                row.callerIdOfNew();
                blocks = allocations.count();
            }
            EXPECT_EQ(blocks, 1U);
        }
    }
}

TEST_P(ReceivedClass, AllocatesOneBlockForTheObjectAndOneForTheFrame)
{
    QEL_TEST_NEEDS_ALLOCATIONS();
    const OddBytes bytes(frame().bytes());
    std::size_t blocks = 0;
    {
        const Allocations allocations;
        GetParam().receive(bytes.data(), bytes.length());
        blocks = allocations.count();
    }
    EXPECT_EQ(blocks, 2U);
}

TEST(CatalogBuilders, RefuseNullDataWithALengthAndDrawNoCallerId)
{
    const CallerIdScope ids(100);
    const auto refused = ThrowsMessage<std::invalid_argument>(StrEq("data"));
    EXPECT_THAT([] { QelMessageDaxBroadcastReq(0, 1, 0, "", nullptr); }, refused);
    EXPECT_THAT([] { QelMessageDaxBroadcastOutboundAsync(1, 0, "", nullptr); }, refused);
    EXPECT_THAT([] { QelMessageVirtualSerialDataToOsAsync(0, 0, 1, nullptr); }, refused);
    EXPECT_THAT([] { QelMessageVirtualSerialDataToDaxAsync(0, 0, 1, nullptr); }, refused);
    EXPECT_EQ(ids.last(), 100U);
}

TEST(CatalogBuilders, AcceptNullDataWithoutALength)
{
    EXPECT_EQ(QelMessageDaxBroadcastReq(0, 0, 0, "", nullptr).dataLength(), 46U);
    EXPECT_EQ(QelMessageDaxBroadcastOutboundAsync(0, 0, "", nullptr).dataLength(), 42U);
    EXPECT_EQ(QelMessageVirtualSerialDataToOsAsync(0, 0, 0, nullptr).dataLength(), 6U);
    EXPECT_EQ(QelMessageVirtualSerialDataToDaxAsync(0, 0, 0, nullptr).dataLength(), 6U);
}

TEST(CatalogBuilders, BuildFramesLongerThanAStreamAccepts)
{
    const std::string longest(65535, 'x');
    EXPECT_EQ(QelMessageDaxBroadcastReq(0, 65535, 0, "", longest.data()).msgLength(), 65613U);
    EXPECT_EQ(QelMessageDaxBroadcastOutboundAsync(65535, 0, "", longest.data()).msgLength(), 65609U);
    EXPECT_EQ(QelMessageVirtualSerialDataToOsAsync(0, 0, 65535, longest.data()).msgLength(), 65573U);
    EXPECT_EQ(QelMessageVirtualSerialDataToDaxAsync(0, 0, 65535, longest.data()).msgLength(), 65573U);
    EXPECT_EQ(QelMessageSetGlobalModeAttributeReq(0, longest).msgLength(), 65571U);
    EXPECT_EQ(QelMessageSetGlobalSaveAreaMetadataReq(longest).msgLength(), 65569U);
}

} // namespace
} // namespace qel
