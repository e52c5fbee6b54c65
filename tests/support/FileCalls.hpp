#pragma once

#include <cstddef>
#include <string>
#include <vector>

/// @file
/// Observes the file calls of the code under test and makes them fail. A program that links FileCalls.cpp replaces the
/// C library's functions by ones that call them, for the calls of shared libraries too.

namespace qel::test {

/// Records file calls, and makes some fail, from construction to destruction. One at a time; without one the calls are
/// not changed.
/// Thread safety: one thread.
class FileCalls {
public:
    enum Call { Open, Lseek, Read, Writev, Ftruncate, Fsync, Close, Rename, Unlink, kCallCount };

    FileCalls();
    ~FileCalls();
    FileCalls(const FileCalls&) = delete;
    FileCalls& operator=(const FileCalls&) = delete;

    /// Makes calls fail with an error number: the next `after` calls of that kind are carried out, then `count` calls
    /// fail and do nothing.
    void fail(Call call, int error, unsigned count = 1, unsigned after = 0);

    /// Makes the next writev write that many bytes at most and return how many. Called twice, it shortens the next two.
    void shortenNextWrite(std::size_t bytes);

    /// Forgets the calls so far.
    /// @return those calls: the name of the function, the file names without their
    /// directories, and what else matters: "rename log.3 log.4", "open log 2102 644" (flags in hexadecimal, mode in
    /// octal), "writev 6+1" (bytes of each piece), "ftruncate 7" (the new size). Failed ones are among them; reads are
    /// not.
    std::vector<std::string> take();
};

} // namespace qel::test
