#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/QelMessageMetadata.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "support/Bytes.hpp"
#include "support/CallerIdScope.hpp"
#include "support/CapturedLog.hpp"
#include "support/MessageProbe.hpp"
#include "support/RawFrame.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <ostream>
#include <stdexcept>
#include <tuple>
#include <type_traits>
#include <typeinfo>
#include <vector>

namespace qel {
namespace {

using test::bytes;
using test::CallerIdScope;
using test::CapturedLog;
using test::frameOf;
using test::heapCopy;
using test::hex;
using test::RawFrame;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::StrEq;
using testing::ThrowsMessage;

// Three kinds of classes as in the catalog: with a payload, without one, and with a template in between.

class NumberReq : public QelMessageMetadata<NumberReq, QelMessageFunctionVirtualSerial,
                                            QelMessageOpOpenVirtualSerialSession, QelMessageClassification::Request> {
public:
    explicit NumberReq(unsigned int number) : QelMessageMetadata(PayloadLength(sizeof(Data)))
    {
        pPayload<Data>().mNumber = number;
    }
    NumberReq(const char* i_buffer, unsigned int i_length) : QelMessageMetadata(i_buffer, i_length)
    {
        if (dataLength() < sizeof(Data)) throw QelMessageValidationException("number is missing");
    }
    ~NumberReq() override = default;

    unsigned int getNumber() const { return pPayload<Data>().mNumber; }

protected:
    void pDerivedDebug(std::ostream& os) const override { os << " number: " << decFormat(getNumber()) << '\n'; }

private:
    struct Data {
        be_uint16_t mReserved;
        be_uint32_t mNumber;
    };
};

class EmptyRsp : public QelMessageMetadata<EmptyRsp, QelMessageFunctionVirtualSerial,
                                           QelMessageOpCloseVirtualSerialSession, QelMessageClassification::Response> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~EmptyRsp() override = default;
};

template <typename Derived, QelMessageOpTypes OpType>
class SizedAsyncBase
    : public QelMessageMetadata<Derived, QelMessageFunctionDax, OpType, QelMessageClassification::Async> {
public:
    using QelMessageMetadata<Derived, QelMessageFunctionDax, OpType,
                             QelMessageClassification::Async>::QelMessageMetadata;

protected:
    SizedAsyncBase(unsigned int callerId, std::uint64_t length)
        : QelMessageMetadata<Derived, QelMessageFunctionDax, OpType, QelMessageClassification::Async>(
              callerId, QelMessage::PayloadLength(length))
    {}
};

class SizedAsync : public SizedAsyncBase<SizedAsync, QelMessageOpSendKrogConnectionClosed> {
public:
    using SizedAsyncBase::SizedAsyncBase;
    static SizedAsync ofLength(std::uint64_t length) { return SizedAsync(77, length); }
    ~SizedAsync() override = default;
};

template <typename T>
T received(const std::vector<char>& frame)
{
    return T(heapCopy(frame).get(), static_cast<unsigned int>(frame.size()));
}

RawFrame numberFrame()
{
    RawFrame frame = RawFrame::newForm();
    frame.callerId(0x21).function(0x6002).operation(0x0402).flags(0x80).payload(bytes({0, 0, 0x01, 0x02, 0x03, 0x04}));
    return frame;
}

// --- identity

TEST(QelMessageMetadata, IdentityIsFixedAtCompileTime)
{
    static_assert(NumberReq::getMessageID() == std::make_tuple(0x6002, 0x0402, QelMessageClassification::Request), "");
    static_assert(EmptyRsp::getMessageID() == std::make_tuple(0x6002, 0x0403, QelMessageClassification::Response), "");
    static_assert(SizedAsync::getMessageID() == std::make_tuple(0x7000, 0xA009, QelMessageClassification::Async), "");
    static_assert(std::is_same<decltype(NumberReq::getMessageID()),
                               std::tuple<unsigned short, unsigned short, QelMessageClassification::Value>>::value,
                  "the key of the registries");
}

TEST(QelMessageMetadata, AddsNothingToTheFrame)
{
    EXPECT_EQ(sizeof(NumberReq), sizeof(QelMessage));
    EXPECT_EQ(sizeof(EmptyRsp), sizeof(QelMessage));
}

// --- building

TEST(QelMessageMetadata, BuiltByDefaultDrawsTheNextCallerIds)
{
    CallerIdScope scope(40);
    const EmptyRsp first;
    const SizedAsync second;
    EXPECT_EQ(frameOf(first),
              hex(RawFrame::newForm().callerId(41).function(0x6002).operation(0x0403).flags(0x40).bytes()));
    EXPECT_EQ(frameOf(second), hex(RawFrame::newForm().callerId(42).function(0x7000).operation(0xA009).bytes()));
    EXPECT_EQ(scope.last(), 42U);
}

TEST(QelMessageMetadata, BuiltWithACallerIdDrawsNone)
{
    CallerIdScope scope(40);
    const EmptyRsp response(0xFEDCBA98);
    EXPECT_EQ(frameOf(response),
              hex(RawFrame::newForm().callerId(0xFEDCBA98).function(0x6002).operation(0x0403).flags(0x40).bytes()));
    EXPECT_EQ(scope.last(), 40U);
}

TEST(QelMessageMetadata, BuiltWithAPayloadIsFilledInPlace)
{
    CallerIdScope scope(0x20);
    const NumberReq request(0x01020304);
    EXPECT_EQ(frameOf(request), hex(numberFrame().bytes()));
    EXPECT_EQ(request.getNumber(), 0x01020304U);
    EXPECT_EQ(scope.last(), 0x21U);
}

TEST(QelMessageMetadata, BuiltWithAPayloadAndACallerId)
{
    CallerIdScope scope(40);
    EXPECT_EQ(
        frameOf(SizedAsync::ofLength(3)),
        hex(RawFrame::newForm().callerId(77).function(0x7000).operation(0xA009).payload(bytes({0, 0, 0})).bytes()));
    EXPECT_EQ(scope.last(), 40U);
}

TEST(QelMessageMetadata, IsNotBuiltLongerThanTheLengthFieldHolds)
{
    EXPECT_THAT([] { SizedAsync::ofLength(4 + std::uint64_t{0xFFFFFFFC}); },
                ThrowsMessage<std::invalid_argument>(StrEq("length")));
    EXPECT_THAT([] { SizedAsync::ofLength(0xFFFFFFE0); }, ThrowsMessage<std::invalid_argument>(StrEq("length")));
}

// --- receiving

TEST(QelMessageMetadata, ParsesAFrameOfItsIdentityAndDrawsNoCallerId)
{
    CallerIdScope scope(40);
    const NumberReq request = received<NumberReq>(numberFrame().bytes());
    EXPECT_EQ(frameOf(request), hex(numberFrame().bytes()));
    EXPECT_EQ(request.getNumber(), 0x01020304U);
    EXPECT_EQ(scope.last(), 40U);
}

TEST(QelMessageMetadata, ReadsThePayloadOfAnOldHeader)
{
    RawFrame frame = RawFrame::oldForm();
    frame.function(0x6002).operation(0x0402).flags(0x80).payload(bytes({0, 0, 0x01, 0x02, 0x03, 0x04}));
    EXPECT_EQ(received<NumberReq>(frame.bytes()).getNumber(), 0x01020304U);
}

TEST(QelMessageMetadata, AcceptsAFrameWithAStatus)
{
    RawFrame frame = RawFrame::newForm();
    frame.function(0x6002).operation(0x0403).flags(0x40).status(20);
    const EmptyRsp response = received<EmptyRsp>(frame.bytes());
    EXPECT_EQ(response.getStatus(), QelMessageStatusConnectionClosureFailure);
    EXPECT_THROW(response.checkStatus(), QelMessageStatusException);
}

TEST(QelMessageMetadata, RefusesEveryOtherIdentityWithOneTextAndLogsNothing)
{
    const std::pair<const char*, RawFrame> frames[] = {
        {"function", numberFrame().function(0x6003)},
        {"operation", numberFrame().operation(0x0403)},
        {"response", numberFrame().flags(0x40)},
        {"async", numberFrame().flags(0x00)},
        {"async with bits without meaning", numberFrame().flags(0x3F)},
        {"both flags", numberFrame().flags(0xC0)},
        {"all three", numberFrame().function(0x7000).operation(0x0401).flags(0x00)},
    };
    CapturedLog log;
    for (const auto& [name, frame] : frames) {
        SCOPED_TRACE(name);
        const std::vector<char> raw = frame.bytes();
        EXPECT_THAT([&] { received<NumberReq>(raw); },
                    ThrowsMessage<QelMessageValidationException>(StrEq("bad operation")));
    }
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(QelMessageMetadata, IgnoresMeaninglessFlagBits)
{
    for (unsigned int flags = 0; flags <= 0xFF; ++flags) {
        SCOPED_TRACE(flags);
        const std::vector<char> request = numberFrame().flags(flags).bytes();
        const std::vector<char> notice = RawFrame::newForm().function(0x7000).operation(0xA009).flags(flags).bytes();
        const std::vector<char> response = RawFrame::newForm().function(0x6002).operation(0x0403).flags(flags).bytes();
        const unsigned int meaning = flags & 0xC0;
        if (meaning == 0x80) {
            EXPECT_EQ(received<NumberReq>(request).getFlags(), flags);
        } else {
            EXPECT_THROW(received<NumberReq>(request), QelMessageValidationException);
        }
        if (meaning == 0x40) {
            EXPECT_NO_THROW(received<EmptyRsp>(response));
        } else {
            EXPECT_THROW(received<EmptyRsp>(response), QelMessageValidationException);
        }
        if (meaning == 0x00) {
            EXPECT_NO_THROW(received<SizedAsync>(notice));
        } else {
            EXPECT_THROW(received<SizedAsync>(notice), QelMessageValidationException);
        }
    }
}

TEST(QelMessageMetadata, ChecksTheFrameThenTheIdentityThenThePayload)
{
    CapturedLog log;
    EXPECT_THAT([] { received<NumberReq>(numberFrame().operation(0x0403).version(0x10).bytes()); },
                ThrowsMessage<QelMessageValidationException>(StrEq("i_buffer bad header version")));
    EXPECT_THAT(log.lines(), ElementsAre("E: bad header version = 0x10"));
    EXPECT_THAT([] { received<NumberReq>(numberFrame().operation(0x0403).payload({}).bytes()); },
                ThrowsMessage<QelMessageValidationException>(StrEq("bad operation")));
    EXPECT_THAT([] { received<NumberReq>(numberFrame().payload({}).bytes()); },
                ThrowsMessage<QelMessageValidationException>(StrEq("number is missing")));
}

// --- copying

TEST(QelMessageMetadata, CopiesTheFrame)
{
    NumberReq original(5);
    const NumberReq copy(original);
    EXPECT_EQ(frameOf(copy), frameOf(original));
    EXPECT_NE(copy.serialize(), original.serialize());

    NumberReq assigned(6);
    assigned = original;
    EXPECT_EQ(frameOf(assigned), frameOf(original));
}

TEST(QelMessageMetadata, ClonesAsTheConcreteClass)
{
    const NumberReq number(5);
    const EmptyRsp empty(1);
    const SizedAsync sized = SizedAsync::ofLength(4);
    const std::pair<const QelMessage*, const std::type_info*> rows[] = {
        {&number, &typeid(NumberReq)}, {&empty, &typeid(EmptyRsp)}, {&sized, &typeid(SizedAsync)}};
    for (const auto& [message, type] : rows) {
        SCOPED_TRACE(type->name());
        const std::unique_ptr<QelMessage> copy = message->clone();
        const QelMessage& copied = *copy;
        EXPECT_EQ(typeid(copied), *type);
        EXPECT_EQ(frameOf(*copy), frameOf(*message));
        EXPECT_NE(copy->serialize(), message->serialize());
    }
}

TEST(QelMessageMetadata, CloneOfAGenericCopyIsGeneric)
{
    const QelMessageGeneric generic(NumberReq(5));
    const std::unique_ptr<QelMessage> copy = generic.clone();
    const QelMessage& copied = *copy;
    EXPECT_EQ(typeid(copied), typeid(QelMessageGeneric));
}

TEST(QelMessageMetadata, CloneDrawsNoCallerId)
{
    const NumberReq request(5);
    CallerIdScope scope(40);
    EXPECT_EQ(request.clone()->getCallerId(), request.getCallerId());
    EXPECT_EQ(scope.last(), 40U);
}

} // namespace
} // namespace qel
