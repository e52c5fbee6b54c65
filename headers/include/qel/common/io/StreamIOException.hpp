#pragma once

#include <qel/common/QelExport.hpp>

#include <stdexcept>

namespace qel {

/// A stream could not do what it was asked to.
///
/// The texts of the stream layer itself are "EOF" (the stream ended before everything had arrived, or nothing can be
/// written to it any more) and "I/O deadline" (the deadline had passed before the call began). Concrete streams add
/// their own; where a system call failed, the PosixError is nested inside (std::rethrow_if_nested brings it out).
class QEL_EXPORT StreamIOException : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
    ~StreamIOException() override;
};

} // namespace qel
