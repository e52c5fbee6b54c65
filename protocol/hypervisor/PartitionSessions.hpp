#pragma once

#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/protocol/CommandEnd.hpp>
#include <qel/protocol/PartitionState.hpp>

#include "hypervisor/ConsoleEntry.hpp"
#include "hypervisor/OutputHistory.hpp"

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <vector>

namespace qel::protocol {

/// The sessions of one partition, by connection number: which console has each, and how much of the output it has got.
/// The session on number 0 types, those on the others watch. Each is sent what its console's link has room for.
///
/// A session that falls behind the history loses what lies between, and is told in its data how many bytes that is. The
/// owner keeps that from happening to number 0: it reads no output while isCaughtUp(0) is false.
///
/// Ownership: borrows the history and the consoles. Thread safety: none of its own.
class PartitionSessions {
public:
    using CloseReason = QelMessageVirtualSerialSessionClosedAsync::CloseReason;

    static constexpr std::uint16_t kTyping = 0;
    static constexpr std::uint16_t kLastNumber = 15;
    /// Bytes of output in one message, at most.
    static constexpr std::size_t kPiece = 4096;

    PartitionSessions(std::uint16_t partition, const OutputHistory& output) : mPartition(partition), mOutput(output) {}

    bool isEmpty() const noexcept { return mSessions.empty(); }
    bool has(std::uint16_t number) const { return mSessions.count(number) != 0; }
    bool isOf(std::uint16_t number, const ConsoleEntry& console) const;
    bool isSetUp(std::uint16_t number) const;
    bool isAnySetUp() const;
    bool areAllSetUp() const;

    /// Whether a session has got all output; true when there is none, or it is not set up.
    bool isCaughtUp(std::uint16_t number) const;
    /// Whether a session has got all output and its console's link has room for more.
    bool hasRoom(std::uint16_t number) const;
    /// Whether deliver() could send something.
    bool canDeliver() const;

    /// @param number  free
    void open(std::uint16_t number, ConsoleEntry& console) { mSessions.emplace(number, console); }

    /// Sets a session up; the first time, the newest output comes first.
    /// @param replay  bytes of the history, at most
    void setUp(std::uint16_t number, std::size_t replay);

    /// Ends a session without a notice.
    void drop(std::uint16_t number) { mSessions.erase(number); }
    /// Ends the sessions of a console without notices. @return whether there were any
    bool dropAllOf(const ConsoleEntry& console);

    /// Ends a session with a notice. Without memory for the notice the session stays.
    /// @param end  for the notice
    void end(std::uint16_t number, CloseReason reason, const CommandEnd& end = {});
    /// Ends all sessions with notices.
    void endAll(CloseReason reason, const CommandEnd& end = {});

    /// Ends the sessions of a console with a line in their data, and the notice of a forced close.
    /// @return whether there were any
    bool endAllOf(const ConsoleEntry& console, const std::string& why);

    /// Bytes of the history that a session has still to get; 0 when there is none, or it is not set up.
    std::size_t unseenBytes(std::uint16_t number) const;

    /// Answers input that is not passed on, in the session's data, once.
    void refuseInput(std::uint16_t number, const char* answer);
    /// Lets the next input that is not passed on be answered again.
    void forgetRefusal(std::uint16_t number);

    /// Tells the console on number 0 that it may be read again.
    void resumeTyping();

    /// The sessions that are open, by number.
    std::vector<SessionState> states() const;

    // Since the partition was added.

    std::uint64_t sentMessages() const noexcept { return mSentMessages; }
    std::uint64_t skippedBytes() const noexcept { return mSkippedBytes; }

    /// Sends what there is room for, a bounded part at a time.
    void deliver();

private:
    struct Session {
        explicit Session(ConsoleEntry& holder) : console(&holder) {}

        ConsoleEntry* console;
        bool isSetUp = false;
        bool isWarned = false;  ///< that its input is not passed on
        std::uint64_t next = 0; ///< offset of the first byte of output that it has not got
        std::string aside;      ///< text for this session alone, which comes next
    };
    using Sessions = std::map<std::uint16_t, Session>;

    void pDeliver(std::uint16_t number, Session& session);
    void pSkipLost(std::uint16_t number, Session& session);
    void pFinish(std::uint16_t number, Session& session);
    bool pIsCaughtUp(const Session& session) const;
    Sessions::iterator pEnd(Sessions::iterator session, CloseReason reason, const CommandEnd& end);
    void pSkip(Session& session, std::uint64_t goOn);
    std::unique_ptr<QelMessage> pMessage(std::uint16_t number, const char* data, std::size_t length);

    const std::uint16_t mPartition;
    const OutputHistory& mOutput;
    Sessions mSessions;
    std::uint64_t mSentMessages = 0; ///< of serial data
    std::uint64_t mSkippedBytes = 0; ///< of output, that sessions have not got
};

} // namespace qel::protocol
