#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/TypeInfo.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/ResponseOf.hpp>
#include <qel/protocol/Text.hpp>

#include <algorithm>
#include <cstddef>
#include <cstring>

namespace qel::protocol {

namespace {

[[noreturn]] void breakOff(const std::string& reason, const std::string& peer)
{
    throw ProtocolBroken("the peer broke the protocol: " + reason, peer);
}

/// The payload of a response that the library only builds.
/// @pre it is long enough
template <typename Response>
typename Response::Data payloadOf(const Response& response)
{
    typename Response::Data payload;
    std::memcpy(&payload, response.getData(), sizeof(payload));
    return payload;
}

/// Makes an object of a class that has no constructor from bytes, with the frame that was received.
template <typename Response>
std::unique_ptr<Response> withFrame(std::unique_ptr<Response> response, const QelMessage& received,
                                    const std::string& peer)
{
    if (received.dataLength() < sizeof(typename Response::Data)) breakOff("the response is too short", peer);
    static_cast<QelMessage&>(*response) = received;
    return response;
}

void requireIdentity(const QelMessage& message, const char* typeName, const std::string& peer,
                     const QelMessage& expected)
{
    if (message.getFunction() == expected.getFunction() && message.getOperation() == expected.getOperation() &&
        message.getClassification() == expected.getClassification()) {
        return;
    }
    detail::throwMalformedResponse(message, typeName, peer);
}

/// BCD has a decimal digit in each half byte.
void requireDecimalDigits(const QelMessageGetQelTodRsp& response, const std::string& peer)
{
    constexpr std::size_t kDigitBytes = offsetof(QelMessageGetQelTodRsp::Data, mRsvd);
    const char* const bytes = response.getData();
    const bool isDecimal = std::all_of(bytes, bytes + kDigitBytes, [](char c) {
        const auto byte = static_cast<unsigned char>(c);
        return (byte >> 4) <= 9 && (byte & 0x0F) <= 9;
    });
    if (isDecimal) return;
    breakOff("the time of day has digits above 9: " + hexDigits(std::string(bytes, kDigitBytes)), peer);
}

bool isSameTime(const std::tm& left, const std::tm& right)
{
    return left.tm_year == right.tm_year && left.tm_mon == right.tm_mon && left.tm_mday == right.tm_mday &&
           left.tm_hour == right.tm_hour && left.tm_min == right.tm_min && left.tm_sec == right.tm_sec;
}

} // namespace

namespace detail {

void throwMalformedResponse(const QelMessage& response, const char* typeName, const std::string& peer)
{
    const QelMessageCastException cause(response, TypeInfo::demangleSymbol(typeName));
    try {
        throw cause;
    } catch (const QelMessageCastException& error) {
        std::throw_with_nested(ProtocolBroken(std::string("the peer broke the protocol: ") + error.what(), peer));
    }
}

std::unique_ptr<QelMessageGetQelTodRsp>
ResponseReader<QelMessageGetQelTodRsp>::read(std::unique_ptr<QelMessage> message, const std::string& peer)
{
    auto response = std::make_unique<QelMessageGetQelTodRsp>(message->getCallerId(), std::time_t{0});
    requireIdentity(*message, typeid(QelMessageGetQelTodRsp).name(), peer, *response);
    response = withFrame(std::move(response), *message, peer);
    requireDecimalDigits(*response, peer);
    return response;
}

std::unique_ptr<QelMessageGetInterfaceLimitsRsp>
ResponseReader<QelMessageGetInterfaceLimitsRsp>::read(std::unique_ptr<QelMessage> message, const std::string& peer)
{
    auto response = std::make_unique<QelMessageGetInterfaceLimitsRsp>(message->getCallerId());
    requireIdentity(*message, typeid(QelMessageGetInterfaceLimitsRsp).name(), peer, *response);
    return withFrame(std::move(response), *message, peer);
}

} // namespace detail

InterfaceLimits limitsOf(const QelMessageGetInterfaceLimitsRsp& response)
{
    const auto payload = payloadOf(response);
    InterfaceLimits limits;
    limits.largestCommand = payload.mMaxCommandSize;
    limits.largestHypervisorCommand = payload.mMaxKrogCommandSize;
    limits.largestBroadcast = payload.mBroadcastMsgPacketSize;
    limits.consoles = payload.mDaxsSupported;
    limits.nonpersistentLocks = payload.mNonpersistentLocksSupported;
    limits.persistentLocks = payload.mPersistentLocksSupported;
    return limits;
}

std::time_t timeOf(const QelMessageGetQelTodRsp& response)
{
    constexpr int kFirstYear = 1900;
    constexpr int kLastSecond = 59;
    constexpr int kLeapSecond = 60;
    const auto payload = payloadOf(response);
    const int second = payload.mSecond.value();
    std::tm time{};
    time.tm_year = payload.mYear.value() - kFirstYear;
    time.tm_mon = payload.mMonth.value() - 1;
    time.tm_mday = payload.mDay.value();
    time.tm_hour = payload.mHour.value();
    time.tm_min = payload.mMinute.value();
    time.tm_sec = std::min(second, kLastSecond);
    std::tm normalised = time; // timegm() takes what is out of range for another time, and writes that here
    const std::time_t seconds = ::timegm(&normalised);
    if (second > kLeapSecond || !isSameTime(time, normalised)) {
        breakOff("the time of day is not a time: " +
                     hexDigits(std::string(response.getData(), offsetof(QelMessageGetQelTodRsp::Data, mRsvd))),
                 {});
    }
    return seconds + (second - time.tm_sec);
}

} // namespace qel::protocol
