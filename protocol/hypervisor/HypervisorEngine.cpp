#include "hypervisor/HypervisorEngine.hpp"

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageGeneric.hpp>
#include <qel/common/util/TimeProvider.hpp>
#include <qel/protocol/FrameLimits.hpp>
#include <qel/protocol/Logging.hpp>

#include "base/Guard.hpp"
#include "base/MessageKind.hpp"
#include "hypervisor/DeferredWakeUps.hpp"
#include "hypervisor/HypervisorImpl.hpp"

#include <algorithm>
#include <chrono>
#include <limits>
#include <stdexcept>
#include <type_traits>
#include <utility>

namespace qel::protocol {

namespace {

/// The broadcast type for a single addressee.
constexpr std::uint8_t kUnicast = 1;

/// Bytes of capability bits in an answer: one for every eight of the 32.
constexpr std::uint32_t kCapabilityBytes = QelCapabilities::size() / 8;

/// Output that the serial thread sends itself.
constexpr std::uint64_t kShortOutput = 256;

/// Where the limits response says how many consoles are supported: offset from the first payload byte.
constexpr std::size_t kConsolesSupportedOffset = 8;

/// A response without payload, for a refused request or one that has no response class.
std::unique_ptr<QelMessage> bareResponse(const QelMessage& request, QelMessageStatusCodes status)
{
    auto response = std::make_unique<QelMessageGeneric>(request.getCallerId(), request.getFunction(),
                                                        request.getOperation(), MsgResponse);
    response->setStatus(status);
    return response;
}

QelCapabilities intersection(const QelCapabilities& left, const QelCapabilities& right)
{
    QelCapabilities both;
    for (std::size_t i = 0; i < QelCapabilities::size(); ++i) {
        if (left[i] && right[i]) both.set(i);
    }
    return both;
}

} // namespace

HypervisorEngine::HypervisorEngine(Hypervisor& machine, std::uint8_t maxConsoles, std::function<void()> wakeSerial,
                                   IdleLimits idle)
    : mMachine(machine), mMaxConsoles(maxConsoles), mWakeSerial(std::move(wakeSerial)), mIdle(idle)
{
    const MutexLock lock(mMutex);
    for (const auto& entry : mMachine.mImpl->partitions)
        mPartitions.add(entry.first, *entry.second.line, entry.second.options);
    if (mMachine.mImpl->served.exchange(true)) throw std::logic_error("a server serves this hypervisor");
}

HypervisorEngine::~HypervisorEngine()
{
    pTellTaps();
    mMachine.mImpl->served = false;
}

ConsoleId HypervisorEngine::connect(ConsoleLink& link, Peer peer)
{
    const MutexLock lock(mMutex);
    const ConsoleId id = ++mLastConsoleId;
    peer.id = id;
    ConsoleEntry& console = mConsoles.emplace(id, ConsoleEntry(std::move(peer), link)).first->second;
    logLine(LogLevel::Info, "console ", id, " connected from ", console.peer.address);
    if (mShutDown) pClose(console);
    return id;
}

Received HypervisorEngine::receive(ConsoleId id, const QelMessage& message)
{
    const DeferredWakeUps wakeUps; // until the lock is released
    const MutexLock lock(mMutex);
    const auto found = mConsoles.find(id);
    if (found == mConsoles.end()) return {ConsoleState::Closing, true};
    ConsoleEntry& console = found->second;
    if (console.state == ConsoleState::Closing) return {console.state, pMayReceive(console)};
    pNoteHeard(console, message);
    switch (message.getClassification()) {
    case QelMessageClassification::Request:
        pHandleRequest(console, message);
        break;
    case QelMessageClassification::Async:
        pHandleNotice(console, message);
        break;
    default: // this end sends no requests, so a response answers none; or the flags contradict each other
        logLine(LogLevel::Warn, "console ", id, ": ignored ", message.getLogID());
        break;
    }
    pWakeIfChanged();
    return {console.state, pMayReceive(console)};
}

bool HypervisorEngine::mayReceive(ConsoleId id) const
{
    const MutexLock lock(mMutex);
    const auto found = mConsoles.find(id);
    return found == mConsoles.end() || pMayReceive(found->second);
}

bool HypervisorEngine::takesConsoles() const
{
    const MutexLock lock(mMutex);
    return !mShutDown && mIdentified.size() < mMaxConsoles;
}

void HypervisorEngine::outputDrained()
{
    const MutexLock lock(mMutex);
    mWakeSerial();
}

std::vector<SerialWatch> HypervisorEngine::serialWatches() const
{
    const MutexLock lock(mMutex);
    return mPartitions.watches();
}

void HypervisorEngine::serviceSerial(std::uint16_t partition)
{
    {
        DeferredWakeUps wakeUps; // until the lock is released
        const MutexLock lock(mMutex);
        const std::uint64_t bytes = mPartitions.service(partition);
        // The echo of a key needs no turn of one more thread. With more, the writer sends while this thread reads on.
        if (bytes <= kShortOutput) wakeUps.change(DeferredWakeUps::How::SendForOne);
    }
    pTellTaps();
}

std::chrono::milliseconds HypervisorEngine::serviceLines()
{
    std::chrono::milliseconds timeout;
    {
        const DeferredWakeUps wakeUps; // until the lock is released
        const MutexLock lock(mMutex);
        const auto now = TimeProvider::steady();
        mPartitions.serviceTime(now);
        if (mLookAtIdle.isExpired(now)) pServiceIdle(now);
        timeout = std::min(mPartitions.nextDeadline(now), mLookAtIdle).getTimeout(now);
        static_cast<void>(mPartitions.takeChanged()); // the caller asks for the watches next
    }
    pTellTaps();
    return timeout;
}

/// Tells the taps what has happened since the last call, in order: the serial thread is the only one that calls it.
void HypervisorEngine::pTellTaps()
{
    std::vector<TapCall> calls;
    {
        const MutexLock lock(mMutex);
        calls = mPartitions.takeTapCalls();
    }
    for (const TapCall& call : calls) {
        if (call.isOutput) {
            call.tap->onOutput(call.partition, call.text.data(), call.text.size());
        } else {
            call.tap->onEvent(call.partition, call.text);
        }
    }
}

void HypervisorEngine::addPartition(std::uint16_t id, std::unique_ptr<SerialLine> line, PartitionOptions options)
{
    PartitionPlan plan{std::move(line), std::move(options)};
    checkPartition(plan);
    const MutexLock lock(mMutex);
    if (mShutDown) throw std::logic_error("the server has finished");
    auto& plans = mMachine.mImpl->partitions;
    const auto added = plans.emplace(id, std::move(plan));
    if (!added.second) throw std::invalid_argument("partition");
    try {
        mPartitions.add(id, *added.first->second.line, added.first->second.options);
    } catch (...) {
        plans.erase(added.first);
        throw;
    }
    logLine(LogLevel::Info, "partition ", id, ": added");
    pWakeIfChanged();
}

bool HypervisorEngine::changePartition(std::uint16_t id, const PartitionOptions& options)
{
    if (options.replayBytes > PartitionOptions::kMaxReplayBytes) throw std::invalid_argument("replayBytes");
    const MutexLock lock(mMutex);
    PartitionOptions kept = options;
    const bool isThere = mPartitions.change(id, options);
    // Not to keep the old tap, such as the log of a line, as long as the partition.
    if (isThere) mMachine.mImpl->partitions.at(id).options.tap.swap(kept.tap);
    pWakeIfChanged();
    return isThere;
}

bool HypervisorEngine::removePartition(std::uint16_t id)
{
    decltype(mMachine.mImpl->partitions)::node_type plan; // destroyed without the lock: its command may take its time
    const DeferredWakeUps wakeUps;
    const MutexLock lock(mMutex);
    if (!mPartitions.remove(id)) return false;
    plan = mMachine.mImpl->partitions.extract(id);
    logLine(LogLevel::Info, "partition ", id, ": removed");
    pWakeIfChanged();
    return true;
}

std::vector<PartitionState> HypervisorEngine::partitions() const
{
    const MutexLock lock(mMutex);
    return mPartitions.states();
}

std::vector<ConnectedConsole> HypervisorEngine::consoles() const
{
    const MutexLock lock(mMutex);
    std::vector<ConnectedConsole> consoles(mConsoles.size());
    auto next = consoles.begin();
    for (const auto& entry : mConsoles) {
        next->peer = entry.second.peer;
        next->isIdentified = entry.second.announced;
        ++next;
    }
    return consoles;
}

bool HypervisorEngine::closeSession(std::uint16_t partition, std::uint16_t number)
{
    const DeferredWakeUps wakeUps;
    const MutexLock lock(mMutex);
    const bool wasOpen = mPartitions.endSession(partition, number);
    pWakeIfChanged();
    return wasOpen;
}

bool HypervisorEngine::sendBreak(std::uint16_t partition)
{
    const MutexLock lock(mMutex);
    const bool sent = mPartitions.sendBreak(partition);
    pWakeIfChanged();
    return sent;
}

void HypervisorEngine::pWakeIfChanged()
{
    if (mPartitions.takeChanged()) mWakeSerial();
}

template <typename T, HypervisorEngine::Handler<T> kHandler>
HypervisorEngine::Rules::value_type HypervisorEngine::pRule(bool needsSession)
{
    const auto identity = T::getMessageID();
    return {RequestId(std::get<0>(identity), std::get<1>(identity)),
            {&HypervisorEngine::pServe<T, kHandler>, needsSession}};
}

const HypervisorEngine::Rules& HypervisorEngine::pRules()
{
    constexpr bool kNeedsSession = true;
    static const Rules rules{
        pRule<QelMessageGetEnclTypeAndInterfaceVersionReq, &HypervisorEngine::pVersion>(),
        pRule<QelMessageInterfaceCmpOpenKrogSessionReq, &HypervisorEngine::pOpenSession>(),
        pRule<QelMessageInterfaceCmpCloseKrogSessionReq, &HypervisorEngine::pCloseSession>(),
        pRule<QelMessageExchIntCapabilitiesReq, &HypervisorEngine::pCapabilities>(),
        pRule<QelMessageGetInterfaceLimitsReq, &HypervisorEngine::pLimits>(),
        pRule<QelMessageDaxBroadcastReq, &HypervisorEngine::pBroadcast>(),
        pRule<QelMessageGetQelTodReq, &HypervisorEngine::pTime>(),
        pRule<QelMessageSetGlobalModeAttributeReq, &HypervisorEngine::pSetMode>(),
        pRule<QelMessageGetGlobalModeAttributeReq, &HypervisorEngine::pGetMode>(),
        pRule<QelMessageSetGlobalSaveAreaMetadataReq, &HypervisorEngine::pSetMetadata>(),
        pRule<QelMessageGetGlobalSaveAreaMetadataReq, &HypervisorEngine::pGetMetadata>(),
        pRule<QelMessageVirtualSerialOpenReq, &HypervisorEngine::pOpenSerial>(kNeedsSession),
        pRule<QelMessageVirtualSerialCloseReq, &HypervisorEngine::pCloseSerial>(kNeedsSession),
        pRule<QelMessageVirtualSerialGetMaxSessionsReq, &HypervisorEngine::pMaxSerialSessions>(kNeedsSession),
        pRule<QelMessageVirtualSerialSetupSessionReq, &HypervisorEngine::pSetUpSerial>(kNeedsSession),
    };
    return rules;
}

bool HypervisorEngine::pKnowsFunction(unsigned short function)
{
    const auto first = pRules().lower_bound(RequestId(function, static_cast<unsigned short>(0)));
    return first != pRules().end() && first->first.first == function;
}

bool HypervisorEngine::pMayReceive(const ConsoleEntry& console) const
{
    return console.link.hasRoom() && mPartitions.hasInputRoom(console);
}

void HypervisorEngine::pHandleRequest(ConsoleEntry& console, const QelMessage& request)
{
    Reply reply = pAnswer(console, request);
    const QelMessageStatusCodes status = reply->getStatus();
    if (status != QelMessageStatusNoError) {
        logLine(LogLevel::Info, "console ", console.peer.id, ": refused ", request.getLogID(), ": ", status);
    }
    console.link.post(std::move(reply));
    static_cast<void>(
        runGuarded([&] { mMachine.onAnswered(console.peer, request, status); }, "console ", console.peer.id));
    if (console.state == ConsoleState::Identified) return pAnnounce(console);
    if (status == QelMessageStatusTooManyConnections) pClose(console);
}

/// The response to a request, whatever the operations of the user's object throw.
HypervisorEngine::Reply HypervisorEngine::pAnswer(ConsoleEntry& console, const QelMessage& request)
{
    try {
        const Rule* rule = nullptr;
        const QelMessageStatusCodes refusal = pAdmit(console, request, rule);
        if (refusal != QelMessageStatusNoError) return bareResponse(request, refusal);
        return (this->*rule->serve)(console, request);
    } catch (...) {
        logCurrent("console ", console.peer.id, ": cannot serve ", request.getLogID());
        return bareResponse(request, QelMessageStatusCmdFailed);
    }
}

/// Tells the user's object once that a console is there.
void HypervisorEngine::pAnnounce(ConsoleEntry& console)
{
    if (std::exchange(console.announced, true)) return;
    static_cast<void>(runGuarded([&] { mMachine.onConnected(console.peer); }, "console ", console.peer.id));
}

void HypervisorEngine::pHandleNotice(ConsoleEntry& console, const QelMessage& notice)
{
    const auto* data = dynamic_cast<const QelMessageVirtualSerialDataToOsAsync*>(&notice);
    if (data != nullptr && mPartitions.feed(console, *data)) return;
    if (isKind<QelMessageUpgradeConnectionAsync>(notice)) return pRefuseUpgrade(console);
    logLine(LogLevel::Warn, "console ", console.peer.id, ": ignored ", notice.getLogID());
}

/// A console asks for TLS on a plain connection, or inside TLS. It waits for an answer, so it gets one.
void HypervisorEngine::pRefuseUpgrade(ConsoleEntry& console)
{
    logLine(LogLevel::Warn, "console ", console.peer.id, ": closed, it asked for TLS, which is not done here");
    console.end = DisconnectReason::Protocol;
    console.link.post(std::make_unique<QelMessageAbortHandshakeAsync>());
    pClose(console);
}

/// The checks that are the same for all requests. @param rule  set when they pass
QelMessageStatusCodes HypervisorEngine::pAdmit(const ConsoleEntry& console, const QelMessage& request,
                                               const Rule*& rule) const
{
    const bool isVersion = isKind<QelMessageGetEnclTypeAndInterfaceVersionReq>(request);
    // The version request comes first and comes once. Before it every other request gets the same status, so that an
    // unidentified peer cannot find out which requests exist.
    if (isVersion != (console.state == ConsoleState::Connected)) return QelMessageStatusInvalidCmdSequence;
    if (!pKnowsFunction(request.getFunction())) return QelMessageStatusInvalidFunction;
    const auto found = pRules().find(RequestId(request.getFunction(), request.getOperation()));
    if (found == pRules().end()) return QelMessageStatusInvalidOperation;
    if (found->second.needsSession && !console.sessionOpen) return QelMessageStatusInvalidCmdSequence;
    rule = &found->second;
    return QelMessageStatusNoError;
}

/// Serves a request of class T. One that has T's identity and another class did not parse.
template <typename T, HypervisorEngine::Handler<T> kHandler>
HypervisorEngine::Reply HypervisorEngine::pServe(ConsoleEntry& console, const QelMessage& message)
{
    const auto* request = dynamic_cast<const T*>(&message);
    if (request == nullptr) return bareResponse(message, QelMessageStatusInvalidData);
    if constexpr (std::is_same_v<T, QelMessageGetEnclTypeAndInterfaceVersionReq>) {
        console.peer.toolType = request->getToolType();
        console.peer.toolId = request->getToolId();
    }
    const QelMessageStatusCodes decision = mMachine.mayRequest(console.peer, *request);
    if (decision != QelMessageStatusNoError) return bareResponse(message, decision);
    return (this->*kHandler)(console, *request);
}

HypervisorEngine::Reply HypervisorEngine::pVersion(ConsoleEntry& console,
                                                   const QelMessageGetEnclTypeAndInterfaceVersionReq& request)
{
    if (pFindIdentified({request.getToolType(), request.getToolId()}) != nullptr) {
        return bareResponse(request, QelMessageStatusDaxAlreadyConnected);
    }
    if (mIdentified.size() >= mMaxConsoles) return bareResponse(request, QelMessageStatusTooManyConnections);
    const MachineInfo machine = mMachine.machine();
    auto response = std::make_unique<QelMessageGetEnclTypeAndInterfaceVersionRsp>(
        request.getCallerId(), machine.interfaceFamily, machine.majorVersion, machine.minorVersion, machine.machineType,
        machine.serialNumber);
    mIdentified.emplace(ToolName(request.getToolType(), request.getToolId()), &console);
    console.state = ConsoleState::Identified;
    pNoteHeard(console, request);
    return response;
}

HypervisorEngine::Reply HypervisorEngine::pOpenSession(ConsoleEntry& console,
                                                       const QelMessageInterfaceCmpOpenKrogSessionReq& request)
{
    if (console.sessionOpen) return bareResponse(request, QelMessageStatusKrogSessionAlreadyOpen);
    console.sessionOpen = true;
    return std::make_unique<QelMessageInterfaceCmpOpenKrogSessionRsp>(request.getCallerId());
}

HypervisorEngine::Reply HypervisorEngine::pCloseSession(ConsoleEntry& console,
                                                        const QelMessageInterfaceCmpCloseKrogSessionReq& request)
{
    if (!console.sessionOpen) return bareResponse(request, QelMessageStatusInvalidCmdSequence);
    console.sessionOpen = false;
    mPartitions.release(console);
    return std::make_unique<QelMessageInterfaceCmpCloseKrogSessionRsp>(request.getCallerId());
}

HypervisorEngine::Reply HypervisorEngine::pCapabilities(ConsoleEntry&, const QelMessageExchIntCapabilitiesReq& request)
{
    return std::make_unique<QelMessageExchIntCapabilitiesRsp>(
        request.getCallerId(), kCapabilityBytes, intersection(request.getCapabilities(), mMachine.capabilities()));
}

HypervisorEngine::Reply HypervisorEngine::pLimits(ConsoleEntry&, const QelMessageGetInterfaceLimitsReq& request)
{
    const QelMessageGetInterfaceLimitsRsp response(request.getCallerId());
    if (mMaxConsoles == QelMessageGetInterfaceLimitsRsp::DAXS_SUPPORTED) return response.clone();
    // The class writes the protocol's own number of consoles; the number that this server allows replaces it.
    std::string payload(response.getData(), response.dataLength());
    payload[kConsolesSupportedOffset] = static_cast<char>(mMaxConsoles);
    auto changed = std::make_unique<QelMessageGeneric>(response);
    changed->setData(payload.data(), static_cast<unsigned int>(payload.size()));
    return changed;
}

HypervisorEngine::Reply HypervisorEngine::pBroadcast(ConsoleEntry& console, const QelMessageDaxBroadcastReq& request)
{
    if (request.getBroadcastMsgLen() > kMaxBroadcast) return bareResponse(request, QelMessageStatusInvalidData);
    if (request.getBroadcastMode() == kUnicast) {
        ConsoleEntry* const addressee = pFindIdentified({request.getToolType(), request.getToolId()});
        if (addressee == nullptr || addressee == &console) {
            return bareResponse(request, QelMessageStatusConnectionNotAvailable);
        }
        if (!pSendBroadcast(*addressee, console, request)) return bareResponse(request, QelMessageStatusCmdFailed);
    } else {
        for (auto& entry : mConsoles) {
            ConsoleEntry& other = entry.second;
            if (&other != &console && other.state == ConsoleState::Identified) {
                static_cast<void>(pSendBroadcast(other, console, request));
            }
        }
    }
    return std::make_unique<QelMessageDaxBroadcastRsp>(request.getCallerId());
}

HypervisorEngine::Reply HypervisorEngine::pTime(ConsoleEntry&, const QelMessageGetQelTodReq& request)
{
    const std::time_t now = std::chrono::system_clock::to_time_t(mMachine.currentTime());
    return std::make_unique<QelMessageGetQelTodRsp>(request.getCallerId(), now);
}

HypervisorEngine::Reply HypervisorEngine::pSetMode(ConsoleEntry& console,
                                                   const QelMessageSetGlobalModeAttributeReq& request)
{
    // A longer text would make a response that the console that reads the mode must not accept.
    if (request.getMTMSLen() > kMaxMtms) return bareResponse(request, QelMessageStatusInvalidData);
    mMachine.setMode(console.peer, {request.getMode(), request.getMTMS()});
    return bareResponse(request, QelMessageStatusNoError); // 0x0108 has no response class
}

HypervisorEngine::Reply HypervisorEngine::pGetMode(ConsoleEntry&, const QelMessageGetGlobalModeAttributeReq& request)
{
    const GlobalMode mode = mMachine.getMode();
    if (mode.mtms.size() > kMaxMtms) throw std::length_error("the text of the mode does not fit a response");
    return std::make_unique<QelMessageGetGlobalModeAttributeRsp>(request.getCallerId(), mode.mode, mode.mtms);
}

HypervisorEngine::Reply HypervisorEngine::pSetMetadata(ConsoleEntry& console,
                                                       const QelMessageSetGlobalSaveAreaMetadataReq& request)
{
    if (request.getMetadataLen() > kMaxMetadata) return bareResponse(request, QelMessageStatusInvalidData);
    mMachine.setMetadata(console.peer, request.getMetadata());
    return std::make_unique<QelMessageSetGlobalSaveAreaMetadataRsp>(request.getCallerId());
}

HypervisorEngine::Reply HypervisorEngine::pGetMetadata(ConsoleEntry&,
                                                       const QelMessageGetGlobalSaveAreaMetadataReq& request)
{
    const std::string metadata = mMachine.getMetadata();
    if (metadata.size() > kMaxMetadata) throw std::length_error("the metadata do not fit a response");
    return std::make_unique<QelMessageGetGlobalSaveAreaMetadataRsp>(request.getCallerId(), metadata);
}

/// Whether a console may use a partition. For one that may not, the partition does not exist.
QelMessageStatusCodes HypervisorEngine::pMayUse(const ConsoleEntry& console, std::uint16_t partition)
{
    const bool mayUse = mPartitions.has(partition) && mMachine.mayOpen(console.peer, partition);
    return mayUse ? QelMessageStatusNoError : QelMessageStatusInvalidLparId;
}

/// The same for a session that may be open: a console that holds it is not asked about again.
QelMessageStatusCodes HypervisorEngine::pMayReach(const ConsoleEntry& console, std::uint16_t partition,
                                                  std::uint16_t number)
{
    if (mPartitions.isHeldBy(console, partition, number)) return QelMessageStatusNoError;
    return pMayUse(console, partition);
}

HypervisorEngine::Reply HypervisorEngine::pOpenSerial(ConsoleEntry& console,
                                                      const QelMessageVirtualSerialOpenReq& request)
{
    auto status = pMayUse(console, request.getLpId());
    if (status == QelMessageStatusNoError) {
        status = mPartitions.open(console, request.getLpId(), request.getVssConnectionNumber(), request.isForceOpen());
    }
    if (status != QelMessageStatusNoError) return bareResponse(request, status);
    return std::make_unique<QelMessageVirtualSerialOpenRsp>(request.getCallerId(), request.getLpId(),
                                                            request.getVssConnectionNumber());
}

HypervisorEngine::Reply HypervisorEngine::pCloseSerial(ConsoleEntry& console,
                                                       const QelMessageVirtualSerialCloseReq& request)
{
    auto status = pMayReach(console, request.getLpId(), request.getVssConnectionNumber());
    if (status == QelMessageStatusNoError) {
        status =
            mPartitions.close(console, request.getLpId(), request.getVssConnectionNumber(), request.isForceClose());
    }
    if (status != QelMessageStatusNoError) return bareResponse(request, status);
    return std::make_unique<QelMessageVirtualSerialCloseRsp>(request.getCallerId());
}

HypervisorEngine::Reply HypervisorEngine::pMaxSerialSessions(ConsoleEntry&,
                                                             const QelMessageVirtualSerialGetMaxSessionsReq& request)
{
    constexpr std::uint16_t kSystems = 1; // this one
    constexpr std::size_t kMax = std::numeric_limits<std::uint8_t>::max();
    const auto partitions = static_cast<std::uint8_t>(std::min(mPartitions.size(), kMax));
    return std::make_unique<QelMessageVirtualSerialGetMaxSessionsRsp>(request.getCallerId(), kSystems, partitions);
}

HypervisorEngine::Reply HypervisorEngine::pSetUpSerial(ConsoleEntry& console,
                                                       const QelMessageVirtualSerialSetupSessionReq& request)
{
    auto status = pMayReach(console, request.getLpId(), request.getVssConnectionNumber());
    if (status == QelMessageStatusNoError) {
        status = mPartitions.setUp(console, request.getLpId(), request.getVssConnectionNumber());
    }
    if (status != QelMessageStatusNoError) return bareResponse(request, status);
    return std::make_unique<QelMessageVirtualSerialSetupSessionRsp>(request.getCallerId());
}

ConsoleEntry* HypervisorEngine::pFindIdentified(const ToolName& name)
{
    const auto found = mIdentified.find(name);
    return found == mIdentified.end() ? nullptr : found->second;
}

/// @return false: the console's queue is full, and it did not get the broadcast
bool HypervisorEngine::pSendBroadcast(ConsoleEntry& to, const ConsoleEntry& from,
                                      const QelMessageDaxBroadcastReq& request)
{
    if (to.link.offer(
            std::make_unique<QelMessageDaxBroadcastOutboundAsync>(request, from.peer.toolId, from.peer.toolType))) {
        return true;
    }
    logLine(LogLevel::Warn, "console ", to.peer.id, ": too slow for a broadcast of console ", from.peer.id);
    return false;
}

} // namespace qel::protocol
