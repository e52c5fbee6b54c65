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
constexpr unsigned int kForceClose = 0xFF;

/// A serial request to be made once the partition is known.
using MakeRequest = std::function<Draft(unsigned int partition)>;

/// Where a request is sent.
enum class From {
    Free,   ///< a console with a session, while no one holds the partition
    Holder, ///< the console that holds number 0
    Other   ///< another console, while one holds number 0
};

Wire& prepare(Trial& trial, From from)
{
    if (from == From::Free) return trial.session();
    Wire& holder = trial.serial(trial.partition());
    return from == From::Holder ? holder : trial.session();
}

Case gets(const char* name, const char* requirement, const char* anchor, Level level, From from, unsigned int status,
          MakeRequest make)
{
    return {std::string("serial/") + name,
            requirement,
            anchor,
            level,
            kPartition,
            [from, status, make = std::move(make)](Trial& trial) {
                prepare(trial, from).expectStatus(make(trial.partition()), status);
            }};
}

/// The same for a partition that does not exist, or a request that does not name one.
Case getsAnywhere(const char* name, const char* requirement, const char* anchor, Level level, unsigned int status,
                  MakeRequest make)
{
    return {std::string("serial/") + name,
            requirement,
            anchor,
            level,
            kNothing,
            [status, make = std::move(make)](Trial& trial) {
                trial.session().expectStatus(make(trial.target().absentPartition), status);
            }};
}

/// Takes the session-closed notice and checks what it says.
void requireClosed(Wire& wire, unsigned int partition, unsigned int number, std::uint32_t reason)
{
    const Frame notice = wire.awaitNotice(kToConsole, kSerialClosed);
    requirePayload(notice, 8);
    Trial::requireEqual("the partition", partition, notice.u16At(0));
    Trial::requireEqual("the connection number", number, notice.u16At(2));
    Trial::requireEqual("the reason", reason, notice.u32At(4));
}

Cases openCases()
{
    const auto open = [](unsigned int number, unsigned int flags) {
        return [number, flags](unsigned int partition) { return openSerial(partition, number, flags); };
    };
    return {
        gets("open", "A free session opens.", kSerialSessions, Level::Rule, From::Free, 0, open(0, 0)),
        gets("open/number-15", "The connection number may be 15.", kRequests, Level::Rule, From::Free, 0, open(15, 0)),
        gets("open/number-16", "The connection number 16 gets status 16.", kRequests, Level::Rule, From::Free,
             kInvalidNumber, open(16, 0)),
        gets("open/number-65535", "The connection number 65535 gets status 16.", kRequests, Level::Rule, From::Free,
             kInvalidNumber, open(0xFFFF, 0)),
        gets("open/held-by-another", "A session that another console holds gets status 19.", kRequests, Level::Rule,
             From::Other, kNotAvailable, open(0, 0)),
        gets("open/held-by-itself", "A session that the console itself holds gets status 19.", kRequests, Level::Rule,
             From::Holder, kNotAvailable, open(0, 0)),
        gets("open/other-number", "A console may hold several numbers of a partition.", kWatching, Level::Rule,
             From::Holder, 0, open(1, 0)),
        gets("open/flags-0x7FFF", "One bit forces, whatever the others are: the flags 0x7FFF do not.", kOddCorners,
             Level::Wire, From::Other, kNotAvailable, open(0, 0x7FFF)),
        gets("open/flags-0xFFFF", "One bit forces, whatever the others are: the flags 0xFFFF do.", kOddCorners,
             Level::Wire, From::Other, 0, open(0, 0xFFFF)),
        gets("open/force-free", "A free session may be opened by force.", kSerialSessions, Level::Rule, From::Free, 0,
             open(0, kForce)),
        gets("open/reserved", "The receiver ignores mReserved of the open request.", kMessages, Level::Wire, From::Free,
             0,
             [](unsigned int partition) {
                 return Draft::request(kSerial, kOpenSerial)
                     .payload(serialAddress(partition, 0) + bigEndian16(0) + bigEndian16(0xA55A));
             }),
        gets("open/longer-payload", "Bytes after the open request are ignored.", "wire-format.md#payload", Level::Wire,
             From::Free, 0,
             [](unsigned int partition) {
                 return Draft::request(kSerial, kOpenSerial)
                     .payload(serialAddress(partition, 0) + std::string(4, '\0') + "more");
             }),
        gets("open/old-header", "An open request with the old header is served.", kOpenReq, Level::Wire, From::Free, 0,
             [](unsigned int partition) { return openSerial(partition, 0).old(); }),
        getsAnywhere("open/absent", "A partition that does not exist gets status 21.", kRequests, Level::Rule,
                     kInvalidPartition, open(0, 0)),
        getsAnywhere("open/absent-before-number", "Of a wrong partition and a wrong number, the partition decides: 21.",
                     kRequests, Level::Rule, kInvalidPartition, open(16, 0)),
        getsAnywhere("open/7-bytes", "An open request with a payload of 7 bytes gets status 3.", kOpenReq, Level::Wire,
                     kInvalidData,
                     [](unsigned int partition) {
                         return Draft::request(kSerial, kOpenSerial).payload(serialAddress(partition, 0) + "\x80xx");
                     }),
        {"serial/open/response", "The response to an open request has its partition and number.", kOpenRsp, Level::Wire,
         kPartition,
         [](Trial& trial) {
             const Frame response = trial.session().expectStatus(openSerial(trial.partition(), 3), 0);
             requirePayload(response, 8);
             Trial::requireEqual("the partition", trial.partition(), response.u16At(0));
             Trial::requireEqual("the connection number", 3, response.u16At(2));
             requireZero(response, 4, 8, "mReserved");
         }},
    };
}

