#include "base/Failures.hpp"
#include "serve/ServeConfig.hpp"

#include <gmock/gmock.h>
#include <sstream>
#include <string>

namespace qel::test {

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using tool::ServeConfig;

const std::string kFingerprint =
    "0C:7B:B2:14:39:6D:89:0B:A9:3B:84:83:63:16:03:B7:18:78:65:1F:B6:C7:8F:DC:1D:1D:66:3C:93:0A:17:CA";

ServeConfig read(const std::string& text)
{
    return tool::readServeConfig(tool::parseToml(text, "f"), {"listen", "name"});
}

std::string failureOf(const std::string& text)
{
    try {
        read(text);
    } catch (const tool::CommandFailure& error) {
        EXPECT_EQ(error.getExitStatus(), tool::ExitStatus::Usage);
        return error.what();
    }
    return "no error";
}

const std::string kRuleHead = "[partition.web]\nid = 40\nline = 'x'\n[[rule]]\nname = 'a'\nmay = 'type'\npartitions = ";

/// The ranges of a rule, as text.
std::string rangesOf(const std::string& partitions)
{
    const ServeConfig config = read(kRuleHead + partitions);
    std::string text;
    for (const auto& range : config.rules.at(0).partitions)
        text += std::to_string(range.first) + "-" + std::to_string(range.last) + " ";
    return text;
}

std::string rangeFailure(const std::string& partitions) { return failureOf(kRuleHead + partitions); }

TEST(ServeConfig, AnEmptyFileHasNoPartitionsAndNoRules)
{
    EXPECT_THAT(read("").partitions, IsEmpty());
    EXPECT_THAT(read("listen = 'x'").rules, IsEmpty());
}

TEST(ServeConfig, ReadsPartitionsInTheOrderOfTheFile)
{
    const ServeConfig config =
        read("[partition.web-1]\nid = 65535\nline = 'cat'\ndescription = 'the web'\n[partition.db]\nid = 1\nline = "
             "'unix:/run/x'\n");
    ASSERT_EQ(config.partitions.size(), 2U);
    EXPECT_EQ(config.partitions[0].name, "web-1");
    EXPECT_EQ(config.partitions[0].id, 65535);
    EXPECT_EQ(config.partitions[0].line, "cat");
    EXPECT_EQ(config.partitions[0].description, "the web");
    EXPECT_EQ(config.partitions[1].name, "db");
    EXPECT_EQ(config.partitions[1].description, "");
    EXPECT_THAT(config.rules, IsEmpty());
}

TEST(ServeConfig, RefusesWrongPartitions)
{
    EXPECT_EQ(failureOf("[partition.a]\nline = 'x'"), "f:1:12: id is missing");
    EXPECT_EQ(failureOf("[partition.a]\nid = 1"), "f:1:12: line is missing");
    EXPECT_EQ(failureOf("[partition.a]\nid = 0\nline = 'x'"), "f:2:6: id: \"0\" is not an integer in [1, 65535]");
    EXPECT_EQ(failureOf("[partition.a]\nid = 65536\nline = 'x'"),
              "f:2:6: id: \"65536\" is not an integer in [1, 65535]");
    EXPECT_EQ(failureOf("[partition.a]\nid = 1\nline = ''"), "f:3:8: line is empty");
    EXPECT_EQ(failureOf("[partition.a]\nid = 1\nlin = 'x'"), "f:3:1: unknown key \"lin\"; did you mean \"line\"?");
    EXPECT_EQ(failureOf("[partition.a]\nid = 1\nline = 'x'\n[partition.b]\nid = 1\nline = 'y'"),
              "f:5:6: partition 1 is a already");
    EXPECT_EQ(failureOf("partition = 1"), "f:1:13: partition takes a table, not an integer");
    EXPECT_EQ(failureOf("[partition.1a]\nid = 1\nline = 'x'"),
              "f:1:12: \"1a\" is not a name for a partition: a letter, then letters, digits, '_' and '-', at most 64");
}

TEST(ServeConfig, LimitsNamesAndDescriptions)
{
    const auto named = [](std::size_t length) {
        return failureOf("[partition." + std::string(length, 'n') + "]\nid = 1\nline = 'x'");
    };
    EXPECT_EQ(named(64), "no error");
    EXPECT_NE(named(65), "no error");
    const auto described = [](std::size_t length) {
        return failureOf("[partition.a]\nid = 1\nline = 'x'\ndescription = '" + std::string(length, 'd') + "'");
    };
    EXPECT_EQ(described(256), "no error");
    EXPECT_EQ(described(257), "f:4:15: description: longer than 256 bytes");
}

TEST(ServeConfig, APartitionIsATableWithAName)
{
    const std::string hint = "is not a table: write [partition.NAME] for each partition";
    EXPECT_EQ(failureOf("[partition]\nid = 1\nline = 'x'"), "f:2:1: \"id\" " + hint);
    EXPECT_EQ(failureOf("[[partition.web]]\nid = 1\nline = 'x'"), "f:1:13: \"web\" " + hint);
}

TEST(ServeConfig, ADescriptionIsALine)
{
    const std::string partition = "[partition.a]\nid = 1\nline = 'x'\ndescription = ";
    EXPECT_EQ(failureOf(partition + "\"a\\nb\""), "f:4:15: description: has control characters");
    EXPECT_EQ(failureOf(partition + "\"\\u001b[2J\""), "f:4:15: description: has control characters");
    EXPECT_EQ(failureOf(partition + "\"\\u007f\""), "f:4:15: description: has control characters");
    EXPECT_EQ(failureOf(partition + "\"\u00e4 \\\"b\\\"\""), "no error");
}

TEST(ServeConfig, ARuleThatLooksLimitedIsLimited)
{
    EXPECT_EQ(failureOf("[[rule]]\nname = 'a'\nfingerprint = []\nmay = 'type'"),
              "f:3:15: fingerprint: the list is empty; name = \"*\" is for everybody");
    EXPECT_EQ(failureOf("[[rule]]\nname = []\nfingerprint = '" + kFingerprint + "'\nmay = 'type'"),
              "f:2:8: name: the list is empty; name = \"*\" is for everybody");
    EXPECT_EQ(failureOf("[[rule]]\nname = ['a', '']\nmay = 'type'"), "f:2:8: name: a name is empty");
    EXPECT_EQ(failureOf("[partition.a]\nid = 1\nline = 'x'\naccess = ''"), "f:4:10: access: a name is empty");
}

TEST(ServeConfig, NamesTheNearestKeyOfAll)
{
    EXPECT_EQ(failureOf("lisen = 1"), "f:1:1: unknown key \"lisen\"; did you mean \"listen\"?");
    EXPECT_EQ(failureOf("[partitions.a]"), "f:1:2: unknown key \"partitions\"; did you mean \"partition\"?");
    EXPECT_EQ(failureOf("[[rules]]"), "f:1:3: unknown key \"rules\"; did you mean \"rule\"?");
}

TEST(ServeConfig, ReadsARule)
{
    const ServeConfig config = read("[[rule]]\nname = ['a', '*']\nfingerprint = '" + kFingerprint +
                                    "'\nmay = ['watch', 'type', 'force', 'broadcast', 'attributes']");
    ASSERT_EQ(config.rules.size(), 1U);
    EXPECT_THAT(config.rules[0].names, ElementsAre("a", "*"));
    EXPECT_THAT(config.rules[0].fingerprints, ElementsAre(kFingerprint));
    EXPECT_TRUE(config.rules[0].allPartitions);
    EXPECT_EQ(static_cast<int>(config.rules[0].rights), 31);
}

TEST(ServeConfig, ReadsFingerprintsOfEveryForm)
{
    std::string plain;
    for (const char c : kFingerprint)
        if (c != ':') plain += static_cast<char>(std::tolower(c));
    EXPECT_THAT(read("[[rule]]\nmay = []\nfingerprint = '" + plain + "'").rules.at(0).fingerprints,
                ElementsAre(kFingerprint));
}

TEST(ServeConfig, ARuleNamesPartitionsByNumberRangeAndName)
{
    EXPECT_EQ(rangesOf("[1, '2', '3-5', 'web', '0x10-20', 65535]"), "1-1 2-2 3-5 40-40 16-20 65535-65535 ");
    EXPECT_EQ(rangesOf("'7-7'"), "7-7 ");
    EXPECT_EQ(rangesOf("9"), "9-9 ");
}

TEST(ServeConfig, ARuleWithAnEmptyListIsForNoPartition)
{
    const ServeConfig config = read("[[rule]]\nname = 'a'\nmay = 'type'\npartitions = []");
    EXPECT_FALSE(config.rules.at(0).allPartitions);
    EXPECT_THAT(config.rules.at(0).partitions, IsEmpty());
}

TEST(ServeConfig, RefusesWrongPartitionsOfARule)
{
    for (const std::string wrong : {"5-3", "0-3", "1-65536", "1-", "1-2-3", "4x"}) {
        SCOPED_TRACE(wrong);
        EXPECT_EQ(rangeFailure("'" + wrong + "'"),
                  "f:7:14: \"" + wrong + "\" is not a partition or a range of partitions in [1, 65535]");
    }
    EXPECT_EQ(rangeFailure("[1, 0]"), "f:7:18: \"0\" is not a partition or a range of partitions in [1, 65535]");
    EXPECT_EQ(rangeFailure("[-3]"), "f:7:15: \"-3\" is not a partition or a range of partitions in [1, 65535]");
    EXPECT_EQ(rangeFailure("'wep'"), "f:7:14: unknown partition \"wep\"; did you mean \"web\"?");
    EXPECT_EQ(rangeFailure("'mail'"), "f:7:14: unknown partition \"mail\"");
    EXPECT_EQ(rangeFailure("true"), "f:7:14: partitions takes numbers, ranges and names, not true or false");
}

TEST(ServeConfig, RefusesWrongRules)
{
    EXPECT_EQ(failureOf("[[rule]]\nname = 'a'"), "f:1:1: may is missing");
    EXPECT_EQ(failureOf("[[rule]]\nmay = 'type'"),
              "f:1:1: whom the rule is for is missing: name, fingerprint, or name = \"*\" for everybody");
    EXPECT_EQ(failureOf("[[rule]]\nname = 'a'\nmay = ['watch', 'typ']"),
              "f:3:17: unknown right \"typ\"; did you mean \"type\"?");
    EXPECT_EQ(failureOf("[[rule]]\nname = 'a'\nmay = 'everything'"),
              "f:3:7: unknown right \"everything\"; known are watch, type, force, broadcast, attributes");
    EXPECT_EQ(failureOf("[[rule]]\nfingerprint = 'AB'\nmay = 'type'"),
              "f:2:15: \"AB\" is not a SHA-256 fingerprint: 64 hexadecimal digits");
    EXPECT_EQ(failureOf("[[rule]]\nnames = 'a'\nmay = 'type'"), "f:2:1: unknown key \"names\"; did you mean \"name\"?");
    EXPECT_EQ(failureOf("rule = 5"), "f:1:8: rule takes tables: write [[rule]]");
}

TEST(ServeConfig, AccessOfAPartitionIsARuleForThosePeople)
{
    const ServeConfig config = read("[partition.web]\nid = 40\nline = 'x'\naccess = ['alice', '" + kFingerprint + "']");
    ASSERT_EQ(config.rules.size(), 2U);
    EXPECT_THAT(config.rules[0].names, ElementsAre("alice"));
    EXPECT_THAT(config.rules[0].fingerprints, IsEmpty());
    EXPECT_THAT(config.rules[1].names, IsEmpty());
    EXPECT_THAT(config.rules[1].fingerprints, ElementsAre(kFingerprint));
    for (const tool::AccessRule& rule : config.rules) {
        EXPECT_EQ(static_cast<int>(rule.rights), 7); // watch, type, force
        EXPECT_FALSE(rule.allPartitions);
        EXPECT_EQ(rule.partitions.at(0).first, 40);
        EXPECT_EQ(rule.partitions.at(0).last, 40);
    }
}

TEST(ServeConfig, AnEmptyAccessListIsARuleForNobody)
{
    const ServeConfig config = read("[partition.web]\nid = 40\nline = 'x'\naccess = []");
    ASSERT_EQ(config.rules.size(), 1U);
    EXPECT_THAT(config.rules[0].names, IsEmpty());
}

TEST(ServeConfig, PrintsWhatItHasReadSoThatItCanBeReadAgain)
{
    const std::string text = "[partition.web]\nid = 40\nline = \"a\\t\\\"b\\\" \\\\\"\ndescription = \"t \\\"ab\\\"\"\n"
                             "access = ['alice']\n\n[[rule]]\nname = 'bob'\nmay = ['watch']\npartitions = ['1-4', 7]\n";
    std::ostringstream first;
    tool::printServeConfig(first, read(text));
    EXPECT_EQ(first.str(), "\n[partition.web]  # f:1\n"
                           "id = 40                   # f:2\n"
                           "line = \"a\\u0009\\\"b\\\" \\\\\"  # f:3\n"
                           "description = \"t \\\"ab\\\"\"  # f:4\n"
                           "access = [\"alice\"]        # f:5\n"
                           "\n[[rule]]  # f:7\n"
                           "name = \"bob\"             # f:8\n"
                           "may = [\"watch\"]          # f:9\n"
                           "partitions = [\"1-4\", 7]  # f:10\n");
    EXPECT_EQ(read(first.str()).partitions.at(0).line, "a\t\"b\" \\");
    EXPECT_EQ(read(first.str()).partitions.at(0).description, "t \"ab\"");
}

} // namespace

} // namespace qel::test
