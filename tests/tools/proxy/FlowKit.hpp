#pragma once

#include "proxy/FrameFlow.hpp"
#include "support/RawFrame.hpp"

#include <cstring>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

namespace qel::test {

/// A frame with the new header. @param id  its caller id
inline std::string frameOf(unsigned int id, const std::string& payload = {}, unsigned int function = 0x6003,
                           unsigned int operation = 0x0107, unsigned int flags = 0x80)
{
    const std::vector<char> bytes = RawFrame::newForm()
                                        .callerId(id)
                                        .function(function)
                                        .operation(operation)
                                        .flags(flags)
                                        .payload({payload.begin(), payload.end()})
                                        .bytes();
    return {bytes.begin(), bytes.end()};
}

inline std::vector<tool::FaultRule> rulesOf(const std::vector<std::string>& texts)
{
    std::vector<tool::FaultRule> rules;
    for (const std::string& text : texts)
        rules.push_back(tool::parseFaultRule({text, "test"}));
    return rules;
}

/// Notes what a flow tells.
struct FlowNotes : tool::FlowObserver {
    void onFrame(const tool::FlowPlace&, std::uint64_t number, const tool::FrameView& frame) override
    {
        frames.push_back(std::to_string(number) + ":" + std::to_string(frame.callerId()));
    }
    void onFault(const tool::FlowPlace&, std::uint64_t number, const tool::FaultRule&, const std::string& what) override
    {
        faults.push_back(std::to_string(number) + " " + what);
    }
    void onNote(const tool::FlowPlace&, const std::string& text) override { notes.push_back(text); }

    std::vector<std::string> frames; // "number:caller id"
    std::vector<std::string> faults; // "number what"
    std::vector<std::string> notes;
};

/// A flow without input or output, at times that the test decides.
class TestFlow {
public:
    using Writes = std::vector<std::string>;

    explicit TestFlow(const std::vector<std::string>& rules, tool::Way way = tool::Way::ToServer,
                      std::uint64_t seed = 1, std::uint64_t connection = 1)
        : mPlan{rulesOf(rules), seed}, flow({connection, way}, mPlan, notes)
    {}

    /// What arrives at a time. @param at  milliseconds
    void arrive(const std::string& bytes, int at = 0)
    {
        std::size_t taken = 0;
        while (taken < bytes.size()) {
            std::size_t room = 0;
            char* const buffer = flow.room(room);
            if (room == 0) throw std::logic_error("the flow has no room");
            const std::size_t count = std::min(room, bytes.size() - taken);
            std::memcpy(buffer, bytes.data() + taken, count);
            flow.take(count, time(at));
            taken += count;
        }
    }
    void end(int at = 0) { flow.takeEnd(time(at)); }

    /// What leaves at a time, write by write.
    Writes leave(int at = 0)
    {
        Writes writes;
        for (;;) {
            const std::string_view bytes = flow.next(time(at));
            if (bytes.empty()) return writes;
            writes.emplace_back(bytes);
            flow.sent(bytes.size(), time(at));
        }
    }

    /// The same as one text.
    std::string bytes(int at = 0)
    {
        std::string all;
        for (const std::string& one : leave(at))
            all += one;
        return all;
    }

    /// When it wants to be asked again, in milliseconds; -1: never
    long wakeAt(int at = 0) const
    {
        const auto wake = flow.wakeAt(time(at));
        if (wake == tool::FrameFlow::kNever) return -1;
        return static_cast<long>(std::chrono::duration_cast<std::chrono::milliseconds>(wake - time(0)).count());
    }

    static tool::FrameFlow::TimePoint time(int milliseconds)
    {
        return tool::FrameFlow::TimePoint(std::chrono::hours(1) + std::chrono::milliseconds(milliseconds));
    }

private:
    tool::FaultPlan mPlan;

public:
    FlowNotes notes;
    tool::FrameFlow flow;
};

} // namespace qel::test
