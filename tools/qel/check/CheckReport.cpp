#include "check/CheckReport.hpp"

#include <qel/protocol/Text.hpp>

#include "check/Frame.hpp"

#include <algorithm>
#include <cstdio>

namespace qel::tool::check {

namespace {

double seconds(std::chrono::nanoseconds time) { return std::chrono::duration<double>(time).count(); }

/// With three decimals, as JUnit has them.
std::string secondsText(std::chrono::nanoseconds time)
{
    char text[32];
    static_cast<void>(std::snprintf(text, sizeof(text), "%.3f", seconds(time)));
    return text;
}

const char* resultName(Result result)
{
    switch (result) {
    case Result::Holds:
        return "holds";
    case Result::Fails:
        return "fails";
    case Result::Skipped:
        break;
    }
    return "skipped";
}

std::string familyOf(const Case& aCase) { return aCase.id.substr(0, aCase.id.find('/')); }

std::string escapedXml(const std::string& text)
{
    std::string escaped;
    for (const char c : printableLines(text)) {
        switch (c) {
        case '&':
            escaped += "&amp;";
            break;
        case '<':
            escaped += "&lt;";
            break;
        case '>':
            escaped += "&gt;";
            break;
        case '"':
            escaped += "&quot;";
            break;
        default:
            escaped += c;
        }
    }
    return escaped;
}

const char* eventName(Event::Kind kind)
{
    switch (kind) {
    case Event::Kind::Sent:
        return "sent";
    case Event::Kind::Seen:
        return "seen";
    case Event::Kind::Note:
        break;
    }
    return "note";
}

nlohmann::ordered_json eventJson(const Event& event)
{
    nlohmann::ordered_json json{{"connection", event.wire}, {"kind", eventName(event.kind)}};
    if (event.kind == Event::Kind::Note) {
        json["text"] = event.text;
        return json;
    }
    json["text"] = describeFrame(event.text);
    json["bytes"] = hexDigits(event.text);
    return json;
}

nlohmann::ordered_json outcomeJson(const Outcome& outcome)
{
    nlohmann::ordered_json json{{"id", outcome.test->id},
                                {"level", levelName(outcome.test->level)},
                                {"requirement", outcome.test->requirement},
                                {"documented", "docs/" + outcome.test->anchor},
                                {"result", resultName(outcome.result)},
                                {"seconds", seconds(outcome.time)}};
    if (outcome.result == Result::Skipped) json["reason"] = outcome.seen;
    if (outcome.result != Result::Fails) return json;
    json["expected"] = outcome.expected;
    json["seen"] = outcome.seen;
    json["events"] = nlohmann::ordered_json::array();
    for (const auto* events : {&outcome.transcript.first(), &outcome.transcript.last()}) {
        for (const Event& event : *events)
            json["events"].push_back(eventJson(event));
    }
    json["eventsOmitted"] = outcome.transcript.omitted();
    return json;
}

} // namespace

Counts countsOf(const std::vector<Outcome>& outcomes)
{
    Counts counts;
    for (const Outcome& outcome : outcomes) {
        if (outcome.result == Result::Holds) ++counts.holds;
        if (outcome.result == Result::Fails) ++counts.fails;
        if (outcome.result == Result::Skipped) ++counts.skipped;
    }
    return counts;
}

std::string outcomeLine(const Outcome& outcome)
{
    const std::string& id = outcome.test->id;
    switch (outcome.result) {
    case Result::Holds:
        return "ok       " + id;
    case Result::Fails:
        return printable("FAILED   " + id + ": expected " + outcome.expected + ", seen " + outcome.seen);
    case Result::Skipped:
        break;
    }
    return printable("skipped  " + id + ": " + outcome.seen);
}

void printFailures(std::ostream& os, const std::vector<Outcome>& outcomes, std::chrono::nanoseconds time, bool hex)
{
    for (const Outcome& outcome : outcomes) {
        if (outcome.result != Result::Fails) continue;
        os << '\n'
           << outcome.test->id << " (" << levelName(outcome.test->level) << ")\n"
           << "  required  " << outcome.test->requirement << "\n"
           << "            docs/" << outcome.test->anchor << "\n"
           << "  expected  " << printable(outcome.expected) << "\n"
           << "  seen      " << printable(outcome.seen) << "\n"
           << transcriptText(outcome.transcript, hex);
    }
    const Counts counts = countsOf(outcomes);
    char duration[32];
    static_cast<void>(std::snprintf(duration, sizeof(duration), "%.1f", seconds(time)));
    os << '\n'
       << outcomes.size() << (outcomes.size() == 1 ? " case: " : " cases: ") << counts.holds << " hold, "
       << counts.fails << " fail, " << counts.skipped << " skipped, in " << duration << " s\n";
}

nlohmann::ordered_json reportJson(const std::string& peer, const std::vector<Outcome>& outcomes,
                                  std::chrono::nanoseconds time)
{
    const Counts counts = countsOf(outcomes);
    nlohmann::ordered_json json{{"peer", peer},
                                {"holds", counts.holds},
                                {"fails", counts.fails},
                                {"skipped", counts.skipped},
                                {"seconds", seconds(time)}};
    json["cases"] = nlohmann::ordered_json::array();
    for (const Outcome& outcome : outcomes)
        json["cases"].push_back(outcomeJson(outcome));
    return json;
}

void printJunit(std::ostream& os, const std::string& suite, const std::vector<Outcome>& outcomes,
                std::chrono::nanoseconds time)
{
    const Counts counts = countsOf(outcomes);
    const std::string totals = R"(tests=")" + std::to_string(outcomes.size()) + R"(" failures=")" +
                               std::to_string(counts.fails) + R"(" errors="0" skipped=")" +
                               std::to_string(counts.skipped) + R"(" time=")" + secondsText(time) + "\"";
    os << R"(<?xml version="1.0" encoding="UTF-8"?>)"
       << "\n"
       << "<testsuites " << totals << ">\n  <testsuite name=\"" << escapedXml(suite) << "\" " << totals << ">\n";
    for (const Outcome& outcome : outcomes) {
        os << "    <testcase classname=\"" << escapedXml(familyOf(*outcome.test)) << "\" name=\""
           << escapedXml(outcome.test->id) << "\" time=\"" << secondsText(outcome.time) << "\"";
        if (outcome.result == Result::Holds) {
            os << "/>\n";
        } else if (outcome.result == Result::Skipped) {
            os << "><skipped message=\"" << escapedXml(outcome.seen) << "\"/></testcase>\n";
        } else {
            os << ">\n      <failure type=\"" << levelName(outcome.test->level) << "\" message=\""
               << escapedXml("expected " + outcome.expected + ", seen " + outcome.seen) << "\">"
               << escapedXml(outcome.test->requirement + "\n" + transcriptText(outcome.transcript, false))
               << "</failure>\n    </testcase>\n";
        }
    }
    os << "  </testsuite>\n</testsuites>\n";
}

