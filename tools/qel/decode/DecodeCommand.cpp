#include "decode/DecodeCommand.hpp"

#include <qel/common/StreamFormatters.hpp>
#include <qel/common/TypeInfo.hpp>
#include <qel/common/util/PosixError.hpp>
#include <qel/protocol/Text.hpp>

#include "base/Answer.hpp"
#include "base/Failures.hpp"
#include "base/Library.hpp"
#include "base/Logging.hpp"
#include "base/OptionChecks.hpp"
#include "decode/CaptureDecoder.hpp"
#include "decode/FrameDecoder.hpp"
#include "decode/FrameJson.hpp"
#include "decode/HexText.hpp"
#include "decode/PcapReader.hpp"
#include "decode/PrefixedInput.hpp"

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

/// The output: text is printed at once, JSON is collected into one document.
class Report {
public:
    Report(bool json, std::ostream& output, std::ostream& errors) : mJson(json), mOutput(output), mErrors(errors) {}

    void add(const FrameDecoder::Item& item)
    {
        if (item.message != nullptr) pAddFrame(item);
        if (!item.reason.empty()) addBad(item.stream, item.offset, item.reason);
    }

    void addBad(const std::string& stream, std::uint64_t offset, const std::string& reason)
    {
        pSay("bad frame at " + place(stream, offset) + ": " + reason);
        nlohmann::ordered_json bad;
        if (!stream.empty()) bad["stream"] = stream;
        bad["offset"] = offset;
        bad["reason"] = reason;
        mBad.push_back(std::move(bad));
    }

    /// The input as a whole cannot be decoded, or not all of it.
    void refuse(const std::string& reason)
    {
        pSay(reason);
        mBad.push_back({{"reason", reason}});
    }

    /// Something was left out that is not an error.
    void addSkipped(const std::string& sentence)
    {
        if (sentence.empty()) return;
        pSay(sentence);
        mSkipped = sentence;
    }

    ExitStatus finish()
    {
        if (mJson) {
            nlohmann::ordered_json document{{"frames", mFrames}, {"bad", mBad}};
            if (!mSkipped.empty()) document["skipped"] = mSkipped;
            printJson(mOutput, document);
        }
        return mBad.empty() ? ExitStatus::Done : ExitStatus::Refused;
    }

private:
    static std::string place(const std::string& stream, std::uint64_t offset)
    {
        return "offset " + std::to_string(offset) + (stream.empty() ? "" : " of " + stream);
    }

    void pSay(const std::string& text)
    {
        mOutput.flush(); // keeps the two streams in order on a terminal
        mErrors << "qel: " << text << std::endl;
    }

    void pAddFrame(const FrameDecoder::Item& item)
    {
        if (mJson) {
            mFrames.push_back(frameJson(item));
            return;
        }
        // The dump contains texts of the frame, which are untrusted.
        mOutput << "frame at " << place(item.stream, item.offset) << ", " << item.message->msgLength() << " bytes\n"
                << toString(item.message->getLogID()) << '\n'
                << printableLines(toString(item.message->debug()));
    }

    bool mJson;
    std::ostream& mOutput;
    std::ostream& mErrors;
    nlohmann::ordered_json mFrames = nlohmann::ordered_json::array();
    nlohmann::ordered_json mBad = nlohmann::ordered_json::array();
    std::string mSkipped;
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
        report.addBad({}, offset, failure.what()); // malformed hexadecimal text
    }
}

void decodeCapture(std::istream& capture, bool isPcapng, Report& report)
{
    CaptureDecoder decoder(capture, isPcapng, [&report](const FrameDecoder::Item& item) { report.add(item); });
    try {
        decoder.run();
    } catch (const CommandFailure& failure) {
        report.refuse(failure.what());
    }
    report.addSkipped(decoder.skipped());
    if (decoder.frameCount() == 0) report.refuse("no frame was found in the capture");
}

void decodeHexText(std::istream& text, Report& report)
{
    HexTextBuffer buffer(text);
    std::istream bytes(&buffer);
    bytes.exceptions(std::ios::badbit); // without it the stream hides what its buffer throws
    decodeBytes(bytes, report);
}

/// Finds out by its first bytes what the input is.
void decodeGuessed(std::istream& input, Report& report)
{
    PrefixedInput buffer(input, PcapReader::kMagicBytes);
    std::istream bytes(&buffer);
    const bool isPcapng = PcapReader::isPcapng(buffer.prefix());
    if (isPcapng || PcapReader::isPcap(buffer.prefix())) {
        decodeCapture(bytes, isPcapng, report);
    } else if (looksLikeHexText(bytes)) {
        decodeHexText(bytes, report);
    } else {
        decodeBytes(bytes, report);
    }
}

std::string checkInput(std::string& name) { return name == "-" ? std::string() : fileValidator()(name); }

ExitStatus runDecode(const DecodeOptions& options)
{
    startLogging(options.log, "qel-decode.log");
    std::ios::sync_with_stdio(false); // otherwise a read error looks like the end of the input
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
    switch (notation) {
    case FrameNotation::Guess:
        decodeGuessed(input, report);
        break;
    case FrameNotation::Raw:
        decodeBytes(input, report);
        break;
    case FrameNotation::Hex:
        decodeHexText(input, report);
        break;
    }
    if (input.bad()) throw CommandFailure(ExitStatus::Failed, "cannot read the input");
    return report.finish();
}

CLI::App& addDecodeCommand(CLI::App& parent, Action& action)
{
    CLI::App& command = addCommand(parent, "decode", "Print the frames in a file or on standard input");
    const auto options = std::make_shared<DecodeOptions>();
    command
        .add_option("file", options->file,
                    "The file; - is standard input. Raw frames, a pcap or pcapng capture, or hexadecimal text")
        ->type_name("FILE")
        ->capture_default_str()
        ->check(CLI::Validator(checkInput, ""));
    CLI::Option* const raw = command.add_flag_callback(
        "--raw", [options] { options->notation = FrameNotation::Raw; },
        "The input is raw frames as on the wire (default: decided by its first bytes)");
    command
        .add_flag_callback(
            "--hex", [options] { options->notation = FrameNotation::Hex; },
            "The input is hexadecimal text: digits with blanks, # comments and addresses that end in ':', output of "
            "xxd or hexdump -C, or golden frames")
        ->excludes(raw);
    addJsonOption(command, options->json);
    // The output reports malformed frames; the library's log lines about them are optional.
    options->log.usual = LogLevel::Error;
    options->log.quiet = true;
    addLogOptions(command, options->log);
    command.callback([&action, options] { action = [options] { return runDecode(*options); }; });
    return command;
}

} // namespace qel::tool
