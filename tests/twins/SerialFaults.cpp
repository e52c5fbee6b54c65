// What is wrong with serial sessions and their data, and with the steps to TLS.

#include "twins/FaultKit.hpp"
#include "twins/Faults.hpp"

#include <algorithm>

namespace qel::test {

namespace {

using namespace tool::check;

bool isData(const TwinFrame& frame) { return frame.is(kSerial, kDataToPartition) && frame.isNotice(); }
bool isOutput(const TwinFrame& frame) { return frame.is(kToConsole, kDataToConsole) && frame.isNotice(); }
bool isClosed(const TwinFrame& frame) { return frame.is(kToConsole, kSerialClosed) && frame.isNotice(); }

/// The data of a message of either direction.
std::string dataOf(const TwinFrame& frame) { return frame.payload().substr(6); }
void setData(TwinFrame& frame, const std::string& data)
{
    frame.setPayload(frame.payload().substr(0, 4) + bigEndian16(static_cast<unsigned int>(data.size())) + data);
}

std::vector<Fault> sessionFaults()
{
    return {
        statusOfAll("absent-partition-is-16", kInvalidPartition, kInvalidNumber),
        statusOfAll("wrong-number-is-21", kInvalidNumber, kInvalidPartition),
        status("a-held-session-is-20", kSerial, kOpenSerial, kNotAvailable, kClosureFailure),
        status("a-free-session-closes", kSerial, kCloseSerial, kClosureFailure, 0),
        status("a-session-not-held-is-set-up", kSerial, kSetUpSerial, kInvalidSequence, 0),
        status("a-malformed-open-is-4", kSerial, kOpenSerial, kInvalidData, kInvalidSequence),
        status("a-malformed-close-is-0", kSerial, kCloseSerial, kInvalidData, 0),
        status("a-malformed-set-up-is-0", kSerial, kSetUpSerial, kInvalidData, 0),
        refuses("connection-numbers-end-at-14", kInvalidNumber,
                [](const TwinFrame& frame) { return frame.is(kSerial, kOpenSerial) && frame.number(34, 2) == 15; }),
        refuses("reserved-of-open-counts", kInvalidData,
                [](const TwinFrame& frame) {
                    return frame.is(kSerial, kOpenSerial) && frame.header() == 32 && frame.number(38, 2) != 0;
                }),
        refuses("a-longer-open-is-refused", kInvalidData,
                [](const TwinFrame& frame) { return frame.is(kSerial, kOpenSerial) && frame.number(16, 4) > 8; }),
        refuses("one-session-for-a-console", kNotAvailable,
                [](const TwinFrame& frame) { return frame.is(kSerial, kOpenSerial) && frame.number(34, 2) == 1; }),
        seen("any-flag-forces",
             [](TwinFrame& frame) {
                 if (frame.is(kSerial, kOpenSerial) && frame.header() == 32 && frame.number(36, 2) != 0) {
                     frame.put(36, 2, 0x8000);
                 }
             }),
        seen("only-0x8000-forces",
             [](TwinFrame& frame) {
                 if (frame.is(kSerial, kOpenSerial) && frame.header() == 32 && frame.number(36, 2) != 0x8000) {
                     frame.put(36, 2, 0);
                 }
             }),
        seen("nothing-forces",
             [](TwinFrame& frame) {
                 if (frame.is(kSerial, kOpenSerial) && frame.header() == 32) frame.put(36, 2, 0);
             }),
        seen("any-value-forces-a-close",
             [](TwinFrame& frame) {
                 if (frame.is(kSerial, kCloseSerial) && frame.number(36, 1) != 0) frame.put(36, 1, 0xFF);
             }),
        seen("nothing-forces-a-close",
             [](TwinFrame& frame) {
                 if (frame.is(kSerial, kCloseSerial)) frame.put(36, 1, 0);
             }),
        downFault("holders-are-not-told",
                  [](TwinLink& link, TwinFrame frame) {
                      if (!isClosed(frame) || frame.number(36, 4) != kForceClosed) link.toConsole(frame);
                  }),
        notice("force-is-a-shutdown", kToConsole, kSerialClosed,
               [](TwinFrame& frame) {
                   if (frame.number(36, 4) == kForceClosed) frame.put(36, 4, 3);
               }),
        downFault("holders-are-told-twice",
                  [](TwinLink& link, TwinFrame frame) {
                      link.toConsole(frame);
                      if (isClosed(frame)) link.toConsole(frame);
                  }),
        notice("closed-notices-are-of-number-0", kToConsole, kSerialClosed,
               [](TwinFrame& frame) { frame.put(34, 2, 0); }),
        downFault("closing-is-told",
                  [](TwinLink& link, TwinFrame frame) {
                      link.toConsole(frame);
                      const bool closed = frame.is(kSerial, kCloseSerial) || frame.is(kInterface, kCloseSession);
                      if (!closed || !frame.isResponse() || frame.status() != 0) return;
                      TwinFrame extra(Draft::notice(kToConsole, kSerialClosed).bytes());
                      extra.setPayload(serialAddress(1, 0) + bigEndian32(1));
                      link.toConsole(extra);
                  }),
        payload("open-answers-without-its-number", kSerial, kOpenSerial,
                [](std::string bytes) { return bytes.replace(2, 2, 2, '\0'); }),
        payload("open-answers-with-4-bytes", kSerial, kOpenSerial,
                [](const std::string& bytes) { return bytes.substr(0, 4); }),
        payload("max-serial-has-4-bytes", kSerial, kMaxSerial, [](const std::string& bytes) { return bytes + '\0'; }),
        payload("max-serial-has-no-system", kSerial, kMaxSerial,
                [](std::string bytes) { return bytes.replace(0, 2, 2, '\0'); }),
        payload("close-serial-answers-with-its-address", kSerial, kCloseSerial,
                [](const std::string&) { return "addr"; }),
        payload("set-up-answers-with-its-address", kSerial, kSetUpSerial, [](const std::string&) { return "addr"; }),
    };
}

/// Sessions that outlive what should end them: their partitions stay held.
std::vector<Fault> lifeFaults()
{
    return {
        only(status("opens-no-partition", kSerial, kOpenSerial, 0, 6), {"serial/open*"}),
        only(status("closes-no-session-of-its-holder", kSerial, kCloseSerial, 0, kClosureFailure), {"serial/close*"}),
        only(status("sets-nothing-up", kSerial, kSetUpSerial, 0, kInvalidSequence), {"serial/set-up*"}),
        only(upFault("sets-up-once",
                     [](TwinLink& link, TwinFrame frame) {
                         const bool isSetUp = frame.is(kSerial, kSetUpSerial);
                         if (isSetUp && link.count++ > 0) return link.toConsole(frame.response(kInvalidSequence));
                         link.toServer(frame);
                     }),
             {"serial/set-up*"}),
        ignores("close-session-is-not-done",
                [](const TwinFrame& frame) { return frame.is(kInterface, kCloseSession); }),
        upFault("close-session-leaves-the-serial-sessions",
                [](TwinLink& link, TwinFrame frame) {
                    if (frame.isRequest() && frame.is(kInterface, kCloseSession))
                        return link.toConsole(frame.response(0));
                    link.toServer(frame);
                }),
        upFault("close-serial-is-only-said",
                [](TwinLink& link, TwinFrame frame) {
                    if (frame.isRequest() && frame.is(kSerial, kCloseSerial)) return link.toConsole(frame.response(0));
                    link.toServer(frame);
                }),
        notice("ended-commands-are-a-shutdown", kToConsole, kSerialClosed,
               [](TwinFrame& frame) {
                   if (frame.number(36, 4) == 4) frame.put(36, 4, 3);
               }),
        notice("how-commands-end-is-not-said", kToConsole, kSerialClosed,
               [](TwinFrame& frame) { frame.put(24, 2, 0); }),
        notice("commands-end-with-a-status", kToConsole, kSerialClosed,
               [](TwinFrame& frame) {
                   if (frame.number(36, 4) == 4) frame.put(22, 2, 6);
               }),
        downFault("data-follow-the-notice",
                  [](TwinLink& link, TwinFrame frame) {
                      link.toConsole(frame);
                      if (!isClosed(frame)) return;
                      TwinFrame late(Draft::notice(kToConsole, kDataToConsole).bytes());
                      late.setPayload(frame.payload().substr(0, 4) + bigEndian16(4) + "late");
                      link.toConsole(late);
                  }),
        downFault("ended-commands-are-told-to-number-0-only",
                  [](TwinLink& link, TwinFrame frame) {
                      const bool isWatcher = isClosed(frame) && frame.number(34, 2) != 0 && frame.number(36, 4) == 4;
                      if (!isWatcher) link.toConsole(frame);
                  }),
        downFault("ended-commands-are-not-told",
                  [](TwinLink& link, TwinFrame frame) {
                      if (!isClosed(frame) || frame.number(36, 4) != 4) link.toConsole(frame);
                  }),
    };
}

/// Changes what is typed.
Fault typed(std::string name, std::function<std::string(std::string)> make)
{
    return seen(std::move(name), [=](TwinFrame& frame) {
        if (isData(frame) && frame.header() == 32 && frame.number(36, 2) + 6 == frame.number(16, 4)) {
            setData(frame, make(dataOf(frame)));
        }
    });
}

std::vector<Fault> typingFaults()
{
    return {
        typed("zero-bytes-are-dropped",
              [](std::string data) {
                  data.erase(std::remove(data.begin(), data.end(), '\0'), data.end());
                  return data;
              }),
        typed("data-have-7-bits",
              [](std::string data) {
                  for (char& c : data)
                      c = static_cast<char>(c & 0x7F);
                  return data;
              }),
        typed("data-have-4096-bytes", [](const std::string& data) { return data.substr(0, 4096); }),
        seen("the-length-of-data-is-the-payload",
             [](TwinFrame& frame) {
                 if (isData(frame) && frame.header() == 32) frame.put(36, 2, frame.number(16, 4) - 6);
             }),
        seen("data-beyond-the-payload-are-cut",
             [](TwinFrame& frame) {
                 if (isData(frame) && frame.header() == 32 && frame.number(36, 2) + 6 > frame.number(16, 4)) {
                     frame.put(36, 2, frame.number(16, 4) - 6);
                 }
             }),
        seen("the-pad-is-data",
             [](TwinFrame& frame) {
                 if (!isData(frame) || frame.header() != 32 || frame.number(15, 1) == 0) return;
                 setData(frame, frame.bytes().substr(38));
             }),
        ignores("old-data-are-ignored", [](const TwinFrame& frame) { return isData(frame) && frame.header() == 24; }),
        seen("data-are-for-number-0",
             [](TwinFrame& frame) {
                 if (isData(frame) && frame.header() == 32 && frame.number(32, 2) == 1) frame.put(34, 2, 0);
             }),
        upFault("data-are-answered",
                [](TwinLink& link, TwinFrame frame) {
                    if (isData(frame)) link.toConsole(frame.response(0));
                    link.toServer(frame);
                }),
        upFault("data-overtake-each-other",
                [](TwinLink& link, TwinFrame frame) {
                    const bool isLate = isData(frame) && frame.bytes().find("piece 7;") != std::string::npos;
                    if (isLate) return link.kept.push_back(frame);
                    link.toServer(frame);
                    for (const TwinFrame& kept : link.kept)
                        link.toServer(kept);
                    link.kept.clear();
                }),
        upFault("early-data-are-kept",
                [](TwinLink& link, TwinFrame frame) {
                    const bool isSetUp = frame.is(kSerial, kSetUpSerial);
                    if (frame.is(kSerial, kOpenSerial)) link.flag = true;
                    if (isData(frame) && link.flag) return link.kept.push_back(frame);
                    link.toServer(frame);
                    if (!isSetUp) return;
                    link.flag = false;
                    for (const TwinFrame& kept : link.kept)
                        link.toServer(kept);
                    link.kept.clear();
                }),
    };
}

std::vector<Fault> outputFaults()
{
    return {
        notice("output-is-of-number-0", kToConsole, kDataToConsole, [](TwinFrame& frame) { frame.put(34, 2, 0); }),
        notice("output-has-a-pad", kToConsole, kDataToConsole,
               [](TwinFrame& frame) {
                   frame.bytes() += std::string(4, '\0');
                   frame.put(4, 4, static_cast<std::uint32_t>(frame.bytes().size()));
                   frame.put(15, 1, 4);
               }),
        notice("output-has-a-longer-payload", kToConsole, kDataToConsole,
               [](TwinFrame& frame) { frame.setPayload(frame.payload() + "x"); }),
        downFault("watchers-are-not-told",
                  [](TwinLink& link, TwinFrame frame) {
                      const bool isNote =
                          isOutput(frame) && frame.bytes().find("[qel: watching only") != std::string::npos;
                      if (!isNote) link.toConsole(frame);
                  }),
        downFault("watchers-get-nothing",
                  [](TwinLink& link, TwinFrame frame) {
                      if (!isOutput(frame) || frame.number(34, 2) == 0) link.toConsole(frame);
                  }),
        downFault("data-come-before-the-response-to-set-up",
                  [](TwinLink& link, TwinFrame frame) {
                      if (frame.isResponse() && frame.is(kSerial, kSetUpSerial) && frame.status() == 0) {
                          TwinFrame early(Draft::notice(kToConsole, kDataToConsole).bytes());
                          early.setPayload(serialAddress(1, 0) + bigEndian16(5) + "early");
                          link.toConsole(early);
                      }
                      link.toConsole(frame);
                  }),
        downFault("data-come-without-set-up",
                  [](TwinLink& link, TwinFrame frame) {
                      link.toConsole(frame);
                      if (!frame.isResponse() || !frame.is(kSerial, kOpenSerial) || frame.status() != 0) return;
                      TwinFrame early(Draft::notice(kToConsole, kDataToConsole).bytes());
                      early.setPayload(frame.payload().substr(0, 4) + bigEndian16(5) + "early");
                      link.toConsole(early);
                  }),
        downFault("data-come-after-close",
                  [](TwinLink& link, TwinFrame frame) {
                      link.toConsole(frame);
                      if (!frame.isResponse() || !frame.is(kSerial, kCloseSerial) || frame.status() != 0) return;
                      TwinFrame late(Draft::notice(kToConsole, kDataToConsole).bytes());
                      late.setPayload(serialAddress(1, 0) + bigEndian16(4) + "late");
                      link.toConsole(late);
                  }),
        [] { // what was there before is dropped until something is typed
            Fault fault = downFault("output-is-not-repeated", [](TwinLink& link, TwinFrame frame) {
                if (!isOutput(frame) || link.flag) link.toConsole(frame);
            });
            fault.up = [](TwinLink& link, TwinFrame frame) {
                if (isData(frame)) link.flag = true;
                link.toServer(frame);
            };
            return fault;
        }(),
        upFault("set-up-twice-repeats-the-output",
                [](TwinLink& link, TwinFrame frame) {
                    if (frame.is(kSerial, kSetUpSerial) && link.count++ > 0) {
                        TwinFrame again(Draft::notice(kToConsole, kDataToConsole).bytes());
                        again.setPayload(frame.payload().substr(0, 4) + bigEndian16(5) + "again");
                        link.toConsole(again);
                    }
                    link.toServer(frame);
                }),
    };
}

Fault tlsFault(std::string name, Fault::Tls tls)
{
    Fault fault;
    fault.name = std::move(name);
    fault.tls = tls;
    return fault;
}

} // namespace

std::vector<Fault> serialFaults()
{
    std::vector<Fault> all = sessionFaults();
    for (const auto& part : {lifeFaults(), typingFaults(), outputFaults()})
        all.insert(all.end(), part.begin(), part.end());
    return all;
}

std::vector<Fault> serverFaults()
{
    std::vector<Fault> all = frameFaults();
    for (const auto& part : {requestFaults(), serialFaults()})
        all.insert(all.end(), part.begin(), part.end());
    return all;
}

std::vector<Fault> tlsFaults()
{
    using Tls = Fault::Tls;
    return {
        tlsFault("grants-anything", Tls::GrantsAnything),
        tlsFault("grants-twice", Tls::AnswersTwice),
        tlsFault("answers-with-a-payload", Tls::AnswersWithPayload),
        tlsFault("answers-as-a-request", Tls::AnswersAsRequest),
        tlsFault("ignores-early-data", Tls::IgnoresEarlyData),
        tlsFault("stays-in-the-clear", Tls::StaysInTheClear),
        tlsFault("grants-nothing-to-the-old-header", Tls::RefusesOldHeader),
        tlsFault("aborts-with-a-payload", Tls::AbortsWithPayload),
        tlsFault("stays-after-the-abort", Tls::StaysAfterAbort),
        tlsFault("does-not-ask-for-certificates", Tls::DoesNotAskForCertificates),
        tlsFault("accepts-other-roots", Tls::AcceptsOtherRoots),
        tlsFault("accepts-tls-1.2", Tls::AcceptsOldTls),
        tlsFault("upgrades-inside", Tls::UpgradesInside),
        tlsFault("answers-garbage", Tls::AnswersGarbage),
        tlsFault("waits-after-garbage", Tls::WaitsAfterGarbage),
        onlyInTime(tlsFault("gives-the-tls-handshake-ten-seconds", Tls::None), {"tls/deadline/*"}),
        tlsFault("one-at-a-time", Tls::OneAtATime),
        tlsFault("does-not-notice-the-end-of-the-stream-before-tls", Tls::StaysAtTheEnd),
    };
}

} // namespace qel::test
