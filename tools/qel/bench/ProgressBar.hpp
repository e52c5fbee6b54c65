#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace qel::tool {

/// Shows on a terminal how far something has come: one line, written over again and again. Does nothing when the
/// descriptor is no terminal, or the terminal is gone.
/// Thread safety: one thread.
class ProgressBar {
public:
    /// @param descriptor  of the terminal, borrowed
    explicit ProgressBar(int descriptor) noexcept;

    /// Clears the line.
    ~ProgressBar();

    ProgressBar(const ProgressBar&) = delete;
    ProgressBar& operator=(const ProgressBar&) = delete;

    bool isShown() const noexcept { return mShown; }

    /// @param fraction  0 to 1; what is beyond counts as the nearest of these
    /// @param remark  stands behind the bar
    void update(double fraction, const std::string& remark);

    /// The line for a terminal of so many columns; shorter than that, so that the cursor stays in it.
    static std::string line(double fraction, const std::string& remark, std::size_t columns);

private:
    std::size_t pColumns() const;
    void pWrite(const std::string& text);

    const int mDescriptor;
    bool mShown;
};

} // namespace qel::tool
