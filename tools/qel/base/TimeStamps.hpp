#pragma once

#include <chrono>
#include <cstddef>
#include <optional>
#include <string>

namespace qel::tool {

/// Puts the time in front of each line of a text that comes in pieces.
/// Thread safety: one thread.
class TimeStamps {
public:
    enum class Style {
        Off,
        Iso,  ///< "[2026-11-22T09:43:00.123Z] ", the time in UTC
        Delta ///< "[+1.234] ", the seconds since the line before
    };

    /// A time in UTC: "2026-11-22T09:43:00.123Z".
    static std::string iso(std::chrono::system_clock::time_point when);

    explicit TimeStamps(Style style = Style::Off) : mStyle(style) {}

    Style style() const noexcept { return mStyle; }

    /// The style after this one, from the last to the first. A line that has begun is not stamped any more.
    void cycle();

    /// Appends the text to `out`, with a stamp before the first byte of each line.
    void append(const char* data, std::size_t length, std::string& out);

    /// Notes text that is shown without stamps.
    void skip(const char* data, std::size_t length);

private:
    std::string pStamp();

    Style mStyle;
    bool mAtLineStart = true;
    std::optional<std::chrono::steady_clock::time_point> mLast; // when the last line began
};

} // namespace qel::tool
