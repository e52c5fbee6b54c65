#pragma once

#include <qel/common/io/Stream.hpp>

#include <chrono>
#include <cstddef>
#include <memory>

namespace qel::protocol {

/// The stream below TLS. It gives each received TLS record a limited time from its first byte to its last. Without it a
/// peer that stops within a record would keep its place for ever: above TLS no byte of a message has arrived by then.
///
/// A deadline that is set from above takes precedence.
///
/// Thread safety: that of a Stream. limitRecords() belongs to the reader.
class RecordStream final : public Stream {
public:
    /// @param stream  owned; nothing of TLS has been read from it
    explicit RecordStream(std::unique_ptr<Stream> stream);
    ~RecordStream() override;

    /// From now on each record has this time. @param timeout  0: it has no limit of its own
    void limitRecords(std::chrono::milliseconds timeout) noexcept { mTimeout = timeout; }

    std::size_t read(char* buffer, std::size_t length) override;
    void write(const char* buffer, std::size_t length) override;
    void close() override;
    void setReadDeadline(std::chrono::milliseconds timeout) override;
    void setWriteDeadline(std::chrono::milliseconds timeout) override;

private:
    bool pIsInRecord() const noexcept { return mHeaderBytes > 0; }
    void pLimit();
    void pFollow(const char* bytes, std::size_t length) noexcept;

    const std::unique_ptr<Stream> mStream;
    std::chrono::milliseconds mTimeout{0}; // 0: records have no limit of their own
    bool mHasDeadline = false;             // set from above
    bool mIsTimed = false;                 // the deadline below is that of a record

    // Where the reader is, see RFC 8446, 5.1: a header of five bytes, the last two of which say how many bytes follow.
    std::size_t mHeaderBytes = 0; // of the current record, read so far; 0: between two records
    std::size_t mBodyBytes = 0;   // of the current record, left to read; valid once its header is complete
};

} // namespace qel::protocol
