#include <qel/common/util/PosixError.hpp>

#include "base/Failures.hpp"
#include "base/TomlFile.hpp"
#include "support/TemporaryDirectory.hpp"

#include <fstream>
#include <functional>
#include <gmock/gmock.h>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::StartsWith;
using tool::CommandFailure;
using tool::TomlEntry;
using tool::TomlValue;

TomlValue parse(const std::string& text) { return tool::parseToml(text, "f.toml"); }

/// What is said about an error, which must be one of usage.
std::string failureOf(const std::function<void()>& action)
{
    try {
        action();
    } catch (const CommandFailure& error) {
        EXPECT_EQ(error.getExitStatus(), tool::ExitStatus::Usage);
        return error.what();
    }
    return "no error";
}

std::string parseFailure(const std::string& text)
{
    return failureOf([&] { static_cast<void>(parse(text)); });
}

/// The one entry of a text.
TomlEntry entry(const std::string& text) { return parse(text).entries.at(0); }

std::vector<std::string> keysOf(const TomlValue& table)
{
    std::vector<std::string> keys;
    for (const TomlEntry& each : table.entries)
        keys.push_back(each.key);
    return keys;
}

TEST(TomlFile, AnEmptyTextIsAnEmptyTable)
{
    EXPECT_EQ(parse("").kind, TomlValue::Kind::Table);
    EXPECT_THAT(parse("# nothing\n").entries, IsEmpty());
}

TEST(TomlFile, ScalarsHaveTheTextThatAnOptionTakes)
{
    struct {
        const char* toml;
        TomlValue::Kind kind;
        const char* text;
    } const rows[] = {
        {"a = \"on\"", TomlValue::Kind::Text, "on"},     {"a = '0x1\\'", TomlValue::Kind::Text, "0x1\\"},
        {"a = 16", TomlValue::Kind::Integer, "16"},      {"a = 0x10", TomlValue::Kind::Integer, "16"},
        {"a = 1_000", TomlValue::Kind::Integer, "1000"}, {"a = -3", TomlValue::Kind::Integer, "-3"},
        {"a = 0.5", TomlValue::Kind::Number, "0.5"},     {"a = 86400.0", TomlValue::Kind::Number, "86400"},
        {"a = true", TomlValue::Kind::Boolean, "true"},  {"a = false", TomlValue::Kind::Boolean, "false"},
        {"a = 2026-11-22", TomlValue::Kind::Time, ""},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.toml);
        EXPECT_EQ(entry(row.toml).value.kind, row.kind);
        EXPECT_EQ(entry(row.toml).value.text, row.text);
    }
}

TEST(TomlFile, KeysKeepTheOrderOfTheFile)
{
    EXPECT_THAT(keysOf(parse("zebra = 1\nant = 2\n[table]\n[mouse.x]\n")),
                ElementsAre("zebra", "ant", "table", "mouse"));
    EXPECT_THAT(keysOf(entry("[p.web]\n[p.db]\n[p.mail]\n").value), ElementsAre("web", "db", "mail"));
}

TEST(TomlFile, EveryValueKnowsItsPlace)
{
    const TomlValue file = parse("first = 1\n  second = [\"a\",\n   \"b\"]\n[[rule]]\nname = \"x\"\n");
    const TomlEntry* second = file.find("second");
    ASSERT_NE(second, nullptr);
    EXPECT_EQ(toText(second->place), "f.toml:2:3");
    EXPECT_EQ(toText(second->value.place), "f.toml:2:12");
    EXPECT_EQ(toText(second->value.items.at(1).place), "f.toml:3:4");
    const TomlValue& rule = file.find("rule")->value.items.at(0);
    EXPECT_EQ(toText(rule.find("name")->value.place), "f.toml:5:8");
}

TEST(TomlFile, FindsNoKeyThatIsNotThere) { EXPECT_EQ(parse("a = 1").find("b"), nullptr); }

TEST(TomlFile, NamesThePlaceOfASyntaxError)
{
    EXPECT_THAT(parseFailure("a = 1\nb = \"open\n"), StartsWith("f.toml:2:10: error while parsing string: "));
    EXPECT_THAT(parseFailure("a = 1\na = 2\n"), StartsWith("f.toml:2:5: "));
    EXPECT_THAT(parseFailure("a"), StartsWith("f.toml:1:2: "));
    EXPECT_THAT(parseFailure("a = \"\xFF\""), StartsWith("f.toml:1:"));
}

TEST(TomlFile, ASyntaxErrorStaysOnOneLine)
{
    const std::string said = parseFailure("a = \x1b[2J");
    EXPECT_EQ(said.find_first_of("\x1b\n"), std::string::npos) << said;
}

