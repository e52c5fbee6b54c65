// A phrase that the library throws is something that programs hold on to: docs/errors.md has to tell each of them.

#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

using testing::ElementsAre;
using testing::IsEmpty;

namespace {

std::string contentOf(const std::filesystem::path& path)
{
    std::ifstream stream(path);
    std::ostringstream text;
    text << stream.rdbuf();
    return text.str();
}

// The code of a file: without comments and without what the preprocessor takes.
std::string codeOf(const std::string& source)
{
    std::string code;
    std::istringstream lines(source);
    for (std::string line; std::getline(lines, line);) {
        const std::string::size_type first = line.find_first_not_of(' ');
        if (first != std::string::npos && line[first] == '#') continue;
        code += line.substr(0, line.find("//")) + '\n';
    }
    return code;
}

/// @param statement  a regular expression that matches the beginning of a statement
/// @return the string literals in all statements that begin so, without their quotes
std::set<std::string> literalsIn(const std::string& code, const std::string& statement)
{
    const std::regex statements("\\b(" + statement + ")[^;]*;");
    const std::regex literals("\"([^\"\\\\\n]+)\"");
    std::set<std::string> found;
    for (std::sregex_iterator s(code.begin(), code.end(), statements), none; s != none; ++s) {
        const std::string text = s->str();
        for (std::sregex_iterator l(text.begin(), text.end(), literals); l != none; ++l)
            found.insert((*l)[1]);
    }
    return found;
}

/// The phrases of exceptions in a source file of the library, and those of the log lines that go with them.
std::set<std::string> phrasesOf(const std::string& source)
{
    const std::string code = codeOf(source);
    std::set<std::string> phrases = literalsIn(code, "throw\\b|(throw_with_nested|throwLogged|require|reject)\\(");
    phrases.merge(literalsIn(code, "const char\\* k\\w*(TooShort|TooLarge|Phrase)\\b"));
    return phrases;
}

std::vector<std::string> missing(const std::set<std::string>& phrases, const std::string& document)
{
    std::vector<std::string> result;
    for (const std::string& phrase : phrases)
        if (document.find(phrase) == std::string::npos) result.push_back(phrase);
    return result;
}

TEST(ErrorsDocument, TellsEveryPhraseThatTheLibraryThrows)
{
    const std::filesystem::path root = QEL_SOURCE_DIR;
    const std::string document = contentOf(root / "docs/errors.md");
    std::size_t count = 0;
    for (const char* folder : {"common", "headers/include"}) {
        for (const auto& entry : std::filesystem::recursive_directory_iterator(root / folder)) {
            const std::string ending = entry.path().extension().string();
            if (ending != ".cpp" && ending != ".hpp") continue;
            const std::set<std::string> phrases = phrasesOf(contentOf(entry.path()));
            count += phrases.size();
            EXPECT_THAT(missing(phrases, document), IsEmpty()) << entry.path();
        }
    }
    EXPECT_GT(count, 80U); // the phrases were found
}

// The check itself can fail.

TEST(ErrorsDocumentCheck, FindsPhrasesHoweverTheyAreThrown)
{
    const std::string source = "if (a) throw std::invalid_argument(\"one\");\n"
                               "throw Error(\"two \" + path +\n    \" three\"); // \"not this\"\n"
                               "/// @throws Error  \"nor this\"\n"
                               "#error \"nor this\"\n"
                               "require(b < 3, \"four\");\n"
                               "throwLogged(errno, \"five\"); log(\"nor this\");\n"
                               "constexpr const char* kTooLarge = \"six\";\n";
    EXPECT_THAT(phrasesOf(source), ElementsAre(" three", "five", "four", "one", "six", "two "));
}

TEST(ErrorsDocumentCheck, NamesAPhraseThatIsNotThere)
{
    EXPECT_THAT(missing({"one", "two"}, "| \"one\" | when |"), ElementsAre("two"));
}

} // namespace
