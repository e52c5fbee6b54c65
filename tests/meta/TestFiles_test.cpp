// A test that is not built tells nothing: every test file on disk must be named in the list that builds them.

#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <set>
#include <sstream>
#include <string>
#include <vector>

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

bool endsWith(const std::string& text, const std::string& end)
{
    return text.size() >= end.size() && text.compare(text.size() - end.size(), end.size(), end) == 0;
}

// The words of a CMake file, without its comments.
std::set<std::string> wordsOf(const std::string& list)
{
    std::set<std::string> words;
    std::istringstream lines(list);
    for (std::string line; std::getline(lines, line);) {
        std::string code = line.substr(0, line.find('#'));
        for (char& c : code)
            if (c == '(' || c == ')' || c == '"') c = ' ';
        std::istringstream stream(code);
        for (std::string word; stream >> word;)
            words.insert(word);
    }
    return words;
}

/// @param files  test files, relative to the folder of the list
/// @return those that the list does not name
std::vector<std::string> unnamed(const std::vector<std::string>& files, const std::string& list)
{
    const std::set<std::string> words = wordsOf(list);
    std::vector<std::string> result;
    for (const std::string& file : files)
        if (words.count(file) == 0 && words.count("${CMAKE_CURRENT_SOURCE_DIR}/" + file) == 0) result.push_back(file);
    return result;
}

TEST(TestFiles, EachOneIsNamedInTheListThatBuildsThem)
{
    const std::filesystem::path root = QEL_SOURCE_DIR "/tests";
    std::vector<std::string> files;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(root)) {
        const std::string name = entry.path().lexically_relative(root).string();
        if (endsWith(name, "_test.cpp") || endsWith(name, ".sh")) files.push_back(name);
    }
    ASSERT_GT(files.size(), 30U); // the folder was found

    std::ifstream stream(root / "CMakeLists.txt");
    std::ostringstream list;
    list << stream.rdbuf();
    EXPECT_THAT(unnamed(files, list.str()), IsEmpty());
}

// The check itself can fail.

TEST(TestFilesCheck, FindsAFileThatNobodyNames)
{
    const std::string list = "qel_add_tests(some_tests\n  A_test.cpp\n  net/B_test.cpp)\n"
                             "add_test(NAME c COMMAND sh ${CMAKE_CURRENT_SOURCE_DIR}/c.sh)\n";
    EXPECT_THAT(unnamed({"A_test.cpp", "net/B_test.cpp", "c.sh"}, list), IsEmpty());
    EXPECT_THAT(unnamed({"B_test.cpp", "net/A_test.cpp", "A_test.cp", "d.sh"}, list),
                ElementsAre("B_test.cpp", "net/A_test.cpp", "A_test.cp", "d.sh"));
}

TEST(TestFilesCheck, DoesNotTakeACommentForAName)
{
    EXPECT_THAT(unnamed({"A_test.cpp"}, "# A_test.cpp\nx # A_test.cpp\n"), ElementsAre("A_test.cpp"));
}

} // namespace