TEST(TomlFile, RefusesNestingWithoutEnd)
{
    const std::string deep(100000, '[');
    EXPECT_THAT(parseFailure("a = " + deep), StartsWith("f.toml:1:"));
}

TEST(TomlFile, NamesTheNearestKnownKey)
{
    const auto failure = [](const std::string& text) {
        return failureOf([&] { tool::requireKnownKeys(parse(text), {"listen", "name", "log-level"}); });
    };
    EXPECT_EQ(failure("name = 1\n lisen = 2\n"), "f.toml:2:2: unknown key \"lisen\"; did you mean \"listen\"?");
    EXPECT_EQ(failure("colour = 1\n"), "f.toml:1:1: unknown key \"colour\"; known keys are listen, name, log-level");
    EXPECT_EQ(failure("\"a\\nb\" = 1\n"),
              "f.toml:1:1: unknown key \"a\\x0ab\"; known keys are listen, name, log-level");
    EXPECT_EQ(failure("listen = 1\nname = 2\n"), "no error");
}

TEST(TomlFile, ReturnsValuesOfTheRightKind)
{
    EXPECT_EQ(tool::textOf(entry("a = \"x\"")), "x");
    EXPECT_TRUE(tool::flagOf(entry("a = true")));
    EXPECT_FALSE(tool::flagOf(entry("a = false")));
    EXPECT_EQ(tool::tableOf(entry("[a]\nb = 1")).entries.size(), 1U);
    EXPECT_THAT(tool::textsOf(entry("a = [\"x\", \"y\"]")), ElementsAre("x", "y"));
    EXPECT_THAT(tool::textsOf(entry("a = \"x\"")), ElementsAre("x"));
    EXPECT_THAT(tool::textsOf(entry("a = []")), IsEmpty());
    EXPECT_EQ(tool::itemsOf(entry("a = [1, \"y\"]")).size(), 2U);
}

TEST(TomlFile, RefusesValuesOfAnotherKind)
{
    EXPECT_EQ(failureOf([] { tool::textOf(entry("a = 1")); }), "f.toml:1:5: a takes a text, not an integer");
    EXPECT_EQ(failureOf([] { tool::flagOf(entry("a = 'yes'")); }), "f.toml:1:5: a takes true or false, not a text");
    EXPECT_EQ(failureOf([] { tool::tableOf(entry("a = [1]")); }), "f.toml:1:5: a takes a table, not a list");
    EXPECT_EQ(failureOf([] { tool::textsOf(entry("a = ['x', 0.5]")); }), "f.toml:1:11: a takes texts, not a number");
    EXPECT_EQ(failureOf([] { tool::integerOf(entry("a = 07:32:00"), 0, 9); }),
              "f.toml:1:5: a takes an integer, not a time");
}

TEST(TomlFile, AcceptsIntegersUpToTheLimitsAndRefusesThemBeyond)
{
    EXPECT_EQ(tool::integerOf(entry("a = 1"), 1, 255), 1U);
    EXPECT_EQ(tool::integerOf(entry("a = 255"), 1, 255), 255U);
    for (const char* number : {"0", "256", "-1"}) {
        SCOPED_TRACE(number);
        EXPECT_EQ(failureOf([&] { tool::integerOf(entry(std::string("a = ") + number), 1, 255); }),
                  std::string("f.toml:1:5: a: \"") + number + "\" is not an integer in [1, 255]");
    }
}

TEST(TomlFile, ReadsAFile)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("a.toml");
    std::ofstream(path) << "a = 1\nb = !\n";
    EXPECT_THAT(failureOf([&] { tool::readToml(path); }), StartsWith(path + ":2:5: "));
    std::ofstream(path) << "a = 1\n";
    EXPECT_EQ(toText(tool::readToml(path).find("a")->value.place), path + ":1:5");
}

TEST(TomlFile, SaysThatAFileCannotBeRead)
{
    const TemporaryDirectory directory;
    try {
        tool::readToml(directory.file("none.toml"));
        FAIL() << "no error";
    } catch (const FileIOError& error) {
        EXPECT_EQ(tool::userMessage(error),
                  "cannot open " + directory.file("none.toml") + ": 2 (No such file or directory)");
    }
    EXPECT_THROW(tool::readToml(directory.path()), FileIOError);
}

TEST(TomlFile, TakesAMebibyteAndRefusesMore)
{
    const TemporaryDirectory directory;
    const std::string path = directory.file("long.toml");
    const std::string full = "#" + std::string(1024 * 1024 - 2, 'x') + "\n";
    std::ofstream(path) << full;
    EXPECT_THAT(tool::readToml(path).entries, IsEmpty());
    std::ofstream(path) << full << "\n";
    EXPECT_EQ(failureOf([&] { tool::readToml(path); }), path + ":1:1: longer than 1 MiB");
}

} // namespace

} // namespace qel::test
