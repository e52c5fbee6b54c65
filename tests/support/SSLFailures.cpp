#include "support/SSLFailures.hpp"

#include <qel/common/security/SSLException.hpp>

#include "support/CapturedLog.hpp"
#include "support/OpenSSLCalls.hpp"

#include <algorithm>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <map>
#include <openssl/err.h>
#include <optional>
#include <regex>
#include <vector>

namespace qel::test {

namespace {

using testing::Contains;
using testing::HasSubstr;

// What the source calls them: OpenSSL's header makes other functions of these.
const std::map<std::string, std::string> kMacros = {{"SSL_CTX_ctrl", "SSL_CTX_set_min_proto_version"}};

std::string nameInSource(const std::string& name)
{
    const auto macro = kMacros.find(name);
    return macro != kMacros.end() ? macro->second : name;
}

struct Location {
    std::string file; // relative to the root of the project
    std::size_t line;
};

// The file is named as in the build: relative to the root of the project, or to wherever a compiler cache
// makes paths relative to. An absolute one would tell where the library was built.
std::optional<Location> locationIn(const std::string& message)
{
    static const std::regex kPattern(
        "An SSL error occurred at (?:[^/].*/)?(common/security/[A-Za-z0-9]+\\.[ch]pp):([1-9][0-9]*)");
    std::smatch match;
    if (!std::regex_match(message, match, kPattern)) return std::nullopt;
    return Location{match[1], std::stoul(match[2])};
}

// The statement at a line: the line itself, and those beside it onto which it may have been broken, or in which the
// result that it checks was taken.
std::string statementAt(const Location& location)
{
    std::ifstream file(std::string(QEL_SOURCE_DIR) + '/' + location.file);
    std::string statement;
    std::string line;
    for (std::size_t number = 1; std::getline(file, line); ++number)
        if (number + 2 >= location.line && number <= location.line + 2) statement += line + '\n';
    return statement;
}

std::vector<std::string> callsOf(const std::function<void()>& action)
{
    action(); // what is made on first use, such as shared keys, is there from now on
    const OpenSSLCalls watch;
    action();
    return watch.calls();
}

} // namespace

unsigned expectEveryFailureIsReported(const std::function<void()>& action, const std::set<std::string>& exceptions)
{
    const std::vector<std::string> calls = callsOf(action);
    unsigned failed = 0;
    for (std::size_t i = 0; i < calls.size(); ++i) {
        const std::string name = nameOf(calls[i]);
        if (exceptions.count(calls[i]) != 0 || exceptions.count(name) != 0) continue;
        SCOPED_TRACE("call " + std::to_string(i) + ", " + calls[i]);

        const CapturedLog log;
        OpenSSLCalls watch;
        watch.failCall(i);
        try {
            action();
            ADD_FAILURE() << "nothing thrown";
        } catch (const SSLException& e) {
            const std::optional<Location> location = locationIn(e.what());
            if (location) {
                EXPECT_THAT(statementAt(*location), HasSubstr(nameInSource(name) + '(')) << e.what();
            } else {
                ADD_FAILURE() << "no source location: " << e.what();
            }
        }
        EXPECT_TRUE(watch.hasFailed());
        EXPECT_EQ(ERR_peek_error(), 0UL);
        EXPECT_THAT(log.lines(), Contains(OpenSSLCalls::injectedErrorLine()));
        ++failed;
    }
    return failed;
}

void expectSSLErrorAt(const std::string& file, const std::function<void()>& action)
{
    try {
        action();
        ADD_FAILURE() << "nothing thrown";
    } catch (const SSLException& e) {
        const std::optional<Location> location = locationIn(e.what());
        if (location) {
            EXPECT_EQ(location->file, "common/security/" + file);
        } else {
            ADD_FAILURE() << "no source location: " << e.what();
        }
    }
    EXPECT_EQ(ERR_peek_error(), 0UL);
}

} // namespace qel::test
