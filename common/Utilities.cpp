#include <qel/common/Utilities.hpp>
#include <qel/common/util/PosixError.hpp>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <fstream>
#include <memory>
#include <set>
#include <sstream>
#include <stdexcept>

namespace qel::Utilities {

namespace {

constexpr char kPathSeparators[] = "/";

} // namespace

std::string lowercase(const std::string& text)
{
    std::string result(text);
    // As unsigned char: tolower is undefined for negative characters.
    std::transform(result.begin(), result.end(), result.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return result;
}

std::string uppercase(const std::string& text)
{
    std::string result(text);
    std::transform(result.begin(), result.end(), result.begin(),
                   [](unsigned char c) { return static_cast<char>(std::toupper(c)); });
    return result;
}

std::string rstrip(const std::string& text, const char* chars)
{
    const std::string::size_type last = text.find_last_not_of(chars);
    return last == std::string::npos ? std::string() : text.substr(0, last + 1);
}

std::string strip(const std::string& text, const char* chars)
{
    const std::string::size_type first = text.find_first_not_of(chars);
    return first == std::string::npos ? std::string() : rstrip(text.substr(first), chars);
}

std::vector<std::string> split(const std::string& text, char separator, long limit)
{
    std::vector<std::string> pieces;
    std::string::size_type begin = 0;
    for (long splits = 0; limit < 0 || splits < limit; ++splits) {
        const std::string::size_type end = text.find(separator, begin);
        if (end == std::string::npos) break;
        pieces.push_back(text.substr(begin, end - begin));
        begin = end + 1;
    }
    pieces.push_back(text.substr(begin));
    return pieces;
}

std::string basename(const std::string& path)
{
    if (path.empty()) return ".";
    const std::string stripped = rstrip(path, kPathSeparators);
    if (stripped.empty()) return "/";
    const std::string::size_type separator = stripped.find_last_of(kPathSeparators);
    return separator == std::string::npos ? stripped : stripped.substr(separator + 1);
}

std::string dirname(const std::string& path)
{
    if (path.empty()) return ".";
    const std::string stripped = rstrip(path, kPathSeparators);
    if (stripped.empty()) return "/";
    const std::string::size_type separator = stripped.find_last_of(kPathSeparators);
    if (separator == std::string::npos) return ".";
    const std::string directory = rstrip(stripped.substr(0, separator), kPathSeparators);
    return directory.empty() ? "/" : directory;
}

std::string normalizePath(const std::string& path)
{
    const std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(path.c_str(), nullptr), &std::free);
    const int error = errno;
    if (!resolved) throw PosixError(error, "Failed to normalize path " + path);
    return resolved.get();
}

std::string readFile(const std::string& path)
{
    std::ifstream file(path);
    int error = errno;
    std::ostringstream content;
    bool good = file.is_open();
    if (good) {
        errno = 0;
        content << file.rdbuf();
        error = errno;
        // A failed read sets the fail bit, and so does an empty file, from which nothing is copied. Those two differ by
        // errno. A directory counts as empty, though reading it fails.
        const bool isEmpty = content.fail() && (error == 0 || error == EISDIR) && content.str().empty();
        good = !content.bad() && (!content.fail() || isEmpty);
    }
    if (!good) throw FileIOError(error, "Failed to read contents of file " + path);
    return content.str();
}

void writeFile(const std::string& path, const std::string& content)
{
    std::ofstream file(path, std::ios_base::out | std::ios_base::trunc);
    int error = errno;
    bool good = file.is_open();
    if (good) {
        // The flush belongs to the write: content that fits into the buffer reaches the system only now.
        file << content << std::flush;
        error = errno;
        good = !file.bad();
    }
    if (!good) throw FileIOError(error, "Failed to write contents of file " + path);
}

bool parseBool(const std::string& text)
{
    static const std::set<std::string> kTrueWords{"y", "yes", "true", "1"};
    static const std::set<std::string> kFalseWords{"n", "no", "false", "0"};

    const std::string word = lowercase(text);
    if (kTrueWords.count(word) != 0) return true;
    if (kFalseWords.count(word) != 0) return false;
    throw std::invalid_argument(text + " is not convertible to bool");
}

} // namespace qel::Utilities
