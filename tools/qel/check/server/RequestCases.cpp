#include "check/Anchors.hpp"
#include "check/Trial.hpp"
#include "check/server/Checks.hpp"
#include "check/server/ServerCases.hpp"

#include <string>
#include <utility>

namespace qel::tool::check {

namespace {

using namespace anchors;

Cases unknownCases()
{
    Cases cases;
    for (const unsigned int function :
         {0x0000U, 0x6000U, 0x6001U, 0x6004U, 0x7000U, 0x8000U, 0x8001U, 0x800AU, 0xFFFFU}) {
        const std::string text = hexNumber(function, 4);
        cases.push_back(getsStatus("request/function/" + text, "A request of the function " + text + " gets status 15.",
                                   kAnswered, Level::Rule, withSession, Draft::request(function, 1), kInvalidFunction));
    }
    for (const unsigned int operation : {0x0000U, 0x0100U, 0x010CU, 0x0402U, 0xFFFFU}) {
        const std::string text = hexNumber(operation, 4);
        cases.push_back(getsStatus("request/operation/interface-" + text,
                                   "A request of the operation " + text + " of the function 0x6003 gets status 1.",
                                   kAnswered, Level::Rule, withSession, interfaceRequest(operation),
                                   kInvalidOperation));
    }
    for (const unsigned int operation : {0x0000U, 0x0101U, 0x0401U, 0x0405U, 0x0407U}) {
        const std::string text = hexNumber(operation, 4);
        cases.push_back(getsStatus("request/operation/serial-" + text,
                                   "A request of the operation " + text + " of the function 0x6002 gets status 1.",
                                   kAnswered, Level::Rule, withSession, Draft::request(kSerial, operation),
                                   kInvalidOperation));
    }
    return cases;
}

/// Of several reasons to refuse a request, the first in the order counts.
Cases orderCases()
{
    return {
        getsStatus("request/order/operation-before-session",
                   "An unknown operation of the serial function gets status 1 also without the session.", kAnswered,
                   Level::Rule, identified, Draft::request(kSerial, 0x04FF), kInvalidOperation),
        getsStatus("request/order/function-before-operation", "An unknown function gets 15 whatever the operation.",
                   kAnswered, Level::Rule, identified, Draft::request(0x6004, kTime), kInvalidFunction),
        getsStatus("request/order/session-before-payload",
                   "Without the session, a serial request with a malformed payload gets status 4.", kAnswered,
                   Level::Rule, identified, Draft::request(kSerial, kOpenSerial), kInvalidSequence),
        getsStatus("request/order/payload-before-partition",
                   "A serial request with a malformed payload gets status 3 whatever its partition.", kAnswered,
                   Level::Rule, withSession, Draft::request(kSerial, kOpenSerial).payload("\xFF\xFF\xFF\xFF"),
                   kInvalidData),
        {"request/refused/empty-payload", "A response with a status other than 0 has an empty payload.", kAnswered,
         Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.session();
             requirePayload(wire.expectStatus(openSession(), kAlreadyOpen), 0);
             requirePayload(wire.expectStatus(interfaceRequest(0x01FF).payload("x"), kInvalidOperation), 0);
             requirePayload(wire.expectStatus(openSerial(trial.target().absentPartition, 0), kInvalidPartition), 0);
         }},
        {"request/refused/header", "The response to a refused request has its caller id, function and operation.",
         kAnswered, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             const Draft request = Draft::request(0x8001, 0x1234);
             requireResponseHeader(wire.expectStatus(request, kInvalidFunction), 0x8001, 0x1234);
         }},
        {"request/refused/goes-on", "A refused request does not end the connection.", kAnswered, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             wire.expectStatus(Draft::request(0x9999, 1), kInvalidFunction);
             wire.expectStatus(interfaceRequest(0x01FF), kInvalidOperation);
             wire.fence();
         }},
    };
}

