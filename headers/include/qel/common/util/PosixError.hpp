#pragma once

#include <qel/common/QelExport.hpp>

#include <cstdint>
#include <ostream>
#include <stdexcept>
#include <string>

/// @file
/// The error codes and exceptions of failed system calls.

namespace qel {

/// An error number of the C library, as in errno. A value, compared by number. An int converts to it, so
/// `code == EINTR` and `code != EINTR` compile.
/// Thread safety: that of an int.
class QEL_EXPORT PosixErrorCode {
public:
    /// The code 0. Does not read errno: pass errno to report a failed call.
    PosixErrorCode() noexcept : mCode(0) {}

    /// @param code an error number; some calls return it negated, so its sign is ignored
    PosixErrorCode(int code) noexcept;

    /// @return the error number, never negative
    int getCode() const noexcept { return mCode; }

    /// @return what the stream operator writes, for example "5 (Input/output error)"
    /// @throws std::bad_alloc  no memory
    std::string message() const;

    bool operator==(const PosixErrorCode& other) const noexcept { return mCode == other.mCode; }
    bool operator!=(const PosixErrorCode& other) const noexcept { return mCode != other.mCode; }

private:
    std::int32_t mCode; // never negative
};

/// Writes the number in decimal and, if the C library has one, its description in parentheses:
/// "5 (Input/output error)". Leaves the stream in decimal. See strerror_r(3).
/// Thread safety: any thread, each with a stream of its own.
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PosixErrorCode& code);

/// A failed system call. The text is composed at construction and does not change.
/// Thread safety: that of std::runtime_error: copies may be used by different threads.
class QEL_EXPORT PosixError : public std::runtime_error {
public:
    /// The text is that of the code: "24 (Too many open files)".
    /// @throws std::bad_alloc  no memory
    explicit PosixError(PosixErrorCode code);

    /// The text is the context, ": " and the text of the code: "Failed to open socket: 24 (Too many open files)".
    /// Save errno on the line after the failed call: composing the context may change it.
    /// @throws std::bad_alloc  no memory
    PosixError(PosixErrorCode code, const std::string& context);

    /// Copies share the text; a move is a copy, so the source stays valid.
    PosixError(const PosixError&) noexcept = default;
    PosixError& operator=(const PosixError&) noexcept = default;
    ~PosixError() override;

    /// @return the error number of the failed call
    const PosixErrorCode& getErrorCode() const noexcept { return mErrorCode; }

private:
    PosixErrorCode mErrorCode;
};

/// A failure to read or write a file: a class of its own, so that callers can catch it apart from socket errors.
/// Thread safety: as PosixError.
class QEL_EXPORT FileIOError : public PosixError {
public:
    using PosixError::PosixError;
    FileIOError(const FileIOError&) noexcept = default;
    FileIOError& operator=(const FileIOError&) noexcept = default;
    ~FileIOError() override;
};

namespace detail {

// strerror_r has two forms; the compilation options decide which one a program gets. One overload takes the result of
// each and returns the text, or null if there is none.

/// The GNU form returns the text, which may be outside the caller's buffer.
inline const char* errorDescription(const char* result, const char* /*buffer*/) noexcept { return result; }

/// The POSIX form returns 0 if it has written the text to the caller's buffer, and an error number otherwise.
inline const char* errorDescription(int result, const char* buffer) noexcept { return result == 0 ? buffer : nullptr; }

} // namespace detail

} // namespace qel
