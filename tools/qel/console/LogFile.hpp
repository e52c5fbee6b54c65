#pragma once

#include "base/TimeStamps.hpp"
#include "console/ControlStripper.hpp"
#include "console/SessionFile.hpp"
#include "console/SessionTap.hpp"

#include <cstddef>
#include <string>

namespace qel::tool {

/// Appends the output of a session to a file: the bytes as they are, or readable text.
///
/// A file that cannot be written any more ends the log, not the session: takeFailure() says so. The session does not
/// wait for a pipe either: one that nobody reads is such a file.
/// Thread safety: one thread.
class LogFile : public SessionTap {
public:
    enum class Content {
        Raw,     ///< every byte
        Stripped ///< without control sequences, see ControlStripper
    };

    /// @param style  of the time before each line of stripped text
    /// @throws FileIOError  the file cannot be opened
    LogFile(std::string path, Content content, TimeStamps::Style style = TimeStamps::Style::Off);

    const std::string& path() const noexcept { return mFile.path(); }

    bool isOn() const noexcept { return mIsOn; }
    /// Turns it off, or on again; a file that has failed is tried again.
    void toggle() noexcept { mIsOn = !mIsOn; }

    void onOutput(const char* data, std::size_t length) override;
    void onGap(const std::string& text) override;

    /// @return why the log ended since the last call; empty: it did not
    std::string takeFailure() { return mFile.takeFailure(); }

private:
    void pWrite(const std::string& text);

    const Content mContent;
    SessionFile mFile;
    bool mIsOn = true;
    bool mEndsLine = true; // what has been written
    ControlStripper mStripper;
    TimeStamps mStamps;
};

} // namespace qel::tool
