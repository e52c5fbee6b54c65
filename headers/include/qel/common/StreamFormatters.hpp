#pragma once

#include <qel/common/BCDExtensions.hpp>
#include <qel/common/EndianExtensions.hpp>
#include <qel/common/HexWidth.hpp>
#include <qel/common/QelExport.hpp>

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <exception>
#include <ios>
#include <iterator>
#include <locale>
#include <ostream>
#include <sstream>
#include <string>
#include <type_traits>
#include <utility>

/// @file
/// Small wrapper objects that print a value in the library's one style: `os << hexFormat(length)`. Every diagnostic
/// text of the library goes through them.
///
/// Lifetime: a formatter holds pointers or copies and owns no buffer. Print it in the statement that makes it; one that
/// points into a buffer, a container or an exception must not outlive that.
///
/// State of the stream: the hexadecimal and decimal formatters do not restore base, case and fill. A plain integer
/// printed after hexFormat() appears in upper-case hexadecimal; decFormat() prints it in decimal. Each formatter that
/// prints numbers sets the base that it needs. Alignment and locale are those of the stream: on a stream set to
/// std::left the fill zeros of a hexadecimal number follow its digits, and a locale that groups digits groups
/// hexadecimal ones, too ("0x6.003"). toString() and log lines use the classic locale.
///
/// Thread safety: formatters are values; one thread at a time uses a stream.
/// A stream operator throws what the stream throws (nothing, unless its exceptions are enabled); ExceptionInfo and
/// toString() may also throw std::bad_alloc, and StringJoiner what the operators of its elements throw.

namespace qel {

/// Converts a value to the integer that is printed for it: `Type` is the type of the integer, `convert` computes it.
///
/// Types of one byte become unsigned 16-bit numbers, so that they print as numbers and not as characters; the signed
/// ones among them are sign-extended. Plain `char` counts as signed on every platform, so the character with code 0x80
/// prints as 0xFF80. Enumerations become their underlying number, wire integers their host value and binary-coded
/// decimals their decoded value, and then follow the same rule. Every other integer stays as it is.
template <typename T, typename Enable = void>
struct PrintableInteger {
    static_assert(std::is_integral<T>::value, "only integers, enumerations and wire integers have a printable number");
    using Type = T;
    static constexpr Type convert(T value) noexcept { return value; }
};

template <typename T>
struct PrintableInteger<T, std::enable_if_t<std::is_integral<T>::value && sizeof(T) == 1>> {
    using Type = std::uint16_t;
    static constexpr Type convert(T value) noexcept
    {
        if constexpr (std::is_same<T, char>::value || std::is_signed<T>::value) {
            return static_cast<Type>(static_cast<signed char>(value));
        } else {
            return static_cast<Type>(value);
        }
    }
};

template <typename T>
struct PrintableInteger<T, std::enable_if_t<std::is_enum<T>::value>> {
    using Number = PrintableInteger<std::underlying_type_t<T>>;
    using Type = typename Number::Type;
    static constexpr Type convert(T value) noexcept
    {
        return Number::convert(static_cast<std::underlying_type_t<T>>(value));
    }
};

template <typename T, unsigned int Order>
struct PrintableInteger<endian_uint<T, Order>> {
    using Type = typename PrintableInteger<T>::Type;
    static Type convert(const endian_uint<T, Order>& value) noexcept
    {
        return PrintableInteger<T>::convert(value.value());
    }
};

template <typename T>
struct PrintableInteger<bcd_uint<T>> {
    using Type = typename PrintableInteger<T>::Type;
    static Type convert(const bcd_uint<T>& value) noexcept { return PrintableInteger<T>::convert(value.value()); }
};

/// The base of the formatters that print a prefix and hexadecimal digits.
/// They leave the stream in upper-case hexadecimal with fill character '0', and a locale of the stream that groups
/// digits groups theirs; see the top of this file.
class HexFormatterBase {
public:
    static constexpr const char* PREFIX = "0x";
    static constexpr const char* NO_PREFIX = "";

protected:
    HexFormatterBase() noexcept : mPrefix(PREFIX) {}

    /// Writes the prefix, then sets the stream to hexadecimal, upper-case digits, fill character '0' and the given
    /// field width. The prefix comes first because it would use up the field width.
    /// @param width the number of digits of the next number
    void pSetupStream(std::ostream& os, std::size_t width) const
    {
        os << mPrefix;
        os.setf(std::ios_base::hex, std::ios_base::basefield);
        os.setf(std::ios_base::uppercase);
        os.fill('0');
        os.width(static_cast<std::streamsize>(width));
    }

