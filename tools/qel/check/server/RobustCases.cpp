#include <qel/common/util/TimeProvider.hpp>

#include "check/Anchors.hpp"
#include "check/Trial.hpp"
#include "check/server/Checks.hpp"
#include "check/server/ServerCases.hpp"

#include <chrono>
#include <random>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool::check {

namespace {

using namespace anchors;

constexpr std::size_t kMany = 20; // connections at a time; a server takes 64 of one address

std::string repeated(const std::string& bytes, std::size_t count)
{
    std::string all;
    for (std::size_t i = 0; i < count; ++i)
        all += bytes;
    return all;
}

/// Bytes that follow from a seed, so that a run can be repeated.
std::string noise(unsigned int seed, std::size_t length)
{
    std::mt19937 random(seed);
    std::string bytes(length, '\0');
    for (char& byte : bytes)
        byte = static_cast<char>(random());
    return bytes;
}

Cases floodCases()
{
    return {
        {"robust/flood/notices", "Five thousand messages that are ignored do not keep a request from its response.",
         kAnswered, Level::Robust, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             const std::string many = repeated(Draft::notice(0x9999, 1).bytes(), 500);
             for (int i = 0; i < 10; ++i)
                 wire.send(many);
             wire.fence();
             wire.expectNothingKept("no answer");
         }},
        {"robust/flood/requests", "Two thousand requests in a row are answered in their order.", kAnswered,
         Level::Robust, kNothing,
         [](Trial& trial) {
             constexpr std::uint32_t kCount = 2000;
             Wire& wire = trial.console();
             std::string all;
             for (std::uint32_t i = 0; i < kCount; ++i)
                 all += timeRequest().callerId(i).bytes();
             wire.send(all);
             for (std::uint32_t i = 0; i < kCount; ++i)
                 Trial::requireEqual("the response to request", i, wire.receive("all responses").callerId);
         }},
        {"robust/flood/largest-frames", "Fifty frames of 16384 bytes in a row are read.", kLimitsOfFrames,
         Level::Robust, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             const std::string frame = limitsRequest().payload(std::string(16384 - 32, 'x')).callerId(1).bytes();
             for (int i = 0; i < 50; ++i)
                 wire.send(frame);
             for (int i = 0; i < 50; ++i)
                 Trial::requireEqual("status", 0, wire.awaitResponse(1, "all responses").status);
         }},
        {"robust/unread-responses", "A console that does not read its responses holds up no other one.", kFlowControl,
         Level::Robust, kNothing,
         [](Trial& trial) {
             constexpr std::uint32_t kCount = 4000;
             Wire& wire = trial.console();
             wire.send(repeated(limitsRequest().callerId(1).bytes(), kCount));
             trial.console().fence();
             for (std::uint32_t i = 0; i < kCount; ++i)
                 wire.awaitResponse(1, "all responses, once they are read");
         }},
    };
}

/// A case that opens many connections, does something with each, and then asks on another one.
Case othersAreServed(const char* name, const char* requirement, std::function<void(Wire&, unsigned int)> work)
{
    return {std::string("robust/many/") + name,
            requirement,
            kBeforeFirst,
            Level::Robust,
            kShared,
            [work = std::move(work)](Trial& trial) {
                for (unsigned int i = 0; i < kMany; ++i)
                    work(trial.connectTcp(), i);
                trial.console().fence();
            }};
}

