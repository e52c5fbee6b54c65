// What is wrong with the answers to requests: statuses, fields, effects.

#include "twins/FaultKit.hpp"
#include "twins/Faults.hpp"

#include <memory>
#include <mutex>
#include <set>

namespace qel::test {

namespace {

using namespace tool::check;

bool isInterface(const TwinFrame& frame, unsigned int operation) { return frame.is(kInterface, operation); }

std::vector<Fault> statusFaults()
{
    return {
        status("grants-a-second-session", kInterface, kOpenSession, kAlreadyOpen, 0),
        status("closes-what-is-not-open", kInterface, kCloseSession, kInvalidSequence, 0),
        status("taken-identity-is-3", kInterface, kVersion, kAlreadyConnected, kInvalidData),
        status("malformed-version-is-4", kInterface, kVersion, kInvalidData, kInvalidSequence),
        status("second-version-is-granted", kInterface, kVersion, kInvalidSequence, 0),
        status("too-many-is-37", kInterface, kVersion, kTooManyConnections, kAlreadyConnected),
        statusOfAll("unknown-function-is-1", kInvalidFunction, kInvalidOperation),
        statusOfAll("unknown-operation-is-15", kInvalidOperation, kInvalidFunction),
        upFault("early-requests-are-known-by-their-operation",
                [](TwinLink& link, TwinFrame frame) {
                    if (isInterface(frame, kVersion)) link.flag = true;
                    const bool isEarly = frame.isRequest() && !link.flag;
                    if (isEarly && frame.function() == 0x9999) return link.toConsole(frame.response(kInvalidFunction));
                    if (isEarly && frame.operation() == 0x01FF)
                        return link.toConsole(frame.response(kInvalidOperation));
                    link.toServer(frame);
                }),
        upFault("closes-for-early-requests",
                [](TwinLink& link, TwinFrame frame) {
                    if (isInterface(frame, kVersion)) link.flag = true;
                    link.toServer(frame);
                    if (frame.isRequest() && !link.flag) link.count = 1;
                }),
        upFault("closes-for-early-notices",
                [](TwinLink& link, TwinFrame frame) {
                    if (isInterface(frame, kVersion)) link.flag = true;
                    if (frame.isNotice() && !link.flag && frame.function() != kHandshake) return link.cut();
                    link.toServer(frame);
                }),
        upFault("serves-the-limits-before-the-version",
                [](TwinLink& link, TwinFrame frame) {
                    if (isInterface(frame, kVersion)) link.flag = true;
                    if (!link.flag && isInterface(frame, kLimits)) return link.toConsole(frame.response(0));
                    link.toServer(frame);
                }),
        status("max-serial-needs-no-session", kSerial, kMaxSerial, kInvalidSequence, 0),
        status("capabilities-are-never-malformed", kInterface, kCapabilities, kInvalidData, 0),
        status("malformed-broadcast-is-6", kInterface, kBroadcast, kInvalidData, 6),
        status("absent-addressee-is-0", kInterface, kBroadcast, kNotAvailable, 0),
        status("malformed-mode-is-0", kInterface, kSetMode, kInvalidData, 0),
        status("malformed-metadata-are-0", kInterface, kSetMetadata, kInvalidData, 0),
        upFault("closes-for-refused-requests",
                [](TwinLink& link, TwinFrame frame) {
                    const bool isUnknown = frame.isRequest() && frame.function() == 0x9999;
                    if (isUnknown) link.toConsole(frame.response(kInvalidFunction));
                    if (isUnknown) return link.cut();
                    link.toServer(frame);
                }),
        upFault("checks-payloads-before-the-session",
                [](TwinLink& link, TwinFrame frame) {
                    if (frame.is(kSerial, kOpenSerial) && frame.isRequest() && frame.number(16, 4) < 8) {
                        return link.toConsole(frame.response(kInvalidData));
                    }
                    link.toServer(frame);
                }),
    };
}

/// Requests that are not refused before the version request, and some that are never served.
std::vector<Fault> earlyFaults()
{
    return {
        status("opens-sessions-before-the-version", kInterface, kOpenSession, kInvalidSequence, 0),
        status("has-capabilities-before-the-version", kInterface, kCapabilities, kInvalidSequence, 0),
        status("sends-broadcasts-before-the-version", kInterface, kBroadcast, kInvalidSequence, 0),
        status("has-the-time-before-the-version", kInterface, kTime, kInvalidSequence, 0),
        status("opens-partitions-before-the-session", kSerial, kOpenSerial, kInvalidSequence, 0),
        only(status("grants-no-version", kInterface, kVersion, 0, kInvalidData),
             {"version/granted", "version/tool-type/*"}),
        only(status("opens-no-session", kInterface, kOpenSession, 0, 6), {"session/open*"}),
        only(ignores("sends-no-broadcast",
                     [](const TwinFrame& frame) { return frame.isRequest() && isInterface(frame, kBroadcast); }),
             {"broadcast/to-*"}),
        only(upFault("the-time-needs-a-session",
                     [](TwinLink& link, TwinFrame frame) {
                         if (isInterface(frame, kOpenSession)) link.flag = true;
                         if (isInterface(frame, kTime) && !link.flag)
                             return link.toConsole(frame.response(kInvalidSequence));
                         link.toServer(frame);
                     }),
             {"time/*"}),
        upFault("answers-notices-for-consoles",
                [](TwinLink& link, TwinFrame frame) {
                    if (frame.isNotice() && frame.function() == kToConsole)
                        return link.toConsole(frame.response(kInvalidFunction));
                    link.toServer(frame);
                }),
        only(downFault("broadcasts-wait-for-the-version",
                       [](TwinLink& link, TwinFrame frame) {
                           link.toConsole(frame);
                           if (!frame.isResponse() || !isInterface(frame, kVersion) || frame.status() != 0) return;
                           TwinFrame late(Draft::notice(kToConsole, kBroadcastNotice).bytes());
                           late.setPayload(bigEndian16(42) + bigEndian16(0) + link.text);
                           link.toConsole(late);
                       }),
             {"broadcast/to-all/not-*"}),
        closesFor("closes-for-malformed-payloads",
                  [](const TwinFrame& frame) { return frame.is(kSerial, kOpenSerial) && frame.number(16, 4) < 8; }),
    };
}

std::vector<Fault> versionFaults()
{
    return {
        refuses("tool-ids-need-their-whole-slot", kInvalidData,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kVersion) && frame.number(16, 4) > 16 && frame.number(16, 4) < 48;
                }),
        refuses("longer-version-requests-are-refused", kInvalidData,
                [](const TwinFrame& frame) { return isInterface(frame, kVersion) && frame.number(16, 4) > 48; }),
        refuses("tool-ids-have-31-bytes", kInvalidData,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kVersion) && frame.header() == 32 && frame.number(40, 2) == 32;
                }),
        refuses("reserved-of-the-version-counts", kInvalidData,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kVersion) && frame.header() == 32 && frame.number(16, 4) >= 16 &&
                           frame.number(46, 2) != 0;
                }),
        refuses("old-versions-are-refused", 0x32,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kVersion) && frame.header() == 32 && frame.number(16, 4) >= 16 &&
                           frame.number(32, 4) == 0;
                }),
        refuses("new-versions-are-refused", 0x32,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kVersion) && frame.header() == 32 && frame.number(32, 4) == 0xFFFFFFFFU;
                }),
        refuses("tool-types-have-16-bits", kInvalidData,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kVersion) && frame.header() == 32 && frame.number(36, 2) == 0xFFFF;
                }),
        refuses("tool-ids-are-text", kInvalidData,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kVersion) && frame.payload().find('\xFF', 16) != std::string::npos;
                }),
        refuses("the-slot-after-the-tool-id-is-zero", kInvalidData,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kVersion) && frame.payload().find("####") != std::string::npos;
                }),
        seen("tool-ids-are-compared-without-their-last-byte",
             [](TwinFrame& frame) {
                 const bool isMeant =
                     isInterface(frame, kVersion) && frame.header() == 32 && frame.payload().size() == 48;
                 if (isMeant && frame.number(48 + frame.number(40, 2) - 1, 1) == 'a') {
                     frame.put(40, 2, frame.number(40, 2) - 1);
                 }
             }),
        seen("tool-types-do-not-count",
             [](TwinFrame& frame) {
                 if (isInterface(frame, kVersion) && frame.header() == 32) frame.put(36, 4, 1);
             }),
        payload("enclosure-type-is-0", kInterface, kVersion,
                [](std::string bytes) { return bytes.replace(1, 1, 1, '\0'); }),
        payload("version-response-ends-early", kInterface, kVersion,
                [](const std::string& bytes) { return bytes.substr(0, 32); }),
        payload("texts-have-rubbish-after-them", kInterface, kVersion,
                [](std::string bytes) { return bytes.replace(47, 1, "x"); }),
        [] {
            Fault fault =
                downFault("identities-are-never-free", [](TwinLink& link, TwinFrame frame) { link.toConsole(frame); });
            const auto used = std::make_shared<std::pair<std::mutex, std::set<std::string>>>();
            fault.up = [used](TwinLink& link, TwinFrame frame) {
                const bool isVersion = isInterface(frame, kVersion) && frame.isRequest();
                const std::string payload = frame.payload();
                if (isVersion && payload.size() >= 16) {
                    const std::lock_guard<std::mutex> lock(used->first);
                    if (!used->second.insert(payload.substr(4)).second) {
                        return link.toConsole(frame.response(kAlreadyConnected));
                    }
                }
                link.toServer(frame);
            };
            return fault;
        }(),
    };
}

