#include "lines/TelnetLine.hpp"

#include <qel/common/util/Poll.hpp>
#include <qel/common/util/TimeProvider.hpp>

#include "lines/TelnetCodec.hpp"

#include <algorithm>
#include <chrono>
#include <stdexcept>
#include <string>
#include <utility>

namespace qel::tool {

namespace {

constexpr std::chrono::milliseconds kBreakTime(250);

/// The time that a peer has to agree to the settings of its port.
constexpr std::chrono::seconds kAgreementTime(5);

/// Bytes of input that are taken while others wait to be sent, or during a break.
constexpr std::size_t kMaxHeld = 4096;

class TelnetLine final : public SerialLine {
public:
    TelnetLine(std::unique_ptr<SerialLine> connection, std::optional<SerialSettings> settings)
        : mConnection(std::move(connection)), mSettings(settings)
    {}

    void start(std::uint16_t partition) override
    {
        if (mHasEnded) stop();
        mConnection->start(partition);
        mName = "partition " + std::to_string(partition);
    }

    void stop() override
    {
        mConnection->stop();
        pForget();
    }

    bool advance() override
    {
        if (!mReason.empty()) throw std::runtime_error(mReason); // read() has passed on what came before it
        if (!mConnection->advance()) return false;
        const auto now = TimeProvider::steady();
        if (mCodec == nullptr) {
            mCodec = std::make_unique<TelnetCodec>(mSettings, mName);
            if (mSettings) mAgreementEnd = now + kAgreementTime;
        }
        if (mBreakEnd.isExpired(now)) pEndBreak();
        if (mAgreementEnd.isExpired(now)) {
            mAgreementEnd = PollDeadline();
            if (!mHasWarned) mCodec->checkAgreement();
            mHasWarned = !mCodec->agrees();
        }
        pFlush();
        return true;
    }

    bool wantsToWrite() const override
    {
        return mConnection->wantsToWrite() || (mCodec != nullptr && !mCodec->output().empty());
    }

    PollDeadline advanceAt() const override
    {
        return std::min({mConnection->advanceAt(), mBreakEnd, mAgreementEnd, mBroken});
    }

    ReadResult read(char* buffer, std::size_t length) override
    {
        if (!mReason.empty()) return {LineState::Ended, 0};
        const ReadResult result = mConnection->read(buffer, length);
        if (result.state == LineState::Ended) mHasEnded = true;
        if (result.state != LineState::Data) return result;
        const std::string data = mCodec->receive(buffer, result.length);
        mReason = mCodec->failure();
        const bool isBroken = !mReason.empty() || data.size() > length;
        if (isBroken) {
            mHasEnded = true;
            if (data.empty() || data.size() > length) return {LineState::Ended, 0};
            mBroken = TimeProvider::steady(); // the connection may have nothing more that would make it readable
        } else {
            pFlush();
        }
        data.copy(buffer, length);
        return {data.empty() ? LineState::Idle : LineState::Data, data.size()};
    }

    std::size_t write(const char* data, std::size_t length) override
    {
        if (pIsBreaking()) { // it would be lost in the break
            const std::size_t taken = std::min(length, kMaxHeld - mHeld.size());
            mHeld.append(data, taken);
            return taken;
        }
        pFlush();
        if (!mCodec->output().empty()) return 0;
        const std::size_t taken = std::min(length, kMaxHeld);
        mCodec->send(std::string(data, taken));
        pFlush();
        return taken;
    }

    int descriptor() const override { return mConnection->descriptor(); }
    bool hasHungUp() const override { return mConnection->hasHungUp(); }
    std::string endReason() const override { return mReason.empty() ? mConnection->endReason() : mReason; }

    bool sendBreak() override
    {
        if (pIsBreaking()) return true; // one is under way
        mIsBreakQueued = mCodec->beginBreak();
        pFlush();
        return true;
    }

private:
    bool pIsBreaking() const { return mIsBreakQueued || !mBreakEnd.isDisabled(); }

    void pEndBreak()
    {
        mBreakEnd = PollDeadline();
        mCodec->endBreak();
        mCodec->send(std::exchange(mHeld, std::string()));
    }

    void pFlush()
    {
        std::string& output = mCodec->output();
        while (!output.empty()) {
            const std::size_t taken = mConnection->write(output.data(), output.size());
            if (taken == 0) return;
            output.erase(0, taken);
        }
        // Counted from now on: behind a full connection the end of the break would go out together with its beginning.
        if (std::exchange(mIsBreakQueued, false)) mBreakEnd = TimeProvider::steady() + kBreakTime;
    }

    void pForget()
    {
        mCodec.reset();
        mIsBreakQueued = false;
        mBreakEnd = PollDeadline();
        mAgreementEnd = PollDeadline();
        mBroken = PollDeadline();
        mHeld.clear();
        mReason.clear();
        mHasEnded = false;
    }

    const std::unique_ptr<SerialLine> mConnection;
    const std::optional<SerialSettings> mSettings;
    std::string mName;                   // for the log
    std::unique_ptr<TelnetCodec> mCodec; // of this connection; null: it is not made yet
    bool mIsBreakQueued = false;         // the beginning of a break waits to be sent
    PollDeadline mBreakEnd;              // enabled: a break is under way
    PollDeadline mAgreementEnd;          // enabled: the peer has time left to agree to the settings
    bool mHasWarned = false;             // the last peer that had its time did not agree: one more is not news
    std::string mHeld;                   // input for after the break
    PollDeadline mBroken;                // enabled: when the peer has broken the protocol, after other data
    std::string mReason;                 // how the peer has broken the protocol
    bool mHasEnded = false;              // read() has said so
};

} // namespace

std::unique_ptr<SerialLine> telnetLine(std::unique_ptr<SerialLine> connection, std::optional<SerialSettings> settings)
{
    return std::make_unique<TelnetLine>(std::move(connection), settings);
}

} // namespace qel::tool
