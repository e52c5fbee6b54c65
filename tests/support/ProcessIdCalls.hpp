#pragma once

/// @file
/// Counts the calls of getpid, to tell whether code asks for the process id or reuses one. A program that links
/// ProcessIdCalls.cpp replaces the C library's getpid, for the calls of shared libraries too.

namespace qel::test {

/// @return the number of calls of getpid(2) in this process
/// Thread safety: any thread.
unsigned processIdCalls();

} // namespace qel::test
