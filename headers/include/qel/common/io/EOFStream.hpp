#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/io/Stream.hpp>

#include <chrono>
#include <cstddef>

namespace qel {

/// The stream that has already ended: what stands in where there is no peer.
///
/// There is one for the whole process. It has no state, so any number of threads may share it, and it is usable before
/// main() begins and after it ends.
class QEL_EXPORT EOFStream final : public Stream {
public:
    /// @return the one instance, always the same object; never destroyed
    static EOFStream& get() noexcept;

    ~EOFStream() override;

    /// Does nothing.
    void close() override;

    /// Accepted and ignored: nothing here ever waits.
    void setReadDeadline(std::chrono::milliseconds timeout) override;

    /// @return 0: the end of the stream; `buffer` is not touched
    std::size_t read(char* buffer, std::size_t length) override;

    /// Accepted and ignored: nothing here ever waits.
    void setWriteDeadline(std::chrono::milliseconds timeout) override;

    /// @throws StreamIOException  "EOF", always, also for no bytes at all
    void write(const char* buffer, std::size_t length) override;

private:
    EOFStream() noexcept = default;
};

} // namespace qel
