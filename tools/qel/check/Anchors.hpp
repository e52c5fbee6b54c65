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

// The messages.
constexpr const char* kMessages = "wire-format.md#messages";
constexpr const char* kVersionReq = "wire-format.md#qelmessagegetencltypeandinterfaceversionreq";
constexpr const char* kVersionRsp = "wire-format.md#qelmessagegetencltypeandinterfaceversionrsp";
constexpr const char* kCapabilitiesReq = "wire-format.md#qelmessageexchintcapabilitiesreq";
constexpr const char* kCapabilitiesRsp = "wire-format.md#qelmessageexchintcapabilitiesrsp";
constexpr const char* kLimitsRsp = "wire-format.md#qelmessagegetinterfacelimitsrsp";
constexpr const char* kTimeRsp = "wire-format.md#qelmessagegetqeltodrsp";
constexpr const char* kSetModeReq = "wire-format.md#qelmessagesetglobalmodeattributereq";
constexpr const char* kGetModeRsp = "wire-format.md#qelmessagegetglobalmodeattributersp";
constexpr const char* kSetMetadataReq = "wire-format.md#qelmessagesetglobalsaveareametadatareq";
constexpr const char* kGetMetadataRsp = "wire-format.md#qelmessagegetglobalsaveareametadatarsp";
constexpr const char* kBroadcastReq = "wire-format.md#qelmessagedaxbroadcastreq";
constexpr const char* kBroadcastAsync = "wire-format.md#qelmessagedaxbroadcastoutboundasync";
constexpr const char* kOpenReq = "wire-format.md#qelmessagevirtualserialopenreq";
constexpr const char* kOpenRsp = "wire-format.md#qelmessagevirtualserialopenrsp";
constexpr const char* kCloseReq = "wire-format.md#qelmessagevirtualserialclosereq";
constexpr const char* kMaxRsp = "wire-format.md#qelmessagevirtualserialgetmaxsessionsrsp";
constexpr const char* kSetUpReq = "wire-format.md#qelmessagevirtualserialsetupsessionreq";
constexpr const char* kDataToOs = "wire-format.md#qelmessagevirtualserialdatatoosasync";
constexpr const char* kDataToDax = "wire-format.md#qelmessagevirtualserialdatatodaxasync";
constexpr const char* kClosedAsync = "wire-format.md#qelmessagevirtualserialsessionclosedasync";
constexpr const char* kUpgradeAsync = "wire-format.md#qelmessageupgradeconnectionasync";
constexpr const char* kAbortAsync = "wire-format.md#qelmessageaborthandshakeasync";

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
