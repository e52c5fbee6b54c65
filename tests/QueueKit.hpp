#pragma once

#include <qel/common/QelMessageQueue.hpp>
#include <qel/common/StreamFormatters.hpp>

#include "support/CapturedLog.hpp"

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

/// @file
/// What the tests of the message queue share.

namespace qel::test {

constexpr MessageQueuingOptions kDefault = MessageQueuingOptions::DEFAULT;
constexpr MessageQueuingOptions kBlocking = MessageQueuingOptions::BLOCKING;
constexpr MessageQueuingOptions kLow = MessageQueuingOptions::LOW_PRIORITY;
constexpr MessageQueuingOptions kBestEffort = MessageQueuingOptions::BEST_EFFORT;
constexpr std::chrono::milliseconds kNoLimit = std::chrono::milliseconds::max();

/// What dumpStatistics() prints.
inline std::string dumpOf(const QelMessageQueue& queue, const Indent& indent = Indent(0, ' '))
{
    std::ostringstream os;
    queue.dumpStatistics(os, indent);
    return os.str();
}

/// The value in the line of the dump that begins with the label: "1 (32 B)" for "Pending".
inline std::string figure(const QelMessageQueue& queue, const std::string& label)
{
    std::istringstream lines(dumpOf(queue));
    for (std::string line; std::getline(lines, line);) {
        if (line.compare(0, label.size(), label) != 0) continue;
        return line.substr(line.find_first_not_of(' ', line.find(':') + 1));
    }
    return "no line " + label;
}

/// Takes the first message. @return its caller id; 0 when there is none
inline unsigned int take(QelMessageQueue& queue)
{
    const std::unique_ptr<QelMessage> message = queue.waitForMsg(std::chrono::milliseconds(0));
    return message == nullptr ? 0 : message->getCallerId();
}

/// Waits for a condition that other threads bring about. The time limit of the test program ends a wait in vain.
template <typename Condition>
void waitUntil(const Condition& condition)
{
    while (!condition())
        std::this_thread::yield();
}

/// Waits until that many producers sleep for room, as their log lines say. They write them with the lock held and
/// release it by falling asleep, so they sleep once this thread has had the lock.
inline void waitForSleepers(const CapturedLog& log, const QelMessageQueue& queue, std::size_t count)
{
    waitUntil([&] {
        const std::vector<std::string> lines = log.lines();
        const auto isSleep = [](const std::string& line) { return line.find("reached, waiting") != std::string::npos; };
        return static_cast<std::size_t>(std::count_if(lines.begin(), lines.end(), isSleep)) == count;
    });
    dumpOf(queue);
}

} // namespace qel::test
