#pragma once

#include <qel/common/io/Stream.hpp>

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <cstring>
#include <deque>
#include <string>
#include <vector>

namespace qel::test {

/// Delivers chunks, and records each read and each deadline that was in force then.
class RecordingStream : public Stream {
public:
    std::deque<std::string> chunks;
    std::vector<std::size_t> lengths;
    std::vector<long> deadlines; ///< -1: none
    std::vector<long> settings;  ///< of the deadline, in order
    std::string written;
    bool isClosed = false;

    void close() override { isClosed = true; }
    void setReadDeadline(std::chrono::milliseconds timeout) override
    {
        mDeadline = timeout.count();
        settings.push_back(mDeadline);
    }
    void setWriteDeadline(std::chrono::milliseconds timeout) override { mWriteDeadline = timeout.count(); }
    std::size_t read(char* buffer, std::size_t length) override
    {
        lengths.push_back(length);
        deadlines.push_back(mDeadline);
        if (chunks.empty()) return 0;
        std::string& chunk = chunks.front();
        const std::size_t count = std::min(length, chunk.size());
        std::memcpy(buffer, chunk.data(), count);
        chunk.erase(0, count);
        if (chunk.empty()) chunks.pop_front();
        return count;
    }
    void write(const char* buffer, std::size_t length) override { written.append(buffer, length); }

    long writeDeadline() const { return mWriteDeadline; }

private:
    long mDeadline = 10000; // of the handshake
    long mWriteDeadline = 0;
};

} // namespace qel::test
