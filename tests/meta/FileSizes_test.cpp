// Files and functions stay short enough to be read in one sitting: a file has 600 lines at most, a function 80.

#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

constexpr std::size_t kMaxFileLines = 600;
constexpr std::size_t kMaxFunctionLines = 80;

std::vector<std::string> linesOf(std::istream& text)
{
    std::vector<std::string> lines;
    for (std::string line; std::getline(text, line);)
        lines.push_back(line);
    return lines;
}

/// The indentation of a line that consists of a brace (and a semicolon) alone; nothing for other lines. In the style of
/// this project such a line opens or ends the body of a function; all other braces share their line with code.
std::optional<std::size_t> loneBrace(const std::string& line, char brace)
{
    const std::size_t indentation = line.find_first_not_of(' ');
    if (indentation == std::string::npos || line[indentation] != brace) return std::nullopt;
    const std::string rest = line.substr(indentation + 1);
    if (!rest.empty() && rest != ";") return std::nullopt;
    return indentation;
}

/// @return a sentence for each limit that a file breaks
std::vector<std::string> tooLong(const std::string& name, const std::vector<std::string>& lines)
{
    std::vector<std::string> result;
    if (lines.size() > kMaxFileLines) result.push_back(name + " has " + std::to_string(lines.size()) + " lines");

    std::optional<std::size_t> indentation; // of the function that is open
    std::size_t begin = 0;
    for (std::size_t i = 0; i < lines.size(); ++i) {
        if (!indentation) {
            indentation = loneBrace(lines[i], '{');
            begin = i;
        } else if (loneBrace(lines[i], '}') == indentation) {
            const std::size_t count = i - begin - 1;
            if (count > kMaxFunctionLines)
                result.push_back(name + ":" + std::to_string(begin + 1) + ": a function of " + std::to_string(count) +
                                 " lines");
            indentation.reset();
        }
    }
    return result;
}

std::vector<std::string> tooLongUnder(const std::filesystem::path& root, const std::vector<std::string>& folders)
{
    std::vector<std::string> result;
    std::size_t fileCount = 0;
    for (const std::string& folder : folders)
        for (const auto& entry : std::filesystem::recursive_directory_iterator(root / folder)) {
            const std::string extension = entry.path().extension();
            if (extension != ".cpp" && extension != ".hpp") continue;
            ++fileCount;
            std::ifstream stream(entry.path());
            for (const std::string& finding : tooLong(entry.path().lexically_relative(root).string(), linesOf(stream)))
                result.push_back(finding);
        }
    EXPECT_GT(fileCount, 200U); // the folders were found
    return result;
}

TEST(FileSizes, AreWithinTheLimits)
{
    EXPECT_THAT(tooLongUnder(QEL_SOURCE_DIR, {"common", "headers", "protocol", "tools", "tests", "bench", "examples"}),
                IsEmpty());
}

// The check itself can fail.

std::vector<std::string> function(std::size_t bodyLines)
{
    std::vector<std::string> lines = {"void f()", "{"};
    lines.insert(lines.end(), bodyLines, "    g();");
    lines.push_back("}");
    return lines;
}

TEST(FileSizesCheck, AcceptsAFileOf600LinesAndRefusesOneMore)
{
    EXPECT_THAT(tooLong("a.cpp", std::vector<std::string>(600)), IsEmpty());
    EXPECT_THAT(tooLong("a.cpp", std::vector<std::string>(601)), ElementsAre("a.cpp has 601 lines"));
}

TEST(FileSizesCheck, AcceptsAFunctionOf80LinesAndRefusesOneMore)
{
    EXPECT_THAT(tooLong("a.cpp", function(80)), IsEmpty());
    EXPECT_THAT(tooLong("a.cpp", function(81)), ElementsAre("a.cpp:2: a function of 81 lines"));
}

TEST(FileSizesCheck, CountsEachFunctionForItself)
{
    std::vector<std::string> lines = function(50);
    for (const std::string& line : function(50))
        lines.push_back(line);
    EXPECT_THAT(tooLong("a.cpp", lines), IsEmpty());
}

TEST(FileSizesCheck, SeesFunctionsInsideAClass)
{
    std::vector<std::string> lines = {"class C {"};
    for (const std::string& line : function(81))
        lines.push_back("    " + line);
    lines.push_back("};");
    EXPECT_THAT(tooLong("a.hpp", lines), ElementsAre("a.hpp:3: a function of 81 lines"));
}

TEST(FileSizesCheck, DoesNotEndAFunctionAtTheBraceOfABlockInIt)
{
    std::vector<std::string> lines = function(81);
    lines[40] = "    }";
    EXPECT_THAT(tooLong("a.cpp", lines), ElementsAre("a.cpp:2: a function of 81 lines"));
}

} // namespace
