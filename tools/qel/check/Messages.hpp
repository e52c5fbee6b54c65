#pragma once

#include "check/Draft.hpp"

#include <cstdint>
#include <string>
#include <vector>

/// @file
/// The requests and notices of a console, by the tables of docs/wire-format.md.

namespace qel::tool::check {

// Functions.
constexpr unsigned int kHandshake = 0x6001;
constexpr unsigned int kSerial = 0x6002;
constexpr unsigned int kInterface = 0x6003;
constexpr unsigned int kToConsole = 0x7000;

// Operations of kHandshake.
constexpr unsigned int kUpgrade = 0x0001;
constexpr unsigned int kAbort = 0x0002;
// Of kInterface.
constexpr unsigned int kVersion = 0x0101;
constexpr unsigned int kOpenSession = 0x0102;
constexpr unsigned int kCloseSession = 0x0103;
constexpr unsigned int kCapabilities = 0x0104;
constexpr unsigned int kLimits = 0x0105;
constexpr unsigned int kBroadcast = 0x0106;
constexpr unsigned int kTime = 0x0107;
constexpr unsigned int kSetMode = 0x0108;
constexpr unsigned int kGetMode = 0x0109;
constexpr unsigned int kSetMetadata = 0x010A;
constexpr unsigned int kGetMetadata = 0x010B;
// Of kSerial.
constexpr unsigned int kOpenSerial = 0x0402;
constexpr unsigned int kCloseSerial = 0x0403;
constexpr unsigned int kMaxSerial = 0x0404;
constexpr unsigned int kDataToPartition = 0x0405;
constexpr unsigned int kSetUpSerial = 0x0406;
// Of kToConsole.
constexpr unsigned int kDataToConsole = 0x0401;
constexpr unsigned int kBroadcastNotice = 0x0B0B;
constexpr unsigned int kSerialClosed = 0xA005;
constexpr unsigned int kConnectionClosed = 0xA009;

// Status codes.
constexpr unsigned int kInvalidOperation = 1;
constexpr unsigned int kInvalidData = 3;
constexpr unsigned int kInvalidSequence = 4;
constexpr unsigned int kInvalidFunction = 15;
constexpr unsigned int kInvalidNumber = 16;
constexpr unsigned int kTooManyConnections = 18;
constexpr unsigned int kNotAvailable = 19;
constexpr unsigned int kClosureFailure = 20;
constexpr unsigned int kInvalidPartition = 21;
constexpr unsigned int kAlreadyOpen = 23;
constexpr unsigned int kAlreadyConnected = 37;

// Reasons of the session-closed notice.
constexpr std::uint32_t kForceClosed = 2;
constexpr std::uint32_t kReadFailure = 4;

/// A request of the interface component without payload.
Draft interfaceRequest(unsigned int operation);

inline Draft timeRequest() { return interfaceRequest(kTime); }
inline Draft limitsRequest() { return interfaceRequest(kLimits); }
inline Draft openSession() { return interfaceRequest(kOpenSession); }
inline Draft closeSession() { return interfaceRequest(kCloseSession); }

/// The fields of the version request. The slot of the tool id has 32 bytes.
struct VersionFields {
    std::uint32_t interfaceVersion = 1;
    std::uint32_t toolType = 1;
    std::string toolId;
    unsigned int toolIdLength = ~0U; ///< ~0U: that of toolId
    unsigned int major = 1;
    unsigned int minor = 0;
    unsigned int reserved = 0;
};
std::string versionPayload(const VersionFields& fields);
Draft versionRequest(std::uint32_t toolType, const std::string& toolId);

/// The fields of a broadcast request.
struct BroadcastFields {
    unsigned int offset = 46;
    unsigned int type = 0;
    std::uint32_t toolType = 0;
    std::string toolId;
    unsigned int toolIdLength = ~0U; ///< ~0U: that of toolId
    std::string text;
    unsigned int textLength = ~0U; ///< ~0U: that of text
    std::string between;           ///< bytes between the fixed part and the text
};
std::string broadcastPayload(const BroadcastFields& fields);
Draft broadcastRequest(const BroadcastFields& fields);
/// A broadcast to one console.
Draft unicast(std::uint32_t toolType, const std::string& toolId, const std::string& text);

/// A length of 4 bytes, or of the given one, and the bytes.
Draft capabilitiesRequest(std::uint32_t length, const std::string& bits);
/// @param length  ~0U: that of the text
Draft setMode(unsigned int mode, const std::string& text, unsigned int length = ~0U);
Draft setMetadata(const std::string& bytes, unsigned int length = ~0U);

/// The first four bytes of nearly every serial payload.
std::string serialAddress(unsigned int partition, unsigned int number);
/// @param flags  0x8000: force
Draft openSerial(unsigned int partition, unsigned int number, unsigned int flags = 0);
/// @param force  0xFF: force
Draft closeSerial(unsigned int partition, unsigned int number, unsigned int force = 0);
Draft setUpSerial(unsigned int partition, unsigned int number);
Draft maxSerial();
/// @param length  ~0U: that of the data
Draft dataToPartition(unsigned int partition, unsigned int number, const std::string& data, unsigned int length = ~0U);

Draft upgradeNotice();

/// A request with its name in ids of cases.
struct NamedRequest {
    const char* name;
    Draft draft;
};
/// All requests but the version request, each well-formed. They change nothing while they are refused.
std::vector<NamedRequest> requestsAfterVersion();
/// Those of the virtual serial function.
std::vector<NamedRequest> serialRequests(unsigned int partition);

} // namespace qel::tool::check
