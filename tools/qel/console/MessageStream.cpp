#include "console/MessageStream.hpp"

#include <qel/common/util/PosixError.hpp>

#include <cstddef>

namespace qel::tool {

MessageBuffer::int_type MessageBuffer::overflow(int_type character)
{
    if (traits_type::eq_int_type(character, traits_type::eof())) return traits_type::not_eof(character);
    const char text = traits_type::to_char_type(character);
    xsputn(&text, 1);
    return character;
}

std::streamsize MessageBuffer::xsputn(const char* text, std::streamsize length)
{
    if (mOutput.hasRoom()) mOutput.append(text, static_cast<std::size_t>(length));
    return length;
}

int MessageBuffer::sync()
{
    try {
        mOutput.writeSome();
    } catch (const PosixError&) {
        return 0; // nobody reads messages any more
    }
    return 0;
}

} // namespace qel::tool
