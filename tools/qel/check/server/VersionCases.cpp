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

constexpr std::size_t kFixed = 16; // bytes before the tool id

/// A payload with a new tool id, changed by the case.
using MakePayload = std::function<std::string(VersionFields)>;

std::string payloadOf(Trial& trial, const MakePayload& make)
{
    VersionFields fields;
    fields.toolType = trial.toolType();
    fields.toolId = trial.newToolId();
    return make(fields);
}

/// A case whose version request must be granted.
Case granted(std::string id, std::string requirement, const char* anchor, MakePayload make)
{
    return {
        std::move(id), std::move(requirement), anchor, Level::Wire, kNothing, [make = std::move(make)](Trial& trial) {
            Wire& wire = trial.connect();
            wire.expectStatus(interfaceRequest(kVersion).payload(payloadOf(trial, make)), 0);
            wire.fence();
        }};
}

/// A case whose version request does not parse: status 3, and then a good one is granted on the same connection.
Case invalid(std::string id, std::string requirement, MakePayload make)
{
    return {std::move(id),
            std::move(requirement),
            kVersionReq,
            Level::Wire,
            kNothing,
            [make = std::move(make)](Trial& trial) {
                Wire& wire = trial.connect();
                wire.expectStatus(interfaceRequest(kVersion).payload(payloadOf(trial, make)), kInvalidData);
                wire.expectStatus(versionRequest(trial.toolType(), trial.newToolId()), 0);
            }};
}

Cases grantedCases()
{
    return {
        granted("version/granted", "The version request of a new console is granted.", kStates,
                [](const VersionFields& fields) { return versionPayload(fields); }),
        granted("version/payload/ends-after-tool-id", "The payload may end after the tool id.", kVersionReq,
                [](const VersionFields& fields) {
                    return versionPayload(fields).substr(0, kFixed + fields.toolId.size());
                }),
        granted("version/payload/longer", "A payload that is longer than needed is accepted.", "wire-format.md#payload",
                [](const VersionFields& fields) { return versionPayload(fields) + std::string(100, 'x'); }),
        granted("version/tool-id/32-bytes", "A tool id may have 32 bytes.", kVersionReq,
                [](VersionFields fields) {
                    fields.toolId.resize(32, '.');
                    return versionPayload(fields);
                }),
        granted("version/tool-id/any-bytes", "A tool id may have bytes that are not text.", kVersionReq,
                [](VersionFields fields) {
                    fields.toolId += std::string("\0\xFF\x80\n", 4);
                    return versionPayload(fields);
                }),
        granted("version/tool-id/unused-tail", "The bytes of the slot after the tool id are ignored.", kMessages,
                [](VersionFields fields) {
                    fields.toolIdLength = static_cast<unsigned int>(fields.toolId.size());
                    fields.toolId.resize(32, '#');
                    return versionPayload(fields);
                }),
        granted("version/tool-type/largest", "Any tool type is accepted.", kVersionReq,
                [](VersionFields fields) {
                    fields.toolType = 0xFFFFFFFFU;
                    return versionPayload(fields);
                }),
        granted("version/numbers/zero", "The versions of the console may be 0.", kVersionReq,
                [](VersionFields fields) {
                    fields.interfaceVersion = fields.major = fields.minor = 0;
                    return versionPayload(fields);
                }),
        granted("version/numbers/largest", "The versions of the console may have their largest value.", kVersionReq,
                [](VersionFields fields) {
                    fields.interfaceVersion = 0xFFFFFFFFU;
                    fields.major = fields.minor = 0xFFFF;
                    return versionPayload(fields);
                }),
        granted("version/reserved", "The receiver ignores mReserved of the version request.", kVersionReq,
                [](VersionFields fields) {
                    fields.reserved = 0xA55A;
                    return versionPayload(fields);
                }),
    };
}

Cases invalidCases()
{
    Cases cases;
    for (const std::size_t bytes : {0U, 1U, 15U}) {
        const std::string text = std::to_string(bytes);
        cases.push_back(
            invalid("version/payload/" + text + "-bytes",
                    "A version request with a payload of " + text + " bytes gets status 3.",
                    [bytes](const VersionFields& fields) { return versionPayload(fields).substr(0, bytes); }));
    }
    cases.push_back(invalid("version/payload/ends-inside-tool-id",
                            "A version request whose payload ends inside the tool id gets status 3.",
                            [](const VersionFields& fields) {
                                return versionPayload(fields).substr(0, kFixed + fields.toolId.size() - 1);
                            }));
    for (const unsigned int length : {33U, 255U, 0xFFFFU}) {
        const std::string text = std::to_string(length);
        cases.push_back(invalid("version/tool-id/length-" + text,
                                "A version request with a tool id of " + text + " bytes gets status 3.",
                                [length](VersionFields fields) {
                                    fields.toolIdLength = length;
                                    return versionPayload(fields) + std::string(300, 'x');
                                }));
    }
    return cases;
}