Cases forceCases()
{
    return {
        {"serial/force/holder-is-told", "The holder of a session that is taken by force gets the notice with reason 2.",
         kSerialSessions, Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& holder = trial.serial(trial.partition());
             trial.session().expectStatus(openSerial(trial.partition(), 0, kForce), 0);
             requireClosed(holder, trial.partition(), 0, kForceClosed);
         }},
        {"serial/force/itself", "A console that takes its own session by force gets the notice with reason 2.",
         kSerialSessions, Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& wire = trial.serial(trial.partition());
             wire.expectStatus(openSerial(trial.partition(), 0, kForce), 0);
             requireClosed(wire, trial.partition(), 0, kForceClosed);
         }},
        {"serial/force/set-up-again", "A session that was taken by force has to be set up by its new holder.",
         kSerialSessions, Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& holder = trial.serial(trial.partition());
             holder.expectStatus(setUpSerial(trial.partition(), 0), 0);
             Wire& other = trial.session();
             other.expectStatus(openSerial(trial.partition(), 0, kForce), 0);
             other.fence();
             other.expectNothingKept("no data before the session is set up");
             other.expectStatus(setUpSerial(trial.partition(), 0), 0);
         }},
        {"serial/force/holder-has-lost-it", "A console whose session was taken does not hold it: set up gets status 4.",
         kRequests, Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& holder = trial.serial(trial.partition());
             trial.session().expectStatus(openSerial(trial.partition(), 0, kForce), 0);
             holder.expectStatus(setUpSerial(trial.partition(), 0), kInvalidSequence);
         }},
        {"serial/force/same-number-only", "Force concerns the session on the same number only.", kSerialSessions,
         Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& holder = trial.serial(trial.partition(), 1);
             trial.session().expectStatus(openSerial(trial.partition(), 0, kForce), 0);
             holder.fence();
             holder.expectNothingKept("no notice");
             holder.expectStatus(closeSerial(trial.partition(), 1), 0);
         }},
        {"serial/force/notice-form", "The session-closed notice has the documented form.", kClosedAsync, Level::Wire,
         kPartition,
         [](Trial& trial) {
             Wire& holder = trial.serial(trial.partition(), 2);
             trial.session().expectStatus(openSerial(trial.partition(), 2, kForce), 0);
             const Frame notice = holder.awaitNotice(kToConsole, kSerialClosed);
             requireNoticeHeader(notice);
             requirePayload(notice, 8);
             Trial::requireEqual("the connection number", 2, notice.u16At(2));
             holder.fence();
             holder.expectNothingKept("one notice");
         }},
        {"serial/force/goes-back-and-forth", "A session may be taken by force again and again; each holder is told.",
         kSerialSessions, Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& first = trial.serial(trial.partition());
             Wire& second = trial.session();
             for (int i = 0; i < 3; ++i) {
                 second.expectStatus(openSerial(trial.partition(), 0, kForce), 0);
                 requireClosed(first, trial.partition(), 0, kForceClosed);
                 first.expectStatus(openSerial(trial.partition(), 0, kForce), 0);
                 requireClosed(second, trial.partition(), 0, kForceClosed);
             }
         }},
    };
}