Cases manyCases()
{
    return {
        othersAreServed("silent", "Twenty connections that say nothing hold up no other one.",
                        [](Wire&, unsigned int) {}),
        othersAreServed("half-a-frame", "Twenty connections that stop inside their first frame hold up no other one.",
                        [](Wire& wire, unsigned int i) { wire.send(upgradeNotice().bytes().substr(0, 1 + i)); }),
        othersAreServed("noise", "Twenty connections that send noise do no harm to another one.",
                        [](Wire& wire, unsigned int i) { wire.send(noise(i, 100 + 50 * i)); }),
        othersAreServed("reset", "Twenty connections that are reset do no harm to another one.",
                        [](Wire& wire, unsigned int i) {
                            if (i % 2 == 0) wire.send(upgradeNotice().bytes().substr(0, 20));
                            wire.reset();
                        }),
        {"robust/many/one-after-the-other", "Fifty consoles may come and leave one after the other.", kOneConnection,
         Level::Robust, kNothing,
         [](Trial& trial) {
             for (int i = 0; i < 50; ++i) {
                 Wire& wire = trial.console();
                 wire.endSending();
                 wire.expectEnd();
             }
         }},
        {"robust/many/frames-of-noise", "A hundred frames of unknown functions with noise as payload do no harm.",
         kRegistry, Level::Robust, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             for (unsigned int i = 0; i < 100; ++i)
                 wire.send(Draft::notice(0x9000 + i, i).payload(noise(i, 37 * i)));
             wire.fence();
             wire.expectNothingKept("no answer");
         }},
        {"robust/many/payloads-of-noise", "Requests of all operations with noise as payload are answered.", kAnswered,
         Level::Robust, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.session();
             for (unsigned int i = 0; i < 60; ++i) {
                 // Not those that could be right by chance and change something.
                 const unsigned int operation = i % 2 == 0 ? kCapabilities : kBroadcast;
                 wire.ask(interfaceRequest(operation).payload(noise(i, i)));
                 wire.ask(Draft::request(kSerial, kOpenSerial).payload(noise(i, i % 8)));
             }
             wire.fence();
         }},
    };
}

/// A case that sends the version request once for each of its bytes, spoilt at this byte, on a connection of its own.
Case atEveryByte(const char* name, const char* requirement, std::function<std::string(std::string, std::size_t)> spoil)
{
    return {std::string("robust/every-byte/") + name,
            requirement,
            kAnswered,
            Level::Robust,
            kShared,
            [spoil = std::move(spoil)](Trial& trial) {
                const std::string frame = versionRequest(trial.toolType(), trial.newToolId()).bytes();
                for (std::size_t at = 0; at < frame.size(); ++at) {
                    Wire& wire = trial.connect();
                    wire.send(spoil(frame, at));
                    wire.endSending();
                    wire.expectEnd();
                }
                trial.console().fence();
            }};
}

Cases everyByteCases()
{
    return {
        atEveryByte("cut", "A version request that is cut at any of its bytes ends its own connection only.",
                    [](const std::string& frame, std::size_t at) { return frame.substr(0, at); }),
        atEveryByte("corrupt", "A version request with any of its bytes inverted does no harm to others.",
                    [](std::string frame, std::size_t at) {
                        frame[at] = static_cast<char>(~frame[at]);
                        return frame;
                    }),
    };
}

/// Tries until the status is 0: the peer notices a reset connection in its own time.
void untilGranted(Trial& trial, Wire& wire, const Draft& request, unsigned int refusal)
{
    const auto end = TimeProvider::steady() + trial.target().timeout;
    for (;;) {
        const unsigned int status = wire.ask(request).status;
        if (status == 0) return;
        Trial::requireEqual("status 0, or for a short time status", refusal, status);
        Trial::require(TimeProvider::steady() < end, "status 0 in the end", "status " + statusText(status));
    }
}

Cases resetCases()
{
    return {
        {"robust/reset/identity", "The identity of a console whose connection is reset becomes free.", kOneConnection,
         Level::Robust, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             const std::string toolId = trial.toolId();
             wire.reset();
             untilGranted(trial, trial.connect(), versionRequest(trial.toolType(), toolId), kAlreadyConnected);
         }},
        {"robust/reset/partition", "The serial session of a console whose connection is reset becomes free.",
         kOneConnection, Level::Robust, kPartition,
         [](Trial& trial) {
             trial.serial(trial.partition()).reset();
             untilGranted(trial, trial.session(), openSerial(trial.partition(), 0), kNotAvailable);
         }},
        {"robust/reset/inside-a-frame", "A connection that is reset inside a frame does no harm to others.", kAnswered,
         Level::Robust, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             wire.send(limitsRequest().bytes().substr(0, 20));
             wire.reset();
             trial.console().fence();
         }},
    };
}

