#pragma once

#include <qel/common/QelExport.hpp>

#include <cstddef>
#include <cstdint>
#include <ostream>
#include <streambuf>
#include <string>

/// @file
/// An output stream that collects text up to a limit.

namespace qel {

/// Collects characters in a string that never grows past a limit.
/// Thread safety: one thread at a time.
class QEL_EXPORT CappedStringStreambuf : public std::streambuf {
public:
    /// @param maxSize  the limit in bytes
    explicit CappedStringStreambuf(std::size_t maxSize);
    ~CappedStringStreambuf() override;

    /// @return the text so far, not copied; it changes with each write and is valid as long as this object
    const std::string& str() const noexcept { return mBuffer; }

protected:
    /// Takes as many of the `count` characters as fit.
    /// @return the number of characters taken
    /// @throws std::bad_alloc  no memory; std::ostream turns it into badbit
    std::streamsize xsputn(const char* text, std::streamsize count) override;
    /// Takes one character.
    /// @return end-of-file if the limit is reached or the argument is end-of-file, another value otherwise
    /// @throws std::bad_alloc  no memory; std::ostream turns it into badbit
    int_type overflow(int_type character) override;

private:
    std::string mBuffer;
    std::uint64_t mMaxSize;
};

/// An output stream whose text is cut at a limit. A write that does not fit is cut there and sets badbit, so that
/// everything after it is dropped; nothing marks the cut. Text that fits exactly does not set badbit. Text for which
/// there is no memory sets it and is dropped.
/// Thread safety: one thread at a time.
class QEL_EXPORT CappedStringStream : public std::ostream {
public:
    /// @param maxSize  the limit in bytes
    explicit CappedStringStream(std::size_t maxSize);
    ~CappedStringStream() override;

    /// @return a copy of the text so far
    std::string str() const { return mBuffer.str(); }

protected:
    /// @return the text so far, not copied; valid until the next write
    const std::string& pText() const noexcept { return mBuffer.str(); }

private:
    CappedStringStreambuf mBuffer;
};

} // namespace qel
