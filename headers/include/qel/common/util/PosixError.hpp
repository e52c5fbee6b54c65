#pragma once

#include <qel/common/QelExport.hpp>

#include <cstdint>
#include <ostream>
#include <stdexcept>
#include <string>

/// @file
/// How failed system calls are reported.

namespace qel {

/// An error number of the C library, as errno holds it. A value: copied freely, compared by number.
/// Thread safety: that of a plain integer.
class QEL_EXPORT PosixErrorCode {
public:
    /// The code 0. Does not look at errno: whoever reports a failed call passes it on.
    PosixErrorCode() noexcept : mCode(0) {}

    /// @param code an error number; a negative one, as some calls return it, means the same as the positive one
    PosixErrorCode(int code) noexcept;

    /// @return the error number, never negative
    int getCode() const noexcept { return mCode; }

    /// @return what the stream operator writes, for example "5 (Input/output error)"
    std::string message() const;

    bool operator==(const PosixErrorCode& other) const noexcept { return mCode == other.mCode; }
    bool operator!=(const PosixErrorCode& other) const noexcept { return mCode != other.mCode; }

private:
    std::int32_t mCode; // never negative
};

/// Writes the number in decimal and, where the C library has one, its description in parentheses:
/// "5 (Input/output error)". Leaves the stream in decimal. See strerror_r(3).
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const PosixErrorCode& code);

/// A system call failed. The text is composed at construction and never changes.
class QEL_EXPORT PosixError : public std::runtime_error {
public:
    /// The text is that of the code alone: "24 (Too many open files)".
    explicit PosixError(PosixErrorCode code);

    /// The text is the context, ": " and that of the code: "Failed to open socket: 24 (Too many open files)".
    /// Save errno in a variable on the line after the failed call: building the context may change it.
    PosixError(PosixErrorCode code, const std::string& context);

    /// Copies share the text and the code; moving copies, so that the source stays whole.
    PosixError(const PosixError&) noexcept = default;
    PosixError& operator=(const PosixError&) noexcept = default;
    ~PosixError() override;

    /// @return the error number of the failed call
    const PosixErrorCode& getErrorCode() const noexcept { return mErrorCode; }

private:
    PosixErrorCode mErrorCode;
};

/// Reading or writing a file failed. A kind of its own, so that callers can tell it from an error of a socket.
class QEL_EXPORT FileIOError : public PosixError {
public:
    using PosixError::PosixError;
    FileIOError(const FileIOError&) noexcept = default;
    FileIOError& operator=(const FileIOError&) noexcept = default;
    ~FileIOError() override;
};

namespace detail {

// strerror_r comes in two forms under one name, and the compilation options of the program decide which one it gets.
// These two overloads take the result of either and give the text, or null when there is none.

/// The GNU form returns the text, which need not stand in the caller's buffer.
inline const char* errorDescription(const char* result, const char* /*buffer*/) noexcept { return result; }

/// The POSIX form returns 0 when it has written the text to the caller's buffer, otherwise an error number.
inline const char* errorDescription(int result, const char* buffer) noexcept { return result == 0 ? buffer : nullptr; }

} // namespace detail

} // namespace qel
