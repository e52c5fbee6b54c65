#pragma once

#include <qel/common/util/Poll.hpp>

#include "base/UniqueFd.hpp"

#include <cstddef>
#include <string>

namespace qel::tool {

/// Writes to a descriptor, such as standard output, without ever waiting for it: what it does not take yet is kept.
///
/// The descriptor's own file description is left as it is, because other processes share it: making it non-blocking
/// would make theirs non-blocking too. A terminal is opened anew for that reason; to anything else no more is written
/// at a time than it takes without waiting once it is ready for writing (see pipe(7): PIPE_BUF).
///
/// Ownership: borrows the descriptor. Thread safety: one thread.
class DescriptorOutput {
public:
    /// Bytes that may be kept before hasRoom() is false.
    static constexpr std::size_t kRoom = 64 * 1024;

    explicit DescriptorOutput(int descriptor);

    /// Keeps bytes for the descriptor, beyond kRoom too.
    void append(const char* data, std::size_t length);

    bool isEmpty() const noexcept { return mKept.empty(); }
    bool hasRoom() const noexcept { return mKept.size() < kRoom; }

    /// True when the last byte that was appended ended a line, and when there was none yet.
    bool endsLine() const noexcept { return mEndsLine; }

    /// Ready once writeSome() gets on.
    PollFd getPollFd() const;

    /// Writes what the descriptor takes at once. @throws PosixError  it cannot be written to
    void writeSome();

    /// Writes everything, and waits as long as that takes. @throws PosixError  as writeSome()
    void flush();

private:
    bool pIsReady() const;
    std::size_t pWrite(const char* data, std::size_t length) const;

    UniqueFd mOwn; ///< the terminal, opened anew; none for anything else
    int mDescriptor;
    std::string mKept;
    bool mEndsLine = true;
};

} // namespace qel::tool
