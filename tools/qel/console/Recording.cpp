#include "console/Recording.hpp"

#include <qel/common/util/TimeProvider.hpp>

#include "console/ConsoleTexts.hpp"

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <nlohmann/json.hpp>
#include <utility>

namespace qel::tool {

namespace {

using Json = nlohmann::ordered_json;

/// One line of JSON. What is not UTF-8 becomes the replacement character, since JSON is Unicode.
std::string lineOf(const Json& json) { return json.dump(-1, ' ', false, Json::error_handler_t::replace) + "\n"; }

/// The length of the character that begins with this byte; 1 for a byte that begins none.
std::size_t characterLength(unsigned char first)
{
    if (first >= 0xF0 && first < 0xF8) return 4;
    if (first >= 0xE0) return first < 0xF0 ? 3 : 1;
    return first >= 0xC0 ? 2 : 1;
}

/// How many bytes at the end of the text begin a character that is not complete.
std::size_t incompleteBytes(const std::string& text)
{
    constexpr std::size_t kLongest = 4;
    for (std::size_t back = 1; back <= std::min(text.size(), kLongest - 1); ++back) {
        const auto byte = static_cast<unsigned char>(text[text.size() - back]);
        if ((byte & 0xC0U) == 0x80U) continue; // within a character
        return characterLength(byte) > back ? back : 0;
    }
    return 0;
}

} // namespace

Recording::Recording(std::string path, const std::string& title, Size size)
    : mFile(std::move(path), O_TRUNC, texts::kCannotRecord), mStart(TimeProvider::steady())
{
    Json header{{"version", 2}, {"width", size.columns}, {"height", size.rows}};
    header["timestamp"] = std::chrono::system_clock::to_time_t(TimeProvider::system());
    header["title"] = title;
    const char* const terminal = std::getenv("TERM");
    if (terminal != nullptr) header["env"] = Json{{"TERM", terminal}};
    pWrite(lineOf(header));
}

Recording::~Recording() { pWriteRest(); }

void Recording::onOutput(const char* data, std::size_t length)
{
    mRest.append(data, length);
    const std::size_t complete = mRest.size() - incompleteBytes(mRest);
    if (complete == 0) return;
    pWriteEvent("o", mRest.substr(0, complete));
    mRest.erase(0, complete);
}

void Recording::onGap(const std::string& text)
{
    pWriteRest();
    pWriteEvent("m", text);
}

void Recording::onResize(Size size)
{
    pWriteEvent("r", std::to_string(size.columns) + "x" + std::to_string(size.rows));
}

/// A character whose last bytes do not come any more.
void Recording::pWriteRest()
{
    if (!mRest.empty()) pWriteEvent("o", std::exchange(mRest, {}));
}

void Recording::pWriteEvent(const char* kind, const std::string& data)
{
    if (mHasFailed) return;
    const double seconds = std::chrono::duration<double>(TimeProvider::steady() - mStart).count();
    std::array<char, 32> time{};
    std::snprintf(time.data(), time.size(), "%.6f", seconds);
    std::string line = lineOf(Json{kind, data});
    line.insert(1, std::string(time.data()) + ", ");
    pWrite(line);
}

void Recording::pWrite(const std::string& line) { mHasFailed = !mFile.write(line); }

} // namespace qel::tool
