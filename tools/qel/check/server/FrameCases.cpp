#include "check/Anchors.hpp"
#include "check/Trial.hpp"
#include "check/server/Checks.hpp"
#include "check/server/ServerCases.hpp"

#include <string>
#include <utility>

namespace qel::tool::check {

namespace {

using namespace anchors;

/// A case that sends one malformed frame, which must end the connection.
Case endsConnection(std::string id, std::string requirement, const char* anchor, Draft draft)
{
    return {std::move(id), std::move(requirement), anchor, Level::Wire, kNothing, [draft](Trial& trial) {
                Wire& wire = trial.console();
                wire.send(draft.bytes());
                wire.expectEndWithoutFrame();
            }};
}

/// A case that sends one request of an unusual form, which must be answered with status 0.
Case isAnswered(std::string id, std::string requirement, const char* anchor, Draft draft)
{
    return {std::move(id), std::move(requirement),
            anchor,        Level::Wire,
            kNothing,      [draft](Trial& trial) { trial.console().expectStatus(draft, 0); }};
}

/// The request of most of these cases; its payload is ignored.
Draft plain() { return limitsRequest(); }

Cases eyecatcherCases()
{
    Cases cases;
    const char* const names[] = {"first", "second", "third"};
    const unsigned int wrong[] = {0xDF, 0xC0, 0x00};
    for (std::size_t i = 0; i < 3; ++i) {
        const std::string name = names[i];
        cases.push_back(endsConnection("frame/eyecatcher/" + name + "-byte",
                                       "A frame with a wrong " + name + " byte of the eyecatcher ends the connection.",
                                       kFrameChecks, plain().byte(i, wrong[i])));
    }
    for (const unsigned int version : {0x01U, 0x10U, 0x1FU, 0x21U, 0xA0U, 0xFFU}) {
        const std::string text = hexNumber(version, 2);
        cases.push_back(endsConnection("frame/version/" + text,
                                       "A frame with the header version " + text + " ends the connection.",
                                       kFrameChecks, plain().byte(3, version)));
    }
    return cases;
}

Cases shortLengthCases()
{
    Cases cases;
    for (const std::uint32_t length : {0U, 1U, 7U, 8U, 16385U, 65536U, 0x80000000U, 0xFFFFFFFFU}) {
        const std::string text = std::to_string(length);
        cases.push_back(endsConnection("frame/length/" + text,
                                       "A frame of the length " + text + " ends the connection.", kStreamChecks,
                                       plain().msgLength(length)));
    }
    for (const std::size_t length : {9U, 21U, 22U, 23U, 24U, 31U}) {
        const std::string text = std::to_string(length);
        cases.push_back({"frame/length/" + text + "-is-too-short",
                         "A frame of " + text + " bytes, shorter than its header, ends the connection.", kFrameChecks,
                         Level::Wire, kNothing, [length](Trial& trial) {
                             Wire& wire = trial.console();
                             const auto announced = static_cast<std::uint32_t>(length);
                             wire.send(plain().msgLength(announced).bytes().substr(0, length));
                             wire.expectEndWithoutFrame();
                         }});
    }
    cases.push_back({"frame/length/9-is-a-frame", "A frame of 9 bytes is read to its end before it is refused.",
                     kStreamChecks, Level::Wire, kNothing, [](Trial& trial) {
                         Wire& wire = trial.console();
                         const std::string bytes = plain().msgLength(9).bytes();
                         wire.send(bytes.substr(0, 8));
                         trial.console().fence(); // the peer has had time to see the first one's bytes
                         Trial::require(wire.isQuiet(), "the peer to wait for the ninth byte", "an answer to eight");
                         wire.send(bytes.substr(8, 1));
                         wire.expectEndWithoutFrame();
                     }});
    return cases;
}

Cases lengthCases()
{
    constexpr std::size_t kLongest = 16384 - 32;
    Cases cases = shortLengthCases();
    cases.push_back(isAnswered("frame/length/16384-is-a-frame", "A frame of 16384 bytes is answered.", kLimitsOfFrames,
                               plain().payload(std::string(kLongest, 'x'))));
    cases.push_back(isAnswered("frame/length/16383-is-a-frame", "A frame of 16383 bytes is answered.", kLimitsOfFrames,
                               plain().payload(std::string(kLongest - 1, 'x'))));
    cases.push_back(isAnswered("frame/length/32-is-a-frame", "A new frame is a header alone.", kPad, plain()));
    cases.push_back(
        isAnswered("frame/length/33-is-a-frame", "A frame of 33 bytes is answered.", kPad, plain().payload("x")));
    cases.push_back(endsConnection("frame/length/data-length-too-small",
                                   "A payload longer than the data length says ends the connection.", kFrameChecks,
                                   plain().payload("four").dataLength(3)));
    cases.push_back(endsConnection("frame/length/data-length-too-large",
                                   "A payload shorter than the data length says ends the connection.", kFrameChecks,
                                   plain().payload("four").dataLength(5)));
    cases.push_back(endsConnection("frame/length/sum-wraps-to-right",
                                   "The sum of the lengths is taken in 64 bits: a data length of 2^32 - 1 and a pad of "
                                   "1 do not make 32.",
                                   kFrameChecks, plain().dataLength(0xFFFFFFFFU).padField(1)));
    return cases;
}

Cases newPadCases()
{
    return {
        isAnswered("frame/pad/new-frame", "A new frame may have a pad.", kPad, plain().pad(3)),
        isAnswered("frame/pad/new-frame-255", "A new frame may have a pad of 255 bytes.", kPad, plain().pad(255)),
        isAnswered("frame/pad/new-frame-with-payload", "The pad follows the payload of a new frame.", kPad,
                   plain().payload("payload").pad(5)),
        isAnswered("frame/pad/bytes-are-ignored", "The bytes of the pad are ignored.", kPad, plain().pad(8, '\xFF')),
        endsConnection("frame/pad/not-counted-in-length",
                       "A pad that the length of the frame does not count ends the connection.", kFrameChecks,
                       plain().padField(4)),
        endsConnection("frame/pad/counted-but-not-declared",
                       "Bytes after the payload that are not declared as pad end the connection.", kFrameChecks,
                       plain().pad(4).padField(0)),
    };
}

Cases oldHeaderCases()
{
    return {
        isAnswered("frame/old/answered", "A request with the old header is answered.", kHeader, plain().old()),
        isAnswered("frame/old/payload-of-8", "An old frame with 8 bytes of payload has a pad of 8.", kPad,
                   plain().old().payload("12345678")),
        isAnswered("frame/old/payload-of-16", "An old frame with 16 bytes of payload has no pad.", kPad,
                   plain().old().payload("1234567890123456")),
        isAnswered("frame/old/payload-of-17", "An old frame with 17 bytes of payload has no pad.", kPad,
                   plain().old().payload("12345678901234567")),
        isAnswered("frame/old/longest", "An old frame may have 16384 bytes.", kLimitsOfFrames,
                   plain().old().payload(std::string(16384 - 24, 'x'))),
        isAnswered("frame/old/larger-pad", "A larger pad than an old frame needs is accepted.", kPad,
                   plain().old().pad(17)),
        isAnswered("frame/old/largest-pad", "An old frame may have a pad of 255 bytes.", kPad, plain().old().pad(255)),
        isAnswered("frame/old/pad-it-does-not-need", "An old frame that needs no pad may have one.", kPad,
                   plain().old().payload("12345678901234567").pad(1)),
        endsConnection("frame/old/no-pad", "An old frame without payload and without pad ends the connection.",
                       kFrameChecks, plain().old().pad(0)),
        endsConnection("frame/old/pad-of-15", "An old frame of 39 bytes ends the connection.", kFrameChecks,
                       plain().old().pad(15)),
        endsConnection("frame/old/pad-of-7-for-8",
                       "An old frame with 8 bytes of payload and a pad of 7 ends the connection.", kFrameChecks,
                       plain().old().payload("12345678").pad(7)),
        {"frame/old/response-is-new", "The response to an old frame has the new header.", kRequests, Level::Rule,
         kNothing,
         [](Trial& trial) {
             const Frame response = trial.console().expectStatus(plain().old(), 0);
             Trial::require(response.version == 0x20, "the new header",
                            "header version " + hexNumber(response.version, 2));
         }},
        {"frame/old/then-new", "Old and new frames may alternate on one connection.", kHeader, Level::Wire, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             for (int i = 0; i < 3; ++i) {
                 wire.expectStatus(plain().old(), 0);
                 wire.expectStatus(plain(), 0);
             }
         }},
    };
}

Cases flagCases()
{
    Cases cases;
    for (const unsigned int flags : {0x81U, 0x90U, 0xBFU}) {
        const std::string text = hexNumber(flags, 2);
        cases.push_back(
            isAnswered("frame/flags/" + text + "-is-a-request",
                       "A message with the flags " + text + " is a request: the lower six bits mean nothing.",
                       kClassification, plain().flags(flags)));
    }
    for (const unsigned int flags : {0x40U, 0x41U, 0x7FU}) {
        const std::string text = hexNumber(flags, 2);
        cases.push_back(isIgnored("frame/flags/" + text + "-is-a-response",
                                  "A message with the flags " + text +
                                      " is a response, and one that no one asked for "
                                      "is ignored.",
                                  kAnswered, Level::Wire, identified, plain().flags(flags)));
    }
    for (const unsigned int flags : {0x00U, 0x01U, 0x3FU}) {
        const std::string text = hexNumber(flags, 2);
        cases.push_back(isIgnored("frame/flags/" + text + "-is-a-notice",
                                  "A message with the flags " + text + " is a notice, and has no answer.", kAnswered,
                                  Level::Wire, identified, plain().flags(flags)));
    }
    for (const unsigned int flags : {0xC0U, 0xFFU}) {
        const std::string text = hexNumber(flags, 2);
        cases.push_back(isIgnored("frame/flags/" + text + "-is-neither",
                                  "A message with the flags " + text + ", both request and response, is ignored.",
                                  kAnswered, Level::Wire, identified, plain().flags(flags)));
    }
    return cases;
}

Cases fieldCases()
{
    Cases cases;
    for (const std::uint32_t id : {0U, 1U, 0x7FFFFFFFU, 0x80000000U, 0xFFFFFFFFU}) {
        const std::string text = hexNumber(id, 8);
        cases.push_back(isAnswered("frame/caller-id/" + text,
                                   "The response carries the caller id " + text + " of its request.", kHeader,
                                   plain().callerId(id)));
    }
    const auto ignores = [&](const char* field, std::size_t offset) {
        cases.push_back(isAnswered(std::string("frame/reserved/") + field,
                                   std::string("The receiver ignores ") + field + ".", kHeader,
                                   plain().byte(offset, 0xA5).byte(offset + 1, 0x5A)));
    };
    ignores("mReserved2", 26);
    ignores("mReserved3", 28);
    cases.push_back({"frame/caller-id/same-twice", "Two requests with the same caller id get a response each.", kHeader,
                     Level::Wire, kNothing, [](Trial& trial) {
                         Wire& wire = trial.console();
                         wire.send(plain().callerId(7));
                         wire.send(timeRequest().callerId(7));
                         const Frame first = wire.awaitResponse(7, "the first response");
                         const Frame second = wire.awaitResponse(7, "the second response");
                         Trial::requireEqual("the operation of the first response", kLimits, first.operation);
                         Trial::requireEqual("the operation of the second response", kTime, second.operation);
                     }});
    return cases;
}

} // namespace

Cases frameHeaderCases()
{
    return joined(eyecatcherCases, lengthCases, newPadCases, oldHeaderCases, flagCases, fieldCases);
}

} // namespace qel::tool::check