Cases ignoredCases()
{
    Cases cases;
    const auto add = [&](const char* name, const char* what, Draft message) {
        cases.push_back(isIgnored(std::string("request/ignored/") + name, std::string(what) + " is ignored.", kAnswered,
                                  Level::Rule, withSession, std::move(message)));
    };
    add("response-version", "A response to the version request", Draft::response(kInterface, kVersion));
    add("response-time", "A response to a time request", Draft::response(kInterface, kTime).payload("12345678"));
    add("response-unknown", "A response of an unknown function", Draft::response(0x9999, 0x9999));
    add("response-malformed", "A response with a malformed payload",
        Draft::response(kSerial, kOpenSerial).payload("x"));
    add("notice-broadcast", "A broadcast notice that a console sends",
        Draft::notice(kToConsole, kBroadcastNotice).payload(std::string(42, '\0')));
    add("notice-serial-closed", "A session-closed notice that a console sends",
        Draft::notice(kToConsole, kSerialClosed).payload(std::string(8, '\0')));
    add("notice-connection-closed", "A connection-closed notice that a console sends",
        Draft::notice(kToConsole, kConnectionClosed));
    add("notice-data-to-console", "A data notice of the other direction",
        Draft::notice(kToConsole, kDataToConsole).payload(serialAddress(1, 0) + bigEndian16(1) + "x"));
    add("notice-unknown-function", "A notice of an unknown function", Draft::notice(0x9999, 1));
    add("notice-unknown-operation", "A notice of an unknown operation", Draft::notice(kSerial, 0x04FF));
    add("notice-of-a-request", "A request sent as a notice", Draft::notice(kInterface, kCloseSession));
    add("notice-abort", "The abort message outside the handshake", Draft::notice(kHandshake, kAbort));
    add("notice-data-without-session", "Data for a session that the sender does not hold", dataToPartition(1, 0, "x"));
    add("notice-data-malformed", "Data whose length is beyond the payload", dataToPartition(1, 0, "x", 2));
    add("notice-data-cut", "Data without all of its fields", Draft::notice(kSerial, kDataToPartition).payload("12345"));
    add("both-flags", "A message that is both request and response", limitsRequest().flags(0xC0));
    return cases;
}

/// One case for each request: exactly one response, of exactly the form that is documented.
Case response(const char* name, const char* anchor, Draft request, std::function<void(const Frame&)> check)
{
    const std::string message = messageName(request.getFunction(), request.getOperation());
    return {std::string("response/") + name,
            "The request " + message + " gets one response, of the documented form.",
            anchor,
            Level::Wire,
            kNothing,
            [request = std::move(request), check = std::move(check)](Trial& trial) {
                const Frame frame = onlyResponse(trial.session(), request);
                requireResponseHeader(frame, request.getFunction(), request.getOperation());
                check(frame);
            }};
}

void isEmpty(const Frame& frame) { requirePayload(frame, 0); }

void isVersion(const Frame& frame)
{
    requirePayload(frame, 48);
    Trial::requireEqual("the enclosure type", 2, frame.byteAt(1));
    requireZero(frame, 6, 12, "mReserved");
    const std::size_t type = frame.u16At(12);
    const std::size_t serial = frame.u16At(14);
    Trial::require(type <= 16, "a machine type of at most 16 bytes", std::to_string(type));
    Trial::require(serial <= 16, "a serial number of at most 16 bytes", std::to_string(serial));
    requireZero(frame, 16 + type, 32, "the slot after the machine type");
    requireZero(frame, 32 + serial, 48, "the slot after the serial number");
}

void isLimits(const Frame& frame)
{
    requirePayload(frame, 16);
    Trial::requireEqual("mMaxCommandSize", 16384, frame.u16At(0));
    Trial::requireEqual("mMaxKrogCommandSize", 4096, frame.u16At(2));
    Trial::requireEqual("mBroadcastMsgPacketSize", 16306, frame.u16At(4));
    requireZero(frame, 6, 8, "mReserved1");
    Trial::require(frame.byteAt(8) >= 1, "at least 1 in mDaxsSupported", "0");
    requireZero(frame, 9, 12, "mReserved2");
    Trial::requireEqual("mNonpersistentLocksSupported", 0, frame.u16At(12));
    Trial::requireEqual("mPersistentLocksSupported", 0, frame.u16At(14));
}

/// Two decimal digits.
unsigned int bcd(const Frame& frame, std::size_t offset)
{
    const unsigned int byte = frame.byteAt(offset);
    Trial::require(byte / 16 < 10 && byte % 16 < 10, "two decimal digits", hexNumber(byte, 2));
    return byte / 16 * 10 + byte % 16;
}

