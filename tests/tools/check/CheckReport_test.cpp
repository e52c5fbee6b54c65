// What a run prints: lines, failures, JSON, JUnit, lists.

#include "check/CheckReport.hpp"
#include "check/Draft.hpp"
#include "check/Messages.hpp"

#include <gtest/gtest.h>
#include <sstream>

namespace qel::test {

namespace {

using namespace tool::check;

/// Three cases, of which one holds, one fails and one is skipped.
class CheckReport : public ::testing::Test {
protected:
    CheckReport()
    {
        holds.test = &cases[0];
        holds.time = std::chrono::milliseconds(12);
        fails.test = &cases[1];
        fails.result = Result::Fails;
        fails.expected = "status 23 (QelMessageStatusKrogSessionAlreadyOpen)";
        fails.seen = "status 0 & \"<none>\"\x1B";
        fails.time = std::chrono::microseconds(1500);
        const std::string request = openSession().callerId(0x101).bytes();
        const std::string response = Draft::response(kInterface, kOpenSession).callerId(0x101).bytes();
        fails.transcript.add({1, Event::Kind::Sent, request, ""});
        fails.transcript.add({1, Event::Kind::Seen, response, ""});
        fails.transcript.add({1, Event::Kind::Note, "the peer ends the connection", ""});
        skipped.test = &cases[2];
        skipped.result = Result::Skipped;
        skipped.seen = "needs TLS";
    }

    std::vector<Outcome> all() const { return {holds, fails, skipped}; }