    /// Writes the prefix and the digits at once and leaves the stream as pSetupStream() and an inserted number do. Only
    /// for a stream whose settings change nothing else about a number: no field width, the classic locale.
    /// @param value the number, with as many bits as its type
    /// @param width the least number of digits
    /// @return false: the stream is another; nothing was written
    QEL_EXPORT bool pPrintPlainly(std::ostream& os, std::uint64_t value, std::size_t width) const;

    const char* mPrefix; // PREFIX or NO_PREFIX
};

/// Prints "0x" and one integer in hexadecimal with at least HexWidth<T> digits: 0x001F for a 16-bit 0x1F.
/// Leaves the stream in upper-case hexadecimal; on a stream whose locale groups digits, 0x6003 prints as "0x6.003".
/// Made by hexFormat(). Holds a copy of the value.
template <typename T>
class HexFormatter : public HexFormatterBase {
public:
    using ConvertedType = typename PrintableInteger<T>::Type;

    explicit HexFormatter(const T& value) noexcept : mValue(PrintableInteger<T>::convert(value)) {}

    /// Omits the prefix.
    /// @return this formatter, so that it chains: `os << hexFormat(x).noPrefix()`
    HexFormatter& noPrefix() noexcept
    {
        mPrefix = NO_PREFIX;
        return *this;
    }

    friend std::ostream& operator<<(std::ostream& os, const HexFormatter& formatter)
    {
        const auto number = static_cast<std::make_unsigned_t<ConvertedType>>(formatter.mValue);
        if (formatter.pPrintPlainly(os, number, HexWidth<T>::value)) return os;
        formatter.pSetupStream(os, HexWidth<T>::value);
        return os << formatter.mValue;
    }

private:
    ConvertedType mValue;
};

/// Prints one integer in decimal and leaves the stream in decimal. On a stream whose locale groups digits, 4711 prints
/// as "4.711". Made by decFormat(). Holds a copy of the value.
template <typename T>
class DecFormatter {
public:
    using ConvertedType = typename PrintableInteger<T>::Type;

    explicit DecFormatter(const T& value) noexcept : mValue(PrintableInteger<T>::convert(value)) {}

    friend std::ostream& operator<<(std::ostream& os, const DecFormatter& formatter)
    {
        os.setf(std::ios_base::dec, std::ios_base::basefield);
        return os << formatter.mValue;
    }

private:
    ConvertedType mValue;
};

/// @param value an integer, an enumeration, a wire integer or a binary-coded decimal
template <typename T>
HexFormatter<T> hexFormat(const T& value) noexcept
{
    return HexFormatter<T>(value);
}

/// @param value an integer, an enumeration, a wire integer or a binary-coded decimal
template <typename T>
DecFormatter<T> decFormat(const T& value) noexcept
{
    return DecFormatter<T>(value);
}

/// Prints a byte string as "0x" and two hexadecimal digits for each byte: the bytes 01 AB 00 print as 0x01AB00. Leaves
/// the stream in upper-case hexadecimal.
class HexStringFormatter : public HexFormatterBase {
public:
    /// @param ptr    the first of `length` bytes, borrowed until the formatter is printed; may be null if `length` is 0
    /// @param length number of bytes
    HexStringFormatter(const void* ptr, std::size_t length) noexcept : mPtr(ptr), mLength(length) {}

    /// Omits the prefix.
    /// @return this formatter, so that it chains
    HexStringFormatter& noPrefix() noexcept
    {
        mPrefix = NO_PREFIX;
        return *this;
    }

    friend std::ostream& operator<<(std::ostream& os, const HexStringFormatter& formatter);

private:
    const void* mPtr;
    std::uint64_t mLength; // bytes
};
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const HexStringFormatter& formatter);

/// Prints a hex dump: lines of 16 bytes in eight groups of two, a blank before each group, and an empty line at the
/// end: " 0001 0203 0405 0607 0809 0a0b 0c0d 0e0f". The digits are lower case unless an earlier hexadecimal formatter
/// left the stream in upper case. Flushes the stream at each line end and leaves it in hexadecimal with fill character
/// '0'.
class HexDumpFormatter {
public:
    /// @param ptr       the first of `length` bytes, borrowed until the formatter is printed; may be null when `length`
    ///                  is 0
    /// @param length    number of bytes
    /// @param printAddr whether each line begins with the address of its first byte, 16 digits and a colon:
    ///                  "00007f3a5c001000: 0001 0203"
    HexDumpFormatter(const void* ptr, std::size_t length, bool printAddr) noexcept
        : mPtr(ptr), mLength(length), mPrintAddr(printAddr)
    {}

    friend std::ostream& operator<<(std::ostream& os, const HexDumpFormatter& formatter);

private:
    const void* mPtr;
    std::uint64_t mLength; // bytes
    bool mPrintAddr;
};
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const HexDumpFormatter& formatter);