void printList(std::ostream& os, const Cases& cases)
{
    std::size_t width = 0;
    for (const Case& aCase : cases)
        width = std::max(width, aCase.id.size());
    for (const Case& aCase : cases) {
        std::string level = levelName(aCase.level);
        level.resize(6, ' ');
        os << aCase.id << std::string(width - aCase.id.size() + 2, ' ') << level << "  " << aCase.requirement << '\n';
    }
}

nlohmann::ordered_json listJson(const Cases& cases)
{
    nlohmann::ordered_json list = nlohmann::ordered_json::array();
    for (const Case& aCase : cases) {
        list.push_back({{"id", aCase.id},
                        {"level", levelName(aCase.level)},
                        {"requirement", aCase.requirement},
                        {"documented", "docs/" + aCase.anchor}});
    }
    return list;
}

void printMarkdown(std::ostream& os, const Cases& cases)
{
    std::string family;
    for (const Case& aCase : cases) {
        if (familyOf(aCase) != family) {
            os << (family.empty() ? "" : "\n");
            family = familyOf(aCase);
            os << "### " << family << "\n\n| Case | Level | Requirement |\n|---|---|---|\n";
        }
        os << "| [`" << aCase.id << "`](" << aCase.anchor << ") | " << levelName(aCase.level) << " | "
           << aCase.requirement << " |\n";
    }
}

} // namespace qel::tool::check
