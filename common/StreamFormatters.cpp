#include <qel/common/StreamFormatters.hpp>
#include <qel/common/TypeInfo.hpp>

#include <algorithm>
#include <csignal>
#include <cstring>
#include <iomanip>

namespace qel {

namespace {

constexpr std::uint64_t kDumpBytesPerLine = 16;

/// @return the C library's description of a signal, or null
const char* signalDescription(int number) noexcept
{
    constexpr int kSignals = 65; // the table covers the signals 0 to 64
    if (number < 0 || number >= kSignals) return nullptr;
// Two conditions, not one: without the macro __GLIBC_PREREQ, which other C libraries lack, its call does not parse.
#if defined(__GLIBC__)
#if __GLIBC_PREREQ(2, 32)
    return ::sigdescr_np(number); // reads the table that was sys_siglist
#else
    return ::sys_siglist[number];
#endif
#else
    // strsignal invents a text for numbers without a description; 1 to 31 have one everywhere.
    return number >= 1 && number <= 31 ? ::strsignal(number) : nullptr;
#endif
}

} // namespace

// The stream's own way to print a number goes through its locale and costs twice as much.
bool HexFormatterBase::pPrintPlainly(std::ostream& os, std::uint64_t value, std::size_t width) const
{
    constexpr std::size_t kMostDigits = 2 * sizeof(value);
    constexpr std::size_t kMostPrefix = 2;
    if ((os.flags() & (std::ios_base::showbase | std::ios_base::left)) != 0 || os.width() != 0 || !os.good())
        return false;
    if (width > kMostDigits || os.getloc() != std::locale::classic()) return false;

    char text[kMostPrefix + kMostDigits];
    char* const end = text + sizeof(text);
    char* first = end;
    for (; value != 0; value >>= 4)
        *--first = "0123456789ABCDEF"[value & 0xF];
    while (end - first < static_cast<std::ptrdiff_t>(std::max<std::size_t>(width, 1)))
        *--first = '0';
    // By its first character: each program and library has a literal of its own, at another address.
    if (*mPrefix != '\0') {
        *--first = PREFIX[1];
        *--first = PREFIX[0];
    }
    os.setf(std::ios_base::hex, std::ios_base::basefield);
    os.setf(std::ios_base::uppercase);
    os.fill('0');
    os.write(first, end - first);
    return true;
}

std::ostream& operator<<(std::ostream& os, const HexStringFormatter& formatter)
{
    formatter.pSetupStream(os, 2);
    const auto* bytes = static_cast<const unsigned char*>(formatter.mPtr);
    for (std::uint64_t i = 0; i < formatter.mLength; ++i) {
        os << std::setw(2) << static_cast<unsigned int>(bytes[i]);
    }
    os.width(0); // without a byte, the width would pad the next output
    return os;
}

std::ostream& operator<<(std::ostream& os, const HexDumpFormatter& formatter)
{
    const auto* bytes = static_cast<const unsigned char*>(formatter.mPtr);
    const std::uint64_t address = reinterpret_cast<std::uintptr_t>(formatter.mPtr);

    os << std::hex << std::setfill('0');
    for (std::uint64_t i = 0; i < formatter.mLength; ++i) {
        if (i % kDumpBytesPerLine == 0) {
            if (i != 0) os << std::endl;
            if (formatter.mPrintAddr) (os << std::setw(16) << address + i).put(':');
        }
        if (i % 2 == 0) os.put(' ');
        os << std::setw(2) << static_cast<unsigned int>(bytes[i]);
    }
    return os << std::endl << std::endl;
}

std::ostream& operator<<(std::ostream& os, const CharArrayFormatter& formatter)
{
    return os.write(formatter.mBuffer, static_cast<std::streamsize>(formatter.mLength));
}

std::ostream& operator<<(std::ostream& os, const SignalFormatter& formatter)
{
    os << decFormat(formatter.mCode);
    if (const char* description = signalDescription(formatter.mCode)) os << " (" << description << ")";
    return os;
}

std::ostream& operator<<(std::ostream& os, const ExceptionInfo& info)
{
    return os << TypeInfo::getTypeName(info.mExc) << ": " << info.mExc.what();
}

std::ostream& operator<<(std::ostream& os, const Indent& indent)
{
    for (std::uint64_t i = 0; i < indent.mCount; ++i) {
        os.put(indent.mValue);
    }
    return os;
}

std::ostream& operator<<(std::ostream& os, const DHMSDurationFormatter& formatter)
{
    using Days = std::chrono::duration<std::int32_t, std::ratio<86400>>;

    // Remainders, not differences: a difference would overflow if the days do not fit their count.
    const std::chrono::milliseconds total = formatter.mDuration;
    const auto days = std::chrono::duration_cast<Days>(total).count();
    const auto hours = std::chrono::duration_cast<std::chrono::hours>(total % Days(1)).count();
    const auto minutes = std::chrono::duration_cast<std::chrono::minutes>(total % std::chrono::hours(1)).count();
    const auto seconds = std::chrono::duration_cast<std::chrono::seconds>(total % std::chrono::minutes(1)).count();
    const auto milliseconds = (total % std::chrono::seconds(1)).count();

    const std::ios_base::fmtflags flags = os.flags();
    os << std::dec << std::right << std::setfill('0');
    os << std::setw(3) << days << "d:";
    os << std::setw(2) << hours << "h:";
    os << std::setw(2) << minutes << "m:";
    os << std::setw(2) << seconds << '.';
    os << std::setw(3) << milliseconds << 's';
    os.flags(flags);
    return os;
}

} // namespace qel
