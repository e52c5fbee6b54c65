#pragma once

#include <qel/common/QelMessage.hpp>
#include <qel/common/QelMessageDax.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>

#include <cstddef>

/// @file
/// The longest texts that fit a frame with the header which both ends of the program build, in bytes. A frame that
/// comes in with the shorter header has room for eight more, which no frame that goes out could carry on.

namespace qel::tool {

constexpr std::size_t kLongestPayload = QelMessage::MtuMax - QelMessage::MaxHeaderSize;

constexpr std::size_t kLongestMtms = kLongestPayload - sizeof(QelMessageSetGlobalModeAttributeReq::Data);
constexpr std::size_t kLongestMetadata = kLongestPayload - sizeof(QelMessageSetGlobalSaveAreaMetadataReq::Data);
/// What the limits response promises.
constexpr std::size_t kLongestBroadcast = kLongestPayload - sizeof(QelMessageDaxBroadcastReq::Data);

static_assert(sizeof(QelMessageDaxBroadcastOutboundAsync::Data) <= sizeof(QelMessageDaxBroadcastReq::Data),
              "a broadcast that fits a frame on its way in fits one on its way out");

} // namespace qel::tool
