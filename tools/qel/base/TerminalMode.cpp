#include "base/TerminalMode.hpp"

#include <qel/common/util/PosixError.hpp>

#include <cerrno>
#include <unistd.h>

namespace qel::tool {

namespace {

termios rawFrom(const termios& original)
{
    termios raw = original;
    ::cfmakeraw(&raw);
    return raw;
}

/// TCSANOW: waiting for pending output (TCSADRAIN) may take forever on a halted terminal.
bool setAttributes(int descriptor, const termios& attributes)
{
    int result = 0;
    do {
        result = ::tcsetattr(descriptor, TCSANOW, &attributes);
    } while (result != 0 && errno == EINTR);
    return result == 0;
}

/// True when another process group is in the foreground. Changing the mode from the background stops this process.
bool servesAnotherJob(int descriptor)
{
    const pid_t foreground = ::tcgetpgrp(descriptor);
    return foreground > 0 && foreground != ::getpgrp();
}

} // namespace

TerminalMode::TerminalMode(int descriptor) noexcept : mDescriptor(descriptor), mIsTerminal(::isatty(descriptor) == 1) {}

TerminalMode::~TerminalMode() { restore(); }

void TerminalMode::enterRaw()
{
    if (!mIsTerminal) return;
    if (!mIsKnown && ::tcgetattr(mDescriptor, &mOriginal) != 0) {
        throw PosixError(errno, "cannot read the mode of the terminal");
    }
    mIsKnown = true;
    if (!setAttributes(mDescriptor, rawFrom(mOriginal))) {
        throw PosixError(errno, "cannot change the mode of the terminal");
    }
    mIsRaw = true;
}

void TerminalMode::restore() noexcept
{
    if (!mIsRaw) return;
    mIsRaw = false;
    if (!servesAnotherJob(mDescriptor)) static_cast<void>(setAttributes(mDescriptor, mOriginal));
}

const char* lineEndOf(int descriptor) noexcept
{
    termios attributes{};
    const bool isTerminal = ::tcgetattr(descriptor, &attributes) == 0;
    return isTerminal && (attributes.c_oflag & OPOST) == 0 ? "\r\n" : "\n";
}

} // namespace qel::tool
