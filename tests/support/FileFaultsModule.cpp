// A module to preload into a program (LD_PRELOAD, see ld.so(8)). It makes file calls of the program fail, or ends the
// program during one. Environment variables say how:
//
//   QEL_FAULT_CALL    write, fsync, openat, renameat, renameat2 or linkat
//   QEL_FAULT_AFTER   the number of calls of that function that succeed first; default 0
//   QEL_FAULT_COUNT   the number of calls that fail then; default all
//   QEL_FAULT_ERROR   the error number with which they fail
//   QEL_FAULT_SIGNAL  instead: the signal that the process gets; the call is then carried out
//   QEL_FAULT_MAKE    a file to create before such a call, as if by another program
//   QEL_FAULT_BYTES   instead, for write: the maximum number of bytes written
//
// Calls within the C library, such as those of its streams, are not intercepted.

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <dlfcn.h>
#include <fcntl.h>
#include <sys/types.h>
#include <unistd.h>

namespace {

int setting(const char* name, int otherwise)
{
    const char* const text = std::getenv(name);
    return text != nullptr ? std::atoi(text) : otherwise;
}

/// Counts the call.
/// @return whether the fault applies to it
bool faultApplies(const char* call)
{
    static int sCalls = 0;
    const char* const faulty = std::getenv("QEL_FAULT_CALL");
    if (faulty == nullptr || std::strcmp(faulty, call) != 0) return false;
    const int number = sCalls++ - setting("QEL_FAULT_AFTER", 0);
    return number >= 0 && number < setting("QEL_FAULT_COUNT", INT_MAX);
}

/// @return true, with errno set, when the call is to fail
bool fails(const char* call)
{
    if (!faultApplies(call)) return false;
    const char* const made = std::getenv("QEL_FAULT_MAKE");
    if (made != nullptr) ::close(::open(made, O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
    const int number = setting("QEL_FAULT_SIGNAL", 0);
    if (number != 0) ::kill(::getpid(), number); // delivered when this returns, unless it is blocked
    errno = setting("QEL_FAULT_ERROR", 0);
    return errno != 0;
}

template <typename Function>
Function* original(const char* name)
{
    return reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, name));
}

} // namespace

extern "C" {

ssize_t write(int fd, const void* data, size_t length)
{
    const int bytes = setting("QEL_FAULT_BYTES", 0);
    if (bytes != 0) length = std::min(length, static_cast<size_t>(bytes));
    if (bytes == 0 && fails("write")) return -1;
    return original<ssize_t(int, const void*, size_t)>("write")(fd, data, length);
}

int fsync(int fd)
{
    if (fails("fsync")) return -1;
    return original<int(int)>("fsync")(fd);
}

int openat(int directory, const char* path, int flags, ...)
{
    va_list arguments;
    va_start(arguments, flags);
    const mode_t mode = (flags & (O_CREAT | O_TMPFILE)) != 0 ? va_arg(arguments, mode_t) : 0;
    va_end(arguments);
    if (fails("openat")) return -1;
    return original<int(int, const char*, int, ...)>("openat")(directory, path, flags, mode);
}

int renameat(int fromDirectory, const char* from, int toDirectory, const char* to) noexcept
{
    if (fails("renameat")) return -1;
    return original<int(int, const char*, int, const char*)>("renameat")(fromDirectory, from, toDirectory, to);
}

int renameat2(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned int flags) noexcept
{
    if (fails("renameat2")) return -1;
    return original<int(int, const char*, int, const char*, unsigned int)>("renameat2")(fromDirectory, from,
                                                                                        toDirectory, to, flags);
}

int linkat(int fromDirectory, const char* from, int toDirectory, const char* to, int flags) noexcept
{
    if (fails("linkat")) return -1;
    return original<int(int, const char*, int, const char*, int)>("linkat")(fromDirectory, from, toDirectory, to,
                                                                            flags);
}

} // extern "C"
