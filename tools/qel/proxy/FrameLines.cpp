#include "proxy/FrameLines.hpp"

#include <qel/common/QelMessage.hpp>
#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Answer.hpp"
#include "base/Library.hpp"
#include "decode/FrameDecoder.hpp"
#include "decode/FrameJson.hpp"
#include "proxy/FrameNames.hpp"

#include <cstdio>
#include <utility>

namespace qel::tool {

namespace {

constexpr std::size_t kGatheredBytes = 64 * 1024;

const char* kindText(QelMessageClassification::Value kind)
{
    switch (kind) {
    case QelMessageClassification::Request:
        return "request ";
    case QelMessageClassification::Response:
        return "response";
    case QelMessageClassification::Async:
        return "notice  ";
    case QelMessageClassification::Unknown:
        break;
    }
    return "unknown ";
}

void appendHex(std::string& line, unsigned int number)
{
    constexpr const char* kDigits = "0123456789ABCDEF";
    line += "0x";
    for (int shift = 12; shift >= 0; shift -= 4)
        line += kDigits[number >> shift & 0xF];
}

std::string counted(std::uint64_t count, const char* what)
{
    return std::to_string(count) + " " + what + (count == 1 ? "" : "s");
}

std::string totalText(std::uint64_t frames, std::uint64_t bytes)
{
    return counted(frames, "frame") + ", " + counted(bytes, "byte");
}

/// "1 to-server  "
void appendPlace(std::string& line, const FlowPlace& place)
{
    line += std::to_string(place.connection);
    line += place.way == Way::ToServer ? " to-server  " : " to-console ";
}

void appendOperation(std::string& line, const FrameView& frame)
{
    const std::string& name = operationName(frame.function(), frame.operation());
    if (!name.empty()) {
        line += "op=" + name;
        return;
    }
    line += "function=";
    appendHex(line, frame.function());
    line += " op=";
    appendHex(line, frame.operation());
}

void appendStatus(std::string& line, std::uint16_t status)
{
    line += " status=" + std::to_string(status);
    const std::string& name = shortStatusName(status);
    if (status != 0 && !name.empty()) line += " " + name;
}

} // namespace

FrameLines::FrameLines(FrameLinesOptions options, Sink sink)
    : mOptions(std::move(options)), mSink(std::move(sink)), mStamps(mOptions.stamps)
{}

void FrameLines::listening(const std::vector<IPEndpoint>& endpoints, const std::string& target, std::uint64_t seed)
{
    for (const IPEndpoint& endpoint : endpoints) {
        if (mOptions.json) {
            nlohmann::ordered_json event{{"time", TimeStamps::iso(TimeProvider::system())}, {"event", "listening"}};
            event["address"] = endpoint.str();
            event["server"] = target;
            event["seed"] = seed;
            pAdd(event);
        } else {
            mLines += endpoint.str() + "\n";
        }
    }
    pWrite();
}

void FrameLines::summary(std::uint64_t connections)
{
    if (mOptions.json) {
        nlohmann::ordered_json event{{"time", TimeStamps::iso(TimeProvider::system())}, {"event", "summary"}};
        event["connections"] = connections;
        event["toServer"] = {{"frames", mToServer.frames}, {"bytes", mToServer.bytes}};
        event["toConsole"] = {{"frames", mToConsole.frames}, {"bytes", mToConsole.bytes}};
        event["faults"] = mFaults;
        pAdd(event);
    } else {
        mLines += counted(connections, "connection") + "; to-server " + totalText(mToServer.frames, mToServer.bytes) +
                  "; to-console " + totalText(mToConsole.frames, mToConsole.bytes) + "; " + counted(mFaults, "fault") +
                  "\n";
    }
    pWrite();
}

void FrameLines::onFrame(const FlowPlace& place, std::uint64_t number, const FrameView& frame)
{
    if (mOptions.quiet || !mOptions.filter.shows(frame, place.way, place.connection, number)) return;
    if (mOptions.json) {
        pFrameJson(place, number, frame);
    } else {
        pFrameText(place, number, frame);
    }
}

void FrameLines::pFrameJson(const FlowPlace& place, std::uint64_t number, const FrameView& frame)
{
    nlohmann::ordered_json event = pEvent("frame", place.connection);
    event["direction"] = wayText(place.way);
    event["number"] = number;
    FrameDecoder::Item item;
    FrameDecoder::decode(frame.bytes(), static_cast<unsigned int>(frame.length()), item);
    if (item.message != nullptr) {
        nlohmann::ordered_json content = frameJson(item);
        content.erase("offset");
        if (!mOptions.dump) content.erase("dump");
        event.update(content);
    } else {
        event["length"] = frame.length();
        event["frame"] = hexDigits(std::string(frame.bytes(), frame.length()));
    }
    if (!item.reason.empty()) event["malformed"] = item.reason;
    pAdd(event);
}

void FrameLines::pFrameText(const FlowPlace& place, std::uint64_t number, const FrameView& frame)
{
    FrameDecoder::Item item;
    FrameDecoder::decode(frame.bytes(), static_cast<unsigned int>(frame.length()), item);
    std::string& line = mLine;
    line.clear();
    appendPlace(line, place);
    line += "frame " + std::to_string(number) + " ";
    line += kindText(frame.kind());
    line += ' ';
    appendOperation(line, frame);
    line += " id=" + std::to_string(frame.callerId());
    const bool isResponse = frame.kind() == QelMessageClassification::Response;
    if (isResponse || frame.status() != 0) appendStatus(line, frame.status());
    line += " length=" + std::to_string(frame.length());
    if (!item.reason.empty()) line += " malformed: " + printable(item.reason);
    pAddLine(line);
    if (!mOptions.dump || item.message == nullptr) return;
    const std::string dump = printableLines(toString(item.message->debug()));
    mStamps.skip(dump.data(), dump.size());
    mLines += dump;
}

void FrameLines::onFault(const FlowPlace& place, std::uint64_t number, const FaultRule& rule, const std::string& what)
{
    ++mFaults;
    if (mOptions.json) {
        nlohmann::ordered_json event = pEvent("fault", place.connection);
        event["direction"] = wayText(place.way);
        if (number > 0) event["number"] = number;
        event["what"] = what;
        event["rule"] = rule.text;
        pAdd(event);
        return;
    }
    std::string line;
    appendPlace(line, place);
    if (number > 0) line += "frame " + std::to_string(number) + " ";
    pAddLine(line + "fault: " + what + " (" + quoted(rule.text) + ")");
}

void FrameLines::onNote(const FlowPlace& place, const std::string& text)
{
    if (mOptions.json) {
        nlohmann::ordered_json event = pEvent("note", place.connection);
        event["direction"] = wayText(place.way);
        event["text"] = text;
        pAdd(event);
        return;
    }
    std::string line;
    appendPlace(line, place);
    pAddLine(line + text);
}

void FrameLines::onOpened(std::uint64_t connection, const ProxyAddresses& addresses)
{
    if (mOptions.json) {
        nlohmann::ordered_json event = pEvent("open", connection);
        event["console"] = addresses.console.str();
        event["server"] = addresses.server.str();
        pAdd(event);
        return;
    }
    pAddLine(std::to_string(connection) + " open from " + addresses.console.str() + " to " + addresses.server.str());
}

void FrameLines::onConnectionNote(std::uint64_t connection, const std::string& text)
{
    if (mOptions.json) {
        nlohmann::ordered_json event = pEvent("note", connection);
        event["text"] = text;
        pAdd(event);
        return;
    }
    pAddLine(std::to_string(connection) + " " + text);
}

void FrameLines::onEnd(const FlowPlace& place)
{
    if (mOptions.json) {
        nlohmann::ordered_json event = pEvent("end", place.connection);
        event["direction"] = wayText(place.way);
        pAdd(event);
        return;
    }
    std::string line;
    appendPlace(line, place);
    pAddLine(line + "end");
}

void FrameLines::onClosed(std::uint64_t connection, const std::string& why, const FrameFlow& toServer,
                          const FrameFlow& toConsole)
{
    mToServer.frames += toServer.frameCount();
    mToServer.bytes += toServer.sentBytes();
    mToConsole.frames += toConsole.frameCount();
    mToConsole.bytes += toConsole.sentBytes();
    if (mOptions.json) {
        nlohmann::ordered_json event = pEvent("closed", connection);
        event["why"] = why;
        event["toServer"] = {{"frames", toServer.frameCount()}, {"bytes", toServer.sentBytes()}};
        event["toConsole"] = {{"frames", toConsole.frameCount()}, {"bytes", toConsole.sentBytes()}};
        pAdd(event);
        return;
    }
    pAddLine(std::to_string(connection) + " closed: " + why + "; to-server " +
             totalText(toServer.frameCount(), toServer.sentBytes()) + "; to-console " +
             totalText(toConsole.frameCount(), toConsole.sentBytes()));
}

void FrameLines::onRefused(std::uint64_t connection, const std::string& why)
{
    if (mOptions.json) {
        nlohmann::ordered_json event = pEvent("refused", connection);
        event["why"] = why;
        pAdd(event);
        return;
    }
    pAddLine(std::to_string(connection) + " refused: " + printable(why));
}

nlohmann::ordered_json FrameLines::pEvent(const char* event, std::uint64_t connection) const
{
    return {{"time", TimeStamps::iso(TimeProvider::system())}, {"event", event}, {"connection", connection}};
}

void FrameLines::pAdd(const nlohmann::ordered_json& event)
{
    mLines += jsonLine(event);
    mLines += '\n';
    if (mLines.size() >= kGatheredBytes) pWrite();
}

void FrameLines::pAddLine(const std::string& line)
{
    mStamps.append(line.data(), line.size(), mLines);
    mStamps.append("\n", 1, mLines);
    if (mLines.size() >= kGatheredBytes) pWrite();
}

void FrameLines::pWrite()
{
    if (mLines.empty()) return;
    mSink(mLines);
    mLines.clear();
}

} // namespace qel::tool
