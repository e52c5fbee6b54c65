#include "support/FileCalls.hpp"

#include "support/Allocations.hpp"

#include <algorithm>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <deque>
#include <dlfcn.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/types.h>
#include <sys/uio.h>
#include <unistd.h>
#include <utility>

namespace qel::test {

namespace {

struct Fault {
    unsigned after = 0; // calls that still succeed
    unsigned count = 0; // calls that fail then
    int error = 0;
};

bool sWatching = false;
Fault sFaults[FileCalls::kCallCount];
std::deque<std::size_t> sShortened; // what the next calls of writev may write
std::vector<std::string> sCalls;

/// @return the C library's function that one of ours replaces
template <typename Function>
Function* original(const char* name)
{
    return reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, name));
}

void record(const std::string& call)
{
    if (sWatching) sCalls.push_back(call);
}

/// @return true, with errno set, when this call is to fail
bool fails(FileCalls::Call call)
{
    if (!sWatching) return false;
    Fault& fault = sFaults[call];
    if (fault.count == 0) return false;
    if (fault.after != 0) {
        --fault.after;
        return false;
    }
    --fault.count;
    errno = fault.error;
    return true;
}

std::string fileName(const char* path)
{
    const std::string text(path);
    return text.substr(text.rfind('/') + 1);
}

std::string openCall(const char* path, int flags, mode_t mode)
{
    char numbers[32];
    std::snprintf(numbers, sizeof(numbers), " %x %o", static_cast<unsigned>(flags), static_cast<unsigned>(mode));
    return "open " + fileName(path) + numbers;
}

} // namespace

FileCalls::FileCalls()
{
    if (sWatching) ADD_FAILURE() << "the file calls are watched already";
    std::fill(std::begin(sFaults), std::end(sFaults), Fault());
    sShortened.clear();
    sCalls.clear();
    sWatching = true;
}

FileCalls::~FileCalls()
{
    sWatching = false;
    sCalls.clear();
}

void FileCalls::fail(Call call, int error, unsigned count, unsigned after) { sFaults[call] = {after, count, error}; }

void FileCalls::shortenNextWrite(std::size_t bytes) { sShortened.push_back(bytes); }

std::vector<std::string> FileCalls::take() { return std::exchange(sCalls, {}); }

} // namespace qel::test

// The C library's entry points.
extern "C" {

int open(const char* path, int flags, ...)
{
    using namespace qel::test;
    const Allocations::Exempt exempt;
    va_list arguments;
    va_start(arguments, flags);
    // Without O_CREAT or O_TMPFILE there is no third argument, and the system ignores the mode.
    const mode_t mode = (flags & (O_CREAT | O_TMPFILE)) != 0 ? va_arg(arguments, mode_t) : 0;
    va_end(arguments);
    record(openCall(path, flags, mode));
    if (fails(FileCalls::Open)) return -1;
    return original<int(const char*, int, ...)>("open")(path, flags, mode);
}

off_t lseek(int fd, off_t offset, int whence) noexcept
{
    using namespace qel::test;
    const Allocations::Exempt exempt;
    record("lseek");
    if (fails(FileCalls::Lseek)) return -1;
    return original<off_t(int, off_t, int)>("lseek")(fd, offset, whence);
}

ssize_t writev(int fd, const struct iovec* pieces, int count)
{
    using namespace qel::test;
    const Allocations::Exempt exempt;
    std::string sizes;
    for (int i = 0; i < count; ++i)
        sizes += (i == 0 ? " " : "+") + std::to_string(pieces[i].iov_len);
    record("writev" + sizes);
    if (fails(FileCalls::Writev)) return -1;
    if (sWatching && !sShortened.empty()) {
        const std::size_t bytes = std::min(sShortened.front(), pieces[0].iov_len);
        sShortened.pop_front();
        return ::write(fd, pieces[0].iov_base, bytes);
    }
    return original<ssize_t(int, const struct iovec*, int)>("writev")(fd, pieces, count);
}

ssize_t read(int fd, void* buffer, size_t length)
{
    using namespace qel::test;
    const Allocations::Exempt exempt;
    if (fails(FileCalls::Read)) return -1;
    return original<ssize_t(int, void*, size_t)>("read")(fd, buffer, length);
}

int ftruncate(int fd, off_t length) noexcept
{
    using namespace qel::test;
    const Allocations::Exempt exempt;
    record("ftruncate " + std::to_string(length));
    if (fails(FileCalls::Ftruncate)) return -1;
    return original<int(int, off_t)>("ftruncate")(fd, length);
}

int fsync(int fd)
{
    using namespace qel::test;
    const Allocations::Exempt exempt;
    record("fsync");
    if (fails(FileCalls::Fsync)) return -1;
    return original<int(int)>("fsync")(fd);
}

int close(int fd)
{
    using namespace qel::test;
    const Allocations::Exempt exempt;
    record("close");
    return original<int(int)>("close")(fd);
}

int rename(const char* from, const char* to) noexcept
{
    using namespace qel::test;
    const Allocations::Exempt exempt;
    record("rename " + fileName(from) + " " + fileName(to));
    if (fails(FileCalls::Rename)) return -1;
    return original<int(const char*, const char*)>("rename")(from, to);
}

int unlink(const char* path) noexcept
{
    using namespace qel::test;
    const Allocations::Exempt exempt;
    record("unlink " + fileName(path));
    if (fails(FileCalls::Unlink)) return -1;
    return original<int(const char*)>("unlink")(path);
}

} // extern "C"
