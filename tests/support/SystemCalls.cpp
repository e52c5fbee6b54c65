#include "support/SystemCalls.hpp"

#include <cstdlib>
#include <dlfcn.h>
#include <sys/eventfd.h>
#include <unistd.h>

namespace qel::test {

namespace {

thread_local SystemCalls* tCurrent = nullptr;

/// @param interceptor  the version of a sanitizer, if the program has one: it checks the arguments and must be called
template <typename Function>
Function* realFunction(Function* interceptor, const char* name)
{
    if (interceptor != nullptr) return interceptor;
    void* const symbol = ::dlsym(RTLD_NEXT, name);
    if (symbol == nullptr) std::abort();
    return reinterpret_cast<Function*>(symbol);
}

/// Calls the replacement of the current thread, or else the real function.
template <typename Result, typename... Parameters>
Result dispatch(std::function<Result(Parameters...)> SystemCalls::*replacement, Result (*real)(Parameters...),
                Parameters... arguments)
{
    SystemCalls* const current = tCurrent;
    if (current == nullptr || !(current->*replacement)) return real(arguments...);
    tCurrent = nullptr;
    const Result result = (current->*replacement)(arguments...);
    tCurrent = current;
    return result;
}

} // namespace

SystemCalls::SystemCalls() : mOuter(tCurrent) { tCurrent = this; }

SystemCalls::~SystemCalls() { tCurrent = mOuter; }

} // namespace qel::test

// The functions of the C library that this program defines. The sanitizer runtimes call theirs `__interceptor_NAME`; a
// program without sanitizers has none.
#define QEL_TEST_CALL(result, name, exceptions, parameters, ...)                                                       \
    extern "C" __attribute__((weak)) result __interceptor_##name parameters;                                           \
    extern "C" __attribute__((visibility("default"))) result name parameters exceptions                                \
    {                                                                                                                  \
        static result(*const sReal) parameters = qel::test::realFunction(&__interceptor_##name, #name);                \
        return qel::test::dispatch(&qel::test::SystemCalls::name, sReal, __VA_ARGS__);                                 \
    }

QEL_TEST_CALL(ssize_t, read, , (int fd, void* buffer, std::size_t length), fd, buffer, length)
QEL_TEST_CALL(ssize_t, send, , (int fd, const void* buffer, std::size_t length, int flags), fd, buffer, length, flags)
QEL_TEST_CALL(int, poll, , (pollfd * fds, nfds_t count, int timeout), fds, count, timeout)
QEL_TEST_CALL(int, socket, noexcept, (int family, int type, int protocol), family, type, protocol)
QEL_TEST_CALL(int, connect, , (int fd, const sockaddr* address, socklen_t length), fd, address, length)
QEL_TEST_CALL(int, bind, noexcept, (int fd, const sockaddr* address, socklen_t length), fd, address, length)
QEL_TEST_CALL(int, accept4, , (int fd, sockaddr* address, socklen_t* length, int flags), fd, address, length, flags)
QEL_TEST_CALL(int, getsockname, noexcept, (int fd, sockaddr* address, socklen_t* length), fd, address, length)
QEL_TEST_CALL(int, getpeername, noexcept, (int fd, sockaddr* address, socklen_t* length), fd, address, length)
QEL_TEST_CALL(int, getsockopt, noexcept, (int fd, int level, int name, void* value, socklen_t* length), fd, level, name,
              value, length)
QEL_TEST_CALL(int, setsockopt, noexcept, (int fd, int level, int name, const void* value, socklen_t length), fd, level,
              name, value, length)
QEL_TEST_CALL(int, eventfd, noexcept, (unsigned int count, int flags), count, flags)
QEL_TEST_CALL(int, close, , (int fd), fd)