Cases closeCases()
{
    const auto close = [](unsigned int number, unsigned int force) {
        return [number, force](unsigned int partition) { return closeSerial(partition, number, force); };
    };
    return {
        gets("close", "The holder closes its session.", kSerialSessions, Level::Rule, From::Holder, 0, close(0, 0)),
        gets("close/free", "Closing a free session gets status 20.", kRequests, Level::Rule, From::Free,
             kClosureFailure, close(0, 0)),
        gets("close/free-by-force", "Closing a free session by force gets status 20.", kRequests, Level::Rule,
             From::Free, kClosureFailure, close(0, kForceClose)),
        gets("close/of-another", "Closing the session of another console gets status 20.", kRequests, Level::Rule,
             From::Other, kClosureFailure, close(0, 0)),
        gets("close/force-0x01", "Only 0xFF forces a close: 0x01 is a normal close.", kOddCorners, Level::Wire,
             From::Other, kClosureFailure, close(0, 0x01)),
        gets("close/force-0xFE", "Only 0xFF forces a close: 0xFE is a normal close.", kOddCorners, Level::Wire,
             From::Other, kClosureFailure, close(0, 0xFE)),
        gets("close/number-16", "Closing the connection number 16 gets status 16.", kRequests, Level::Rule, From::Free,
             kInvalidNumber, close(16, 0)),
        gets("close/other-number", "Closing another number than the one that is held gets status 20.", kRequests,
             Level::Rule, From::Holder, kClosureFailure, close(1, 0)),
        getsAnywhere("close/absent", "Closing the session of a partition that does not exist gets status 21.",
                     kRequests, Level::Rule, kInvalidPartition, close(0, 0)),
        getsAnywhere("close/4-bytes", "A close request with a payload of 4 bytes gets status 3.", kCloseReq,
                     Level::Wire, kInvalidData,
                     [](unsigned int partition) {
                         return Draft::request(kSerial, kCloseSerial).payload(serialAddress(partition, 0));
                     }),
        {"serial/close/force", "A session that is closed by force ends with the notice with reason 2.", kSerialSessions,
         Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& holder = trial.serial(trial.partition());
             trial.session().expectStatus(closeSerial(trial.partition(), 0, kForceClose), 0);
             requireClosed(holder, trial.partition(), 0, kForceClosed);
         }},
        {"serial/close/without-notice", "The holder that closes its session gets no notice.", kSerialSessions,
         Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& wire = trial.serial(trial.partition());
             wire.expectStatus(closeSerial(trial.partition(), 0), 0);
             wire.fence();
             wire.expectNothingKept("no notice");
         }},
        {"serial/close/frees", "A session that was closed is free for another console.", kSerialSessions, Level::Rule,
         kPartition,
         [](Trial& trial) {
             trial.serial(trial.partition()).expectStatus(closeSerial(trial.partition(), 0), 0);
             trial.serial(trial.partition());
         }},
    };
}

