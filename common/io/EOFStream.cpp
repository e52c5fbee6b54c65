#include <qel/common/io/EOFStream.hpp>
#include <qel/common/io/StreamIOException.hpp>

#include <new>

namespace qel {

// Constructed on first use and never destroyed. A class with a virtual base cannot be initialised at compile time, and
// a plain static object could be used before its constructor or after its destructor has run.
EOFStream& EOFStream::get() noexcept
{
    alignas(EOFStream) static unsigned char sStorage[sizeof(EOFStream)];
    static EOFStream& sInstance = *::new (static_cast<void*>(sStorage)) EOFStream;
    return sInstance;
}

EOFStream::~EOFStream() = default;

void EOFStream::close() {}

void EOFStream::setReadDeadline(std::chrono::milliseconds) {}

std::size_t EOFStream::read(char*, std::size_t) { return 0; }

void EOFStream::setWriteDeadline(std::chrono::milliseconds) {}

void EOFStream::write(const char*, std::size_t) { throw StreamIOException("EOF"); }

} // namespace qel
