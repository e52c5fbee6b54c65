#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>

#include <cstddef>

/// @file
/// How many bytes of text fit a frame with the header that the library sends. A received frame with the older, shorter
/// header has room for eight bytes more; a text that uses them could not be sent on.

namespace qel::protocol {

constexpr std::size_t kMaxPayload = QelMessage::MtuMax - QelMessage::MaxHeaderSize;

constexpr std::size_t kMaxMtms = kMaxPayload - sizeof(QelMessageSetGlobalModeAttributeReq::Data);
constexpr std::size_t kMaxMetadata = kMaxPayload - sizeof(QelMessageSetGlobalSaveAreaMetadataReq::Data);
/// Also the broadcast size in the limits response.
constexpr std::size_t kMaxBroadcast = kMaxPayload - sizeof(QelMessageDaxBroadcastReq::Data);

static_assert(sizeof(QelMessageDaxBroadcastOutboundAsync::Data) <= sizeof(QelMessageDaxBroadcastReq::Data),
              "a broadcast that fits the request also fits the notice that is sent on");

} // namespace qel::protocol
