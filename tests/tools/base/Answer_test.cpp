#include "base/Answer.hpp"

#include <gtest/gtest.h>
#include <sstream>

namespace qel::test {

namespace {

using tool::Answer;

TEST(Answer, TextHasOneAlignedLineForEachValue)
{
    Answer answer;
    answer.add("a", "Short", 5);
    answer.add("b", "Rather long", "text");
    answer.addForPrograms("c", "not for people");
    std::ostringstream os;
    answer.print(os);
    EXPECT_EQ(os.str(), "Short:       5\n"
                        "Rather long: text\n");
}

TEST(Answer, JsonHasTheValuesInOrder)
{
    Answer answer;
    answer.add("z", "Z", 5);
    answer.addText("a", "A", "x");
    answer.addForPrograms("m", true);
    EXPECT_EQ(answer.json().dump(), R"({"z":5,"a":"x","m":true})");
}

TEST(Answer, UntrustedTextIsEscaped)
{
    Answer answer;
    answer.addText("a", "A", "\x1B[2J");
    std::ostringstream os;
    answer.print(os);
    EXPECT_EQ(os.str(), "A: \\x1b[2J\n");
}

TEST(Answer, BytesThatAreNotUtf8AreReplacedInJson)
{
    Answer answer;
    answer.addText("a", "A", "x\xFFy");
    std::ostringstream os;
    tool::printJson(os, answer.json());
    EXPECT_EQ(os.str(), "{\n  \"a\": \"x\xEF\xBF\xBDy\"\n}\n");
}

TEST(Answer, ControlCharactersAreEscapedInJson)
{
    Answer answer;
    answer.addText("c0", "A", std::string("\x1B\0\x1F ", 4));
    answer.addText("c1", "A", "~\x7F\xC2\x80\xC2\x9B\x32J\xC2\x9F\xC2\xA0");
    answer.addText("raw", "A", "\x80\x9B\x9F");
    answer.addText("letters", "A", "\xC3\x80\xC3\x9F\xE2\x82\x9B");
    std::ostringstream os;
    tool::printJson(os, answer.json());
    EXPECT_EQ(os.str(), "{\n"
                        "  \"c0\": \"\\u001b\\u0000\\u001f \",\n"
                        "  \"c1\": \"~\\u007f\\u0080\\u009b2J\\u009f\xC2\xA0\",\n"
                        "  \"raw\": \"\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD\",\n"
                        "  \"letters\": \"\xC3\x80\xC3\x9F\xE2\x82\x9B\"\n"
                        "}\n");
    EXPECT_EQ(nlohmann::ordered_json::parse(os.str())["c1"], answer.json()["c1"]) << "still the same text";
}

TEST(Answer, TheHeadNamesRequestAndStatus)
{
    EXPECT_EQ(tool::jsonHead("time", QelMessageStatusInvalidLparId, 7).dump(),
              R"({"request":"time","status":21,"statusName":"QelMessageStatusInvalidLparId","statusDetail":7})");
}

TEST(Answer, StatusNameHasNoNumber)
{
    EXPECT_EQ(tool::statusName(QelMessageStatusNoError), "QelMessageStatusNoError");
    EXPECT_EQ(tool::statusName(static_cast<QelMessageStatusCodes>(5)), "unknown status code");
}

} // namespace

} // namespace qel::test
