#include "base/Answer.hpp"

#include <gtest/gtest.h>
#include <sstream>

namespace qel::test {

namespace {

using tool::Answer;

TEST(Answer, PeopleGetOneAlignedLineForEachValue)
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

TEST(Answer, ProgramsGetTheValuesInOrder)
{
    Answer answer;
    answer.add("z", "Z", 5);
    answer.addText("a", "A", "x");
    answer.addForPrograms("m", true);
    EXPECT_EQ(answer.json().dump(), R"({"z":5,"a":"x","m":true})");
}

TEST(Answer, TextOfTheOtherEndCannotChangeTheTerminal)
{
    Answer answer;
    answer.addText("a", "A", "\x1B[2J");
    std::ostringstream os;
    answer.print(os);
    EXPECT_EQ(os.str(), "A: \\x1b[2J\n");
}

TEST(Answer, BytesThatAreNoUtf8AreReplacedInJson)
{
    Answer answer;
    answer.addText("a", "A", "x\xFFy");
    std::ostringstream os;
    tool::printJson(os, answer.json());
    EXPECT_EQ(os.str(), "{\n  \"a\": \"x\xEF\xBF\xBDy\"\n}\n");
}

TEST(Answer, TheHeadNamesRequestAndStatus)
{
    EXPECT_EQ(tool::jsonHead("time", QelMessageStatusInvalidLparId, 7).dump(),
              R"({"request":"time","status":21,"statusName":"QelMessageStatusInvalidLparId","statusDetail":7})");
}

TEST(Answer, StatusNamesStandAlone)
{
    EXPECT_EQ(tool::statusName(QelMessageStatusNoError), "QelMessageStatusNoError");
    EXPECT_EQ(tool::statusName(static_cast<QelMessageStatusCodes>(5)), "unknown status code");
}

} // namespace

} // namespace qel::test
