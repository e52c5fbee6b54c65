#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/common/security/SSLStream.hpp>

#include <algorithm>
#include <cstring>
#include <stdexcept>
#include <utility>

namespace qel {

namespace {

constexpr std::size_t kCacheLineBytes = 64;

Stream& notNull(const std::unique_ptr<Stream>& stream)
{
    if (stream == nullptr) throw std::invalid_argument("stream");
    return *stream;
}

// Two of these on top of each other would copy everything twice, and a flush of one would not flush the other.
Stream& notBuffered(Stream& stream)
{
    if (dynamic_cast<const BufferedStream*>(&stream) != nullptr) throw std::invalid_argument("stream");
    return stream;
}

} // namespace

/// A buffer of one direction; the bytes in [first, end) wait in it.
struct alignas(kCacheLineBytes) BufferedStream::Buffer {
    // Not initialised: pages that are never used cost no memory.
    explicit Buffer(std::size_t capacity) : bytes(capacity > 0 ? new char[capacity] : nullptr), size(capacity) {}

    std::size_t waiting() const noexcept { return end - first; }
    std::size_t room() const noexcept { return size - end; }

    /// Takes the first bytes out, at most `length`. @return how many
    std::size_t take(char* buffer, std::size_t length) noexcept
    {
        const std::size_t count = std::min(length, waiting());
        if (count == 0) return 0;
        std::memcpy(buffer, bytes.get() + first, count);
        first += count;
        return count;
    }

    const std::unique_ptr<char[]> bytes;
    const std::size_t size;
    std::size_t first = 0;
    std::size_t end = 0;
};

BufferedStream::BufferedStream(Stream& stream, const Options& options) : BufferedStream(nullptr, stream, options) {}

BufferedStream::BufferedStream(std::unique_ptr<Stream> stream, const Options& options)
    : BufferedStream(std::move(stream), notNull(stream), options)
{}

// `owned` is a reference, so that the caller can look at the pointer while it passes it.
BufferedStream::BufferedStream(std::unique_ptr<Stream>&& owned, Stream& stream, const Options& options)
    : mOwned(std::move(owned)), mStream(notBuffered(stream)), mTls(dynamic_cast<SSLStream*>(&stream)),
      mFlushBeforeRead(options.flushBeforeRead), mInbound(std::make_unique<Buffer>(options.readAheadBytes)),
      mOutbound(std::make_unique<Buffer>(options.gatherBytes))
{}

BufferedStream::~BufferedStream() = default;

/// Empties the buffer even when the write fails: how much was sent is unknown then, and nothing may be sent twice.
void BufferedStream::flush()
{
    const std::size_t count = std::exchange(mOutbound->end, 0);
    if (count > 0) mStream.write(mOutbound->bytes.get(), count);
}

bool BufferedStream::hasPending() const { return mInbound->waiting() > 0 || (mTls != nullptr && mTls->hasPending()); }

void BufferedStream::close() { mStream.close(); }

void BufferedStream::setReadDeadline(std::chrono::milliseconds timeout) { mStream.setReadDeadline(timeout); }

void BufferedStream::setWriteDeadline(std::chrono::milliseconds timeout) { mStream.setWriteDeadline(timeout); }

std::size_t BufferedStream::read(char* buffer, std::size_t length)
{
    if (length == 0) return 0;
    Buffer& in = *mInbound;
    if (in.waiting() == 0) {
        if (mFlushBeforeRead) flush();
        if (length >= in.size) return mStream.read(buffer, length);
        pReadAhead(length);
    }
    return in.take(buffer, length);
}

void BufferedStream::fill(char* buffer, std::size_t length)
{
    const std::size_t count = mInbound->take(buffer, length);
    if (count < length) InputStream::fill(buffer + count, length - count);
}

void BufferedStream::write(const char* buffer, std::size_t length)
{
    if (length == 0) return;
    Buffer& out = *mOutbound;
    if (length > out.room()) {
        flush();
        if (length > out.size) {
            mStream.write(buffer, length);
            return;
        }
    }
    std::memcpy(out.bytes.get() + out.end, buffer, length);
    out.end += length;
}

/// Reads into the empty buffer.
/// @param needed  what the caller has asked for; less than the size of the buffer
void BufferedStream::pReadAhead(std::size_t needed)
{
    Buffer& in = *mInbound;
    in.first = in.end = 0; // also if a read throws
    in.end = mStream.read(in.bytes.get(), mTls != nullptr ? needed : in.size);
    if (mTls == nullptr) return;

    // A TLS stream that is asked for more than the peer's data discards this data when it finds the end of TLS, or an
    // invalid record, behind it. So it is asked for what is certain to be there, and nothing else.
    const std::size_t more = std::min(mTls->getReadableBytes(), in.room());
    if (more == 0) return;
    try {
        in.end += mStream.read(in.bytes.get() + in.end, more);
    } catch (const StreamIOException&) {
        // Another thread has closed the stream meanwhile. The next read below says so.
    }
}

} // namespace qel
