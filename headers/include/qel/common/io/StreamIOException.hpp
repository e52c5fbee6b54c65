#pragma once

#include <qel/common/QelExport.hpp>

#include <stdexcept>

namespace qel {

/// An operation of a stream failed.
///
/// The texts of the stream layer are "EOF" (the stream ended too early, or accepts no more bytes) and "I/O deadline"
/// (the deadline had passed before the call began). Concrete streams add their own; if a system call failed, its
/// PosixError is nested (std::rethrow_if_nested).
/// Thread safety: that of std::runtime_error.
class QEL_EXPORT StreamIOException : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
    ~StreamIOException() override;
};

} // namespace qel
