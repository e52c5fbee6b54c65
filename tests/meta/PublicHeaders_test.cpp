// Public headers hold no vocabulary of tests: a namespace `test` in `qel` makes a program's own `test::` ambiguous, and
// a friend of a test is a promise to every program.

#include <cstddef>
#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <regex>
#include <string>
#include <vector>

using testing::IsEmpty;

namespace {

/// @return true if a line of code declares, befriends or uses something of a test
bool namesTests(const std::string& line)
{
    static const std::regex kTests("\\bnamespace +(qel::)?test\\b|\\btest::|\\bfriend +(class|struct) +\\w*[Tt]est");
    return std::regex_search(line.substr(0, line.find("//")), kTests);
}

TEST(PublicHeaders, NameNoTests)
{
    std::size_t headers = 0;
    std::vector<std::string> found;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(QEL_SOURCE_DIR "/headers")) {
        if (entry.path().extension() != ".hpp") continue;
        ++headers;
        std::ifstream in(entry.path());
        for (std::string line; std::getline(in, line);)
            if (namesTests(line)) found.push_back(entry.path().filename().string() + ": " + line);
    }
    EXPECT_GT(headers, 50U) << "the directory was not found";
    EXPECT_THAT(found, IsEmpty());
}

TEST(PublicHeadersCheck, FindsTestVocabulary)
{
    EXPECT_TRUE(namesTests("namespace test {"));
    EXPECT_TRUE(namesTests("namespace qel::test {"));
    EXPECT_TRUE(namesTests("    friend class test::Scope;"));
    EXPECT_TRUE(namesTests("    friend class SocketTest;"));
    EXPECT_FALSE(namesTests("namespace qel { // namespace test"));
    EXPECT_FALSE(namesTests("    bool test(std::size_t index) const;"));
}

} // namespace
