#pragma once

#include <qel/common/QelExport.hpp>
#include <qel/common/io/Stream.hpp>

#include <chrono>
#include <cstddef>

namespace qel {

/// A stream that has already ended: a placeholder where there is no peer.
///
/// Lifetime: there is one in the process. It is usable before main() begins and after it ends.
/// Thread safety: any number of threads may use it; it has no state.
class QEL_EXPORT EOFStream final : public Stream {
public:
    /// @return the instance, always the same object; never destroyed
    static EOFStream& get() noexcept;

    ~EOFStream() override;

    /// Does nothing.
    void close() override;

    /// Does nothing: no operation of this stream waits.
    void setReadDeadline(std::chrono::milliseconds timeout) override;

    /// @return 0: end of stream; `buffer` is not written to
    std::size_t read(char* buffer, std::size_t length) override;

    /// Does nothing: no operation of this stream waits.
    void setWriteDeadline(std::chrono::milliseconds timeout) override;

    /// @throws StreamIOException  "EOF", always, even if `length` is 0
    void write(const char* buffer, std::size_t length) override;

private:
    EOFStream() noexcept = default;
};

} // namespace qel
