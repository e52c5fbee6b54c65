#include "hypervisor/PartitionSessions.hpp"

#include <qel/common/QelMessageGeneric.hpp>

#include <algorithm>
#include <memory>
#include <utility>

namespace qel::protocol {

namespace {

/// Messages that one call of deliver() sends to a session, at most, so that the other partitions get their turn.
constexpr int kMostMessages = 32;

/// The notice that a session is closed. How the command ended, where that is known, is in the status detail of its
/// header.
std::unique_ptr<QelMessage> closedNotice(const QelMessageVirtualSerialSessionClosedAsync& notice, const CommandEnd& end)
{
    const std::uint16_t detail = toStatusDetail(end);
    if (detail == 0) return notice.clone();
    auto detailed = std::make_unique<QelMessageGeneric>(notice);
    detailed->setStatus(QelMessageStatusNoError, detail);
    return detailed;
}

/// A line of the program's own.
std::string noteText(const std::string& text) { return "\r\n[qel: " + text + "]\r\n"; }

std::string skippedText(std::uint64_t bytes) { return noteText(std::to_string(bytes) + " bytes skipped"); }

} // namespace

bool PartitionSessions::isOf(std::uint16_t number, const ConsoleEntry& console) const
{
    const auto found = mSessions.find(number);
    return found != mSessions.end() && found->second.console == &console;
}

bool PartitionSessions::isSetUp(std::uint16_t number) const
{
    const auto found = mSessions.find(number);
    return found != mSessions.end() && found->second.isSetUp;
}

bool PartitionSessions::isAnySetUp() const
{
    return std::any_of(mSessions.begin(), mSessions.end(), [](const auto& entry) { return entry.second.isSetUp; });
}

bool PartitionSessions::areAllSetUp() const
{
    return std::all_of(mSessions.begin(), mSessions.end(), [](const auto& entry) { return entry.second.isSetUp; });
}

bool PartitionSessions::isCaughtUp(std::uint16_t number) const
{
    const auto found = mSessions.find(number);
    return found == mSessions.end() || !found->second.isSetUp || pIsCaughtUp(found->second);
}

bool PartitionSessions::hasRoom(std::uint16_t number) const
{
    const auto found = mSessions.find(number);
    if (found == mSessions.end()) return false;
    return pIsCaughtUp(found->second) && found->second.console->link.hasSerialRoom();
}

bool PartitionSessions::canDeliver() const
{
    return std::any_of(mSessions.begin(), mSessions.end(), [this](const auto& entry) {
        const Session& session = entry.second;
        return session.isSetUp && !pIsCaughtUp(session) && session.console->link.hasSerialRoom();
    });
}

void PartitionSessions::setUp(std::uint16_t number, std::size_t replay)
{
    Session& session = mSessions.at(number);
    if (std::exchange(session.isSetUp, true)) return;
    const std::uint64_t kept = mOutput.end() - mOutput.begin();
    session.next = mOutput.end() - std::min<std::uint64_t>(kept, replay);
}

bool PartitionSessions::dropAllOf(const ConsoleEntry& console)
{
    const std::size_t before = mSessions.size();
    for (auto next = mSessions.begin(); next != mSessions.end();)
        next = next->second.console == &console ? mSessions.erase(next) : std::next(next);
    return mSessions.size() != before;
}

void PartitionSessions::end(std::uint16_t number, CloseReason reason, const CommandEnd& end)
{
    const auto found = mSessions.find(number);
    if (found != mSessions.end()) pEnd(found, reason, end);
}

void PartitionSessions::endAll(CloseReason reason, const CommandEnd& end)
{
    while (!mSessions.empty())
        pEnd(mSessions.begin(), reason, end);
}

bool PartitionSessions::endAllOf(const ConsoleEntry& console, const std::string& why)
{
    const std::string line = noteText(why);
    bool isAny = false;
    for (auto next = mSessions.begin(); next != mSessions.end();) {
        const auto session = next++;
        if (session->second.console != &console) continue;
        isAny = true;
        pFinish(session->first, session->second);
        if (session->second.isSetUp) console.link.post(pMessage(session->first, line.data(), line.size()));
        pEnd(session, CloseReason::CloseReasonForceClose, {});
    }
    return isAny;
}

std::size_t PartitionSessions::unseenBytes(std::uint16_t number) const
{
    const auto found = mSessions.find(number);
    if (found == mSessions.end() || !found->second.isSetUp) return 0;
    return static_cast<std::size_t>(mOutput.end() - std::max(found->second.next, mOutput.begin()));
}

void PartitionSessions::refuseInput(std::uint16_t number, const char* answer)
{
    Session& session = mSessions.at(number);
    if (session.isWarned) return;
    session.aside += noteText(answer);
    session.isWarned = true;
}

void PartitionSessions::forgetRefusal(std::uint16_t number)
{
    const auto found = mSessions.find(number);
    if (found != mSessions.end()) found->second.isWarned = false;
}

void PartitionSessions::resumeTyping()
{
    const auto found = mSessions.find(kTyping);
    if (found != mSessions.end()) found->second.console->link.resumeReading();
}

std::vector<SessionState> PartitionSessions::states() const
{
    std::vector<SessionState> states;
    states.reserve(mSessions.size());
    for (const auto& entry : mSessions)
        states.push_back({entry.first, entry.second.console->peer.id, entry.second.isSetUp});
    return states;
}

void PartitionSessions::deliver()
{
    for (auto& entry : mSessions)
        pDeliver(entry.first, entry.second);
}

/// Without memory for a message the session gets its bytes the next time.
void PartitionSessions::pDeliver(std::uint16_t number, Session& session)
{
    if (!session.isSetUp) return;
    ConsoleLink& link = session.console->link;
    for (int sent = 0; sent < kMostMessages && !pIsCaughtUp(session) && link.hasSerialRoom(); ++sent) {
        pSkipLost(number, session);
        if (!session.aside.empty()) {
            link.postSerial(pMessage(number, session.aside.data(), session.aside.size()));
            session.aside.clear();
            continue;
        }
        const OutputHistory::Piece piece = mOutput.piece(session.next, kPiece);
        link.postSerial(pMessage(number, piece.data, piece.length));
        session.next += piece.length;
    }
}

/// Lets a session that has fallen behind the history go on in the middle of it: at its oldest byte it would soon fall
/// behind again. Not so the one that types, which nothing runs away from.
void PartitionSessions::pSkipLost(std::uint16_t number, Session& session)
{
    if (session.next >= mOutput.begin()) return;
    const std::uint64_t kept = mOutput.end() - mOutput.begin();
    const std::uint64_t goOn = mOutput.end() - (number == kTyping ? kept : kept / 2);
    pSkip(session, goOn);
}

/// Leaves out what a session has still to get before an offset, and says so in its data.
void PartitionSessions::pSkip(Session& session, std::uint64_t goOn)
{
    session.aside += skippedText(goOn - session.next);
    mSkippedBytes += goOn - session.next;
    session.next = goOn;
}

/// Sends the last of the output to a session that ends with its command. What finds no room is skipped.
void PartitionSessions::pFinish(std::uint16_t number, Session& session)
{
    pDeliver(number, session);
    if (!session.isSetUp || pIsCaughtUp(session)) return;
    pSkip(session, mOutput.end());
    session.console->link.post(pMessage(number, session.aside.data(), session.aside.size()));
    session.aside.clear();
}

bool PartitionSessions::pIsCaughtUp(const Session& session) const
{
    return session.next == mOutput.end() && session.aside.empty();
}

PartitionSessions::Sessions::iterator PartitionSessions::pEnd(Sessions::iterator session, CloseReason reason,
                                                              const CommandEnd& end)
{
    ConsoleLink& link = session->second.console->link;
    if (reason == CloseReason::CloseReasonReadFailure) pFinish(session->first, session->second);
    link.post(closedNotice({mPartition, session->first, reason}, end));
    const auto next = mSessions.erase(session);
    link.resumeReading(); // it may have waited for this partition to take its input
    return next;
}

std::unique_ptr<QelMessage> PartitionSessions::pMessage(std::uint16_t number, const char* data, std::size_t length)
{
    auto message = std::make_unique<QelMessageVirtualSerialDataToDaxAsync>(mPartition, number,
                                                                           static_cast<std::uint16_t>(length), data);
    ++mSentMessages;
    return message;
}

} // namespace qel::protocol
