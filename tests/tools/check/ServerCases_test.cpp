// The table of the cases for servers, and whole runs against a server of this project: none fails.

#include <qel/protocol/CommandLine.hpp>

#include "check/CheckReport.hpp"
#include "check/server/ServerCases.hpp"
#include "protocol/server/ServerFixture.hpp"

#include <cctype>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <regex>
#include <set>
#include <sstream>

namespace qel::test {

namespace {

using namespace tool::check;

std::string document(const std::string& name)
{
    std::ifstream in(QEL_SOURCE_DIR "/docs/" + name);
    EXPECT_TRUE(in) << name;
    std::ostringstream text;
    text << in.rdbuf();
    return text.str();
}

/// The anchor of a heading, as it is made from its text: lower case, blanks become dashes, marks are dropped.
std::string anchorOf(const std::string& heading)
{
    std::string anchor;
    for (const char c : heading) {
        const auto byte = static_cast<unsigned char>(c);
        if (std::isalnum(byte) != 0 || c == '-' || c == '_') anchor += static_cast<char>(std::tolower(byte));
        if (c == ' ') anchor += '-';
    }
    return anchor;
}

std::set<std::string> anchorsOf(const std::string& name)
{
    std::set<std::string> anchors;
    std::istringstream lines(document(name));
    for (std::string line; std::getline(lines, line);) {
        const std::size_t text = line.find_first_not_of('#');
        if (text != 0 && text != std::string::npos && line[text] == ' ')
            anchors.insert(anchorOf(line.substr(text + 1)));
    }
    return anchors;
}

TEST(ServerCases, AnchorsAreMadeFromHeadings)
{
    EXPECT_EQ(anchorOf("What is answered, in which order"), "what-is-answered-in-which-order");
    EXPECT_EQ(anchorOf("Interface component, function 0x6003"), "interface-component-function-0x6003");
}

TEST(ServerCases, EachIsDocumentedWhereItSays)
{
    std::map<std::string, std::set<std::string>> documents;
    for (const char* name : {"wire-format.md", "connection.md", "tls.md"})
        documents[name] = anchorsOf(name);
    for (const Case& aCase : serverCases()) {
        const std::size_t mark = aCase.anchor.find('#');
        const std::string name = aCase.anchor.substr(0, mark);
        ASSERT_EQ(documents.count(name), 1U) << aCase.id << ": " << aCase.anchor;
        EXPECT_EQ(documents[name].count(aCase.anchor.substr(mark + 1)), 1U) << aCase.id << ": " << aCase.anchor;
    }
}

TEST(ServerCases, EachHasAnIdOfItsOwnAndOneSentence)
{
    const std::regex form("[a-z]+(/[A-Za-z0-9.-]+)+");
    std::set<std::string> ids;
    for (const Case& aCase : serverCases()) {
        EXPECT_TRUE(ids.insert(aCase.id).second) << aCase.id << " is there twice";
        EXPECT_TRUE(std::regex_match(aCase.id, form)) << aCase.id;
        ASSERT_FALSE(aCase.requirement.empty()) << aCase.id;
        EXPECT_EQ(aCase.requirement.back(), '.') << aCase.id;
        EXPECT_EQ(aCase.requirement.find('|'), std::string::npos) << aCase.id; // it is printed in a table
        EXPECT_TRUE(aCase.run) << aCase.id;
    }
}

TEST(ServerCases, AreGroupedByFamily)
{
    std::set<std::string> families;
    std::string last;
    for (const Case& aCase : serverCases()) {
        const std::string family = aCase.id.substr(0, aCase.id.find('/'));
        if (family == last) continue;
        EXPECT_TRUE(families.insert(family).second) << family << " begins twice, at " << aCase.id;
        last = family;
    }
}

TEST(ServerCases, TheDocumentListsThem)
{
    std::ostringstream list;
    printMarkdown(list, serverCases());
    const std::string text = document("conformance.md");
    const std::string heading = "\n## The cases for servers\n\n";
    const std::size_t begin = text.find(heading);
    ASSERT_NE(begin, std::string::npos);
    const std::size_t table = text.find("\n### ", begin) + 1;
    std::size_t end = text.find("\n## ", table);
    end = end == std::string::npos ? text.size() : end;
    EXPECT_EQ(text.substr(table, end - table), list.str())
        << "replace the tables by the output of: qel check server --list --markdown";
}

/// A server with a partition that echoes and one whose command ends.
class WholeRun : public ServerFixture {
protected:
    static constexpr std::uint16_t kEcho = 1;
    static constexpr std::uint16_t kEnding = 2;

    WholeRun()
    {
        machine.addPartition(kEcho, protocol::commandLine("stty raw -echo; exec cat"));
        machine.addPartition(kEnding, protocol::commandLine("read x; exit 3"));
    }

    Target target() const
    {
        Target target(protocol::ServerAddress::parse(server->endpoints().front().str()));
        target.endpoints = server->endpoints();
        target.timeout = std::chrono::seconds(10); // the machine may be busy
        target.partition = kEcho;
        target.echoPartition = kEcho;
        target.endingPartition = kEnding;
        return target;
    }

    static std::vector<Outcome> check(const Target& target)
    {
        static const Cases cases = serverCases();
        CheckRun run(cases, 4, [&](const Case& aCase, unsigned int number) { return runCase(aCase, target, number); });
        return run.run([](const Outcome&, std::size_t) { return true; });
    }

    /// @param skips  the reasons for skipping that are to be expected
    static void expectNoFailure(const std::vector<Outcome>& outcomes, const std::set<std::string>& skips)
    {
        std::ostringstream text;
        printFailures(text, outcomes, std::chrono::nanoseconds(0), false);
        EXPECT_EQ(countsOf(outcomes).fails, 0U) << text.str();
        EXPECT_GT(countsOf(outcomes).holds, 350U);
        for (const Outcome& outcome : outcomes) {
            if (outcome.result != Result::Skipped) continue;
            EXPECT_EQ(skips.count(outcome.seen), 1U) << outcomeLine(outcome);
        }
    }
};

TEST_F(WholeRun, NoCaseFailsWithoutTls)
{
    make(plainOptions());
    run();
    expectNoFailure(check(target()), {"needs TLS", "needs --peer-deadline"});
}

TEST_F(WholeRun, NoCaseFailsOverTls)
{
    make(tlsOptions());
    run();
    Target tls = target();
    tls.credentials = Authority::trusted().clientCredentials();
    tls.context = std::make_shared<SSLClientContext>();
    tls.context->setCredentials(tls.credentials);
    expectNoFailure(check(tls), {"needs --plain", "needs --peer-deadline"});
}

} // namespace

} // namespace qel::test
