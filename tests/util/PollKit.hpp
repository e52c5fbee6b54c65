#pragma once

#include <qel/common/util/Poll.hpp>

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sstream>
#include <string>
#include <unistd.h>

/// @file
/// What the tests of the poll set share.

namespace qel::test {

template <typename Value>
std::string print(const Value& value)
{
    std::ostringstream os;
    os << value;
    return os.str();
}

/// Both ends of a pipe, closed by the destructor.
class Pipe {
public:
    Pipe() { EXPECT_EQ(::pipe2(mFds, O_CLOEXEC), 0); }
    ~Pipe()
    {
        closeReader();
        closeWriter();
    }
    Pipe(const Pipe&) = delete;
    Pipe& operator=(const Pipe&) = delete;

    int reader() const { return mFds[0]; }
    int writer() const { return mFds[1]; }
    void fill() const { EXPECT_EQ(::write(mFds[1], "x", 1), 1); }
    void closeReader() { pClose(mFds[0]); }
    void closeWriter() { pClose(mFds[1]); }

private:
    static void pClose(int& fd)
    {
        if (fd >= 0) ::close(fd);
        fd = -1;
    }

    int mFds[2] = {-1, -1};
};

/// An entry with the given events seen.
inline PollFd seen(int fd, PollEvents events, int revents)
{
    PollFd entry(fd, events);
    entry.mFd.revents = static_cast<short>(revents);
    return entry;
}

inline const PollFd kThree(3, PollEvents::Read);
inline const PollFd kFour(4, PollEvents::Write);
inline const PollFd kFive(5, PollEvents::Error);
inline const char* const kThreeText = "(fd=3, mask=0x0039, results=0x0000)";
inline const char* const kFourText = "(fd=4, mask=0x003C, results=0x0000)";
inline const char* const kFiveText = "(fd=5, mask=0x0038, results=0x0000)";

} // namespace qel::test
