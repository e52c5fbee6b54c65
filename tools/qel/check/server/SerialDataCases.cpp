#include "check/Anchors.hpp"
#include "check/Trial.hpp"
#include "check/server/Checks.hpp"
#include "check/server/ServerCases.hpp"

#include <functional>
#include <string>
#include <utility>

namespace qel::tool::check {

namespace {

using namespace anchors;

constexpr unsigned int kForce = 0x8000;
constexpr std::size_t kFixed = 6; // bytes of a data message before the data

/// The data of one session, as they arrive. Borrows the connection.
class Data {
public:
    Data(Wire& wire, unsigned int partition, unsigned int number) : mWire(wire), mPartition(partition), mNumber(number)
    {}

    void type(const std::string& text) { mWire.send(dataToPartition(mPartition, mNumber, text)); }

    /// Takes data until they contain the text. @return what came before it since the last call
    std::string readUntil(const std::string& text)
    {
        std::size_t found = 0;
        while ((found = mData.find(text)) == std::string::npos)
            pTake();
        std::string before = mData.substr(0, found);
        mData.erase(0, found + text.size());
        return before;
    }

    /// The next byte.
    char next()
    {
        while (mData.empty())
            pTake();
        const char byte = mData.front();
        mData.erase(0, 1);
        return byte;
    }

    Wire& wire() { return mWire; }

private:
    void pTake()
    {
        const Frame notice = mWire.awaitNotice(kToConsole, kDataToConsole);
        requirePayload(notice, kFixed + notice.u16At(4));
        Trial::requireEqual("data of the partition", mPartition, notice.u16At(0));
        Trial::requireEqual("data of the connection number", mNumber, notice.u16At(2));
        mData += notice.payload.substr(kFixed);
    }

