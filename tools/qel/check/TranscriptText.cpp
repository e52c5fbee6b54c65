#include "check/Frame.hpp"
#include "check/Transcript.hpp"

#include <algorithm>
#include <array>
#include <cstdio>
#include <vector>

namespace qel::tool::check {

namespace {

using Lines = std::vector<std::string>;

constexpr std::size_t kColumn = 80; // characters of what was sent: most frames fit
constexpr std::size_t kRow = 16;    // bytes of a dump
constexpr std::size_t kMaxDump = 512;
constexpr std::size_t kMaxDetails = 8;

void addDump(Lines& lines, const std::string& bytes)
{
    const std::size_t end = std::min(bytes.size(), kMaxDump);
    for (std::size_t row = 0; row < end; row += kRow) {
        std::string line = "  " + hexNumber(static_cast<std::uint32_t>(row), 4).substr(2) + " ";
        for (std::size_t i = row; i < std::min(row + kRow, end); ++i)
            line += " " + hexNumber(static_cast<unsigned char>(bytes[i]), 2).substr(2);
        lines.push_back(line);
    }
    if (end < bytes.size()) lines.push_back("  and " + std::to_string(bytes.size() - end) + " bytes more");
}

Lines linesOf(const Event& event, bool hex)
{
    if (event.kind == Event::Kind::Note) return {"- " + event.text};
    Lines lines{describeFrame(event.text) + (event.remark.empty() ? "" : ", " + event.remark)};
    const Lines details = frameDetails(event.text);
    for (std::size_t i = 0; i < std::min(details.size(), kMaxDetails); ++i)
        lines.push_back("  " + details[i]);
    if (hex) addDump(lines, event.text);
    return lines;
}

std::string padded(std::string text, std::size_t width)
{
    text.resize(std::max(width, text.size()), ' ');
    return text;
}

/// Rows of two columns. A line of the left column that is too long has a row of its own.
class Columns {
public:
    void add(const std::string& label, const Event& event, bool hex)
    {
        const bool isRight = event.kind == Event::Kind::Seen;
        std::string head = label;
        for (const std::string& line : linesOf(event, hex)) {
            const std::string left = isRight ? std::string() : line;
            const std::string right = isRight ? line : std::string();
            pAdd(padded(head, label.size()) + padded(left, kColumn) + "| " + right);
            head.clear();
        }
    }
    void addNote(const std::string& text) { pAdd(text); }
    const std::string& text() const { return mText; }

private:
    void pAdd(std::string line)
    {
        line.erase(line.find_last_not_of(' ') + 1);
        mText += "    " + line + "\n";
    }

    std::string mText;
};

unsigned int wiresOf(const Transcript& transcript)
{
    unsigned int wires = 0;
    for (const auto* events : {&transcript.first(), &transcript.last()}) {
        for (const Event& event : *events)
            wires = std::max(wires, event.wire);
    }
    return wires;
}

} // namespace

std::string transcriptText(const Transcript& transcript, bool hex)
{
    const bool numbered = wiresOf(transcript) > 1;
    const auto label = [&](const Event& event) { return numbered ? "#" + std::to_string(event.wire) + " " : ""; };
    Columns columns;
    columns.addNote((numbered ? "   " : "") + padded("sent", kColumn) + "| seen");
    for (const Event& event : transcript.first())
        columns.add(label(event), event, hex);
    if (transcript.omitted() > 0) columns.addNote("... " + std::to_string(transcript.omitted()) + " events more ...");
    for (const Event& event : transcript.last())
        columns.add(label(event), event, hex);
    return columns.text();
}

} // namespace qel::tool::check