/// Prints exactly the given number of characters, null bytes included, without padding.
class CharArrayFormatter {
public:
    /// @param buffer the first of `length` characters, borrowed until the formatter is printed; may be null when
    ///               `length` is 0
    /// @param length number of characters
    CharArrayFormatter(const char* buffer, std::size_t length) noexcept : mBuffer(buffer), mLength(length) {}

    friend std::ostream& operator<<(std::ostream& os, const CharArrayFormatter& formatter);

private:
    const char* mBuffer;
    std::size_t mLength; // characters
};
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const CharArrayFormatter& formatter);

/// Prints a signal number in decimal and, if the C library has one, its description in parentheses: "15 (Terminated)".
/// 0, the real-time signals and numbers outside [0, 64] have none. See sigdescr_np(3).
class SignalFormatter {
public:
    explicit SignalFormatter(int code) noexcept : mCode(code) {}

    friend std::ostream& operator<<(std::ostream& os, const SignalFormatter& formatter);

private:
    std::int32_t mCode;
};
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const SignalFormatter& formatter);

/// Prints the dynamic type and the text of an exception: "qel::PosixError: 5 (Input/output error)". Printing throws
/// std::bad_alloc if there is no memory for the name of the type.
class ExceptionInfo {
public:
    /// @param exception borrowed until the formatter is printed
    explicit ExceptionInfo(const std::exception& exception) noexcept : mExc(exception) {}

    friend std::ostream& operator<<(std::ostream& os, const ExceptionInfo& info);

private:
    const std::exception& mExc;
};
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const ExceptionInfo& info);

/// Prints a number of copies of one character, to indent the lines of a dump. Neither applies nor resets the field
/// width of the stream.
class Indent {
public:
    /// @param count the number of copies
    /// @param value the character
    Indent(std::size_t count, char value) noexcept : mCount(count), mValue(value) {}

    /// @return an Indent with `count` more copies of the same character, for a nested part
    Indent operator+(std::size_t count) const noexcept
    {
        Indent deeper(*this);
        deeper += count;
        return deeper;
    }

    Indent& operator+=(std::size_t count) noexcept
    {
        mCount += count;
        return *this;
    }

    friend std::ostream& operator<<(std::ostream& os, const Indent& indent);

private:
    std::uint64_t mCount;
    char mValue;
};
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const Indent& indent);

/// Prints a duration as days, hours, minutes, seconds and milliseconds: 001d:02h:03m:04.005s. More than 999 days take
/// as many digits as they need, up to 2147483647 days: the count has 32 bits and wraps around. Each part of a negative
/// duration keeps its sign. Restores the flags of the stream; its fill character stays '0'.
class DHMSDurationFormatter {
public:
    explicit DHMSDurationFormatter(const std::chrono::milliseconds& duration) noexcept : mDuration(duration) {}

    friend std::ostream& operator<<(std::ostream& os, const DHMSDurationFormatter& formatter);

private:
    std::chrono::milliseconds mDuration;
};
QEL_EXPORT std::ostream& operator<<(std::ostream& os, const DHMSDurationFormatter& formatter);

/// Prints the elements of a range, each with its own stream operator, with a separator between them. An empty range
/// prints nothing. Made by join(). Holds iterators: the range must not change before the joiner is printed.
template <typename Iterator>
class StringJoiner {
public:
    StringJoiner(Iterator begin, Iterator end, std::string separator)
        : mBegin(std::move(begin)), mEnd(std::move(end)), mSeparator(std::move(separator))
    {}

    friend std::ostream& operator<<(std::ostream& os, const StringJoiner& joiner)
    {
        Iterator element = joiner.mBegin;
        if (element == joiner.mEnd) return os;
        os << *element;
        for (++element; element != joiner.mEnd; ++element) {
            os << joiner.mSeparator << *element;
        }
        return os;
    }

private:
    Iterator mBegin;
    Iterator mEnd;
    std::string mSeparator;
};

/// @param begin      the beginning of the range, which is borrowed until the result is printed
/// @param end        the end of the range
/// @param separator  copied
template <typename Iterator>
StringJoiner<Iterator> join(Iterator begin, Iterator end, const std::string& separator)
{
    return StringJoiner<Iterator>(std::move(begin), std::move(end), separator);
}

/// @param container any type with begin and end, borrowed until the result is printed: the result holds its iterators
/// @param separator copied
template <typename Container>
auto join(const Container& container, const std::string& separator)
{
    using std::begin;
    using std::end;
    return join(begin(container), end(container), separator);
}

/// @return what a value prints onto a fresh stream in the classic locale, so that the global locale of the program does
/// not change the library's texts
/// @throws std::bad_alloc  no memory
template <typename T>
std::string toString(const T& value)
{
    std::ostringstream os;
    os.imbue(std::locale::classic());
    os << value;
    return os.str();
}

} // namespace qel
