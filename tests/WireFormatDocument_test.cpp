#include <qel/common/QelMessageIdentifiers.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "support/GoldenClasses.hpp"
#include "support/GoldenFrame.hpp"

#include <cstddef>
#include <cstdio>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <iterator>
#include <sstream>
#include <stdexcept>
#include <string>
#include <utility>

// docs/wire-format.md shows the golden frames and the names that the library prints.

namespace qel::test {
namespace {

using testing::HasSubstr;

std::string wireFormatDocument()
{
    std::ifstream in(QEL_SOURCE_DIR "/docs/wire-format.md", std::ios::binary);
    if (!in) throw std::runtime_error("docs/wire-format.md cannot be read");
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

std::size_t countOf(const std::string& what, const std::string& where)
{
    std::size_t count = 0;
    for (std::size_t at = where.find(what); at != std::string::npos; at = where.find(what, at + what.size())) {
        ++count;
    }
    return count;
}

TEST(WireFormatDocument, ShowsEveryGoldenFrameInTheSectionOfItsClass)
{
    const std::string document = wireFormatDocument();
    for (const std::string& name : GoldenFrame::allNames()) {
        const GoldenFrame golden = GoldenFrame::load(name);
        const std::size_t begin = document.find("\n#### " + golden.className() + "\n");
        if (begin == std::string::npos) {
            ADD_FAILURE() << "no section for " << golden.className();
            continue;
        }
        const std::size_t nextSection = document.find("\n#", begin + 1);
        const std::string section = document.substr(begin, nextSection - begin);
        EXPECT_THAT(section, HasSubstr("```text\n" + golden.frameText() + "```\n")) << name;
    }
}

TEST(WireFormatDocument, HasNoOtherFramesAndSections)
{
    const std::string document = wireFormatDocument();
    EXPECT_EQ(countOf("```text\n", document), GoldenFrame::allNames().size());
    EXPECT_EQ(countOf("  # mDesc", document), GoldenFrame::allNames().size());
    EXPECT_EQ(countOf("\n#### ", document), messageClasses().size());
}

/// @return the number of lines that `take` accepts
template <typename Take>
unsigned int forEachLine(Take take)
{
    unsigned int taken = 0;
    std::istringstream in(wireFormatDocument());
    for (std::string line; std::getline(in, line);) {
        if (take(line.c_str())) ++taken;
    }
    return taken;
}

TEST(WireFormatDocument, NamesTheFunctionsAsTheyPrint)
{
    const unsigned int count = forEachLine([](const char* line) {
        unsigned int function = 0;
        char name[64];
        if (std::sscanf(line, "| 0x%4x | `%63[A-Za-z0-9]` |", &function, name) != 2) return false;
        if (std::string(name).find("QelMessageFunction") != 0) return false;
        EXPECT_THAT(toString(static_cast<QelMessageFunctionCodes>(function)), HasSubstr(std::string("(") + name + ")"));
        return true;
    });
    EXPECT_EQ(count, 16U);
}

TEST(WireFormatDocument, NamesTheOperationsAsTheyPrint)
{
    const unsigned int count = forEachLine([](const char* line) {
        unsigned int function = 0;
        unsigned int operation = 0;
        char name[64];
        if (std::sscanf(line, "| 0x%4x | 0x%4x | `%63[A-Za-z0-9]` |", &function, &operation, name) != 3) return false;
        const auto pair =
            std::make_pair(static_cast<QelMessageFunctionCodes>(function), static_cast<QelMessageOpTypes>(operation));
        EXPECT_THAT(toString(pair), HasSubstr(std::string("(") + name + ")"));
        return true;
    });
    EXPECT_EQ(count, 42U);
}

TEST(WireFormatDocument, NamesTheStatusCodesAsTheyPrint)
{
    const unsigned int count = forEachLine([](const char* line) {
        unsigned int decimal = 0;
        unsigned int hexadecimal = 0;
        char name[64];
        if (std::sscanf(line, "| %5u (0x%4x) | `%63[A-Za-z0-9]` |", &decimal, &hexadecimal, name) != 3) return false;
        EXPECT_EQ(decimal, hexadecimal) << line;
        EXPECT_THAT(toString(static_cast<QelMessageStatusCodes>(decimal)), HasSubstr(std::string("(") + name + ")"));
        return true;
    });
    EXPECT_EQ(count, 18U);
}

} // namespace
} // namespace qel::test