    const Cases cases{
        {"frame/a", "A frame is a frame.", "wire-format.md#header", Level::Wire, kNothing, {}},
        {"session/b", "A second one is refused.", "connection.md#states", Level::Rule, kNothing, {}},
        {"session/c", "It survives.", "tls.md#pins", Level::Robust, kTls, {}},
    };
    Outcome holds;
    Outcome fails;
    Outcome skipped;
};

const char* const kSent = "request 0x6003/0x0102 OpenKrogSession, id 0x00000101, 32 bytes";
const char* const kSeen = "response 0x6003/0x0102 OpenKrogSession, id 0x00000101, status 0, 32 bytes";

TEST_F(CheckReport, TheLineOfACase)
{
    EXPECT_EQ(outcomeLine(holds), "ok       frame/a");
    EXPECT_EQ(outcomeLine(fails), "FAILED   session/b: expected status 23 (QelMessageStatusKrogSessionAlreadyOpen), "
                                  "seen status 0 & \"<none>\"\\x1b");
    EXPECT_EQ(outcomeLine(skipped), "skipped  session/c: needs TLS");
}

TEST_F(CheckReport, AFailureShowsWhatIsRequiredSentAndSeen)
{
    std::ostringstream text;
    printFailures(text, all(), std::chrono::milliseconds(1260), false);
    const std::string gap(80, ' ');
    EXPECT_EQ(text.str(), std::string("\nsession/b (rule)\n"
                                      "  required  A second one is refused.\n"
                                      "            docs/connection.md#states\n"
                                      "  expected  status 23 (QelMessageStatusKrogSessionAlreadyOpen)\n"
                                      "  seen      status 0 & \"<none>\"\\x1b\n") +
                              "    sent" + gap.substr(4) + "| seen\n    " + kSent +
                              gap.substr(std::string(kSent).size()) + "|\n    " + gap + "| " + kSeen +
                              "\n    - the peer ends the connection" + gap.substr(30) +
                              "|\n\n3 cases: 1 hold, 1 fail, 1 skipped, in 1.3 s\n");
}

TEST_F(CheckReport, HexShowsTheBytes)
{
    std::ostringstream text;
    printFailures(text, {fails}, std::chrono::nanoseconds(0), true);
    EXPECT_NE(
        text.str().find("\n      0000  DE CA FF 20 00 00 00 20 00 00 01 01 60 03 80 00                         |\n"
                        "      0010  00 00 00 00 01 02 00 00 00 00 00 00 00 00 00 00                         |\n"),
        std::string::npos)
        << text.str();
}

TEST_F(CheckReport, ARunWithoutFailuresPrintsItsCounts)
{
    std::ostringstream text;
    printFailures(text, {holds}, std::chrono::milliseconds(40), false);
    EXPECT_EQ(text.str(), "\n1 case: 1 hold, 0 fail, 0 skipped, in 0.0 s\n");
}

TEST_F(CheckReport, Json)
{
    const auto json = reportJson("127.0.0.1:4711", all(), std::chrono::milliseconds(1500));
    EXPECT_EQ(json["peer"], "127.0.0.1:4711");
    EXPECT_EQ(json["holds"], 1);
    EXPECT_EQ(json["fails"], 1);
    EXPECT_EQ(json["skipped"], 1);
    EXPECT_EQ(json["seconds"], 1.5);
    ASSERT_EQ(json["cases"].size(), 3U);
    EXPECT_EQ(json["cases"][0].dump(),
              R"({"id":"frame/a","level":"wire","requirement":"A frame is a frame.",)"
              R"("documented":"docs/wire-format.md#header","result":"holds","seconds":0.012})");
    EXPECT_EQ(json["cases"][2]["reason"], "needs TLS");
    const auto& failure = json["cases"][1];
    EXPECT_EQ(failure["result"], "fails");
    EXPECT_EQ(failure["expected"], fails.expected);
    EXPECT_EQ(failure["seen"], fails.seen);
    EXPECT_EQ(failure["eventsOmitted"], 0);
    ASSERT_EQ(failure["events"].size(), 3U);
    EXPECT_EQ(failure["events"][0]["kind"], "sent");
    EXPECT_EQ(failure["events"][0]["text"], kSent);
    EXPECT_EQ(failure["events"][0]["bytes"], "decaff20000000200000010160038000000000000102000000000000"
                                             "00000000");
    EXPECT_EQ(failure["events"][1]["kind"], "seen");
    EXPECT_EQ(failure["events"][2].dump(), R"({"connection":1,"kind":"note","text":"the peer ends the connection"})");
}

TEST_F(CheckReport, Junit)
{
    std::ostringstream text;
    printJunit(text, "qel check server", all(), std::chrono::milliseconds(1500));
    const std::string gap(80, ' ');
    EXPECT_EQ(
        text.str(),
        std::string(
            R"(<?xml version="1.0" encoding="UTF-8"?>)"
            "\n"
            R"(<testsuites tests="3" failures="1" errors="0" skipped="1" time="1.500">)"
            "\n"
            R"(  <testsuite name="qel check server" tests="3" failures="1" errors="0" skipped="1" time="1.500">)"
            "\n"
            R"(    <testcase classname="frame" name="frame/a" time="0.012"/>)"
            "\n"
            R"(    <testcase classname="session" name="session/b" time="0.002">)"
            "\n"
            R"(      <failure type="rule" message="expected status 23 (QelMessageStatusKrogSessionAlreadyOpen), )"
            R"(seen status 0 &amp; &quot;&lt;none&gt;&quot;\x1b">A second one is refused.)"
            "\n") +
            "    sent" + gap.substr(4) + "| seen\n    " + kSent + gap.substr(std::string(kSent).size()) + "|\n    " +
            gap + "| " + kSeen + "\n    - the peer ends the connection" + gap.substr(30) +
            "|\n</failure>\n    </testcase>\n"
            R"(    <testcase classname="session" name="session/c" time="0.000"><skipped message="needs TLS"/></testcase>)"
            "\n  </testsuite>\n</testsuites>\n");
}

TEST_F(CheckReport, Lists)
{
    std::ostringstream text;
    printList(text, cases);
    EXPECT_EQ(text.str(), "frame/a    wire    A frame is a frame.\n"
                          "session/b  rule    A second one is refused.\n"
                          "session/c  robust  It survives.\n");
    EXPECT_EQ(listJson(cases)[1].dump(), R"({"id":"session/b","level":"rule","requirement":"A second one is refused.",)"
                                         R"("documented":"docs/connection.md#states"})");
}

TEST_F(CheckReport, Markdown)
{
    std::ostringstream text;
    printMarkdown(text, cases);
    EXPECT_EQ(text.str(), "### frame\n\n"
                          "| Case | Level | Requirement |\n|---|---|---|\n"
                          "| [`frame/a`](wire-format.md#header) | wire | A frame is a frame. |\n\n"
                          "### session\n\n"
                          "| Case | Level | Requirement |\n|---|---|---|\n"
                          "| [`session/b`](connection.md#states) | rule | A second one is refused. |\n"
                          "| [`session/c`](tls.md#pins) | robust | It survives. |\n");
}

TEST(CheckTranscript, NumbersTheConnectionsWhenThereAreSeveral)
{
    Transcript transcript;
    transcript.add({1, Event::Kind::Sent, "abc", "byte by byte"});
    transcript.add({2, Event::Kind::Note, "connection reset", ""});
    const std::string gap(80, ' ');
    const std::string first = "3 bytes: 616263, byte by byte";
    EXPECT_EQ(transcriptText(transcript, false), "       sent" + gap.substr(4) + "| seen\n    #1 " + first +
                                                     gap.substr(first.size()) + "|\n    #2 - connection reset" +
                                                     gap.substr(18) + "|\n");
}

TEST(CheckTranscript, ShowsTheFieldsOfAMessage)
{
    Transcript transcript;
    transcript.add({1, Event::Kind::Sent, openSerial(3, 1, 0x8000).callerId(1).bytes(), ""});
    const std::string text = transcriptText(transcript, false);
    EXPECT_NE(text.find("\n      LPID:               3 "), std::string::npos) << text;
    EXPECT_NE(text.find("\n      VSS connection num: 1 "), std::string::npos) << text;
    EXPECT_NE(text.find("\n      Is force open:      True "), std::string::npos) << text;
}

TEST(CheckTranscript, KeepsTheFirstAndTheNewestEvents)
{
    Transcript transcript;
    for (std::size_t i = 0; i < 100; ++i)
        transcript.add({1, Event::Kind::Note, std::to_string(i), ""});
    ASSERT_EQ(transcript.first().size(), Transcript::kFirst);
    ASSERT_EQ(transcript.last().size(), Transcript::kLast);
    EXPECT_EQ(transcript.first().back().text, "11");
    EXPECT_EQ(transcript.last().front().text, "64");
    EXPECT_EQ(transcript.last().back().text, "99");
    EXPECT_EQ(transcript.omitted(), 52U);
    EXPECT_NE(transcriptText(transcript, false).find("    ... 52 events more ...\n"), std::string::npos);
}

} // namespace

} // namespace qel::test
