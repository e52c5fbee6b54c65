#include <qel/common/QelCapabilities.hpp>

#include <algorithm>
#include <ostream>
#include <stdexcept>

namespace qel {

QelCapabilities::QelCapabilities(const std::string& text)
{
    const std::size_t count = std::min(text.size(), size());
    for (std::size_t index = 0; index < count; ++index) {
        if (text[index] == '1') {
            mCapabilities.set(index);
        } else if (text[index] != '0') {
            throw std::invalid_argument("invalid string given to capability set");
        }
    }
}

QelCapabilities& QelCapabilities::set(std::size_t index)
{
    mCapabilities.set(index);
    return *this;
}

QelCapabilities& QelCapabilities::reset(std::size_t index)
{
    mCapabilities.reset(index);
    return *this;
}

std::string QelCapabilities::to_string() const
{
    std::string text(size(), '0');
    for (std::size_t index = 0; index < size(); ++index) {
        if (mCapabilities.test(index)) text[index] = '1';
    }
    return text;
}

std::ostream& operator<<(std::ostream& os, const QelCapabilities& capabilities)
{
    return os << capabilities.to_string();
}

} // namespace qel
