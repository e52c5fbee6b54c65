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

constexpr std::size_t kMaxText = 16306;

/// A sender, an addressee and a third console.
struct Consoles {
    explicit Consoles(Trial& trial)
        : sender(trial.console()), senderId(trial.toolId()), addressee(trial.console()), addresseeId(trial.toolId()),
          third(trial.console())
    {}

    Wire& sender;
    const std::string senderId;
    Wire& addressee;
    const std::string addresseeId;
    Wire& third;
};

/// A notice, taken apart.
struct Notice {
    Frame frame;
    std::uint32_t toolType = 0;
    std::string toolId;
    std::string text;
};

Notice takeNotice(Wire& wire)
{
    Notice notice;
    notice.frame = wire.awaitNotice(kToConsole, kBroadcastNotice);
    const std::size_t offset = notice.frame.u16At(0);
    const std::size_t length = notice.frame.u16At(2);
    const std::size_t idLength = notice.frame.u16At(8);
    Trial::require(notice.frame.payload.size() >= 42, "a payload of at least 42 bytes",
                   std::to_string(notice.frame.payload.size()));
    Trial::require(offset >= 42 && offset + length <= notice.frame.payload.size(), "a text inside the payload",
                   "offset " + std::to_string(offset) + " and length " + std::to_string(length));
    Trial::require(idLength <= 32, "a tool id of at most 32 bytes", std::to_string(idLength));
    notice.toolType = notice.frame.u32At(4);
    notice.toolId = notice.frame.payload.substr(10, idLength);
    notice.text = notice.frame.payload.substr(offset, length);
    return notice;
}

void requireSame(const std::string& expected, const std::string& seen)
{
    Trial::require(expected == seen, "the text that was sent, " + std::to_string(expected.size()) + " bytes",
                   "another text, " + std::to_string(seen.size()) + " bytes");
}

/// Nothing has arrived that was on its way when the response to the sender came.
void requireNone(Wire& wire)
{
    wire.fence();
    wire.expectNothingKept("no broadcast");
}

/// A case that sends one broadcast to the addressee, made by the case; the text must arrive.
Case arrives(const char* name, const char* requirement, const char* anchor, Level level, std::string text,
             std::function<Draft(const Trial&, const std::string& toolId, const std::string& text)> make)
{
    return {std::string("broadcast/") + name,
            requirement,
            anchor,
            level,
            kNothing,
            [text = std::move(text), make = std::move(make)](Trial& trial) {
                Consoles consoles(trial);
                consoles.sender.expectStatus(make(trial, consoles.addresseeId, text), 0);
                requireSame(text, takeNotice(consoles.addressee).text);
            }};
}

Draft toOne(const Trial& trial, const std::string& toolId, const std::string& text)
{
    return unicast(trial.toolType(), toolId, text);
}

/// The fields of a broadcast to one console.
BroadcastFields fieldsFor(const Trial& trial, const std::string& toolId, const std::string& text)
{
    BroadcastFields fields;
    fields.type = 1;
    fields.toolType = trial.toolType();
    fields.toolId = toolId;
    fields.text = text;
    return fields;
}