Cases identityCases()
{
    return {
        {"version/identity/taken",
         "A console with the tool type and id of another one gets status 37, and may try again.", kRequests,
         Level::Rule, kNothing,
         [](Trial& trial) {
             trial.console();
             const std::string taken = trial.toolId();
             Wire& wire = trial.connect();
             wire.expectStatus(versionRequest(trial.toolType(), taken), kAlreadyConnected);
             wire.expectStatus(versionRequest(trial.toolType(), trial.newToolId()), 0);
         }},
        {"version/identity/other-type", "Two consoles may have the same tool id if their tool types differ.", kRequests,
         Level::Rule, kNothing,
         [](Trial& trial) {
             trial.console();
             const std::string toolId = trial.toolId();
             trial.connect().expectStatus(versionRequest(trial.toolType() + 1, toolId), 0);
         }},
        {"version/identity/longer-id", "A tool id that begins like another one is another one.", kRequests, Level::Rule,
         kNothing,
         [](Trial& trial) {
             trial.console();
             const std::string longer = trial.toolId() + "a";
             trial.connect().expectStatus(versionRequest(trial.toolType(), longer), 0);
         }},
        {"version/twice", "A second version request on a connection gets status 4, and the console stays what it is.",
         kStates, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             wire.expectStatus(versionRequest(trial.toolType(), trial.newToolId()), kInvalidSequence);
             wire.fence();
         }},
        {"version/old-header", "A version request with the old header is granted.", kHeader, Level::Wire, kNothing,
         [](Trial& trial) {
             trial.connect().expectStatus(versionRequest(trial.toolType(), trial.newToolId()).old(), 0);
         }},
    };
}

/// What comes before the version request.
Cases firstCases()
{
    Cases cases;
    for (const NamedRequest& request : requestsAfterVersion()) {
        const std::string name = request.name;
        cases.push_back(getsStatus("version/before/" + name,
                                   "Before the version request, the request " +
                                       messageName(request.draft.getFunction(), request.draft.getOperation()) +
                                       " gets status 4.",
                                   kStates, Level::Rule, connected, request.draft, kInvalidSequence));
    }
    cases.push_back(getsStatus("version/before/unknown-function",
                               "Before the version request, an unknown function gets status 4 like all others.",
                               kAnswered, Level::Rule, connected, Draft::request(0x9999, 1), kInvalidSequence));
    cases.push_back(getsStatus("version/before/unknown-operation",
                               "Before the version request, an unknown operation gets status 4 like all others.",
                               kAnswered, Level::Rule, connected, interfaceRequest(0x01FF), kInvalidSequence));
    cases.push_back({"version/before/then-granted",
                     "A request that comes too early does not end the connection: the version request is granted.",
                     kStates, Level::Rule, kNothing, [](Trial& trial) {
                         Wire& wire = trial.connect();
                         wire.expectStatus(limitsRequest(), kInvalidSequence);
                         wire.expectStatus(versionRequest(trial.toolType(), trial.newToolId()), 0);
                         wire.fence();
                     }});
    cases.push_back({"version/before/notice", "Before the version request, a notice is ignored.", kStates, Level::Rule,
                     kNothing, [](Trial& trial) {
                         Wire& wire = trial.connect();
                         wire.send(dataToPartition(1, 0, "x"));
                         wire.send(Draft::notice(kToConsole, kConnectionClosed));
                         wire.expectStatus(versionRequest(trial.toolType(), trial.newToolId()), 0);
                         wire.expectNothingKept("no answer to a notice");
                     }});
    return cases;
}

} // namespace

Cases versionCases() { return joined(grantedCases, invalidCases, identityCases, firstCases); }

Cases sessionCases()
{
    Cases cases{
        getsStatus("session/open", "The session opens.", kRequests, Level::Rule, identified, openSession(), 0),
        getsStatus("session/open/twice", "A second open session gets status 23.", kRequests, Level::Rule, withSession,
                   openSession(), kAlreadyOpen),
        getsStatus("session/open/with-payload", "The payload of a request without fields is ignored.", kMessages,
                   Level::Wire, identified, openSession().payload("payload"), 0),
        getsStatus("session/open/old-header", "An open session with the old header is served.", kHeader, Level::Wire,
                   identified, openSession().old(), 0),
        getsStatus("session/close", "An open session closes.", kRequests, Level::Rule, withSession, closeSession(), 0),
        getsStatus("session/close/not-open", "A close session without a session gets status 4.", kRequests, Level::Rule,
                   identified, closeSession(), kInvalidSequence),
        {"session/close/twice", "A second close session gets status 4.", kRequests, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.session();
             wire.expectStatus(closeSession(), 0);
             wire.expectStatus(closeSession(), kInvalidSequence);
         }},
        {"session/open/again", "A session that was closed may be opened again.", kStates, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.session();
             wire.expectStatus(closeSession(), 0);
             wire.expectStatus(openSession(), 0);
             wire.expectStatus(maxSerial(), 0);
         }},
        {"session/others-are-not-concerned", "A session belongs to one connection: another console has none.", kStates,
         Level::Rule, kNothing,
         [](Trial& trial) {
             trial.session();
             trial.console().expectStatus(maxSerial(), kInvalidSequence);
         }},
        {"session/close/ends-serial-requests", "After close session, virtual serial requests get status 4 again.",
         kStates, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.session();
             wire.expectStatus(closeSession(), 0);
             wire.expectStatus(maxSerial(), kInvalidSequence);
         }},
    };
    for (const NamedRequest& request : serialRequests(1)) {
        cases.push_back(getsStatus(std::string("session/missing/") + request.name,
                                   "Without the session, the request " +
                                       messageName(request.draft.getFunction(), request.draft.getOperation()) +
                                       " gets status 4.",
                                   kAnswered, Level::Rule, identified, request.draft, kInvalidSequence));
    }
    return cases;
}

} // namespace qel::tool::check
