// docs/performance.md is written by script/bench in part: what it shows has to exist, and what it names has to run.

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <iterator>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

using testing::HasSubstr;
using testing::IsEmpty;
using testing::IsSupersetOf;
using testing::Not;
using testing::SizeIs;

namespace {

const std::filesystem::path& root()
{
    static const std::filesystem::path path = QEL_SOURCE_DIR;
    return path;
}

std::string contentOf(const std::filesystem::path& path)
{
    std::ifstream stream(path);
    std::ostringstream text;
    text << stream.rdbuf();
    return text.str();
}

/// What the first group of the expression matches in a text, in its order.
std::vector<std::string> allIn(const std::string& text, const std::string& expression)
{
    const std::regex regex(expression);
    std::vector<std::string> found;
    for (std::sregex_iterator match(text.begin(), text.end(), regex), none; match != none; ++match)
        found.push_back((*match)[1]);
    return found;
}

std::string document() { return contentOf(root() / "docs/performance.md"); }

TEST(PerformanceDocument, ShowsThePicturesThatExist)
{
    const std::vector<std::string> shown = allIn(document(), R"(\]\((pictures/[^)]*)\))");
    std::vector<std::string> existing;
    for (const auto& entry : std::filesystem::directory_iterator(root() / "docs/pictures"))
        existing.push_back("pictures/" + entry.path().filename().string());
    EXPECT_THAT(shown, SizeIs(3));
    EXPECT_THAT(shown, testing::UnorderedElementsAreArray(existing));
}

TEST(PerformanceDocument, PicturesAreSmallAndTheirTextIsText)
{
    constexpr std::uintmax_t kMostBytes = 60 * 1024;
    for (const auto& entry : std::filesystem::directory_iterator(root() / "docs/pictures")) {
        SCOPED_TRACE(entry.path().filename());
        EXPECT_LE(entry.file_size(), kMostBytes);
        const std::string picture = contentOf(entry.path());
        EXPECT_THAT(picture, HasSubstr("<text"));
        EXPECT_THAT(picture, Not(HasSubstr("<image xlink:href=\"data:")));
    }
}

TEST(PerformanceDocument, HasAPlaceForEachTableOfTheScript)
{
    const std::string script = contentOf(root() / "script/bench");
    std::vector<std::string> tables = allIn(script, R"(\btable ([a-z-]+) \./)");
    tables.emplace_back("machine");
    const std::string text = document();
    const std::vector<std::string> begun = allIn(text, "<!-- begin ([a-z-]+) -->");
    EXPECT_THAT(begun, testing::UnorderedElementsAreArray(tables));
    EXPECT_EQ(allIn(text, "<!-- end ([a-z-]+) -->"), begun);
}

TEST(PerformanceDocument, NamesOnlyOptionsOfTheScript)
{
    const std::string script = contentOf(root() / "script/bench");
    std::set<std::string> known = {"--benchmark_filter"}; // of Google Benchmark
    for (const std::string& option : allIn(script, R"((--[a-z]+)\)\s)"))
        known.insert(option);
    std::set<std::string> named;
    for (const std::string& command : allIn(document(), "(script/bench --[^`\n]*)"))
        for (const std::string& option : allIn(command, "(--[a-z_]+)"))
            named.insert(option);
    EXPECT_THAT(named, Not(IsEmpty()));
    EXPECT_THAT(known, IsSupersetOf(named));
}

TEST(PerformanceDocument, FiltersSelectContests)
{
    std::string sources;
    for (const auto& entry : std::filesystem::directory_iterator(root() / "bench"))
        if (entry.path().extension() == ".cpp") sources += contentOf(entry.path());
    const std::vector<std::string> works =
        allIn(sources, R"-((?:contest|addRequestContest<\w+>)\((?:std::string\()?"([^"]*)")-");
    EXPECT_THAT(works, Not(IsEmpty()));
    for (const std::string& filter : allIn(document(), "--benchmark_filter='([^']*)'")) {
        const std::regex regex(filter);
        EXPECT_TRUE(std::any_of(works.begin(), works.end(), [&regex](const std::string& work) {
            return std::regex_search(work, regex);
        })) << filter;
    }
}

} // namespace