std::vector<Fault> interfaceFaults()
{
    return {
        payload("command-size-is-16383", kInterface, kLimits,
                [](std::string bytes) { return bytes.replace(0, 2, "\x3F\xFF"); }),
        payload("broadcast-size-is-16384", kInterface, kLimits,
                [](std::string bytes) { return bytes.replace(4, 2, std::string("\x40\0", 2)); }),
        payload("no-console-is-supported", kInterface, kLimits,
                [](std::string bytes) { return bytes.replace(8, 1, 1, '\0'); }),
        payload("the-month-is-binary", kInterface, kTime,
                [](std::string bytes) { return bytes.replace(2, 1, "\x0C"); }),
        payload("the-month-counts-from-0", kInterface, kTime,
                [](std::string bytes) { return bytes.replace(2, 1, 1, '\0'); }),
        payload("the-time-is-local", kInterface, kTime,
                [](std::string bytes) { return bytes.replace(4, 1, bytes[4] == '\x12' ? "\x13" : "\x12"); }),
        downFault("the-time-stands-still-and-falls-back",
                  [](TwinLink& link, TwinFrame frame) {
                      if (frame.isResponse() && isInterface(frame, kTime) && frame.status() == 0 && link.count++ == 1) {
                          std::string bytes = frame.payload();
                          frame.setPayload(bytes.replace(0, 2, "\x20\x01"));
                      }
                      link.toConsole(frame);
                  }),
        payload("all-capabilities-are-common", kInterface, kCapabilities,
                [](const std::string&) { return std::string("\0\0\0\x04\xFF\xFF\xFF\xFF", 8); }),
        payload("capabilities-are-as-long-as-offered", kInterface, kCapabilities,
                [](const std::string& bytes) {
                    return std::string("\0\0\0\x08", 4) + bytes.substr(4) + std::string(4, '\0');
                }),
        payload("capabilities-have-3-bytes", kInterface, kCapabilities,
                [](const std::string&) { return std::string("\0\0\0\x03\0\0\0", 7); }),
        refuses("capabilities-must-have-4-bytes", kInvalidData,
                [](const TwinFrame& frame) { return isInterface(frame, kCapabilities) && frame.number(32, 4) != 4; }),
        refuses("the-time-has-no-payload", kInvalidData,
                [](const TwinFrame& frame) { return isInterface(frame, kTime) && frame.number(16, 4) != 0; }),
        refuses("sessions-have-no-payload", kInvalidData,
                [](const TwinFrame& frame) { return isInterface(frame, kOpenSession) && frame.number(16, 4) != 0; }),
    };
}

