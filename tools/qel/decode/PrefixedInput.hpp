#pragma once

#include <array>
#include <istream>
#include <streambuf>
#include <string>

namespace qel::tool {

/// Reads the first bytes of an input ahead, so that they can be looked at, and then all of it. The input need not be
/// able to seek. When reading it fails, its badbit is set.
///
/// Lifetime: borrows the input. Thread safety: one thread.
class PrefixedInput : public std::streambuf {
public:
    /// @param bytes  how many to read ahead
    PrefixedInput(std::istream& input, std::size_t bytes) : mInput(input), mPrefix(bytes, '\0')
    {
        input.read(mPrefix.data(), static_cast<std::streamsize>(bytes));
        mPrefix.resize(static_cast<std::size_t>(input.gcount()));
        mBuffered = mPrefix;
        setg(mBuffered.data(), mBuffered.data(), mBuffered.data() + mBuffered.size());
    }

    /// Fewer bytes than asked for when the input is shorter.
    const std::string& prefix() const noexcept { return mPrefix; }

protected:
    int_type underflow() override
    {
        const int_type first = mInput.get();
        if (traits_type::eq_int_type(first, traits_type::eof())) return first;
        mBuffer[0] = traits_type::to_char_type(first);
        // What is there already, without waiting for more: the input may be a pipe.
        const auto room = static_cast<std::streamsize>(mBuffer.size() - 1);
        const std::streamsize more = mInput.readsome(mBuffer.data() + 1, room);
        setg(mBuffer.data(), mBuffer.data(), mBuffer.data() + 1 + more);
        return first;
    }

private:
    std::istream& mInput;
    std::string mPrefix;
    std::string mBuffered; // the prefix as it is read
    std::array<char, 16384> mBuffer{};
};

} // namespace qel::tool
