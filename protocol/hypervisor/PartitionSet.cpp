#include "hypervisor/PartitionSet.hpp"

#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/Logging.hpp>

#include <array>
#include <optional>
#include <utility>

namespace qel::protocol {

namespace {

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

constexpr CommandEnd kClosedTerminal{CommandEnd::Kind::ClosedTerminal, 0};

} // namespace

PartitionSet::PartitionSet() = default;

PartitionSet::~PartitionSet()
{
    for (auto& entry : mPartitions) {
        if (entry.second.isUp) entry.second.line.stop();
    }
}

void PartitionSet::add(std::uint16_t id, SerialLine& line) { mPartitions.emplace(id, Partition(id, line)); }

bool PartitionSet::isHeldBy(const ConsoleEntry& console, std::uint16_t id) const
{
    const auto found = mPartitions.find(id);
    return found != mPartitions.end() && found->second.holder == &console;
}

QelMessageStatusCodes PartitionSet::open(ConsoleEntry& console, std::uint16_t id, std::uint16_t connection, bool force)
{
    Partition* partition = nullptr;
    const QelMessageStatusCodes found = pFindPartition(id, connection, partition);
    if (found != QelMessageStatusNoError) return found;
    if (partition->holder != nullptr && !force) return QelMessageStatusConnectionNotAvailable;
    mChanged = true; // even when the command cannot be started: what is left of an ended one is taken down first
    if (!pStart(*partition)) return QelMessageStatusCmdFailed;
    if (partition->holder != nullptr) pEndSession(*partition, CloseReason::CloseReasonForceClose);
    partition->holder = &console;
    return QelMessageStatusNoError;
}

QelMessageStatusCodes PartitionSet::setUp(ConsoleEntry& console, std::uint16_t id, std::uint16_t connection)
{
    Partition* partition = nullptr;
    const QelMessageStatusCodes found = pFindPartition(id, connection, partition);
    if (found != QelMessageStatusNoError) return found;
    if (partition->holder != &console) return QelMessageStatusInvalidCmdSequence;
    partition->setUp = true;
    mChanged = true;
    return QelMessageStatusNoError;
}

QelMessageStatusCodes PartitionSet::close(ConsoleEntry& console, std::uint16_t id, std::uint16_t connection, bool force)
{
    Partition* partition = nullptr;
    const QelMessageStatusCodes found = pFindPartition(id, connection, partition);
    if (found != QelMessageStatusNoError) return found;
    if (partition->holder == &console) {
        partition->holder = nullptr;
        partition->setUp = false;
        mChanged = true;
        return QelMessageStatusNoError;
    }
    if (partition->holder == nullptr || !force) return QelMessageStatusConnectionClosureFailure;
    pEndSession(*partition, CloseReason::CloseReasonForceClose);
    return QelMessageStatusNoError;
}

bool PartitionSet::feed(const ConsoleEntry& console, const QelMessageVirtualSerialDataToOsAsync& data)
{
    Partition* const partition = pFind(data.getLpId());
    if (partition == nullptr || data.getVssConnectionNumber() != kConnectionNumber) return false;
    if (partition->holder != &console || !partition->setUp) return false;
    if (data.getSerialDataLength() == 0) return true;
    mChanged = true;
    partition->input.append(data.getSerialData(), data.getSerialDataLength());
    pPumpInput(*partition);
    return true;
}

void PartitionSet::release(const ConsoleEntry& console)
{
    for (auto& entry : mPartitions) {
        Partition& partition = entry.second;
        if (partition.holder != &console) continue;
        partition.holder = nullptr;
        partition.setUp = false;
        mChanged = true;
    }
}

void PartitionSet::shutDown()
{
    for (auto& entry : mPartitions)
        pTakeDown(entry.second, CloseReason::CloseReasonQelShutdown);
}

bool PartitionSet::hasInputRoom(const ConsoleEntry& console) const
{
    for (const auto& entry : mPartitions) {
        const Partition& partition = entry.second;
        if (partition.holder == &console && partition.setUp && partition.input.size() >= kInputLimit) return false;
    }
    return true;
}

std::vector<SerialWatch> PartitionSet::watches() const
{
    std::vector<SerialWatch> watches;
    for (const auto& entry : mPartitions) {
        const Partition& partition = entry.second;
        if (!partition.isUp || pIsExiting(partition)) continue;
        const bool wantsInput = !partition.input.empty();
        const bool wantsOutput = pWantsOutput(partition);
        if (partition.holder != nullptr && !wantsInput && !wantsOutput) continue;
        // Without a session nothing is read, but a hang-up is noticed: poll(2) always reports it.
        PollFd fd(partition.line.descriptor(), PollEvents::Error);
        if (wantsInput) fd.mFd.events |= static_cast<short>(PollEvents::Write);
        if (wantsOutput) fd.mFd.events |= static_cast<short>(PollEvents::Read);
        watches.push_back({partition.id, fd});
    }
    return watches;
}

bool PartitionSet::takeChanged() { return std::exchange(mChanged, false); }

void PartitionSet::service(std::uint16_t id)
{
    Partition* const partition = pFind(id);
    if (partition == nullptr || !partition->isUp || pIsExiting(*partition)) return;
    if (partition->holder == nullptr && partition->line.hasHungUp()) return pBeginExit(*partition);
    pPumpInput(*partition);
    if (partition->isUp && pWantsOutput(*partition)) pPumpOutput(*partition);
}

bool PartitionSet::serviceEnded()
{
    bool anyLeft = false;
    for (auto& entry : mPartitions) {
        if (pIsExiting(entry.second) && !pFinishExit(entry.second)) anyLeft = true;
    }
    return anyLeft;
}

PartitionSet::Partition* PartitionSet::pFind(std::uint16_t id)
{
    const auto found = mPartitions.find(id);
    return found == mPartitions.end() ? nullptr : &found->second;
}

QelMessageStatusCodes PartitionSet::pFindPartition(std::uint16_t id, std::uint16_t connection, Partition*& partition)
{
    partition = pFind(id);
    if (partition == nullptr) return QelMessageStatusInvalidLparId;
    if (connection != kConnectionNumber) return QelMessageStatusInvalidConnectionNumber;
    return QelMessageStatusNoError;
}

bool PartitionSet::pStart(Partition& partition)
{
    if (pIsExiting(partition)) pEndLine(partition, partition.line.commandEnd().value_or(kClosedTerminal));
    if (partition.line.start()) {
        partition.isUp = true;
        return true;
    }
    // What had ended on the line could not be started again.
    if (partition.isUp && partition.line.descriptor() < 0) pTakeDown(partition, CloseReason::CloseReasonReadFailure);
    return false;
}

/// Ends the session, if there is one, with a notice to the console that holds it.
void PartitionSet::pEndSession(Partition& partition, CloseReason reason, const CommandEnd& end)
{
    ConsoleEntry* const holder = partition.holder;
    if (holder == nullptr) return;
    partition.holder = nullptr;
    partition.setUp = false;
    holder->link.post(closedNotice({partition.id, kConnectionNumber, reason}, end));
    mChanged = true;
    holder->link.resumeReading(); // it may have waited for this partition to take its input
}

/// Ends the session, with a notice, and takes the line down.
void PartitionSet::pTakeDown(Partition& partition, CloseReason reason, const CommandEnd& end)
{
    pEndSession(partition, reason, end);
    partition.input.clear();
    partition.exitDeadline = PollDeadline();
    partition.isUp = false;
    partition.line.stop();
}

/// The line has ended. Its command ends a moment later, unless it has only closed its terminal.
void PartitionSet::pBeginExit(Partition& partition)
{
    partition.exitDeadline = TimeProvider::steady() + kExitTimeout;
    static_cast<void>(pFinishExit(partition));
}

/// Takes the line of an ended command down. @return false: the command has not ended, and may take more time
bool PartitionSet::pFinishExit(Partition& partition)
{
    std::optional<CommandEnd> end = partition.line.commandEnd();
    if (!end) {
        if (!partition.exitDeadline.isExpired(TimeProvider::steady())) return false;
        end = kClosedTerminal;
    }
    pEndLine(partition, *end);
    return true;
}

/// Takes the line of a command down, logs how it ended, and ends the session.
void PartitionSet::pEndLine(Partition& partition, const CommandEnd& end)
{
    logLine(LogLevel::Info, "partition ", partition.id, ": ", describe(end),
            partition.holder == nullptr ? ", with no session open" : "");
    pTakeDown(partition, CloseReason::CloseReasonReadFailure, end);
}

void PartitionSet::pPumpInput(Partition& partition)
{
    if (partition.input.empty()) return;
    const bool wasFull = partition.input.size() >= kInputLimit;
    if (partition.line.hasHungUp()) partition.input.clear(); // nothing is left that reads it
    while (!partition.input.empty()) {
        const std::optional<std::size_t> taken = partition.line.write(partition.input.data(), partition.input.size());
        if (!taken) return pTakeDown(partition, CloseReason::CloseReasonWriteFailure);
        if (*taken == 0) break;
        partition.input.erase(0, *taken);
    }
    const bool isFull = partition.input.size() >= kInputLimit;
    if (wasFull && !isFull && partition.holder != nullptr) partition.holder->link.resumeReading();
}

void PartitionSet::pPumpOutput(Partition& partition)
{
    std::array<char, kOutputChunk> buffer;
    const SerialLine::ReadResult result = partition.line.read(buffer.data(), buffer.size());
    switch (result.state) {
    case SerialLine::LineState::Idle:
        return;
    case SerialLine::LineState::Ended:
        pBeginExit(partition);
        return;
    case SerialLine::LineState::Data:
        partition.holder->link.postSerial(std::make_unique<QelMessageVirtualSerialDataToDaxAsync>(
            partition.id, kConnectionNumber, static_cast<std::uint16_t>(result.length), buffer.data()));
        return;
    }
}

bool PartitionSet::pIsExiting(const Partition& partition) { return !partition.exitDeadline.isDisabled(); }

bool PartitionSet::pWantsOutput(const Partition& partition)
{
    return partition.holder != nullptr && partition.setUp && partition.holder->link.hasSerialRoom();
}

} // namespace qel::protocol
