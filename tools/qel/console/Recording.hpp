#pragma once

#include "console/SessionFile.hpp"
#include "console/SessionTap.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>

namespace qel::tool {

/// Records what a session shows in the format asciicast v2: a header, and one line of JSON for each piece of output,
/// with its time. What is typed is not recorded, since it may be secret; the partition's echo is output.
///
/// A file that cannot be written any more ends the recording, not the session: takeFailure() says so. A pipe that
/// nobody reads is such a file. Thread safety: one thread.
class Recording : public SessionTap {
public:
    struct Size {
        std::uint16_t columns = 80;
        std::uint16_t rows = 24;
    };

    /// Makes the file, or empties it, and writes the header.
    /// @throws FileIOError  the file cannot be written
    Recording(std::string path, const std::string& title, Size size);

    ~Recording() override;
    Recording(const Recording&) = delete;
    Recording& operator=(const Recording&) = delete;

    void onOutput(const char* data, std::size_t length) override;
    void onGap(const std::string& text) override;

    /// The window has a new size.
    void onResize(Size size);

    /// @return why the recording ended since the last call; empty: it did not
    std::string takeFailure() { return mFile.takeFailure(); }

private:
    void pWriteRest();
    void pWriteEvent(const char* kind, const std::string& data);
    void pWrite(const std::string& line);

    SessionFile mFile;
    bool mHasFailed = false;
    const std::chrono::steady_clock::time_point mStart;
    std::string mRest; // the first bytes of a character whose last ones have not come yet
};

} // namespace qel::tool
