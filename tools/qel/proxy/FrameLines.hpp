#pragma once

#include "base/TimeStamps.hpp"
#include "proxy/ProxyObserver.hpp"

#include <array>
#include <cstdint>
#include <functional>
#include <nlohmann/json.hpp>
#include <string>

namespace qel::tool {

/// How the lines of "qel proxy" look.
struct FrameLinesOptions {
    bool json = false;
    bool dump = false;  ///< each frame with its contents
    bool quiet = false; ///< no lines about frames
    TimeStamps::Style stamps = TimeStamps::Style::Iso;
    FrameFilter filter; ///< of the frames that have lines
};

/// Writes a line about each thing that happens in a proxy, as text or as a JSON object. What peers have sent is
/// escaped, so that the lines are safe on a terminal. Lines are gathered until the proxy waits.
///
/// Thread safety: one thread.
class FrameLines final : public ProxyObserver {
public:
    /// Writes gathered lines. It may throw: the proxy ends then.
    using Sink = std::function<void(const std::string& lines)>;

    FrameLines(FrameLinesOptions options, Sink sink);

    /// The first line: where the proxy listens. Text has no time here, so that a script can read the line.
    void listening(const std::vector<IPEndpoint>& endpoints, const std::string& target, std::uint64_t seed);

    /// The last line: how much has passed.
    void summary(std::uint64_t connections);

    void onFrame(const FlowPlace& place, std::uint64_t number, const FrameView& frame) override;
    void onFault(const FlowPlace& place, std::uint64_t number, const FaultRule& rule, const std::string& what) override;
    void onNote(const FlowPlace& place, const std::string& text) override;
    void onOpened(std::uint64_t connection, const ProxyAddresses& addresses) override;
    void onConnectionNote(std::uint64_t connection, const std::string& text) override;
    void onEnd(const FlowPlace& place) override;
    void onClosed(std::uint64_t connection, const std::string& why, const FrameFlow& toServer,
                  const FrameFlow& toConsole) override;
    void onRefused(std::uint64_t connection, const std::string& why) override;
    void onIdle() override { pWrite(); }

private:
    struct Totals {
        std::uint64_t frames = 0;
        std::uint64_t bytes = 0;
    };

    void pFrameJson(const FlowPlace& place, std::uint64_t number, const FrameView& frame);
    void pFrameText(const FlowPlace& place, std::uint64_t number, const FrameView& frame);
    nlohmann::ordered_json pEvent(const char* event, std::uint64_t connection) const;
    void pAdd(const nlohmann::ordered_json& event);
    void pAddLine(const std::string& line);
    void pWrite();

    const FrameLinesOptions mOptions;
    const Sink mSink;
    TimeStamps mStamps;
    std::string mLines; // gathered
    std::string mLine;  // kept for its memory
    Totals mToServer;
    Totals mToConsole;
    std::uint64_t mFaults = 0;
};

} // namespace qel::tool
