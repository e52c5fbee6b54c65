#pragma once

#include <qel/common/QelCapabilities.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/Mutex.hpp>

#include "hypervisor/ConsoleEntry.hpp"
#include "hypervisor/PartitionSet.hpp"

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace qel::protocol {

/// What the hypervisor end reports about itself, and how many consoles it takes.
struct HypervisorSettings {
    char interfaceFamily = 'Q';
    std::uint16_t majorVersion = 1;
    std::uint16_t minorVersion = 0;
    std::string machineType = "QEL-SERVE"; ///< at most 16 bytes
    std::string serialNumber = "0000001";  ///< at most 16 bytes
    QelCapabilities capabilities;
    std::uint8_t maxConsoles = 16; ///< identified at a time; more than 0
};

/// What follows from a message for the reader of its connection.
struct Received {
    ConsoleState state; ///< of the connection
    /// False while the next message has to wait: the console's responses wait for room, or too much input waits for its
    /// partition.
    bool mayReadNext;
};

/// The logic of the hypervisor end, without input or output: which response each request gets, and which console holds
/// which session. Messages come in through receive(); responses and notices go out through the consoles' links, serial
/// data through the partitions' ports. docs/connection.md describes the rules.
///
/// Thread safety: any thread may call any operation. One lock guards everything. Links and ports are called with it
/// held and do not block, so it is never held for long. Lock order: this lock, then the locks of links and ports, then
/// the logger's.
class HypervisorEngine {
public:
    /// @param wakeSerial  called, with the lock held, when serialWatches() may have changed
    HypervisorEngine(HypervisorSettings settings, PartitionSet partitions, std::function<void()> wakeSerial);
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
    void disconnect(ConsoleId id);

    /// To be called when a link has room again.
    void outputDrained();

    /// Sends every console the notices of the shutdown, ends the connections, and takes the partitions' lines down.
    /// Later connections are ended at once.
    void shutDown();

    /// What the serial thread has to wait for.
    std::vector<SerialWatch> serialWatches() const;

    /// Moves the serial data of one partition.
    void serviceSerial(std::uint16_t partition);

    /// Takes down the lines whose commands have ended: see PartitionSet::serviceEnded().
    /// @return true: call again soon
    bool serviceEndedLines();

private:
    using Reply = std::unique_ptr<QelMessage>;
    /// The identity of a request: function and operation.
    using RequestId = std::pair<unsigned short, unsigned short>;

    /// How a request is handled.
    struct Rule {
        std::function<Reply(HypervisorEngine&, ConsoleEntry&, const QelMessage&)> handle;
        bool needsSession = false; ///< the hypervisor session must be open
    };
    using Rules = std::map<RequestId, Rule>;

    template <typename T>
    static Rules::value_type pRule(Reply (HypervisorEngine::*handler)(ConsoleEntry&, const T&),
                                   bool needsSession = false);
    static const Rules& pRules();
    static bool pKnowsFunction(unsigned short function);

    bool pMayReceive(const ConsoleEntry& console) const QEL_REQUIRES(mMutex);
    void pHandleRequest(ConsoleEntry& console, const QelMessage& request) QEL_REQUIRES(mMutex);
    void pHandleNotice(ConsoleEntry& console, const QelMessage& notice) QEL_REQUIRES(mMutex);
    QelMessageStatusCodes pAdmit(const ConsoleEntry& console, const QelMessage& request, const Rule*& rule) const
        QEL_REQUIRES(mMutex);

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

    ConsoleEntry* pFindIdentified(std::uint32_t toolType, const std::string& toolId) QEL_REQUIRES(mMutex);
    std::size_t pCountIdentified() const QEL_REQUIRES(mMutex);
    bool pSendBroadcast(ConsoleEntry& to, const ConsoleEntry& from, const QelMessageDaxBroadcastReq&)
        QEL_REQUIRES(mMutex);
    void pRefuseUpgrade(ConsoleEntry& console) QEL_REQUIRES(mMutex);
    void pClose(ConsoleEntry& console) QEL_REQUIRES(mMutex);

    const HypervisorSettings mSettings;
    const std::function<void()> mWakeSerial;

    mutable Mutex mMutex;
    PartitionSet mPartitions QEL_GUARDED_BY(mMutex);
    std::map<ConsoleId, ConsoleEntry> mConsoles QEL_GUARDED_BY(mMutex);
    ConsoleId mLastConsoleId QEL_GUARDED_BY(mMutex) = 0;
    bool mShutDown QEL_GUARDED_BY(mMutex) = false;
    std::uint8_t mMode QEL_GUARDED_BY(mMutex) = 0; // the global mode attribute
    std::string mMtms QEL_GUARDED_BY(mMutex);      // and the machine it names
    std::string mMetadata QEL_GUARDED_BY(mMutex);  // of the global save area
};

} // namespace qel::protocol
