// The command line of "qel ca".

#include "integration/CaKit.hpp"

#include <gmock/gmock.h>

namespace qel::test {

namespace {

using testing::HasSubstr;
using testing::IsEmpty;
using testing::MatchesRegex;
using testing::Not;
using testing::StartsWith;

std::string joined(const std::vector<std::string>& arguments)
{
    std::string text = "qel ca";
    for (const std::string& argument : arguments)
        text += " " + argument;
    return text;
}

TEST_F(Ca, HelpAndVersionWorkAtEveryLevel)
{
    for (const char* name : {"", "init", "request", "sign", "issue", "show", "check"}) {
        SCOPED_TRACE(name);
        std::vector<std::string> level;
        if (*name != '\0') level.push_back(name);
        level.push_back("--help");
        const auto help = runCa(level);
        EXPECT_EQ(help.exitStatus, 0);
        EXPECT_EQ(help.errors, "");
        EXPECT_THAT(help.output, HasSubstr("Usage: qel ca " + (*name != '\0' ? name + std::string(" ") : "")));
        level.back() = "--version";
        EXPECT_THAT(runCa(level).output, MatchesRegex("qel [0-9]+\\.[0-9]+\\.[0-9]+\n"));
    }
}

TEST_F(Ca, BadCommandLinesAreUsageErrors)
{
    const std::string crt = shared() + "/server.crt";
    const std::vector<std::vector<std::string>> bad{
        {},
        {"nonsense"},
        {"init"},
        {"init", path()},
        {"init", path(), "--subject"},
        {"init", path(), "--subject", ""},
        {"init", path(), "--subject", "root"},
        {"init", path(), "--subject", "CN="},
        {"init", path(), "--subject", "CN=a,CN=b"},
        {"init", path(), "--subject", "CN=a,commonName=b"},
        {"init", path(), "--subject", "Nonsense=a"},
        {"init", path(), "--subject", "C=DEU"},
        {"init", path(), "--subject", "CN=root,subjectAltName=DNS:root"},
        {"init", path(), "--subject", "CN=root", "--days", "0"},
        {"init", path(), "--subject", "CN=root", "--days", "36526"},
        {"init", path(), "--subject", "CN=root", "--days", "-1"},
        {"init", path(), "--subject", "CN=root", "--days", "1d"},
        {"init", path(), "extra", "--subject", "CN=root"},
        {"request", path(), "--subject", "CN=a"},
        {"request", path(), "a"},
        {"request", path(), "../a", "--subject", "CN=a"},
        {"request", path(), ".a", "--subject", "CN=a"},
        {"request", path(), "", "--subject", "CN=a"},
        {"request", path(), std::string(65, 'a'), "--subject", "CN=a"},
        {"request", path(), "root", "--subject", "CN=a"},
        {"request", path(), "a", "--subject", "CN=a", "--days", "1"},
        {"sign", path()},
        {"sign", path(), "root"},
        {"sign", path(), "a", "--days", "0"},
        {"sign", path(), "a", "--subject", "CN=a"},
        {"issue", path(), "a"},
        {"issue", path(), "root", "--subject", "CN=a"},
        {"issue", path(), "a", "--subject", "CN=a", "--days", "36526"},
        {"show"},
        {"show", file("missing")},
        {"show", crt, crt},
        {"check", file("missing")},
        {"check", crt, "--within", "30"},
        {"check", crt, "--within", "-1d"},
        {"check", crt, "--within", "101y"},
        {"check", crt, "--within", ""},
        {"show", crt, "check", crt},
    };
    for (const auto& arguments : bad) {
        SCOPED_TRACE(joined(arguments));
        const auto result = runCa(arguments);
        EXPECT_EQ(result.exitStatus, 2);
        EXPECT_EQ(result.output, "");
        EXPECT_THAT(result.errors, Not(IsEmpty()));
    }
    EXPECT_THAT(names(), IsEmpty());
}

TEST_F(Ca, UsageErrorsNameTheReason)
{
    EXPECT_THAT(runCa({"init", path(), "--subject", "CN=a,CN=b"}).errors,
                StartsWith("qel: --subject: CN is given twice\n"));
    EXPECT_THAT(runCa({"request", path(), "a/b", "--subject", "CN=a"}).errors,
                HasSubstr("'a/b' is not a name for credentials: "));
    EXPECT_THAT(runCa({"sign", path(), "root"}).errors, HasSubstr("'root' is reserved for the authority"));
    EXPECT_THAT(runCa({"check", shared() + "/server.crt", "--within", "soon"}).errors,
                StartsWith("qel: --within: \"soon\" is not a length of time: "));
}

} // namespace

} // namespace qel::test
