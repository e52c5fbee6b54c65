#include "base/ProgressBar.hpp"

#include <algorithm>
#include <cmath>
#include <sys/ioctl.h>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr std::size_t kDefaultColumns = 80;
constexpr std::size_t kMaxBar = 40;

} // namespace

ProgressBar::ProgressBar(int descriptor) noexcept : mDescriptor(descriptor), mShown(::isatty(descriptor) == 1) {}

ProgressBar::~ProgressBar() { clear(); }

void ProgressBar::update(double fraction, const std::string& remark)
{
    pWrite("\r\x1B[K" + line(fraction, remark, pColumns()));
}

std::string ProgressBar::line(double fraction, const std::string& remark, std::size_t columns)
{
    const double done = std::min(std::max(fraction, 0.0), 1.0);
    const std::string text = " " + std::to_string(std::lround(done * 100)) + "%  " + remark;
    const std::size_t taken = text.size() + 3; // the brackets, and one column for the cursor
    if (columns <= taken) return columns == 0 ? std::string() : text.substr(1, columns - 1);
    const std::size_t width = std::min(columns - taken, kMaxBar);
    const auto full = static_cast<std::size_t>(done * static_cast<double>(width));
    return "[" + std::string(full, '#') + std::string(width - full, '.') + "]" + text;
}

std::size_t ProgressBar::pColumns() const
{
    winsize size{};
    if (::ioctl(mDescriptor, TIOCGWINSZ, &size) != 0 || size.ws_col == 0) return kDefaultColumns;
    return size.ws_col;
}

void ProgressBar::pWrite(const std::string& text)
{
    if (!mShown) return;
    mShown = ::write(mDescriptor, text.data(), text.size()) >= 0;
}

} // namespace qel::tool