/// Changes the length field of a request's text, at an offset of its payload.
std::function<void(TwinFrame&)> wholeText(unsigned int operation, std::size_t offset)
{
    return [=](TwinFrame& frame) {
        if (!frame.isRequest() || !isInterface(frame, operation) || frame.header() != 32) return;
        if (frame.number(16, 4) < offset + 2) return;
        frame.put(32 + offset, 2, frame.number(16, 4) - static_cast<std::uint32_t>(offset) - 2);
    };
}

std::function<std::string(std::string)> cutAtZero(std::size_t fixed)
{
    return [=](std::string bytes) {
        bytes = bytes.substr(0, bytes.find('\0', fixed));
        const std::size_t length = bytes.size() - fixed;
        return bytes.replace(fixed - 2, 2, bigEndian16(static_cast<unsigned int>(length)));
    };
}

std::vector<Fault> attributeFaults()
{
    return {
        seen("the-text-of-the-mode-is-the-whole-payload", wholeText(kSetMode, 2)),
        seen("the-metadata-are-the-whole-payload", wholeText(kSetMetadata, 0)),
        payload("the-mode-ends-at-a-zero", kInterface, kGetMode, cutAtZero(4)),
        payload("the-metadata-end-at-a-zero", kInterface, kGetMetadata, cutAtZero(2)),
        payload("the-mode-has-7-bits", kInterface, kGetMode,
                [](std::string bytes) { return bytes.replace(0, 1, 1, static_cast<char>(bytes[0] & 0x7F)); }),
        payload("reserved-of-the-mode-is-not-zero", kInterface, kGetMode,
                [](std::string bytes) { return bytes.replace(1, 1, "r"); }),
        refuses("the-mode-needs-a-text", kInvalidData,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kSetMode) && frame.header() == 32 && frame.number(16, 4) == 4;
                }),
        refuses("the-metadata-are-not-empty", kInvalidData,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kSetMetadata) && frame.header() == 32 && frame.number(16, 4) == 2;
                }),
        refuses("texts-have-16000-bytes", kInvalidData,
                [](const TwinFrame& frame) {
                    return (isInterface(frame, kSetMode) || isInterface(frame, kSetMetadata)) &&
                           frame.bytes().size() > 16000;
                }),
        refuses("reserved-of-the-mode-counts", kInvalidData,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kSetMode) && frame.header() == 32 && frame.number(16, 4) >= 4 &&
                           frame.number(33, 1) != 0;
                }),
        payload("set-mode-answers-with-the-mode", kInterface, kSetMode, [](const std::string&) { return "mode"; }),
        payload("set-metadata-answers-with-the-length", kInterface, kSetMetadata,
                [](const std::string&) { return "12"; }),
        [] { // each console has a mode of its own
            Fault fault = downFault("each-console-has-attributes-of-its-own", [](TwinLink& link, TwinFrame frame) {
                if (frame.isResponse() && frame.status() == 0 && !link.flag) {
                    if (isInterface(frame, kGetMode)) frame.setPayload(std::string(4, '\0'));
                    if (isInterface(frame, kGetMetadata)) frame.setPayload(std::string(2, '\0'));
                }
                link.toConsole(frame);
            });
            fault.up = [](TwinLink& link, TwinFrame frame) {
                if (isInterface(frame, kSetMode) || isInterface(frame, kSetMetadata)) link.flag = true;
                link.toServer(frame);
            };
            return fault;
        }(),
    };
}