Cases unicastCases()
{
    std::string bytes;
    for (int i = 0; i < 256; ++i)
        bytes += static_cast<char>(i);
    return {
        arrives("to-one", "A broadcast of type 1 arrives at its addressee.", kRequests, Level::Rule, "hello", toOne),
        arrives("empty", "A broadcast may be empty.", kBroadcastReq, Level::Wire, "", toOne),
        arrives("any-bytes", "The bytes of a broadcast are relayed unchanged.", kBroadcastAsync, Level::Wire, bytes,
                toOne),
        arrives("longest", "A broadcast may have 16306 bytes.", kLimitsRsp, Level::Wire, std::string(kMaxText, 'b'),
                toOne),
        arrives("old-header", "A broadcast with the old header is served.", kHeader, Level::Wire, "old",
                [](const Trial& trial, const std::string& id, const std::string& text) {
                    return toOne(trial, id, text).old();
                }),
        arrives("offset-48", "Bytes between the fixed part and the text are skipped.", kBroadcastReq, Level::Wire,
                "later",
                [](const Trial& trial, const std::string& id, const std::string& text) {
                    BroadcastFields fields = fieldsFor(trial, id, text);
                    fields.offset = 48;
                    fields.between = "\xEE\xEF";
                    return broadcastRequest(fields);
                }),
        arrives("length-counts", "Bytes of the payload after the text are ignored.", "wire-format.md#payload",
                Level::Wire, "abc",
                [](const Trial& trial, const std::string& id, const std::string& text) {
                    BroadcastFields fields = fieldsFor(trial, id, text + "def");
                    fields.textLength = 3;
                    return broadcastRequest(fields);
                }),
        {"broadcast/to-one-only", "A broadcast of type 1 goes to its addressee and no other console.", kRequests,
         Level::Rule, kNothing,
         [](Trial& trial) {
             Consoles consoles(trial);
             consoles.sender.expectStatus(toOne(trial, consoles.addresseeId, "hello"), 0);
             requireNone(consoles.third);
             requireNone(consoles.sender);
         }},
        {"broadcast/sender", "The notice has the tool type and id of the sender.", kBroadcastAsync, Level::Wire,
         kNothing,
         [](Trial& trial) {
             Consoles consoles(trial);
             consoles.sender.expectStatus(toOne(trial, consoles.addresseeId, "hello"), 0);
             const Notice notice = takeNotice(consoles.addressee);
             Trial::requireEqual("the tool type of the sender,", trial.toolType(), notice.toolType);
             Trial::require(notice.toolId == consoles.senderId, "the tool id " + consoles.senderId, notice.toolId);
         }},
        {"broadcast/notice-form", "The notice of a broadcast has the documented form.", kBroadcastAsync, Level::Wire,
         kNothing,
         [](Trial& trial) {
             Consoles consoles(trial);
             consoles.sender.expectStatus(toOne(trial, consoles.addresseeId, "hello"), 0);
             const Notice notice = takeNotice(consoles.addressee);
             requireNoticeHeader(notice.frame);
             Trial::requireEqual("the offset", 42, notice.frame.u16At(0));
             requirePayload(notice.frame, 42 + notice.text.size());
             requireZero(notice.frame, 10 + notice.toolId.size(), 42, "the slot after the tool id");
         }},
        {"broadcast/order", "Broadcasts of one sender arrive in their order.", kFlowControl, Level::Rule, kNothing,
         [](Trial& trial) {
             Consoles consoles(trial);
             for (int i = 0; i < 20; ++i)
                 consoles.sender.expectStatus(toOne(trial, consoles.addresseeId, std::to_string(i)), 0);
             for (int i = 0; i < 20; ++i)
                 requireSame(std::to_string(i), takeNotice(consoles.addressee).text);
         }},
    };
}

Cases toAllCases()
{
    Cases cases;
    for (const unsigned int type : {0U, 2U, 255U}) {
        const std::string text = std::to_string(type);
        cases.push_back(
            {"broadcast/to-all/type-" + text,
             "A broadcast of type " + text + " goes to all other identified consoles, and not to its sender.",
             kRequests, Level::Rule, kNothing, [type](Trial& trial) {
                 Consoles consoles(trial);
                 BroadcastFields fields;
                 fields.type = type;
                 fields.text = trial.newText();
                 consoles.sender.expectStatus(broadcastRequest(fields), 0);
                 requireSame(fields.text, takeNotice(consoles.addressee).text);
                 requireSame(fields.text, takeNotice(consoles.third).text);
                 requireNone(consoles.sender);
             }});
    }
    cases.push_back({"broadcast/to-all/not-before-the-version-request",
                     "A console that has not identified itself gets no broadcast.", kStates, Level::Rule, kNothing,
                     [](Trial& trial) {
                         Wire& early = trial.connect();
                         BroadcastFields fields;
                         fields.text = trial.newText();
                         trial.console().expectStatus(broadcastRequest(fields), 0);
                         early.expectStatus(versionRequest(trial.toolType(), trial.newToolId()), 0);
                         requireNone(early);
                     }});
    return cases;
}

