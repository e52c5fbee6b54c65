#pragma once

#include <cstddef>
#include <string>

namespace qel::tool {

/// Sees what a session brings. Borrowed by the screen; called on its thread.
class SessionTap {
public:
    virtual ~SessionTap() = default;

    /// Output of the partition, as it came.
    virtual void onOutput(const char* data, std::size_t length) = 0;

    /// Output may be missing here. @param text  why, in one line
    virtual void onGap(const std::string& text) { static_cast<void>(text); }
};

} // namespace qel::tool
