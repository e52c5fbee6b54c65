#pragma once

#include "base/DescriptorOutput.hpp"

#include <ostream>
#include <streambuf>

namespace qel::tool {

/// A buffer for messages to a person that never waits for the descriptor: what it does not take yet is kept and follows
/// with the next message, and beyond DescriptorOutput::kRoom messages are dropped. Failures are ignored, since there is
/// no place to report them.
/// Ownership: borrows the descriptor. Thread safety: one thread.
class MessageBuffer : public std::streambuf {
public:
    explicit MessageBuffer(int descriptor) : mOutput(descriptor) {}

private:
    int_type overflow(int_type character) override;
    std::streamsize xsputn(const char* text, std::streamsize length) override;
    int sync() override;

    DescriptorOutput mOutput;
};

/// A stream over it.
class MessageStream : public std::ostream {
public:
    explicit MessageStream(int descriptor) : std::ostream(nullptr), mBuffer(descriptor) { rdbuf(&mBuffer); }

private:
    MessageBuffer mBuffer;
};

} // namespace qel::tool
