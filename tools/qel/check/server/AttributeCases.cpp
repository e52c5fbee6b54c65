#include "check/Anchors.hpp"
#include "check/Trial.hpp"
#include "check/server/Checks.hpp"
#include "check/server/ServerCases.hpp"

#include <string>
#include <utility>

namespace qel::tool::check {

namespace {

using namespace anchors;

constexpr std::size_t kMaxMode = 16348;
constexpr std::size_t kMaxMetadata = 16350;

/// The mode and its text, as the peer has them now.
struct Mode {
    unsigned int mode = 0;
    std::string text;
};

Mode getMode(Wire& wire)
{
    const Frame response = wire.expectStatus(interfaceRequest(kGetMode), 0);
    requirePayload(response, 4 + response.u16At(2));
    return {response.byteAt(0), response.payload.substr(4)};
}

std::string getMetadata(Wire& wire)
{
    const Frame response = wire.expectStatus(interfaceRequest(kGetMetadata), 0);
    requirePayload(response, 2 + response.u16At(0));
    return response.payload.substr(2);
}

/// A console that may set the mode: what it is now is put back at the end, on a connection of its own.
Wire& keepingMode(Trial& trial)
{
    Wire& wire = trial.console();
    const Mode mode = getMode(wire);
    trial.atEnd([&trial, mode] { trial.console().expectStatus(setMode(mode.mode, mode.text), 0); });
    return wire;
}

Wire& keepingMetadata(Trial& trial)
{
    Wire& wire = trial.console();
    const std::string metadata = getMetadata(wire);
    trial.atEnd([&trial, metadata] { trial.console().expectStatus(setMetadata(metadata), 0); });
    return wire;
}

void requireText(const std::string& what, const std::string& expected, const std::string& seen)
{
    const auto shown = [](const std::string& text) { return std::to_string(text.size()) + " bytes"; };
    Trial::require(expected == seen, what + " as it was set, " + shown(expected),
                   expected.size() == seen.size() ? "other bytes" : shown(seen));
}

/// Sets a mode and gets it.
Case modeIsKept(const char* name, const char* requirement, const char* anchor, unsigned int mode, std::string text,
                Draft request)
{
    return {std::string("mode/") + name,
            requirement,
            anchor,
            Level::Wire,
            kShared,
            [mode, text = std::move(text), request = std::move(request)](Trial& trial) {
                Wire& wire = keepingMode(trial);
                wire.expectStatus(request, 0);
                const Mode seen = getMode(wire);
                Trial::requireEqual("the mode", mode, seen.mode);
                requireText("the text", text, seen.text);
            }};
}

/// A set-mode request that is refused and changes nothing.
Case modeIsRefused(const char* name, const char* requirement, const char* anchor, Level level, Draft request)
{
    return {std::string("mode/invalid/") + name,
            requirement,
            anchor,
            level,
            kShared,
            [request = std::move(request)](Trial& trial) {
                Wire& wire = keepingMode(trial);
                wire.expectStatus(setMode(77, "before"), 0);
                wire.expectStatus(request, kInvalidData);
                const Mode seen = getMode(wire);
                Trial::requireEqual("the mode as before,", 77, seen.mode);
                requireText("the text", "before", seen.text);
            }};
}

Case metadataAreKept(const char* name, const char* requirement, const char* anchor, std::string metadata, Draft request)
{
    return {std::string("metadata/") + name,
            requirement,
            anchor,
            Level::Wire,
            kShared,
            [metadata = std::move(metadata), request = std::move(request)](Trial& trial) {
                Wire& wire = keepingMetadata(trial);
                wire.expectStatus(request, 0);
                requireText("the metadata", metadata, getMetadata(wire));
            }};
}

Case metadataAreRefused(const char* name, const char* requirement, const char* anchor, Level level, Draft request)
{
    return {std::string("metadata/invalid/") + name,
            requirement,
            anchor,
            level,
            kShared,
            [request = std::move(request)](Trial& trial) {
                Wire& wire = keepingMetadata(trial);
                wire.expectStatus(setMetadata("before"), 0);
                wire.expectStatus(request, kInvalidData);
                requireText("the metadata", "before", getMetadata(wire));
            }};
}

std::string everyByte()
{
    std::string bytes;
    for (int i = 0; i < 256; ++i)
        bytes += static_cast<char>(i);
    return bytes;
}

Cases keptModes()
{
    const std::string longest(kMaxMode, 'm');
    return {
        modeIsKept("kept", "The mode and its text are what was set.", kSetModeReq, 5, "QX-9000*0012345",
                   setMode(5, "QX-9000*0012345")),
        modeIsKept("empty-text", "The text of the mode may be empty.", kSetModeReq, 1, "", setMode(1, "")),
        modeIsKept("largest", "The mode may be 255.", kSetModeReq, 255, "x", setMode(255, "x")),
        modeIsKept("any-bytes", "The text may have any bytes.", kSetModeReq, 2, everyByte(), setMode(2, everyByte())),
        modeIsKept("longest", "The text may have 16348 bytes.", kRequests, 3, longest, setMode(3, longest)),
        modeIsKept("length-counts", "Bytes of the payload beyond the length are ignored.", "wire-format.md#payload", 4,
                   "abc", setMode(4, "abcdef", 3)),
        modeIsKept("reserved", "The receiver ignores mReserved of the mode.", kMessages, 6, "r",
                   setMode(6, "r").byte(33, 0xA5)),
        modeIsKept("old-header", "A set-mode request with the old header is served.", kHeader, 7, "old",
                   setMode(7, "old").old()),
        {"mode/of-all-consoles", "The mode is one for all consoles.", kRequests, Level::Rule, kShared,
         [](Trial& trial) {
             Wire& wire = keepingMode(trial);
             Wire& other = trial.console();
             wire.expectStatus(setMode(9, "of all"), 0);
             const Mode seen = getMode(other);
             Trial::requireEqual("the mode", 9, seen.mode);
             requireText("the text", "of all", seen.text);
         }},
        {"mode/survives-its-console", "The mode stays when the console that set it leaves.", kRequests, Level::Rule,
         kShared,
         [](Trial& trial) {
             keepingMode(trial);
             Wire& setter = trial.console();
             setter.expectStatus(setMode(8, "stays"), 0);
             setter.endSending();
             setter.expectEnd();
             requireText("the text", "stays", getMode(trial.console()).text);
         }},
        {"mode/bare-response", "The response to the set-mode request has an empty payload.", kAnswered, Level::Rule,
         kShared,
         [](Trial& trial) {
             const Frame response = onlyResponse(keepingMode(trial), setMode(1, "x"));
             requireResponseHeader(response, kInterface, kSetMode);
             requirePayload(response, 0);
         }},
    };
}

Cases refusedModes()
{
    return {
        modeIsRefused("empty", "A set-mode request without payload gets status 3.", kSetModeReq, Level::Wire,
                      interfaceRequest(kSetMode)),
        modeIsRefused("3-bytes", "A set-mode request with a payload of 3 bytes gets status 3.", kSetModeReq,
                      Level::Wire, interfaceRequest(kSetMode).payload(std::string(3, '\0'))),
        modeIsRefused("beyond-payload", "A text of one byte more than there are gets status 3.", kSetModeReq,
                      Level::Wire, setMode(1, "abc", 4)),
        modeIsRefused("length-65535", "A text of 65535 bytes that are not there gets status 3.", kSetModeReq,
                      Level::Wire, setMode(1, "abc", 65535)),
        modeIsRefused("too-long",
                      "A text of 16349 bytes, which fits a frame with the old header but no response, gets status 3.",
                      kRequests, Level::Rule, setMode(1, std::string(kMaxMode + 1, 'm')).old()),
    };
}

Cases keptMetadata()
{
    const std::string longest(kMaxMetadata, 'm');
    return {
        metadataAreKept("kept", "The metadata are what was set.", kSetMetadataReq, "slot=3", setMetadata("slot=3")),
        metadataAreKept("empty", "The metadata may be empty.", kSetMetadataReq, "", setMetadata("")),
        metadataAreKept("any-bytes", "The metadata may have any bytes.", kSetMetadataReq, everyByte(),
                        setMetadata(everyByte())),
        metadataAreKept("longest", "The metadata may have 16350 bytes.", kRequests, longest, setMetadata(longest)),
        metadataAreKept("length-counts", "Bytes of the payload beyond the length of the metadata are ignored.",
                        "wire-format.md#payload", "abc", setMetadata("abcdef", 3)),
        metadataAreKept("old-header", "A set-metadata request with the old header is served.", kHeader, "old",
                        setMetadata("old").old()),
        {"metadata/of-all-consoles", "The metadata are the same for all consoles.", kRequests, Level::Rule, kShared,
         [](Trial& trial) {
             Wire& wire = keepingMetadata(trial);
             Wire& other = trial.console();
             wire.expectStatus(setMetadata("of all"), 0);
             requireText("the metadata", "of all", getMetadata(other));
         }},
        {"metadata/response", "The response to the set-metadata request has an empty payload.",
         "wire-format.md#qelmessagesetglobalsaveareametadatarsp", Level::Wire, kShared,
         [](Trial& trial) {
             const Frame response = onlyResponse(keepingMetadata(trial), setMetadata("x"));
             requireResponseHeader(response, kInterface, kSetMetadata);
             requirePayload(response, 0);
         }},
    };
}

Cases refusedMetadata()
{
    return {
        metadataAreRefused("empty-payload", "A set-metadata request without payload gets status 3.", kSetMetadataReq,
                           Level::Wire, interfaceRequest(kSetMetadata)),
        metadataAreRefused("1-byte", "A set-metadata request with a payload of 1 byte gets status 3.", kSetMetadataReq,
                           Level::Wire, interfaceRequest(kSetMetadata).payload(std::string(1, '\0'))),
        metadataAreRefused("beyond-payload", "Metadata of one byte more than there are get status 3.", kSetMetadataReq,
                           Level::Wire, setMetadata("abc", 4)),
        metadataAreRefused("length-65535", "Metadata of 65535 bytes that are not there get status 3.", kSetMetadataReq,
                           Level::Wire, setMetadata("abc", 65535)),
        metadataAreRefused(
            "too-long", "Metadata of 16351 bytes, which fit a frame with the old header but no response, get status 3.",
            kRequests, Level::Rule, setMetadata(std::string(kMaxMetadata + 1, 'm')).old()),
    };
}

} // namespace

Cases modeCases() { return joined(keptModes, refusedModes); }

Cases metadataCases() { return joined(keptMetadata, refusedMetadata); }

} // namespace qel::tool::check
