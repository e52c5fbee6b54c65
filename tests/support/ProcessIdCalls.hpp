#pragma once

/// @file
/// Whether code asks the system for the id of the process, or shows one that it has kept. A program that links
/// ProcessIdCalls.cpp replaces the C library's getpid by one that counts, for the calls of shared libraries too.

namespace qel::test {

/// @return how often anybody in this process has called getpid(2)
/// Thread safety: any thread.
unsigned processIdCalls();

} // namespace qel::test
