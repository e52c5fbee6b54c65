#include "support/ScriptedStream.hpp"

#include <qel/common/io/StreamIOException.hpp>

#include <algorithm>
#include <stdexcept>
#include <utility>

namespace qel::test {

ScriptedStream::ScriptedStream() = default;
ScriptedStream::~ScriptedStream() = default;

ScriptedStream& ScriptedStream::deliver(Bytes chunk)
{
    if (chunk.empty()) throw std::logic_error("ScriptedStream: an empty chunk is the end of the stream, use end()");
    mScript.push_back({Step::Chunk, std::move(chunk), {}});
    return *this;
}

ScriptedStream& ScriptedStream::deliverOneByOne(const Bytes& bytes)
{
    for (const char byte : bytes)
        deliver({byte});
    return *this;
}

ScriptedStream& ScriptedStream::end()
{
    mScript.push_back({Step::End, {}, {}});
    return *this;
}

ScriptedStream& ScriptedStream::fail(std::string text)
{
    mScript.push_back({Step::Failure, {}, std::move(text)});
    return *this;
}

ScriptedStream& ScriptedStream::failWriteAt(std::size_t position, std::string text)
{
    if (position < mBytesWritten) throw std::logic_error("ScriptedStream: that byte was already written");
    mWriteLimit = position;
    mWriteFailure = std::move(text);
    return *this;
}

std::size_t ScriptedStream::bytesLeft() const
{
    std::size_t count = 0;
    for (const Step& step : mScript)
        count += step.bytes.size();
    return count;
}

ScriptedStream::Bytes ScriptedStream::written() const
{
    Bytes all;
    for (const Bytes& one : mWrites)
        all.insert(all.end(), one.begin(), one.end());
    return all;
}

void ScriptedStream::close() { ++mCloseCount; }

void ScriptedStream::setReadDeadline(std::chrono::milliseconds timeout) { mReadDeadlines.push_back(timeout); }

std::size_t ScriptedStream::read(char* buffer, std::size_t length)
{
    pThrowIfClosed();
    mReads.push_back(length);
    if (mScript.empty()) throw std::logic_error("ScriptedStream: read beyond the end of the script");

    Step& step = mScript.front();
    if (step.kind == Step::End) return 0;
    if (step.kind == Step::Failure) {
        const std::string text = std::move(step.text);
        mScript.pop_front();
        throw StreamIOException(text);
    }
    const std::size_t count = std::min(length, step.bytes.size());
    const auto taken = step.bytes.begin() + static_cast<Bytes::difference_type>(count);
    std::copy(step.bytes.begin(), taken, buffer);
    step.bytes.erase(step.bytes.begin(), taken);
    if (step.bytes.empty()) mScript.pop_front();
    mBytesRead += count;
    return count;
}

void ScriptedStream::fill(char* buffer, std::size_t length)
{
    mFills.push_back(length);
    Stream::fill(buffer, length);
}

void ScriptedStream::setWriteDeadline(std::chrono::milliseconds timeout) { mWriteDeadlines.push_back(timeout); }

void ScriptedStream::write(const char* buffer, std::size_t length)
{
    pThrowIfClosed();
    const std::size_t count = std::min(length, mWriteLimit - mBytesWritten);
    mWrites.emplace_back(buffer, buffer + count);
    mBytesWritten += count;
    if (count < length) throw StreamIOException(mWriteFailure);
}

void ScriptedStream::pThrowIfClosed() const
{
    if (mCloseCount > 0) throw StreamIOException("closed");
}

} // namespace qel::test
