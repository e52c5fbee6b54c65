#pragma once

#include <qel/common/util/Poll.hpp>
#include <qel/common/util/UniqueFd.hpp>

#include <cstddef>
#include <string>

namespace qel::tool {

/// Writes to a descriptor, such as standard output, without blocking. Keeps what the descriptor does not take yet.
///
/// The descriptor's file description stays unchanged, because other processes share it: O_NONBLOCK would apply to them
/// too. A terminal is therefore opened again. To anything else at most PIPE_BUF bytes are written at a time, and only
/// when it is ready, so that the write does not block (pipe(7)).
///
/// Ownership: borrows the descriptor. Thread safety: one thread.
class DescriptorOutput {
public:
    /// hasRoom() is false once this many bytes are kept.
    static constexpr std::size_t kRoom = 64 * 1024;

    explicit DescriptorOutput(int descriptor);

    /// Keeps bytes for the descriptor, even beyond kRoom.
    void append(const char* data, std::size_t length);

    bool isEmpty() const noexcept { return mKept.empty(); }
    bool hasRoom() const noexcept { return mKept.size() < kRoom; }

    /// True when the last byte that was appended is a line feed, and before the first byte.
    bool endsLine() const noexcept { return mEndsLine; }

    /// Ready when writeSome() can write.
    PollFd getPollFd() const;

    /// Writes what the descriptor takes without blocking. @throws PosixError  writing failed
    void writeSome();

    /// Forgets what is kept.
    void drop();

    /// Writes everything and waits without limit. @throws PosixError  writing failed
    void flush();

private:
    bool pIsReady() const;
    std::size_t pWrite(const char* data, std::size_t length) const;

    UniqueFd mOwn; ///< the terminal, opened again; none for anything else
    int mDescriptor;
    std::string mKept;
    bool mEndsLine = true;
};

} // namespace qel::tool