/// Twice the peer's deadline, and the usual time.
std::chrono::milliseconds longEnough(const Trial& trial)
{
    return *trial.target().deadline * 2 + trial.target().timeout;
}

void expectCut(Trial& trial, Wire& wire)
{
    wire.setTimeout(longEnough(trial));
    wire.drain();
}

/// Sends a byte now and then, so that the whole takes longer than the deadline allows. Ends when the peer does.
void drip(Trial& trial, Wire& wire, const std::string& bytes)
{
    const auto pause = *trial.target().deadline / 4;
    for (std::size_t i = 0; i < bytes.size() && !wire.awaitInput(pause); ++i)
        wire.send(bytes.substr(i, 1));
}

Cases deadlineCases()
{
    return {
        {"robust/deadline/silent", "A connection that says nothing is ended when its time is over.", kStates,
         Level::Robust, kDeadline, [](Trial& trial) { expectCut(trial, trial.connectTcp()); }},
        {"robust/deadline/not-introduced", "A connection without a granted version request is ended.", kStates,
         Level::Robust, kDeadline, [](Trial& trial) { expectCut(trial, trial.connect()); }},
        {"robust/deadline/refused-all-the-time",
         "Requests that are refused do not prolong the time to introduce oneself.", kStates, Level::Robust, kDeadline,
         [](Trial& trial) {
             Wire& wire = trial.connect();
             wire.expectStatus(limitsRequest(), kInvalidSequence);
             expectCut(trial, wire);
         }},
        {"robust/deadline/inside-a-frame", "A console that stops inside a frame is ended.", kStates, Level::Robust,
         kDeadline,
         [](Trial& trial) {
             Wire& wire = trial.console();
             wire.send(limitsRequest().bytes().substr(0, 20));
             expectCut(trial, wire);
         }},
        {"robust/deadline/dripping", "A frame whose bytes come now and then has no more time than another one.",
         kStates, Level::Robust, kDeadline,
         [](Trial& trial) {
             Wire& wire = trial.console();
             drip(trial, wire, limitsRequest().payload("0123456789").bytes().substr(0, 12));
             expectCut(trial, wire);
         }},
        {"robust/deadline/idle", "The time between messages is not limited: an idle console stays.", kStates,
         Level::Robust, kDeadline,
         [](Trial& trial) {
             Wire& wire = trial.console();
             const bool spoke = wire.awaitInput(*trial.target().deadline * 3 / 2);
             Trial::require(!spoke, "silence", "a message, or the end of the connection");
             wire.fence();
         }},
    };
}

/// All places for consoles, less those that others have.
Cases limitCases()
{
    return {
        {"robust/most-consoles",
         "When the largest number of consoles is connected, a further one is refused: with status 18, or over TLS with "
         "the "
         "abort message; and its connection is closed.",
         kStates, Level::Rule, kAlone,
         [](Trial& trial) {
             constexpr unsigned int kMostTried = 48;
             const unsigned int places = trial.console().expectStatus(limitsRequest(), 0).byteAt(8);
             if (places > kMostTried) throw Skip("the peer takes " + std::to_string(places) + " consoles");
             for (unsigned int i = 1; i < places; ++i)
                 trial.console();
             Wire& further = trial.connectTcp();
             if (trial.target().isProtected()) {
                 further.send(upgradeNotice());
                 const Frame answer = further.receive("the abort message");
                 Trial::require(answer.is(kHandshake, kAbort), "the abort message", describeFrame(answer.bytes));
             } else {
                 further.expectStatus(versionRequest(trial.toolType(), trial.newToolId()), kTooManyConnections);
             }
             further.expectEndWithoutFrame();
         }},
    };
}

} // namespace

Cases robustCases() { return joined(floodCases, manyCases, everyByteCases, resetCases, deadlineCases, limitCases); }

} // namespace qel::tool::check