void isTime(const Frame& frame)
{
    const auto between = [&](const char* field, std::size_t offset, unsigned int least, unsigned int most) {
        const unsigned int value = bcd(frame, offset);
        Trial::require(value >= least && value <= most,
                       std::string(field) + " from " + std::to_string(least) + " to " + std::to_string(most),
                       std::to_string(value));
    };
    requirePayload(frame, 8);
    between("the century", 0, 19, 99);
    between("the year", 1, 0, 99);
    between("the month", 2, 1, 12);
    between("the day", 3, 1, 31);
    between("the hour", 4, 0, 23);
    between("the minute", 5, 0, 59);
    between("the second", 6, 0, 60);
    requireZero(frame, 7, 8, "mRsvd");
}

void isMode(const Frame& frame)
{
    requirePayload(frame, 4 + frame.u16At(2));
    requireZero(frame, 1, 2, "mReserved");
}

void isMetadata(const Frame& frame) { requirePayload(frame, 2 + frame.u16At(0)); }

void isMaximum(const Frame& frame)
{
    requirePayload(frame, 3);
    Trial::require(frame.u16At(0) >= 1, "at least one system", "0");
}

void isCapabilities(const Frame& frame)
{
    Trial::require(frame.u32At(0) % 4 == 0, "a length that is a multiple of 4", std::to_string(frame.u32At(0)));
    requirePayload(frame, 4 + frame.u32At(0));
}

/// A response of a partition's session: the request works only on a session that is open.
Case serialResponse(const char* name, const char* anchor, unsigned int operation, std::function<Draft(Trial&)> request,
                    std::size_t payload)
{
    const std::string message = messageName(kSerial, operation);
    return {std::string("response/") + name,
            "The request " + message + " gets one response, of the documented form.",
            anchor,
            Level::Wire,
            kPartition,
            [request = std::move(request), operation, payload](Trial& trial) {
                const bool isOpen = operation != kOpenSerial;
                Wire& wire = isOpen ? trial.serial(trial.partition()) : trial.session();
                const Frame frame = onlyResponse(wire, request(trial));
                requireResponseHeader(frame, kSerial, operation);
                requirePayload(frame, payload);
            }};
}

} // namespace

Cases requestCases() { return joined(unknownCases, orderCases, ignoredCases); }

Cases responseCases()
{
    Cases cases{
        response("limits", kLimitsRsp, limitsRequest(), isLimits),
        response("time", kTimeRsp, timeRequest(), isTime),
        response("get-mode", kGetModeRsp, interfaceRequest(kGetMode), isMode),
        response("get-metadata", kGetMetadataRsp, interfaceRequest(kGetMetadata), isMetadata),
        response("capabilities", kCapabilitiesRsp, capabilitiesRequest(4, std::string(4, '\xFF')), isCapabilities),
        response("close-session", "wire-format.md#qelmessageinterfacecmpclosekrogsessionrsp", closeSession(), isEmpty),
        response("max-serial", kMaxRsp, maxSerial(), isMaximum),
        {"response/version", "The version request gets one response, of the documented form.", kVersionRsp, Level::Wire,
         kNothing,
         [](Trial& trial) {
             const Frame frame = onlyResponse(trial.connect(), versionRequest(trial.toolType(), trial.newToolId()));
             requireResponseHeader(frame, kInterface, kVersion);
             isVersion(frame);
         }},
        {"response/open-session",
         "The request " + messageName(kInterface, kOpenSession) + " gets one response, of the documented form.",
         "wire-format.md#qelmessageinterfacecmpopenkrogsessionrsp", Level::Wire, kNothing,
         [](Trial& trial) {
             const Frame frame = onlyResponse(trial.console(), openSession());
             requireResponseHeader(frame, kInterface, kOpenSession);
             requirePayload(frame, 0);
         }},
    };
    cases.push_back(serialResponse(
        "open-serial", kOpenRsp, kOpenSerial, [](Trial& trial) { return openSerial(trial.partition(), 0); }, 8));
    cases.push_back(serialResponse(
        "close-serial", "wire-format.md#qelmessagevirtualserialclosersp", kCloseSerial,
        [](Trial& trial) { return closeSerial(trial.partition(), 0); }, 0));
    return cases;
}

} // namespace qel::tool::check
