#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace qel::tool {

/// Shows progress on one line of a terminal. Does nothing when the descriptor is not a terminal, or after writing to it
/// failed.
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

    /// @param fraction  clamped to [0, 1]
    /// @param remark  printed after the bar
    void update(double fraction, const std::string& remark);

    /// Clears the line, for text that goes to the same terminal.
    void clear() { pWrite("\r\x1B[K"); }

    /// The line for a terminal of `columns` columns; one column shorter, so that the cursor stays on it.
    static std::string line(double fraction, const std::string& remark, std::size_t columns);

private:
    std::size_t pColumns() const;
    void pWrite(const std::string& text);

    const int mDescriptor;
    bool mShown;
};

} // namespace qel::tool
