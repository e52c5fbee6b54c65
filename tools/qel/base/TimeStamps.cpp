#include "base/TimeStamps.hpp"

#include <qel/common/util/TimeProvider.hpp>

#include <array>
#include <cstdio>
#include <cstring>
#include <ctime>

namespace qel::tool {

namespace {

using std::chrono::milliseconds;

} // namespace

std::string TimeStamps::iso(std::chrono::system_clock::time_point when)
{
    const auto sinceEpoch = std::chrono::floor<milliseconds>(when.time_since_epoch());
    const auto seconds = std::chrono::floor<std::chrono::seconds>(sinceEpoch);
    const std::time_t time = seconds.count();
    std::tm utc{};
    ::gmtime_r(&time, &utc);
    std::array<char, 32> text{};
    const std::size_t length = std::strftime(text.data(), text.size(), "%Y-%m-%dT%H:%M:%S", &utc);
    std::array<char, 8> fraction{};
    std::snprintf(fraction.data(), fraction.size(), ".%03dZ", static_cast<int>((sinceEpoch - seconds).count()));
    return std::string(text.data(), length) + fraction.data();
}

void TimeStamps::cycle()
{
    switch (mStyle) {
    case Style::Off:
        mStyle = Style::Iso;
        break;
    case Style::Iso:
        mStyle = Style::Delta;
        break;
    case Style::Delta:
        mStyle = Style::Off;
        break;
    }
}

void TimeStamps::append(const char* data, std::size_t length, std::string& out)
{
    while (length > 0) {
        if (mAtLineStart && mStyle != Style::Off) out += pStamp();
        const auto* const end = static_cast<const char*>(std::memchr(data, '\n', length));
        mAtLineStart = end != nullptr;
        const std::size_t count = mAtLineStart ? static_cast<std::size_t>(end - data) + 1 : length;
        out.append(data, count);
        data += count;
        length -= count;
    }
}

void TimeStamps::skip(const char* data, std::size_t length)
{
    if (length > 0) mAtLineStart = data[length - 1] == '\n';
}

std::string TimeStamps::pStamp()
{
    if (mStyle == Style::Iso) return "[" + iso(TimeProvider::system()) + "] ";
    const auto now = TimeProvider::steady();
    const double seconds = mLast ? std::chrono::duration<double>(now - *mLast).count() : 0;
    mLast = now;
    std::array<char, 32> text{};
    std::snprintf(text.data(), text.size(), "[+%.3f] ", seconds);
    return text.data();
}

} // namespace qel::tool
