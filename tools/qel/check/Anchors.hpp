#pragma once

/// @file
/// Where the requirements are documented: headings of documents, as links name them. A test checks that each exists.

namespace qel::tool::check::anchors {

constexpr const char* kHeader = "wire-format.md#header";
constexpr const char* kPad = "wire-format.md#pad";
constexpr const char* kFrame = "wire-format.md#the-frame";
constexpr const char* kFrameChecks = "wire-format.md#frame";
constexpr const char* kStreamChecks = "wire-format.md#message-stream";
constexpr const char* kRegistry = "wire-format.md#registry";
constexpr const char* kLimitsOfFrames = "wire-format.md#limits";
constexpr const char* kClassification = "wire-format.md#classification";
constexpr const char* kOddCorners = "wire-format.md#odd-corners";

constexpr const char* kBeforeFirst = "connection.md#before-the-first-message";
constexpr const char* kOneConnection = "connection.md#one-connection-from-beginning-to-end";
constexpr const char* kStates = "connection.md#states";
constexpr const char* kAnswered = "connection.md#what-is-answered-in-which-order";
constexpr const char* kRequests = "connection.md#the-requests";
constexpr const char* kSerialSessions = "connection.md#virtual-serial-sessions";
constexpr const char* kUnattended = "connection.md#output-that-no-console-takes";
constexpr const char* kWatching = "connection.md#watching";
constexpr const char* kCommandEnd = "connection.md#how-a-command-ended";
constexpr const char* kFlowControl = "connection.md#flow-control";
constexpr const char* kShortages = "connection.md#resource-shortages";

constexpr const char* kTlsProfile = "tls.md#the-profile";
constexpr const char* kTlsFailures = "tls.md#what-a-failure-looks-like";

} // namespace qel::tool::check::anchors
