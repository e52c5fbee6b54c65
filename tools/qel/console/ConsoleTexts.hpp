#pragma once

#include <initializer_list>
#include <string>

/// @file
/// What "qel console" says to its user. In the texts $1 to $9 stand for values; see filled().

namespace qel::tool {

/// Replaces "$1" by the first value, and so on. @param text  has no other dollar signs
std::string filled(const char* text, std::initializer_list<std::string> values);

namespace texts {

// The session.
constexpr const char* kConnected = "connected to partition $1 of $2 ($3); $4";
constexpr const char* kEscapes = "$1. at the start of a line leaves, $1? lists the commands";
constexpr const char* kNoEscape = "there is no escape character";
constexpr const char* kPlain = "plain";
constexpr const char* kProtected = "$1, TLS 1.3"; // the library accepts no other version
constexpr const char* kLeft = "left partition $1";
constexpr const char* kThrownAway = "; $1 bytes of input that were not sent are thrown away";

// Input that finds no room.
constexpr const char* kHeld = "$1 bytes of input are held back: the partition or the server takes none";
constexpr const char* kHeldLeave = "; $1. at the start of a line leaves and throws them away";
constexpr const char* kDropped = "the limit of 1 MiB is reached: further input is dropped until there is room";
constexpr const char* kSent = "all input that was held back has been sent";
constexpr const char* kSentSome = "all input that was held back has been sent, except $1 bytes that were dropped";

// A server that says nothing.
constexpr const char* kSilent = "the server has sent nothing for $1 s: it is gone or stopped";
constexpr const char* kSilentHeld =
    "the server has sent nothing for $1 s: it is gone or stopped, or the partition takes no input";
constexpr const char* kSilentChoice = "; wait, or leave with $1. at the start of a line";
constexpr const char* kBack = "the server answers again";

} // namespace texts

} // namespace qel::tool