/// A case whose broadcast to one console is refused; its addressee must get nothing.
Case refused(const char* name, const char* requirement, const char* anchor, Level level, unsigned int status,
             std::function<Draft(BroadcastFields)> make)
{
    return {std::string("broadcast/refused/") + name,
            requirement,
            anchor,
            level,
            kNothing,
            [status, make = std::move(make)](Trial& trial) {
                Consoles consoles(trial);
                consoles.sender.expectStatus(make(fieldsFor(trial, consoles.addresseeId, "refused")), status);
                requireNone(consoles.addressee);
            }};
}

Cases addresseeCases()
{
    return {
        refused("absent", "A broadcast to a console that is not connected gets status 19.", kRequests, Level::Rule,
                kNotAvailable,
                [](BroadcastFields fields) {
                    fields.toolId = "nobody";
                    return broadcastRequest(fields);
                }),
        refused("other-type", "The tool type of the addressee counts: another one is not connected.", kRequests,
                Level::Rule, kNotAvailable,
                [](BroadcastFields fields) {
                    ++fields.toolType;
                    return broadcastRequest(fields);
                }),
        {"broadcast/refused/self", "A broadcast to the sender itself gets status 19.", kRequests, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             wire.expectStatus(toOne(trial, trial.toolId(), "me"), kNotAvailable);
             requireNone(wire);
         }},
        {"broadcast/refused/left", "A console that has left is not connected any more: status 19.", kRequests,
         Level::Rule, kNothing,
         [](Trial& trial) {
             Consoles consoles(trial);
             consoles.addressee.endSending();
             consoles.addressee.expectEnd();
             consoles.sender.expectStatus(toOne(trial, consoles.addresseeId, "gone"), kNotAvailable);
         }},
    };
}

Cases malformedCases()
{
    const auto malformed = [](const char* name, const char* requirement, std::function<Draft(BroadcastFields)> make) {
        return refused(name, requirement, kBroadcastReq, Level::Wire, kInvalidData, std::move(make));
    };
    return {
        malformed("payload-of-45", "A broadcast with a payload of 45 bytes gets status 3.",
                  [](const BroadcastFields& fields) {
                      return interfaceRequest(kBroadcast).payload(broadcastPayload(fields).substr(0, 45));
                  }),
        malformed("empty-payload", "A broadcast without payload gets status 3.",
                  [](const BroadcastFields&) { return interfaceRequest(kBroadcast); }),
        malformed("offset-45", "A broadcast with the offset 45 gets status 3.",
                  [](BroadcastFields fields) {
                      fields.offset = 45;
                      return broadcastRequest(fields);
                  }),
        malformed("offset-beyond", "A broadcast whose offset is beyond the payload gets status 3.",
                  [](BroadcastFields fields) {
                      fields.offset = 0xFFFF;
                      return broadcastRequest(fields);
                  }),
        malformed("text-beyond", "A broadcast with a text of one byte more than there are gets status 3.",
                  [](BroadcastFields fields) {
                      fields.textLength = static_cast<unsigned int>(fields.text.size()) + 1;
                      return broadcastRequest(fields);
                  }),
        malformed("tool-id-33", "A broadcast with a tool id of 33 bytes gets status 3.",
                  [](BroadcastFields fields) {
                      fields.toolIdLength = 33;
                      return broadcastRequest(fields);
                  }),
        malformed("no-tool-id", "A broadcast of type 1 without a tool id gets status 3.",
                  [](BroadcastFields fields) {
                      fields.toolIdLength = 0;
                      return broadcastRequest(fields);
                  }),
        refused("too-long", "A text of 16307 bytes, which fits a frame with the old header, gets status 3.", kRequests,
                Level::Rule, kInvalidData,
                [](BroadcastFields fields) {
                    fields.text = std::string(kMaxText + 1, 'b');
                    return broadcastRequest(fields).old();
                }),
    };
}

} // namespace

Cases broadcastCases() { return joined(unicastCases, toAllCases, addresseeCases, malformedCases); }

} // namespace qel::tool::check
