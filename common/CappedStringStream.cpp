#include <qel/common/CappedStringStream.hpp>

#include <algorithm>

namespace qel {

namespace {

// Enough for most log lines, so that a line costs one allocation instead of one for every doubling.
constexpr std::size_t kFirstCapacity = 255;

} // namespace

CappedStringStreambuf::CappedStringStreambuf(std::size_t maxSize) : mMaxSize(maxSize) {}

CappedStringStreambuf::~CappedStringStreambuf() = default;

std::streamsize CappedStringStreambuf::xsputn(const char* text, std::streamsize count)
{
    if (count <= 0) return 0;
    const std::uint64_t room = mMaxSize - mBuffer.size();
    const std::uint64_t taken = std::min(static_cast<std::uint64_t>(count), room);
    if (mBuffer.empty()) mBuffer.reserve(static_cast<std::size_t>(std::min<std::uint64_t>(kFirstCapacity, mMaxSize)));
    mBuffer.append(text, static_cast<std::size_t>(taken));
    return static_cast<std::streamsize>(taken);
}

CappedStringStreambuf::int_type CappedStringStreambuf::overflow(int_type character)
{
    if (traits_type::eq_int_type(character, traits_type::eof()) || mBuffer.size() >= mMaxSize) {
        return traits_type::eof();
    }
    const char byte = traits_type::to_char_type(character);
    xsputn(&byte, 1);
    return traits_type::not_eof(character);
}

// The base is constructed before the buffer, so it gets the buffer afterwards. rdbuf() also clears the badbit of a
// stream without a buffer.
CappedStringStream::CappedStringStream(std::size_t maxSize) : std::ostream(nullptr), mBuffer(maxSize)
{
    rdbuf(&mBuffer);
}

CappedStringStream::~CappedStringStream() = default;

} // namespace qel
