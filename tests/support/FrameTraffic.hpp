#pragma once

#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/io/BufferedStream.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/io/Stream.hpp>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <exception>
#include <functional>
#include <iterator>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <utility>
#include <vector>

/// @file
/// Random frames through buffered streams, in both directions at once. QEL_TEST_FRAMES and QEL_TEST_SEED in the
/// environment choose how many and which.

namespace qel::test {

inline std::size_t numberFromEnvironment(const char* name, std::size_t otherwise)
{
    const char* const text = std::getenv(name);
    return text == nullptr ? otherwise : std::strtoull(text, nullptr, 10);
}

/// Frames of random lengths and contents that follow from the seed alone. Most are short; some are as long as frames
/// may be.
class RandomFrames {
public:
    explicit RandomFrames(std::uint32_t seed) : mRandom(seed), mNoise(2 * kLongest, '\0')
    {
        for (char& byte : mNoise)
            byte = static_cast<char>(mRandom());
    }

    /// @return the next frame, valid and of a function without a class
    std::string next()
    {
        const std::size_t length = kHeader + pDataLength();
        std::string frame("\xDE\xCA\xFF\x20----....\x7F\x01\x80\x00----\x01\x02\0\0\0\0\0\0\0\0\0\0", kHeader);
        putNumber(frame, 4, length);
        putNumber(frame, 8, ++mCount);
        putNumber(frame, 16, length - kHeader);
        frame.append(mNoise, mRandom() % kLongest, length - kHeader);
        return frame;
    }

    /// @return a number in [0, limit)
    std::size_t below(std::size_t limit) { return mRandom() % limit; }

private:
    static constexpr std::size_t kHeader = 32;
    static constexpr std::size_t kLongest = 16384;

    std::size_t pDataLength()
    {
        switch (below(64)) {
        case 0:
            return below(kLongest - kHeader + 1);
        case 1:
            return kLongest - kHeader;
        case 2:
        case 3:
        case 4:
            return below(2000);
        default:
            return below(100);
        }
    }

    static void putNumber(std::string& frame, std::size_t at, std::size_t number)
    {
        for (std::size_t i = 0; i < 4; ++i)
            frame[at + i] = static_cast<char>(number >> (24 - 8 * i));
    }

    std::mt19937 mRandom;
    std::string mNoise;
    std::size_t mCount = 0;
};

inline BufferedStreamOptions randomOptions(RandomFrames& random)
{
    constexpr std::size_t sizes[] = {0, 1, 7, 8, 39, 100, 4096, 16383, 16384, 65536};
    BufferedStreamOptions options;
    options.readAheadBytes = sizes[random.below(std::size(sizes))];
    options.gatherBytes = sizes[random.below(std::size(sizes))];
    return options;
}

/// Writes `count` frames of a seed; flushes now and then, and at the end.
inline void sendFrames(BufferedStream& stream, std::uint32_t seed, std::size_t count)
{
    RandomFrames frames(seed);
    RandomFrames random(~seed);
    for (std::size_t i = 0; i < count; ++i) {
        const std::string frame = frames.next();
        stream.write(frame.data(), frame.size());
        if (random.below(20) == 0) stream.flush();
    }
    stream.flush();
}

/// Reads as many frames. @return the first difference to those of the seed; empty: there is none
inline std::string receiveFrames(BufferedStream& stream, std::uint32_t seed, std::size_t count)
{
    QelMessageRegistry registry;
    QelMessageStream messages(stream, registry);
    RandomFrames frames(seed);
    for (std::size_t i = 0; i < count; ++i) {
        const std::unique_ptr<QelMessage> message = messages.read();
        const std::string expected = frames.next();
        if (std::string(message->serialize(), message->msgLength()) != expected) {
            return "frame " + std::to_string(i) + " of seed " + std::to_string(seed) + " is another";
        }
    }
    return stream.hasPending() ? "bytes follow the last frame" : "";
}

/// Sends frames in both directions at the same time, with a reader and a writer thread at each end.
/// @return what went wrong; empty: nothing did
inline std::string exchangeFrames(BufferedStream& near, BufferedStream& far, std::uint32_t seed, std::size_t count)
{
    std::string failures[4];
    const auto guarded = [](std::string& failure, const std::function<std::string()>& work) {
        try {
            failure = work();
        } catch (const std::exception& e) {
            failure = e.what();
        }
    };
    const auto send = [&](BufferedStream& stream, std::uint32_t which) {
        sendFrames(stream, which, count);
        return std::string();
    };
    std::vector<std::thread> threads;
    threads.emplace_back([&] { guarded(failures[0], [&] { return send(near, seed); }); });
    threads.emplace_back([&] { guarded(failures[1], [&] { return receiveFrames(far, seed, count); }); });
    threads.emplace_back([&] { guarded(failures[2], [&] { return send(far, seed + 1); }); });
    threads.emplace_back([&] { guarded(failures[3], [&] { return receiveFrames(near, seed + 1, count); }); });
    for (std::thread& thread : threads)
        thread.join();
    std::string all;
    for (const std::string& failure : failures)
        all += failure.empty() ? "" : failure + "; ";
    return all;
}

/// One end sends bursts of frames, the other sends each back; one thread at each end, which never flushes itself.
/// @return what went wrong; empty: nothing did
inline std::string echoFrames(BufferedStream& near, BufferedStream& far, std::uint32_t seed, std::size_t count)
{
    std::string failure;
    std::thread echo([&] {
        QelMessageRegistry registry;
        QelMessageStream messages(far, registry);
        try {
            for (std::size_t i = 0; i < count; ++i)
                messages.write(*messages.read());
            far.flush();
        } catch (const std::exception& e) {
            failure = e.what();
        }
    });
    std::string result;
    try {
        QelMessageRegistry registry;
        QelMessageStream messages(near, registry);
        RandomFrames frames(seed);
        for (std::size_t sent = 0; sent < count && result.empty();) {
            std::vector<std::string> burst(std::min(count - sent, 1 + frames.below(8)));
            for (std::string& frame : burst) {
                frame = frames.next();
                near.write(frame.data(), frame.size());
            }
            for (const std::string& frame : burst) {
                const std::unique_ptr<QelMessage> message = messages.read();
                if (std::string(message->serialize(), message->msgLength()) != frame) result = "another frame";
            }
            sent += burst.size();
        }
    } catch (const std::exception& e) {
        result = e.what();
    }
    if (!result.empty()) near.close();
    echo.join();
    return result + failure;
}

} // namespace qel::test
