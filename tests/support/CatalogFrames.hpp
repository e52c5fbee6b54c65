#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/TypeInfo.hpp>

#include "support/Bytes.hpp"
#include "support/RawFrame.hpp"

#include <cstddef>
#include <cstring>
#include <memory>
#include <sstream>
#include <string>
#include <tuple>
#include <typeinfo>
#include <vector>

/// @file
/// Shared by the tests of the message classes: payloads built field by field, frames with the identity of a class, and
/// the parts of a message that are compared.

namespace qel::test {

/// The bytes of a payload, integers big-endian. Every call appends and returns the payload, for chaining.
class Payload {
public:
    Payload& u8(unsigned int value) { return append(1, value); }
    Payload& u16(unsigned int value) { return append(2, value); }
    Payload& u32(unsigned int value) { return append(4, value); }
    Payload& zeros(std::size_t count) { return fill(count, '\0'); }
    Payload& fill(std::size_t count, char value)
    {
        mBytes.insert(mBytes.end(), count, value);
        return *this;
    }
    /// The characters, then zeros up to `width`.
    Payload& text(const std::string& characters, std::size_t width = 0)
    {
        mBytes.insert(mBytes.end(), characters.begin(), characters.end());
        return characters.size() < width ? zeros(width - characters.size()) : *this;
    }
    /// Overwrites bytes.
    Payload& at(std::size_t offset, const std::vector<char>& values)
    {
        for (std::size_t i = 0; i < values.size(); ++i)
            mBytes.at(offset + i) = values[i];
        return *this;
    }
    /// Truncates the payload, or extends it with zeros.
    Payload& resize(std::size_t length)
    {
        mBytes.resize(length);
        return *this;
    }

    const std::vector<char>& bytes() const { return mBytes; }

private:
    Payload& append(unsigned int width, unsigned int value)
    {
        for (unsigned int i = width; i > 0; --i) {
            mBytes.push_back(static_cast<char>(static_cast<unsigned char>(value >> (8 * (i - 1)))));
        }
        return *this;
    }

    std::vector<char> mBytes;
};

/// Names the tests of a class list after the classes.
struct ClassNames {
    template <typename T>
    static std::string GetName(int)
    {
        const std::string name = TypeInfo::demangleSymbol(typeid(T).name());
        return name.substr(name.rfind(':') + 1);
    }
};

/// Gives a frame the identity of a message class.
template <typename T>
RawFrame& identifyAs(RawFrame& frame)
{
    const auto id = T::getMessageID();
    return frame.function(std::get<0>(id))
        .operation(std::get<1>(id))
        .flags(QelMessageClassification::toFlags(std::get<2>(id)));
}

/// A frame with a 32-byte header.
template <typename T>
RawFrame newFrame(const Payload& payload)
{
    RawFrame frame = RawFrame::newForm();
    return identifyAs<T>(frame).payload(payload.bytes());
}

/// A frame with a 24-byte header, padded up to 40 bytes.
template <typename T>
RawFrame oldFrame(const Payload& payload)
{
    RawFrame frame = RawFrame::oldForm();
    return identifyAs<T>(frame).payload(payload.bytes());
}

/// Bytes at an odd address at the end of a heap block, as in the middle of a receive buffer. The sanitizers report an
/// aligned read and a read past the end.
class OddBytes {
public:
    explicit OddBytes(const std::vector<char>& bytes) : mBlock(new char[bytes.size() + 1]), mLength(bytes.size())
    {
        std::memcpy(mBlock.get() + 1, bytes.data(), bytes.size());
    }
    const char* data() const { return mBlock.get() + 1; }
    unsigned int length() const { return static_cast<unsigned int>(mLength); }

private:
    std::unique_ptr<char[]> mBlock;
    std::size_t mLength;
};

/// The message that a class parses from a frame.
template <typename T>
T received(const RawFrame& frame)
{
    const OddBytes bytes(frame.bytes());
    return T(bytes.data(), bytes.length());
}

/// The same from a payload alone, in a frame with a 32-byte header.
template <typename T>
T received(const Payload& payload)
{
    return received<T>(newFrame<T>(payload));
}

/// @return the text with which a class refuses a frame, or "accepted"
template <typename T>
std::string verdict(const RawFrame& frame)
{
    const OddBytes bytes(frame.bytes());
    try {
        const T message(bytes.data(), bytes.length());
    } catch (const QelMessageValidationException& exception) {
        return exception.what();
    }
    return "accepted";
}

template <typename T>
std::string verdict(const Payload& payload)
{
    return verdict<T>(newFrame<T>(payload));
}

/// The payload of a message as hexadecimal digits.
inline std::string payloadOf(const QelMessage& message) { return hex(message.getData(), message.dataLength()); }

/// Everything that debug() prints.
inline std::string dumpOf(const QelMessage& message)
{
    std::ostringstream os;
    os << message.debug();
    return os.str();
}

/// What debug() prints about the payload: the part between its heading and the line end before the raw bytes.
inline std::string detailsOf(const QelMessage& message)
{
    static const std::string kBegin = "\nAdditional message details:\n";
    static const std::string kEnd = "\n\nCurrent raw message contents:\n";
    const std::string dump = dumpOf(message);
    const std::size_t begin = dump.find(kBegin) + kBegin.size();
    return dump.substr(begin, dump.find(kEnd, begin) - begin);
}

} // namespace qel::test