/// The payload of a request with the new header is replaced.
Fault broadcast(std::string name, std::function<std::string(std::string)> make)
{
    return seen(std::move(name), [=](TwinFrame& frame) {
        const bool isMeant = frame.isRequest() && isInterface(frame, kBroadcast) && frame.header() == 32;
        if (isMeant && frame.number(16, 4) >= 46) frame.setPayload(make(frame.payload()));
    });
}

std::vector<Fault> broadcastFaults()
{
    return {
        broadcast("unicast-goes-to-all", [](std::string bytes) { return bytes.replace(2, 1, 1, '\0'); }),
        broadcast("type-2-is-unknown",
                  [](std::string bytes) { return bytes[2] == '\0' ? bytes : bytes.replace(2, 1, "\x01"); }),
        broadcast("the-offset-is-46",
                  [](std::string bytes) { return bytes[1] == '\x30' ? bytes.replace(1, 1, "\x2E") : bytes; }),
        broadcast("the-text-is-the-rest",
                  [](std::string bytes) {
                      return bytes.replace(4, 2, bigEndian16(static_cast<unsigned int>(bytes.size() - 46)));
                  }),
        refuses("broadcasts-are-not-empty", kInvalidData,
                [](const TwinFrame& frame) {
                    return isInterface(frame, kBroadcast) && frame.number(36, 2) == 0 && frame.number(34, 1) == 1;
                }),
        refuses("broadcasts-have-16000-bytes", kInvalidData,
                [](const TwinFrame& frame) { return isInterface(frame, kBroadcast) && frame.bytes().size() > 16000; }),
        status("one-who-has-left-is-there", kInterface, kBroadcast, kNotAvailable, 3),
        notice("the-sender-has-no-name", kToConsole, kBroadcastNotice,
               [](TwinFrame& frame) { frame.put(40, 2, frame.number(40, 2) - 1); }),
        notice("the-sender-has-another-type", kToConsole, kBroadcastNotice,
               [](TwinFrame& frame) { frame.put(36, 4, 99); }),
        notice("the-notice-has-the-offset-of-the-request", kToConsole, kBroadcastNotice,
               [](TwinFrame& frame) {
                   const std::string bytes = frame.payload();
                   frame.setPayload(bytes.substr(0, 42) + "\1\2\3\4" + bytes.substr(42));
                   frame.put(32, 2, 46);
               }),
        notice("notices-are-requests", kToConsole, kBroadcastNotice, [](TwinFrame& frame) { frame.put(14, 1, 0x01); }),
        notice("texts-are-made-printable", kToConsole, kBroadcastNotice,
               [](TwinFrame& frame) {
                   for (std::size_t i = 32 + 42; i < frame.bytes().size(); ++i)
                       if (frame.number(i, 1) == 0) frame.put(i, 1, '.');
               }),
        upFault("broadcasts-come-back-to-the-sender",
                [](TwinLink& link, TwinFrame frame) {
                    if (frame.isRequest() && isInterface(frame, kVersion) && frame.number(16, 4) >= 48) {
                        link.kept = {frame};
                    }
                    link.toServer(frame);
                    if (!frame.isRequest() || !isInterface(frame, kBroadcast) || frame.number(34, 1) == 1) return;
                    if (link.kept.empty()) return;
                    const std::string version = link.kept.front().payload();
                    TwinFrame copy(Draft::notice(kToConsole, kBroadcastNotice).bytes());
                    copy.setPayload(bigEndian16(42) + bigEndian16(0) + version.substr(4, 4) + version.substr(8, 2) +
                                    version.substr(16, 32));
                    link.toConsole(copy);
                }),
        [] {
            Fault fault = downFault("broadcasts-overtake-each-other", [](TwinLink& link, TwinFrame frame) {
                const bool isFifth = frame.is(kToConsole, kBroadcastNotice) && link.count++ == 5;
                if (isFifth) return link.kept.push_back(frame);
                link.toConsole(frame);
                for (const TwinFrame& kept : link.kept)
                    link.toConsole(kept);
                link.kept.clear();
            });
            return fault;
        }(),
    };
}

} // namespace

std::vector<Fault> requestFaults()
{
    std::vector<Fault> all = statusFaults();
    for (const auto& part : {earlyFaults(), versionFaults(), interfaceFaults(), attributeFaults(), broadcastFaults()})
        all.insert(all.end(), part.begin(), part.end());
    // The server's answer goes out before the connection is closed.
    for (Fault& fault : all) {
        if (fault.name == "broadcasts-wait-for-the-version") {
            fault.up = [](TwinLink& link, TwinFrame frame) {
                const std::string payload = frame.payload();
                if (isInterface(frame, kVersion) && payload.size() == 48) {
                    link.text = payload.substr(4, 4) + payload.substr(8, 2) + payload.substr(16, 32);
                }
                link.toServer(frame);
            };
        }
        if (fault.name != "closes-for-early-requests") continue;
        fault.down = [](TwinLink& link, TwinFrame frame) {
            link.toConsole(frame);
            if (link.count == 1) link.cut();
        };
    }
    return all;
}

} // namespace qel::test
