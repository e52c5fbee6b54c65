// What is wrong with the frames: reading them and writing them.

#include "twins/FaultKit.hpp"
#include "twins/Faults.hpp"

namespace qel::test {

namespace {

using namespace tool::check;

bool isRightLength(const TwinFrame& frame)
{
    return frame.header() + frame.number(16, 4) + frame.number(15, 1) == frame.bytes().size();
}

std::vector<Fault> readingFaults()
{
    return {
        seen("accepts-any-eyecatcher", [](TwinFrame& frame) { frame.put(0, 3, 0xDECAFF); }),
        seen("compares-two-bytes-of-the-eyecatcher", [](TwinFrame& frame) { frame.put(2, 1, 0xFF); }),
        seen("accepts-any-header-version",
             [](TwinFrame& frame) {
                 if (frame.number(3, 1) != 0) frame.put(3, 1, 0x20);
             }),
        seen("accepts-header-version-0x21",
             [](TwinFrame& frame) {
                 if (frame.number(3, 1) == 0x21) frame.put(3, 1, 0x20);
             }),
        closesFor("refuses-frames-of-16384", [](const TwinFrame& frame) { return frame.bytes().size() == 16384; }),
        closesFor("refuses-the-old-header", [](const TwinFrame& frame) { return frame.number(3, 1) == 0; }),
        closesFor("refuses-pads-of-new-frames",
                  [](const TwinFrame& frame) { return frame.number(3, 1) != 0 && frame.number(15, 1) != 0; }),
        closesFor("refuses-larger-pads-of-old-frames",
                  [](const TwinFrame& frame) { return frame.number(3, 1) == 0 && frame.number(15, 1) > 16; }),
        seen("accepts-short-pads-of-old-frames",
             [](TwinFrame& frame) {
                 if (frame.number(3, 1) != 0 || frame.bytes().size() >= 40 || frame.bytes().size() < 24) return;
                 frame.bytes().resize(40, '\0');
                 frame.put(4, 4, 40);
                 frame.put(15, 1, 16 - frame.number(16, 4));
             }),
        seen("does-not-compare-the-lengths",
             [](TwinFrame& frame) {
                 if (frame.number(3, 1) != 0x20 || frame.bytes().size() < 32 || isRightLength(frame)) return;
                 frame.put(15, 1, 0);
                 frame.put(16, 4, static_cast<std::uint32_t>(frame.bytes().size() - 32));
             }),
        seen("adds-the-lengths-in-32-bits",
             [](TwinFrame& frame) {
                 if (frame.number(16, 4) != 0xFFFFFFFFU) return;
                 frame.put(15, 1, 0);
                 frame.put(16, 4, 0);
             }),
        closesFor("requires-zero-in-reserved-fields",
                  [](const TwinFrame& frame) {
                      return frame.header() == 32 && frame.bytes().size() >= 32 &&
                             (frame.number(26, 2) != 0 || frame.number(28, 4) != 0);
                  }),
        ignores("compares-the-whole-flag-byte",
                [](const TwinFrame& frame) { return frame.isRequest() && frame.flags() != 0x80; }),
        seen("takes-both-flags-for-a-request",
             [](TwinFrame& frame) {
                 if ((frame.flags() & 0xC0U) == 0xC0) frame.put(14, 1, 0x80);
             }),
        seen("answers-notices",
             [](TwinFrame& frame) {
                 if (frame.isNotice() && frame.function() == kInterface) frame.put(14, 1, 0x80);
             }),
        seen("answers-responses",
             [](TwinFrame& frame) {
                 if (frame.isResponse()) frame.put(14, 1, 0x80);
             }),
        closesFor("closes-for-an-unasked-response", [](const TwinFrame& frame) { return frame.isResponse(); }),
        closesFor("closes-for-unknown-operations",
                  [](const TwinFrame& frame) { return frame.isNotice() && frame.is(kSerial, 0x04FF); }),
        closesFor("closes-for-large-notices-of-unknown-functions",
                  [](const TwinFrame& frame) {
                      return frame.isNotice() && frame.bytes().size() > 3000 && frame.function() > 0x9000;
                  }),
        upFault("answers-a-thousand-requests",
                [](TwinLink& link, TwinFrame frame) {
                    if (++link.count < 1000 || !frame.isRequest()) link.toServer(frame);
                }),
        closesFor("closes-for-an-abort",
                  [](const TwinFrame& frame) { return frame.isNotice() && frame.is(kHandshake, kAbort); }),
        closesFor("closes-for-unknown-notices",
                  [](const TwinFrame& frame) { return frame.isNotice() && frame.function() == 0x9999; }),
    };
}

Fault rawFault(std::string name, std::function<bool(TwinLink&, std::string&)> raw)
{
    Fault fault;
    fault.name = std::move(name);
    fault.raw = std::move(raw);
    return fault;
}

std::uint32_t announced(const std::string& bytes) { return TwinFrame(bytes).number(4, 4); }

/// Whether the first frame is whole, or malformed in its length.
bool isBadLength(const std::string& bytes)
{
    return bytes.size() >= 8 && (announced(bytes) <= 8 || announced(bytes) > 16384);
}

std::vector<Fault> endFaults()
{
    Fault halfClose;
    halfClose.name = "drops-everything-at-a-half-close";
    halfClose.dropsHalfClose = true;
    halfClose.only = {"frame/end/half-*"}; // whether the server has noticed when the console has is luck
    Fault stays;
    stays.name = "does-not-notice-the-end-of-the-stream";
    stays.staysAtTheEnd = true;
    stays.only = {"frame/cut/*", "frame/end/*"};
    Fault outlives;
    outlives.name = "connections-outlive-their-consoles";
    outlives.outlivesItsConsole = true;
    outlives.only = {"frame/end/forgotten", "serial/disconnect/frees", "robust/reset/*", "broadcast/refused/left"};
    Fault one;
    one.name = "serves-one-connection-at-a-time";
    one.tls = Fault::Tls::OneAtATime;
    one.only = {"robust/many/*", "robust/unread-responses"};
    Fault few;
    few.name = "serves-thirty-connections-in-all";
    few.mostConnections = 30;
    few.only = {"robust/many/one-after-the-other"};
    Fault none;
    none.name = "ends-for-good-after-a-disturbance";
    none.mostConnections = 5;
    none.only = {"robust/many/noise", "robust/many/reset", "robust/every-byte/*"};
    Fault single;
    single.name = "serves-one-connection-in-all";
    single.mostConnections = 1;
    single.only = {"robust/reset/inside-a-frame"};
    Fault open;
    open.name = "never-ends-a-connection";
    open.staysOpen = true;
    open = onlyInTime(open, {"robust/deadline/*"});
    Fault idle;
    idle.name = "ends-idle-connections";
    idle.endsIdle = true;
    idle = onlyInTime(idle, {"robust/deadline/idle"});
    return {halfClose, stays, outlives, one, few, none, single, open, idle};
}

std::vector<Fault> streamFaults()
{
    return {
        rawFault("grants-tls-without-tls",
                 [](TwinLink& link, std::string& bytes) {
                     const TwinFrame first(bytes);
                     if (!first.is(kHandshake, kUpgrade)) return true;
                     link.toConsole(first);
                     bytes.clear();
                     return true;
                 }),
        rawFault("waits-when-tls-comes",
                 [](TwinLink&, std::string& bytes) { return bytes.empty() || bytes.front() != '\x16'; }),
        ignores("waits-for-a-whole-header",
                [](const TwinFrame& frame) { return frame.number(3, 1) == 0x20 && frame.bytes().size() < 32; }),
        closesFor("refuses-frames-of-16383", [](const TwinFrame& frame) { return frame.bytes().size() == 16383; }),
        closesFor("refuses-frames-of-33", [](const TwinFrame& frame) { return frame.bytes().size() == 33; }),
        only(
            ignores("frames-must-have-a-payload",
                    [](const TwinFrame& frame) { return frame.is(kInterface, kLimits) && frame.bytes().size() == 32; }),
            {"frame/length/3*"}),
        upFault("an-id-that-repeats-is-a-repetition",
                [](TwinLink& link, TwinFrame frame) {
                    if (frame.isRequest() && link.count == frame.number(8, 4) && frame.number(8, 4) == 7) return;
                    link.count = frame.number(8, 4);
                    link.toServer(frame);
                }),
        notice("aborts-with-a-payload-without-tls", kHandshake, kAbort,
               [](TwinFrame& frame) { frame.setPayload("why"); }),
        only(response("counts-caller-ids-of-its-own", kInterface, kLimits,
                      [](TwinFrame& frame) { frame.put(8, 4, frame.number(8, 4) ^ 0x40U); }),
             {"frame/caller-id/*"}),
        rawFault("drops-frames-of-a-wrong-length",
                 [](TwinLink&, std::string& bytes) {
                     if (isBadLength(bytes)) bytes.erase(0, 32);
                     return true;
                 }),
        rawFault("takes-a-length-of-9-for-too-short",
                 [](TwinLink& link, std::string& bytes) {
                     if (bytes.size() >= 8 && announced(bytes) == 9) link.cut();
                     return true;
                 }),
        only(rawFault("reads-one-frame-of-a-segment",
                      [](TwinLink&, std::string& bytes) {
                          if (bytes.size() > 8 && !isBadLength(bytes) && bytes.size() > announced(bytes)) {
                              bytes.resize(announced(bytes));
                          }
                          return true;
                      }),
             {"frame/joined/*", "data/joined"}),
        only(rawFault("expects-whole-frames",
                      [](TwinLink& link, std::string& bytes) {
                          if (!bytes.empty() &&
                              (bytes.size() < 8 || (!isBadLength(bytes) && bytes.size() < announced(bytes)))) {
                              link.cut();
                          }
                          return true;
                      }),
             {"frame/split/*"}),
        upFault("answers-after-a-malformed-frame",
                [](TwinLink& link, TwinFrame frame) {
                    if (frame.number(0, 3) == 0xDECAFF) return link.toServer(frame);
                    if (frame.number(0, 3) != 0x00CAFF) return link.cut();
                }),
    };
}

std::vector<Fault> writingFaults()
{
    return {
        response("keeps-31-bits-of-the-caller-id", kInterface, kLimits,
                 [](TwinFrame& frame) { frame.put(8, 4, frame.number(8, 4) & 0x7FFFFFFFU); }),
        only(response("answers-with-another-caller-id", kInterface, kGetMode,
                      [](TwinFrame& frame) { frame.put(8, 4, frame.number(8, 4) + 1); }),
             {"response/get-*"}),
        only(response("answers-without-the-caller-id", kInterface, kGetMetadata,
                      [](TwinFrame& frame) { frame.put(8, 4, 0); }),
             {"response/get-*"}),
        response("responses-have-0x41", kInterface, kGetMetadata, [](TwinFrame& frame) { frame.put(14, 1, 0x41); }),
        response("responses-have-a-pad", kInterface, kCloseSession,
                 [](TwinFrame& frame) {
                     frame.bytes() += std::string(8, '\0');
                     frame.put(4, 4, 40);
                     frame.put(15, 1, 8);
                 }),
        response("reserved-fields-are-not-zero", kInterface, kOpenSession,
                 [](TwinFrame& frame) { frame.put(28, 4, 0xA5A5A5A5U); }),
        response("responses-have-the-old-header", kSerial, kMaxSerial,
                 [](TwinFrame& frame) {
                     if (frame.status() != 0) return;
                     std::string bytes = frame.bytes();
                     bytes = bytes.substr(0, 24) + bytes.substr(32) + std::string(13, '\0');
                     frame.bytes() = bytes;
                     frame.put(3, 1, 0);
                     frame.put(4, 4, 40);
                     frame.put(15, 1, 13);
                 }),
        upFault("answers-old-frames-in-kind",
                [](TwinLink& link, TwinFrame frame) {
                    link.flag = frame.number(3, 1) == 0 && frame.is(kInterface, kLimits);
                    link.toServer(frame);
                }),
        downFault("answers-twice",
                  [](TwinLink& link, TwinFrame frame) {
                      link.toConsole(frame);
                      if (frame.isResponse() && frame.is(kInterface, kGetMode)) link.toConsole(frame);
                  }),
        downFault("answers-in-another-order",
                  [](TwinLink& link, TwinFrame frame) {
                      // A time that waits for the limits comes after them.
                      if (frame.isResponse() && frame.is(kInterface, kLimits) && frame.status() == 0 &&
                          link.count++ > 0) {
                          link.kept.push_back(frame);
                          return;
                      }
                      link.toConsole(frame);
                      for (const TwinFrame& kept : link.kept)
                          link.toConsole(kept);
                      link.kept.clear();
                  }),
        downFault("answers-refused-requests-with-a-payload",
                  [](TwinLink& link, TwinFrame frame) {
                      if (frame.isResponse() && frame.status() != 0) frame.setPayload("why");
                      link.toConsole(frame);
                  }),
        downFault("refused-responses-lose-their-function",
                  [](TwinLink& link, TwinFrame frame) {
                      if (frame.isResponse() && frame.status() == kInvalidFunction) frame.put(12, 2, kInterface);
                      link.toConsole(frame);
                  }),
    };
}

} // namespace

std::vector<Fault> frameFaults()
{
    std::vector<Fault> all = readingFaults();
    for (const auto& part : {endFaults(), streamFaults(), writingFaults()})
        all.insert(all.end(), part.begin(), part.end());
    // Two directions of one fault.
    for (Fault& fault : all) {
        if (fault.name != "answers-old-frames-in-kind") continue;
        fault.down = [](TwinLink& link, TwinFrame frame) {
            if (link.flag && frame.is(kInterface, kLimits)) {
                frame.bytes().erase(24, 8);
                frame.put(3, 1, 0);
                frame.put(4, 4, 40);
            }
            link.toConsole(frame);
        };
    }
    return all;
}

} // namespace qel::test
