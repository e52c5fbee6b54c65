#include <qel/common/io/Stream.hpp>
#include <qel/common/io/StreamDeadline.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include <stdexcept>

namespace qel {

StreamBase::~StreamBase() = default;

InputStream::~InputStream() = default;

void InputStream::setReadDeadline(std::chrono::milliseconds) { throw std::invalid_argument("Not supported"); }

void InputStream::fill(char* buffer, std::size_t length)
{
    while (length > 0) {
        const std::size_t count = read(buffer, length);
        if (count == 0) throw StreamIOException("EOF");
        buffer += count;
        length -= count;
    }
}

void InputStream::clearReadDeadline() { setReadDeadline(StreamDeadline::Infinite); }

OutputStream::~OutputStream() = default;

void OutputStream::setWriteDeadline(std::chrono::milliseconds) { throw std::invalid_argument("Not supported"); }

void OutputStream::clearWriteDeadline() { setWriteDeadline(StreamDeadline::Infinite); }

Stream::~Stream() = default;

} // namespace qel
