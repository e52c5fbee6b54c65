#include "support/Pty.hpp"

#include <algorithm>
#include <array>
#include <cstdlib>
#include <fcntl.h>
#include <iterator>
#include <poll.h>
#include <stdexcept>
#include <unistd.h>

namespace qel::test {

namespace {

void require(bool condition, const char* what)
{
    if (!condition) throw std::runtime_error(what);
}

} // namespace

Pty::Pty()
{
    std::array<char, 128> name{};
    mMaster = ::posix_openpt(O_RDWR | O_NOCTTY | O_CLOEXEC);
    require(mMaster >= 0, "posix_openpt");
    require(::grantpt(mMaster) == 0 && ::unlockpt(mMaster) == 0, "unlockpt");
    require(::ptsname_r(mMaster, name.data(), name.size()) == 0, "ptsname_r");
    mName = name.data();
    mSlave = ::open(mName.c_str(), O_RDWR | O_NOCTTY | O_CLOEXEC);
    require(mSlave >= 0, "open the terminal");
}

Pty::~Pty()
{
    closeSlave();
    hangUp();
}

termios Pty::attributes() const
{
    termios attributes{};
    require(::tcgetattr(mMaster >= 0 ? mMaster : mSlave, &attributes) == 0, "tcgetattr"); // either tells
    return attributes;
}

void Pty::setAttributes(const termios& attributes) const
{
    require(::tcsetattr(mSlave, TCSANOW, &attributes) == 0, "tcsetattr");
}

void Pty::type(const std::string& text) const
{
    std::size_t typed = 0;
    while (typed < text.size()) {
        const ssize_t count = ::write(mMaster, text.data() + typed, text.size() - typed);
        require(count > 0, "type");
        typed += static_cast<std::size_t>(count);
    }
}

std::string Pty::read(std::size_t length) const
{
    constexpr int kDeadline = 20000;
    std::string text;
    while (text.size() < length) {
        pollfd fd{mMaster, POLLIN, 0};
        require(::poll(&fd, 1, kDeadline) == 1, "nothing on the screen");
        std::array<char, 4096> buffer;
        const ssize_t count = ::read(mMaster, buffer.data(), std::min(buffer.size(), length - text.size()));
        require(count > 0, "read the screen");
        text.append(buffer.data(), static_cast<std::size_t>(count));
    }
    return text;
}

void Pty::hangUp()
{
    if (mMaster >= 0) ::close(mMaster);
    mMaster = -1;
}

void Pty::closeSlave()
{
    if (mSlave >= 0) ::close(mSlave);
    mSlave = -1;
}

bool isRaw(const termios& attributes)
{
    return (attributes.c_lflag & (ICANON | ECHO | ISIG | IEXTEN)) == 0 && (attributes.c_oflag & OPOST) == 0 &&
           (attributes.c_iflag & (ICRNL | IXON | ISTRIP)) == 0;
}

bool operator==(const termios& left, const termios& right)
{
    return left.c_iflag == right.c_iflag && left.c_oflag == right.c_oflag && left.c_cflag == right.c_cflag &&
           left.c_lflag == right.c_lflag && std::equal(std::begin(left.c_cc), std::end(left.c_cc), right.c_cc);
}

} // namespace qel::test
