#include "decode/DecodeCommand.hpp"

#include <qel/common/StreamFormatters.hpp>
#include <qel/common/TypeInfo.hpp>
#include <qel/common/util/PosixError.hpp>

#include "base/Answer.hpp"
#include "base/Failures.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "base/Text.hpp"
#include "decode/FrameDecoder.hpp"
#include "decode/HexText.hpp"

#include <cerrno>
#include <fstream>
#include <iostream>
#include <memory>
#include <string>
#include <utility>

namespace qel::tool {

namespace {

struct DecodeOptions {
    std::string file = "-";
    FrameNotation notation = FrameNotation::Guess;
    bool json = false;
    LogOptions log;
};

const char* classificationName(QelMessageClassification::Value classification)
{
    switch (classification) {
    case QelMessageClassification::Request:
        return "Request";
    case QelMessageClassification::Response:
        return "Response";
    case QelMessageClassification::Async:
        return "Async";
    case QelMessageClassification::Unknown:
        break;
    }
    return "Unknown";
}

std::string payloadOf(const QelMessage& message)
{
    return message.dataLength() == 0 ? std::string() : std::string(message.getData(), message.dataLength());
}

nlohmann::ordered_json describe(const FrameDecoder::Item& item)
{
    const QelMessage& message = *item.message;
    nlohmann::ordered_json frame;
    frame["offset"] = item.offset;
    frame["length"] = message.msgLength();
    frame["class"] = TypeInfo::getTypeName(message);
    frame["callerId"] = message.getCallerId();
    frame["function"] = static_cast<unsigned int>(message.getFunction());
    frame["functionText"] = toString(message.getFunction());
    frame["operation"] = static_cast<unsigned int>(message.getOperation());
    frame["operationText"] = toString(std::make_pair(message.getFunction(), message.getOperation()));
    frame["classification"] = classificationName(message.getClassification());
    frame["flags"] = static_cast<unsigned int>(message.getFlags());
    frame["status"] = static_cast<unsigned int>(message.getStatus());
    frame["statusName"] = statusName(message.getStatus());
    frame["statusDetail"] = message.getStatusDetail();
    frame["payload"] = hexDigits(payloadOf(message));
    frame["frame"] = hexDigits(std::string(message.serialize(), message.msgLength()));
    frame["dump"] = toString(message.debug());
    return frame;
}

/// Where what is decoded goes: printed at once for people, collected into one document for programs.
class Report {
public:
    Report(bool json, std::ostream& output, std::ostream& errors) : mJson(json), mOutput(output), mErrors(errors) {}

    void add(const FrameDecoder::Item& item)
    {
        if (item.message != nullptr) pAddFrame(item);
        if (!item.reason.empty()) addBad(item.offset, item.reason);
    }

    void addBad(std::uint64_t offset, const std::string& reason)
    {
        mOutput.flush(); // so that the two streams stand in order on a terminal
        mErrors << "qel: bad frame at offset " << offset << ": " << reason << std::endl;
        mBad.push_back({{"offset", offset}, {"reason", reason}});
    }

    ExitStatus finish()
    {
        if (mJson) printJson(mOutput, {{"frames", mFrames}, {"bad", mBad}});
        return mBad.empty() ? ExitStatus::Done : ExitStatus::Refused;
    }

private:
    void pAddFrame(const FrameDecoder::Item& item)
    {
        if (mJson) {
            mFrames.push_back(describe(item));
            return;
        }
        // A dump contains texts of whoever made the frame, as they are.
        mOutput << "frame at offset " << item.offset << ", " << item.message->msgLength() << " bytes\n"
                << toString(item.message->getLogID()) << '\n'
                << printableLines(toString(item.message->debug()));
    }

    bool mJson;
    std::ostream& mOutput;
    std::ostream& mErrors;
    nlohmann::ordered_json mFrames = nlohmann::ordered_json::array();
    nlohmann::ordered_json mBad = nlohmann::ordered_json::array();
};

void decodeBytes(std::istream& bytes, Report& report)
{
    FrameDecoder decoder(bytes);
    FrameDecoder::Item item;
    std::uint64_t offset = 0;
    try {
        for (; decoder.next(item); offset = decoder.offset())
            report.add(item);
    } catch (const CommandFailure& failure) {
        report.addBad(offset, failure.what()); // hexadecimal text that is none
    }
}

std::string checkInput(std::string& name) { return name == "-" ? std::string() : fileValidator()(name); }

ExitStatus runDecode(const DecodeOptions& options)
{
    startLogging(options.log, "qel-decode.log");
    std::ios::sync_with_stdio(false); // else a failure to read cannot be told from the end of the input
    if (options.file == "-") return decodeFrames(std::cin, options.notation, options.json, std::cout, std::cerr);

    std::ifstream file(options.file, std::ios::binary);
    if (!file) {
        const PosixErrorCode error = errno;
        throw FileIOError(error, "cannot open " + options.file);
    }
    return decodeFrames(file, options.notation, options.json, std::cout, std::cerr);
}

} // namespace

ExitStatus decodeFrames(std::istream& input, FrameNotation notation, bool json, std::ostream& output,
                        std::ostream& errors)
{
    Report report(json, output, errors);
    if (notation == FrameNotation::Hex || (notation == FrameNotation::Guess && looksLikeHexText(input))) {
        HexTextBuffer buffer(input);
        std::istream bytes(&buffer);
        bytes.exceptions(std::ios::badbit); // a stream swallows what its buffer throws unless it is told otherwise
        decodeBytes(bytes, report);
    } else {
        decodeBytes(input, report);
    }
    if (input.bad()) throw CommandFailure(ExitStatus::Failed, "cannot read the input");
    return report.finish();
}

CLI::App& addDecodeCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "decode", "Print the frames that a file or standard input holds");
    const auto options = std::make_shared<DecodeOptions>();
    command.add_option("file", options->file, "The file; - for standard input")
        ->type_name("FILE")
        ->capture_default_str()
        ->check(CLI::Validator(checkInput, ""));
    CLI::Option* const raw = command.add_flag_callback(
        "--raw", [options] { options->notation = FrameNotation::Raw; },
        "The input is the frames as they are on the wire; guessed unless given");
    command
        .add_flag_callback(
            "--hex", [options] { options->notation = FrameNotation::Hex; },
            "The input is hexadecimal text; # begins a comment, digits before ':' are an address. Golden frames are "
            "such text, too")
        ->excludes(raw);
    addJsonOption(command, options->json);
    // What is wrong with a frame is said once, in the answer; the library's own lines about it come on demand.
    options->log.usual = LogLevel::Error;
    options->log.quiet = true;
    addLogOptions(command, options->log);
    command.callback([&action, options] { action = [options] { return runDecode(*options); }; });
    return command;
}

} // namespace qel::tool