    Wire& mWire;
    const unsigned int mPartition;
    const unsigned int mNumber;
    std::string mData;
};

/// A session that is set up, and whose line has been seen to send back exactly what it gets.
///
/// A command that makes its terminal raw has a moment before it, in which the terminal itself echoes and turns line
/// feeds into pairs. So lines are typed until one comes back unchanged; what was typed before has come back by then.
Data echoing(Trial& trial, unsigned int number = 0)
{
    constexpr int kAttempts = 1000;
    Wire& wire = trial.serial(trial.echoPartition(), number);
    wire.expectStatus(setUpSerial(trial.echoPartition(), number), 0);
    Data data(wire, trial.echoPartition(), number);
    for (int i = 0; i < kAttempts; ++i) {
        const std::string text = trial.newText();
        data.type(text + "\n");
        data.readUntil(text);
        if (data.next() == '\n') return data;
    }
    throw Skip("the line of --echo-partition changes what it sends back");
}

/// What comes back between two marks must be exactly this.
void requireBetween(Trial& trial, Data& data, const std::function<void()>& type, const std::string& expected)
{
    const std::string begin = trial.newText();
    const std::string end = trial.newText();
    data.type(begin);
    data.readUntil(begin);
    type();
    data.type(end);
    const std::string seen = data.readUntil(end);
    Trial::require(seen == expected, "exactly what was typed, " + std::to_string(expected.size()) + " bytes",
                   std::to_string(seen.size()) + (seen.size() == expected.size() ? " other bytes" : " bytes"));
}

std::string everyByte()
{
    std::string bytes;
    for (int i = 0; i < 256; ++i)
        bytes += static_cast<char>(i);
    return bytes;
}

/// A case that types between two marks.
Case comesBack(const char* name, const char* requirement, const char* anchor, Level level, std::string expected,
               std::function<void(Trial&, Data&)> type)
{
    return {std::string("data/") + name,
            requirement,
            anchor,
            level,
            kEchoPartition,
            [expected = std::move(expected), type = std::move(type)](Trial& trial) {
                Data data = echoing(trial);
                requireBetween(
                    trial, data, [&] { type(trial, data); }, expected);
            }};
}

std::string manyPieces()
{
    std::string all;
    for (int i = 0; i < 200; ++i)
        all += "piece " + std::to_string(i) + ";";
    return all;
}

Cases echoCases()
{
    const std::string longest = std::string(16384 - 32 - kFixed, 'd');
    return {
        comesBack("to-and-fro", "Data go to the partition and come back.", kSerialSessions, Level::Rule, "hello",
                  [](Trial&, Data& data) { data.type("hello"); }),
        comesBack("every-byte", "All 256 values of a byte pass both ways.", kDataToOs, Level::Rule, everyByte(),
                  [](Trial&, Data& data) { data.type(everyByte()); }),
        comesBack("order", "Data of many messages arrive in their order.", kFlowControl, Level::Rule, manyPieces(),
                  [](Trial&, Data& data) {
                      for (int i = 0; i < 200; ++i)
                          data.type("piece " + std::to_string(i) + ";");
                  }),
        comesBack("joined", "Several data messages may come in one segment.", kFrame, Level::Wire, "onetwothree",
                  [](Trial& trial, Data& data) {
                      std::string together;
                      for (const char* text : {"one", "two", "three"})
                          together += dataToPartition(trial.echoPartition(), 0, text).bytes();
                      data.wire().send(together);
                  }),
        comesBack("longest", "A data message may have 16384 bytes.", kLimitsOfFrames, Level::Wire, longest,
                  [longest](Trial&, Data& data) { data.type(longest); }),
        comesBack("empty", "A data message with the length 0 has no data, even if bytes follow.", kOddCorners,
                  Level::Wire, "",
                  [](Trial& trial, Data& data) {
                      data.wire().send(dataToPartition(trial.echoPartition(), 0, "not data", 0));
                      data.type("");
                  }),
        comesBack(
            "length-counts", "Bytes of the payload beyond the length are not data.", kDataToOs, Level::Wire, "abc",
            [](Trial& trial, Data& data) { data.wire().send(dataToPartition(trial.echoPartition(), 0, "abcdef", 3)); }),
        comesBack(
            "beyond-payload", "A data message whose length is beyond its payload is ignored.", kDataToOs, Level::Wire,
            "",
            [](Trial& trial, Data& data) { data.wire().send(dataToPartition(trial.echoPartition(), 0, "abc", 4)); }),
        comesBack(
            "old-header", "A data message with the old header is served.", kDataToOs, Level::Wire, "old",
            [](Trial& trial, Data& data) { data.wire().send(dataToPartition(trial.echoPartition(), 0, "old").old()); }),
        comesBack("padded", "The pad of a data message is not data.", kPad, Level::Wire, "padded",
                  [](Trial& trial, Data& data) {
                      data.wire().send(dataToPartition(trial.echoPartition(), 0, "padded").pad(3, 'p'));
                  }),
        comesBack("set-up-twice", "A second set-up changes nothing: no output is repeated.", kRequests, Level::Rule, "",
                  [](Trial& trial, Data& data) { data.wire().expectStatus(setUpSerial(trial.echoPartition(), 0), 0); }),
        comesBack("of-a-number-not-held", "Data for a connection number that the sender does not hold are ignored.",
                  kAnswered, Level::Rule, "",
                  [](Trial& trial, Data& data) {
                      data.wire().send(dataToPartition(trial.echoPartition(), 1, "of number 1"));
                  }),
        comesBack("of-another-console", "Data of a console that does not hold the session are ignored.", kAnswered,
                  Level::Rule, "",
                  [](Trial& trial, Data&) {
                      Wire& other = trial.session();
                      other.send(dataToPartition(trial.echoPartition(), 0, "of another console"));
                      other.fence();
                      other.expectNothingKept("no answer");
                  }),
    };
}

Cases formCases()
{
    return {
        {"data/notice-form", "The data notice has the documented form.", kDataToDax, Level::Wire, kEchoPartition,
         [](Trial& trial) {
             Data data = echoing(trial);
             data.type("form");
             const Frame notice = data.wire().awaitNotice(kToConsole, kDataToConsole);
             requireNoticeHeader(notice);
             Trial::require(notice.u16At(4) > 0, "data", "none");
             requirePayload(notice, kFixed + notice.u16At(4));
         }},
        {"data/not-before-set-up", "No data come before the session is set up.", kSerialSessions, Level::Rule,
         kEchoPartition,
         [](Trial& trial) {
             Wire& wire = echoing(trial).wire(); // there is output to be repeated
             wire.expectStatus(closeSerial(trial.echoPartition(), 0), 0);
             Wire& other = trial.serial(trial.echoPartition());
             other.fence();
             other.expectNothingKept("no data before the session is set up");
         }},
        {"data/typed-before-set-up", "Data for a session that is not set up are ignored.", kAnswered, Level::Rule,
         kEchoPartition,
         [](Trial& trial) {
             echoing(trial).wire().expectStatus(closeSerial(trial.echoPartition(), 0), 0);
             Wire& wire = trial.serial(trial.echoPartition());
             const std::string early = trial.newText();
             wire.send(dataToPartition(trial.echoPartition(), 0, early));
             wire.expectStatus(setUpSerial(trial.echoPartition(), 0), 0);
             Data data(wire, trial.echoPartition(), 0);
             const std::string end = trial.newText();
             data.type(end);
             Trial::require(data.readUntil(end).find(early) == std::string::npos, "no data from before the set-up",
                            "them");
         }},
        {"data/not-after-close", "After a session is closed, no more of its data come, and what is typed is ignored.",
         kSerialSessions, Level::Rule, kEchoPartition,
         [](Trial& trial) {
             Data data = echoing(trial);
             data.wire().expectStatus(closeSerial(trial.echoPartition(), 0), 0);
             data.wire().takeKept();
             data.type("too late");
             data.wire().fence();
             data.wire().expectNothingKept("nothing");
         }},
        {"data/not-after-force", "The holder that has lost its session gets no more of its data.", kSerialSessions,
         Level::Rule, kEchoPartition,
         [](Trial& trial) {
             Data data = echoing(trial);
             Wire& other = trial.session();
             other.expectStatus(openSerial(trial.echoPartition(), 0, kForce), 0);
             other.expectStatus(setUpSerial(trial.echoPartition(), 0), 0);
             data.wire().awaitNotice(kToConsole, kSerialClosed);
             data.wire().takeKept();
             Data taken(other, trial.echoPartition(), 0);
             const std::string text = trial.newText();
             taken.type(text);
             taken.readUntil(text);
             data.wire().fence();
             data.wire().expectNothingKept("no data of a session that is held by another console");
         }},
        {"data/repeated", "The newest output comes first when a session is set up, also on another console.",
         kUnattended, Level::Rule, kEchoPartition,
         [](Trial& trial) {
             Data data = echoing(trial);
             const std::string text = trial.newText();
             data.type(text);
             data.readUntil(text);
             data.wire().expectStatus(closeSerial(trial.echoPartition(), 0), 0);
             Wire& other = trial.serial(trial.echoPartition());
             other.expectStatus(setUpSerial(trial.echoPartition(), 0), 0);
             Data(other, trial.echoPartition(), 0).readUntil(text);
         }},
    };
}

Cases watchCases()
{
    return {
        {"data/watch/same", "A session on another number than 0 gets the same data, with its own number.", kWatching,
         Level::Rule, kEchoPartition,
         [](Trial& trial) {
             Data data = echoing(trial);
             Wire& wire = trial.serial(trial.echoPartition(), 1);
             wire.expectStatus(setUpSerial(trial.echoPartition(), 1), 0);
             Data watcher(wire, trial.echoPartition(), 1);
             const std::string text = trial.newText();
             data.type(text);
             data.readUntil(text);
             watcher.readUntil(text);
         }},
        {"data/watch/input-is-dropped", "What a watching session types does not reach the partition; it is told so.",
         kWatching, Level::Rule, kEchoPartition,
         [](Trial& trial) {
             Data data = echoing(trial);
             Wire& wire = trial.serial(trial.echoPartition(), 1);
             wire.expectStatus(setUpSerial(trial.echoPartition(), 1), 0);
             Data watcher(wire, trial.echoPartition(), 1);
             requireBetween(
                 trial, data,
                 [&] {
                     watcher.type("of a watcher");
                     watcher.readUntil("[qel: watching only, input is not passed on]");
                 },
                 "");
         }},
        {"data/watch/goes-on", "A watching session goes on when the one on number 0 is closed.", kWatching, Level::Rule,
         kEchoPartition,
         [](Trial& trial) {
             Data data = echoing(trial);
             Wire& wire = trial.serial(trial.echoPartition(), 1);
             wire.expectStatus(setUpSerial(trial.echoPartition(), 1), 0);
             data.wire().expectStatus(closeSerial(trial.echoPartition(), 0), 0);
             Data again = echoing(trial);
             const std::string text = trial.newText();
             again.type(text);
             Data(wire, trial.echoPartition(), 1).readUntil(text);
         }},
    };
}

/// Opens the session of the command that ends with a line, and types it.
/// @return the connection, from which the notice is to come
Wire& endedCommand(Trial& trial)
{
    Wire& wire = trial.serial(trial.endingPartition());
    wire.expectStatus(setUpSerial(trial.endingPartition(), 0), 0);
    wire.send(dataToPartition(trial.endingPartition(), 0, "end\n"));
    return wire;
}

Cases endCases()
{
    return {
        {"data/end/reason", "When a command ends, its sessions end with the notice with reason 4.", kSerialSessions,
         Level::Rule, kEndingPartition,
         [](Trial& trial) {
             const Frame notice = endedCommand(trial).awaitNotice(kToConsole, kSerialClosed);
             requirePayload(notice, 8);
             Trial::requireEqual("the partition", trial.endingPartition(), notice.u16At(0));
             Trial::requireEqual("the reason", kReadFailure, notice.u32At(4));
         }},
        {"data/end/detail", "The status detail of the notice says how the command ended: 0x0103 for exit status 3.",
         kCommandEnd, Level::Rule, kEndingPartition,
         [](Trial& trial) {
             const Frame notice = endedCommand(trial).awaitNotice(kToConsole, kSerialClosed);
             Trial::requireEqual("the status", 0, notice.status);
             Trial::require(notice.statusDetail == 0x0103, "the status detail 0x0103",
                            hexNumber(notice.statusDetail, 4));
         }},
        {"data/end/last", "Nothing of the session comes after its notice.", kSerialSessions, Level::Rule,
         kEndingPartition,
         [](Trial& trial) {
             Wire& wire = endedCommand(trial);
             wire.awaitNotice(kToConsole, kSerialClosed);
             wire.takeKept();
             wire.fence();
             wire.expectNothingKept("nothing after the notice");
         }},
        {"data/end/free", "The session of a command that has ended is free: closing it gets status 20.", kRequests,
         Level::Rule, kEndingPartition,
         [](Trial& trial) {
             Wire& wire = endedCommand(trial);
             wire.awaitNotice(kToConsole, kSerialClosed);
             wire.expectStatus(closeSerial(trial.endingPartition(), 0), kClosureFailure);
         }},
        {"data/end/starts-again", "The next open starts a command that has ended again.", kSerialSessions, Level::Rule,
         kEndingPartition,
         [](Trial& trial) {
             for (int i = 0; i < 2; ++i)
                 endedCommand(trial).awaitNotice(kToConsole, kSerialClosed);
         }},
        {"data/end/watchers-are-told", "All sessions of a command that ends get the notice, each with its number.",
         kWatching, Level::Rule, kEndingPartition,
         [](Trial& trial) {
             Wire& watcher = trial.serial(trial.endingPartition(), 5);
             watcher.expectStatus(setUpSerial(trial.endingPartition(), 5), 0);
             endedCommand(trial).awaitNotice(kToConsole, kSerialClosed);
             Trial::requireEqual("the connection number", 5, watcher.awaitNotice(kToConsole, kSerialClosed).u16At(2));
         }},
    };
}

} // namespace

Cases serialDataCases() { return joined(echoCases, formCases, watchCases, endCases); }

} // namespace qel::tool::check
