#include "check/Anchors.hpp"
#include "check/Trial.hpp"
#include "check/server/Checks.hpp"
#include "check/server/ServerCases.hpp"

#include <string>
#include <utility>
#include <vector>

namespace qel::tool::check {

namespace {

using namespace anchors;

/// Sends a request in two writes. @param bytes  in the first
Case splitAt(std::size_t bytes)
{
    const std::string text = std::to_string(bytes);
    return {"frame/split/after-" + text,
            "A frame may come in two parts, of which the first has " + text + " bytes.",
            kFrame,
            Level::Wire,
            kNothing,
            [bytes](Trial& trial) {
                Wire& wire = trial.console();
                std::uint32_t id = 0;
                const std::string frame = wire.prepare(limitsRequest().payload("payload"), id);
                wire.send(frame.substr(0, bytes));
                trial.console().fence(); // the first part has gone out, and the peer has had time to read it
                wire.send(frame.substr(bytes));
                wire.awaitResponse(id, "the response to a frame in two parts");
            }};
}

/// Ends the stream inside a frame. @param bytes  of the frame that are sent
Case cutAt(std::size_t bytes)
{
    const std::string text = std::to_string(bytes);
    return {"frame/cut/after-" + text,
            "A stream that ends after " + text + " bytes of a frame ends the connection without an answer to it.",
            kAnswered,
            Level::Wire,
            kNothing,
            [bytes](Trial& trial) {
                Wire& wire = trial.console();
                wire.send(limitsRequest().payload("payload").bytes().substr(0, bytes));
                wire.endSending();
                wire.expectEndWithoutFrame();
            }};
}

void sendTogether(Wire& wire, std::size_t count, std::vector<std::uint32_t>& ids)
{
    std::string together;
    for (std::size_t i = 0; i < count; ++i) {
        std::uint32_t id = 0;
        together += wire.prepare(i % 2 == 0 ? limitsRequest() : timeRequest(), id);
        ids.push_back(id);
    }
    wire.send(together);
}

/// Sends requests in one write; the answers must come in the same order.
void answersInOrder(Trial& trial, std::size_t count)
{
    Wire& wire = trial.console();
    std::vector<std::uint32_t> ids;
    sendTogether(wire, count, ids);
    for (const std::uint32_t id : ids) {
        const Frame response = wire.receive("the response to each request");
        Trial::require(response.callerId == id, "the response to the request " + hexNumber(id, 8),
                       describeFrame(response.bytes));
    }
}

Cases joinedCases()
{
    return {
        {"frame/joined/two", "Two frames may come in one segment; the responses come in their order.", kFrame,
         Level::Wire, kNothing, [](Trial& trial) { answersInOrder(trial, 2); }},
        {"frame/joined/hundred", "A hundred frames may come at once; the responses come in their order.", kFrame,
         Level::Wire, kNothing, [](Trial& trial) { answersInOrder(trial, 100); }},
        {"frame/joined/one-and-a-half", "A frame is answered although only a part of the next one has come.", kFrame,
         Level::Wire, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             std::uint32_t first = 0;
             std::uint32_t second = 0;
             const std::string one = wire.prepare(limitsRequest(), first);
             const std::string next = wire.prepare(timeRequest(), second);
             wire.send(one + next.substr(0, 13));
             wire.awaitResponse(first, "the response to the complete frame");
             wire.send(next.substr(13));
             wire.awaitResponse(second, "the response to the second frame");
         }},
        {"frame/split/every-byte", "A frame may come byte by byte.", kFrame, Level::Wire, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             std::uint32_t id = 0;
             wire.sendByteByByte(wire.prepare(limitsRequest().payload("payload"), id));
             wire.awaitResponse(id, "the response to a frame that comes byte by byte");
         }},
    };
}

Cases endCases()
{
    return {
        {"frame/malformed/earlier-are-answered", "Responses to requests before a malformed frame still go out.",
         kAnswered, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             std::uint32_t id = 0;
             const std::string good = wire.prepare(limitsRequest(), id);
             wire.send(good + limitsRequest().byte(0, 0x00).bytes());
             wire.awaitResponse(id, "the response to the request before the malformed frame");
             wire.expectEndWithoutFrame();
         }},
        {"frame/malformed/later-are-not-read", "What follows a malformed frame is not answered.", kAnswered,
         Level::Wire, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             wire.send(limitsRequest().byte(0, 0x00).bytes() + limitsRequest().bytes());
             wire.expectEndWithoutFrame();
         }},
        {"frame/malformed/ends-only-its-own", "A malformed frame ends its own connection and no other.", kAnswered,
         Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& other = trial.console();
             Wire& wire = trial.console();
             wire.send(limitsRequest().byte(0, 0x00).bytes());
             wire.expectEnd();
             other.fence();
         }},
        {"frame/malformed/before-the-version-request", "A malformed first frame ends the connection.", kAnswered,
         Level::Wire, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.connect();
             wire.send(limitsRequest().byte(0, 0x00).bytes());
             wire.expectEndWithoutFrame();
         }},
        {"frame/end/half-close-is-answered",
         "A console that half-closes the connection still gets the responses to what it has sent, and then the end of "
         "stream.",
         kOneConnection, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             std::vector<std::uint32_t> ids;
             sendTogether(wire, 5, ids);
             wire.endSending();
             for (const std::uint32_t id : ids)
                 wire.awaitResponse(id, "the responses to what was sent before the end of stream");
             wire.expectEndWithoutFrame();
         }},
        {"frame/end/at-once", "A console may end the connection before it sends anything.", kOneConnection, Level::Wire,
         kNothing,
         [](Trial& trial) {
             Wire& wire = trial.connect();
             wire.endSending();
             wire.expectEndWithoutFrame();
         }},
        {"frame/end/forgotten", "When the end of stream comes, the console is forgotten: its identity is free.",
         kOneConnection, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             const std::string toolId = trial.toolId();
             wire.endSending();
             wire.expectEndWithoutFrame();
             trial.connect().expectStatus(versionRequest(trial.toolType(), toolId), 0);
         }},
    };
}

} // namespace

Cases frameStreamCases()
{
    Cases all;
    for (const std::size_t bytes : {1U, 4U, 7U, 8U, 9U, 22U, 31U, 32U, 38U})
        all.push_back(splitAt(bytes));
    for (const std::size_t bytes : {1U, 8U, 9U, 31U, 32U, 38U})
        all.push_back(cutAt(bytes));
    for (Case& aCase : joined(joinedCases, endCases))
        all.push_back(std::move(aCase));
    return all;
}

} // namespace qel::tool::check
