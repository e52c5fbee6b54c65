#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/common/util/Poll.hpp>
#include <qel/protocol/Hypervisor.hpp>
#include <qel/protocol/ServerState.hpp>

#include "hypervisor/ConsoleEntry.hpp"
#include "hypervisor/PartitionSet.hpp"

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace qel::protocol {

/// What follows from a message for the reader of its connection.
struct Received {
    ConsoleState state; ///< of the connection
    /// False while the next message has to wait: the console's responses wait for room, or too much input waits for its
    /// partition.
    bool mayReadNext;
};

/// When a console that says nothing is let go.
struct IdleLimits {
    std::chrono::steady_clock::duration timeout{0};                      ///< after its newest message; 0: never
    std::chrono::steady_clock::duration linger{std::chrono::seconds(2)}; ///< to take what is queued for it
};

/// The logic of the hypervisor end, without input or output: which response each request gets, and which console holds
/// which session. Messages come in through receive(); responses and notices go out through the consoles' links, serial
/// data through the partitions' lines. What is specific to a machine it asks the user's Hypervisor; what that throws is
/// logged, and the request is answered with status 6. docs/connection.md describes the rules.
///
/// Thread safety: any thread may call any operation. One lock guards everything. The user's object, links and lines are
/// called with it held and do not block, so it is never held for long. Lock order: this lock, then the locks of links,
/// lines and the user's object, then the logger's.
class HypervisorEngine {
public:
    /// The default maximum of consoles.
    static constexpr std::uint8_t kDefaultMaxConsoles = 16;

    /// @param machine  borrowed; must outlive this object
    /// @param maxConsoles  identified at a time; more than 0
    /// @param wakeSerial  called, with the lock held, when serialWatches() may have changed
    /// @throws std::logic_error  another engine serves the machine
    HypervisorEngine(Hypervisor& machine, std::uint8_t maxConsoles, std::function<void()> wakeSerial,
                     IdleLimits idle = {});

    /// Takes the partitions' lines down. All connections must have been disconnected.
    ~HypervisorEngine();
    HypervisorEngine(const HypervisorEngine&) = delete;
    HypervisorEngine& operator=(const HypervisorEngine&) = delete;

    /// Adds a connection.
    /// @param link  borrowed until disconnect() has returned
    /// @param peer  address, certificate and protection of the connection; the id is assigned here
    ConsoleId connect(ConsoleLink& link, Peer peer);

    /// Acts on a message of a console.
    /// @return what follows for the reader of the connection
    Received receive(ConsoleId id, const QelMessage& message);

    /// Whether the next message of a console may be read, for a reader that waits because receive() has said no.
    /// ConsoleLink::resumeReading() says when to ask again.
    bool mayReceive(ConsoleId id) const;

    /// False when another console would be refused: the maximum is connected, or the hypervisor shuts down.
    bool takesConsoles() const;

    /// Forgets a connection; its sessions end. Its link is not called afterwards. Unknown ids are ignored.
    /// @param why  as far as the connection knows: a reason of the hypervisor's own comes first
    void disconnect(ConsoleId id, DisconnectReason why = DisconnectReason::Closed);

    /// To be called when a link has room again.
    void outputDrained();

    /// Sends every console the notices of the shutdown, ends the connections, and takes the partitions' lines down.
    /// Later connections are ended at once.
    void shutDown();

    /// What the serial thread has to wait for.
    std::vector<SerialWatch> serialWatches() const;

    /// Moves the serial data of one partition. This and the next one belong to one thread; they call the taps, without
    /// the lock.
    void serviceSerial(std::uint16_t partition);

    /// Does what is due on all partitions, see PartitionSet::serviceTime(), and lets consoles go that say nothing.
    /// @return when to call it again at the latest: from now; negative: when serialWatches() have changed
    std::chrono::milliseconds serviceLines();

    // Partitions, while consoles are served: see Server.

    void addPartition(std::uint16_t id, std::unique_ptr<SerialLine> line, PartitionOptions options);
    bool changePartition(std::uint16_t id, const PartitionOptions& options);
    bool removePartition(std::uint16_t id);
    std::vector<PartitionState> partitions() const;
    /// Who is connected: see Server::state().
    std::vector<ConnectedConsole> consoles() const;
    bool closeSession(std::uint16_t partition, std::uint16_t number);
    bool sendBreak(std::uint16_t partition);

private:
    using Reply = std::unique_ptr<QelMessage>;
    using TimePoint = std::chrono::steady_clock::time_point;
    /// The type and the id of a console's tool.
    using ToolName = std::pair<std::uint32_t, std::string>;
    /// The identity of a request: function and operation.
    using RequestId = std::pair<unsigned short, unsigned short>;

    template <typename T>
    using Handler = Reply (HypervisorEngine::*)(ConsoleEntry&, const T&);

    /// How a request is handled.
    struct Rule {
        Handler<QelMessage> serve = nullptr;
        bool needsSession = false; ///< the hypervisor session must be open
    };
    using Rules = std::map<RequestId, Rule>;

    template <typename T, Handler<T> kHandler>
    static Rules::value_type pRule(bool needsSession = false);
    static const Rules& pRules();
    static bool pKnowsFunction(unsigned short function);

    bool pMayReceive(const ConsoleEntry& console) const QEL_REQUIRES(mMutex);
    void pHandleRequest(ConsoleEntry& console, const QelMessage& request) QEL_REQUIRES(mMutex);
    void pHandleNotice(ConsoleEntry& console, const QelMessage& notice) QEL_REQUIRES(mMutex);
    Reply pAnswer(ConsoleEntry& console, const QelMessage& request) QEL_REQUIRES(mMutex);
    QelMessageStatusCodes pAdmit(const ConsoleEntry& console, const QelMessage& request, const Rule*& rule) const
        QEL_REQUIRES(mMutex);
    template <typename T, Handler<T> kHandler>
    Reply pServe(ConsoleEntry& console, const QelMessage& message) QEL_REQUIRES(mMutex);
    void pAnnounce(ConsoleEntry& console) QEL_REQUIRES(mMutex);
    QelMessageStatusCodes pMayUse(const ConsoleEntry& console, std::uint16_t partition) QEL_REQUIRES(mMutex);
    QelMessageStatusCodes pMayReach(const ConsoleEntry& console, std::uint16_t partition, std::uint16_t number)
        QEL_REQUIRES(mMutex);
    void pTellTaps();
    void pWakeIfChanged() QEL_REQUIRES(mMutex);

    // One operation for each request; they return the response.
    Reply pVersion(ConsoleEntry&, const QelMessageGetEnclTypeAndInterfaceVersionReq&) QEL_REQUIRES(mMutex);
    Reply pOpenSession(ConsoleEntry&, const QelMessageInterfaceCmpOpenKrogSessionReq&) QEL_REQUIRES(mMutex);
    Reply pCloseSession(ConsoleEntry&, const QelMessageInterfaceCmpCloseKrogSessionReq&) QEL_REQUIRES(mMutex);
    Reply pCapabilities(ConsoleEntry&, const QelMessageExchIntCapabilitiesReq&) QEL_REQUIRES(mMutex);
    Reply pLimits(ConsoleEntry&, const QelMessageGetInterfaceLimitsReq&) QEL_REQUIRES(mMutex);
    Reply pBroadcast(ConsoleEntry&, const QelMessageDaxBroadcastReq&) QEL_REQUIRES(mMutex);
    Reply pTime(ConsoleEntry&, const QelMessageGetQelTodReq&) QEL_REQUIRES(mMutex);
    Reply pSetMode(ConsoleEntry&, const QelMessageSetGlobalModeAttributeReq&) QEL_REQUIRES(mMutex);
    Reply pGetMode(ConsoleEntry&, const QelMessageGetGlobalModeAttributeReq&) QEL_REQUIRES(mMutex);
    Reply pSetMetadata(ConsoleEntry&, const QelMessageSetGlobalSaveAreaMetadataReq&) QEL_REQUIRES(mMutex);
    Reply pGetMetadata(ConsoleEntry&, const QelMessageGetGlobalSaveAreaMetadataReq&) QEL_REQUIRES(mMutex);
    Reply pOpenSerial(ConsoleEntry&, const QelMessageVirtualSerialOpenReq&) QEL_REQUIRES(mMutex);
    Reply pCloseSerial(ConsoleEntry&, const QelMessageVirtualSerialCloseReq&) QEL_REQUIRES(mMutex);
    Reply pMaxSerialSessions(ConsoleEntry&, const QelMessageVirtualSerialGetMaxSessionsReq&) QEL_REQUIRES(mMutex);
    Reply pSetUpSerial(ConsoleEntry&, const QelMessageVirtualSerialSetupSessionReq&) QEL_REQUIRES(mMutex);

    ConsoleEntry* pFindIdentified(const ToolName& name) QEL_REQUIRES(mMutex);
    void pForgetIdentified(const ConsoleEntry& console) QEL_REQUIRES(mMutex);
    bool pSendBroadcast(ConsoleEntry& to, const ConsoleEntry& from, const QelMessageDaxBroadcastReq&)
        QEL_REQUIRES(mMutex);
    void pRefuseUpgrade(ConsoleEntry& console) QEL_REQUIRES(mMutex);
    void pClose(ConsoleEntry& console) QEL_REQUIRES(mMutex);
    void pNoteHeard(ConsoleEntry& console, const QelMessage& message) QEL_REQUIRES(mMutex);
    void pServiceIdle(TimePoint now) QEL_REQUIRES(mMutex);
    PollDeadline pServiceIdle(ConsoleEntry& console, TimePoint now) QEL_REQUIRES(mMutex);
    void pLetGo(ConsoleEntry& console, TimePoint now) QEL_REQUIRES(mMutex);

    Hypervisor& mMachine;
    const std::uint8_t mMaxConsoles;
    const std::function<void()> mWakeSerial;
    const IdleLimits mIdle;

    mutable Mutex mMutex;
    PartitionSet mPartitions QEL_GUARDED_BY(mMutex);
    std::map<ConsoleId, ConsoleEntry> mConsoles QEL_GUARDED_BY(mMutex);
    // Those in the state Identified, by what they say about themselves. A look at each console would be most of the
    // engine's work on a message between two of many.
    std::map<ToolName, ConsoleEntry*> mIdentified QEL_GUARDED_BY(mMutex);
    ConsoleId mLastConsoleId QEL_GUARDED_BY(mMutex) = 0;
    bool mShutDown QEL_GUARDED_BY(mMutex) = false;
    PollDeadline mLookAtIdle QEL_GUARDED_BY(mMutex); // not later than a console is to be let go or cut
};

} // namespace qel::protocol
