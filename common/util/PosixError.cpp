#include <qel/common/StreamFormatters.hpp>
#include <qel/common/util/PosixError.hpp>

#include <cstring>
#include <limits>

namespace qel {

namespace {

std::int32_t absoluteValue(int code) noexcept
{
    // Negating the smallest integer is undefined.
    if (code == std::numeric_limits<int>::min()) return std::numeric_limits<int>::max();
    return code < 0 ? -code : code;
}

} // namespace

PosixErrorCode::PosixErrorCode(int code) noexcept : mCode(absoluteValue(code)) {}

std::string PosixErrorCode::message() const { return toString(*this); }

std::ostream& operator<<(std::ostream& os, const PosixErrorCode& code)
{
    char buffer[256] = {};
    const char* description = detail::errorDescription(::strerror_r(code.getCode(), buffer, sizeof(buffer)), buffer);
    os << decFormat(code.getCode());
    if (description != nullptr) os << " (" << description << ")";
    return os;
}

PosixError::PosixError(PosixErrorCode code) : std::runtime_error(code.message()), mErrorCode(code) {}

PosixError::PosixError(PosixErrorCode code, const std::string& context)
    : std::runtime_error(context + ": " + code.message()), mErrorCode(code)
{}

PosixError::~PosixError() = default;

FileIOError::~FileIOError() = default;

} // namespace qel
