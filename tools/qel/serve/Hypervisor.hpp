#pragma once

#include <qel/common/QelCapabilities.hpp>
#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>
#include <qel/common/util/Mutex.hpp>

#include "serve/Console.hpp"
#include "serve/PartitionSet.hpp"

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace qel::tool {

/// What the hypervisor end says of itself, and how many consoles it takes.
struct HypervisorSettings {
    char interfaceFamily = 'Q';
    std::uint16_t majorVersion = 1;
    std::uint16_t minorVersion = 0;
    std::string machineType = "QEL-SERVE"; ///< at most 16 bytes
    std::string serialNumber = "0000001";  ///< at most 16 bytes
    QelCapabilities capabilities;
    std::uint8_t maxConsoles = QelMessageGetInterfaceLimitsRsp::DAXS_SUPPORTED;
};

/// The hypervisor end of the protocol without any input or output: what it answers to whom, and who holds what.
/// Messages come in through receive(), answers and notices go out through the consoles' links, serial data through the
/// partitions' ports. docs/connection.md describes the rules.
///
/// Thread safety: every operation may be called from any thread. One lock guards everything; links and ports are called
/// with it held and wait for nothing, so that it is never held for long. Lock order: this lock first, then whatever a
/// link or a port locks, then the logger's.
class Hypervisor {
public:
    /// @param wakeSerial  called, with the lock held, when serialWatches() may have changed
    Hypervisor(HypervisorSettings settings, PartitionSet partitions, std::function<void()> wakeSerial);
    ~Hypervisor();
    Hypervisor(const Hypervisor&) = delete;
    Hypervisor& operator=(const Hypervisor&) = delete;

    /// Takes a new connection in.
    /// @param link  borrowed until disconnect() has returned
    /// @param peer  where it comes from, for the log
    ConsoleId connect(ConsoleLink& link, const std::string& peer);

    /// Acts on a message of a console.
    /// @return how far the connection has come by now
    ConsoleState receive(ConsoleId id, const QelMessage& message);

    /// False while the next message of a console has to wait: it does not take its answers, or a partition does not
    /// take its input. ConsoleLink::resumeReading() says when to look again.
    bool mayReceive(ConsoleId id) const;

    /// False when another console would be turned away: as many as allowed are there, or the hypervisor shuts down.
    bool takesConsoles() const;

    /// Forgets a connection; its sessions end. Its link is not called afterwards. Unknown ids are ignored.
    void disconnect(ConsoleId id);

    /// A link that had no room has room again.
    void outputDrained();

    /// Tells every console that the hypervisor shuts down, ends their connections, and takes the partitions' lines
    /// down. Connections that come later are ended at once.
    void shutDown();

    /// What the thread that moves serial data has to wait for.
    std::vector<SerialWatch> serialWatches() const;

    /// Moves the serial data of one partition.
    void serviceSerial(std::uint16_t partition);

private:
    using Reply = std::unique_ptr<QelMessage>;
    /// The identity of a request: function and operation.
    using RequestId = std::pair<unsigned short, unsigned short>;

    /// What is known of a request before it is looked into.
    struct Rule {
        std::function<Reply(Hypervisor&, Console&, const QelMessage&)> handle;
        bool needsSession = false; ///< the hypervisor session must be open
    };
    using Rules = std::map<RequestId, Rule>;

    template <typename T>
    static Rules::value_type pRule(Reply (Hypervisor::*handler)(Console&, const T&), bool needsSession = false);
    static const Rules& pRules();
    static bool pKnowsFunction(unsigned short function);

    void pHandleRequest(Console& console, const QelMessage& request) QEL_REQUIRES(mMutex);
    void pHandleNotice(Console& console, const QelMessage& notice) QEL_REQUIRES(mMutex);
    QelMessageStatusCodes pAdmit(const Console& console, const QelMessage& request, const Rule*& rule) const
        QEL_REQUIRES(mMutex);

    // One operation for each request; they return the response.
    Reply pVersion(Console&, const QelMessageGetEnclTypeAndInterfaceVersionReq&) QEL_REQUIRES(mMutex);
    Reply pOpenSession(Console&, const QelMessageInterfaceCmpOpenKrogSessionReq&) QEL_REQUIRES(mMutex);
    Reply pCloseSession(Console&, const QelMessageInterfaceCmpCloseKrogSessionReq&) QEL_REQUIRES(mMutex);
    Reply pCapabilities(Console&, const QelMessageExchIntCapabilitiesReq&) QEL_REQUIRES(mMutex);
    Reply pLimits(Console&, const QelMessageGetInterfaceLimitsReq&) QEL_REQUIRES(mMutex);
    Reply pBroadcast(Console&, const QelMessageDaxBroadcastReq&) QEL_REQUIRES(mMutex);
    Reply pTime(Console&, const QelMessageGetQelTodReq&) QEL_REQUIRES(mMutex);
    Reply pSetMode(Console&, const QelMessageSetGlobalModeAttributeReq&) QEL_REQUIRES(mMutex);
    Reply pGetMode(Console&, const QelMessageGetGlobalModeAttributeReq&) QEL_REQUIRES(mMutex);
    Reply pSetMetadata(Console&, const QelMessageSetGlobalSaveAreaMetadataReq&) QEL_REQUIRES(mMutex);
    Reply pGetMetadata(Console&, const QelMessageGetGlobalSaveAreaMetadataReq&) QEL_REQUIRES(mMutex);
    Reply pOpenSerial(Console&, const QelMessageVirtualSerialOpenReq&) QEL_REQUIRES(mMutex);
    Reply pCloseSerial(Console&, const QelMessageVirtualSerialCloseReq&) QEL_REQUIRES(mMutex);
    Reply pMaxSerialSessions(Console&, const QelMessageVirtualSerialGetMaxSessionsReq&) QEL_REQUIRES(mMutex);
    Reply pSetUpSerial(Console&, const QelMessageVirtualSerialSetupSessionReq&) QEL_REQUIRES(mMutex);

    Console* pFindIdentified(std::uint32_t toolType, const std::string& toolId) QEL_REQUIRES(mMutex);
    std::size_t pCountIdentified() const QEL_REQUIRES(mMutex);
    bool pSendBroadcast(Console& to, const Console& from, const QelMessageDaxBroadcastReq&) QEL_REQUIRES(mMutex);
    void pRefuseUpgrade(Console& console) QEL_REQUIRES(mMutex);
    void pClose(Console& console) QEL_REQUIRES(mMutex);

    const HypervisorSettings mSettings;
    const std::function<void()> mWakeSerial;

    mutable Mutex mMutex;
    PartitionSet mPartitions QEL_GUARDED_BY(mMutex);
    std::map<ConsoleId, Console> mConsoles QEL_GUARDED_BY(mMutex);
    ConsoleId mLastConsoleId QEL_GUARDED_BY(mMutex) = 0;
    bool mShutDown QEL_GUARDED_BY(mMutex) = false;
    std::uint8_t mMode QEL_GUARDED_BY(mMutex) = 0; // the global mode attribute
    std::string mMtms QEL_GUARDED_BY(mMutex);      // and the machine it names
    std::string mMetadata QEL_GUARDED_BY(mMutex);  // of the global save area
};

} // namespace qel::tool