Cases endCases()
{
    return {
        {"serial/close-session/frees", "Close session ends the serial sessions of the console.", kRequests, Level::Rule,
         kPartition,
         [](Trial& trial) {
             trial.serial(trial.partition()).expectStatus(closeSession(), 0);
             trial.serial(trial.partition());
         }},
        {"serial/close-session/without-notice", "Close session ends serial sessions without notices.", kRequests,
         Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& wire = trial.serial(trial.partition());
             wire.expectStatus(closeSession(), 0);
             wire.fence();
             wire.expectNothingKept("no notice");
         }},
        {"serial/disconnect/frees", "When the console's connection has ended, its serial sessions are free.",
         kOneConnection, Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& wire = trial.serial(trial.partition());
             wire.endSending();
             wire.expectEnd();
             trial.serial(trial.partition());
         }},
        {"serial/malformed-frame/frees", "A malformed frame of the holder frees its session.", kAnswered, Level::Rule,
         kPartition,
         [](Trial& trial) {
             Wire& wire = trial.serial(trial.partition());
             wire.send(limitsRequest().byte(0, 0).bytes());
             wire.expectEnd();
             trial.serial(trial.partition());
         }},
    };
}

Cases setUpCases()
{
    return {
        gets("set-up", "The holder sets its session up.", kSerialSessions, Level::Rule, From::Holder, 0,
             [](unsigned int partition) { return setUpSerial(partition, 0); }),
        gets("set-up/free", "Setting up a session that is free gets status 4.", kRequests, Level::Rule, From::Free,
             kInvalidSequence, [](unsigned int partition) { return setUpSerial(partition, 0); }),
        gets("set-up/of-another", "Setting up the session of another console gets status 4.", kRequests, Level::Rule,
             From::Other, kInvalidSequence, [](unsigned int partition) { return setUpSerial(partition, 0); }),
        gets("set-up/number-16", "Setting up the connection number 16 gets status 16.", kRequests, Level::Rule,
             From::Free, kInvalidNumber, [](unsigned int partition) { return setUpSerial(partition, 16); }),
        gets("set-up/other-number", "Setting up another number than the one that is held gets status 4.", kRequests,
             Level::Rule, From::Holder, kInvalidSequence,
             [](unsigned int partition) { return setUpSerial(partition, 1); }),
        getsAnywhere("set-up/absent", "Setting up a session of a partition that does not exist gets status 21.",
                     kRequests, Level::Rule, kInvalidPartition,
                     [](unsigned int partition) { return setUpSerial(partition, 0); }),
        getsAnywhere("set-up/3-bytes", "A set-up request with a payload of 3 bytes gets status 3.", kSetUpReq,
                     Level::Wire, kInvalidData,
                     [](unsigned int partition) {
                         return Draft::request(kSerial, kSetUpSerial).payload(serialAddress(partition, 0).substr(1));
                     }),
        {"serial/set-up/twice", "A second set-up is granted.", kRequests, Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& wire = trial.serial(trial.partition());
             wire.expectStatus(setUpSerial(trial.partition(), 0), 0);
             wire.expectStatus(setUpSerial(trial.partition(), 0), 0);
         }},
        {"serial/set-up/response-comes-first", "The response to a set-up comes before the session's data.",
         kFlowControl, Level::Rule, kPartition,
         [](Trial& trial) {
             Wire& wire = trial.serial(trial.partition());
             const Frame response = wire.expectStatus(setUpSerial(trial.partition(), 0), 0);
             wire.expectNothingKept("the response before any data");
             requireResponseHeader(response, kSerial, kSetUpSerial);
             requirePayload(response, 0);
         }},
    };
}

} // namespace

Cases serialCases() { return joined(openCases, forceCases, closeCases, endCases, setUpCases); }

} // namespace qel::tool::check
