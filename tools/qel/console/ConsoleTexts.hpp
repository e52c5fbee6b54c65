#pragma once

#include <initializer_list>
#include <string>

/// @file
/// What "qel console" says to its user. In the texts $1 to $9 stand for values; see filled().

namespace qel::tool {

/// Replaces "$1" by the first value, and so on. @param text  has no other dollar signs
std::string filled(const char* text, std::initializer_list<std::string> values);

/// A number as it is given on a command line: 15, 0.4.
std::string numberText(double number);

namespace texts {

// The session.
constexpr const char* kConnected = "connected to partition $1 of $2 ($3); $4";
constexpr const char* kWatching = "watching partition $1 of $2 ($3); $4";
constexpr const char* kEscapes = "$1. at the start of a line leaves, $1? lists the commands";
constexpr const char* kNoEscape = "there is no escape character";
constexpr const char* kPlain = "plain";
constexpr const char* kProtected = "$1, TLS 1.3"; // the library accepts no other version
constexpr const char* kLeft = "left partition $1";
constexpr const char* kThrownAway = "$1 bytes of input that were not sent are thrown away";

constexpr const char* kPartition = "partition $1";
constexpr const char* kNamed = "$1 ($2)"; // a partition with a name
constexpr const char* kBroadcast = "broadcast from tool type $1, $2: $3";
constexpr const char* kCannotReadInput = "cannot read standard input";
constexpr const char* kSignalIgnored = "signal $1 did not end this process";

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

// The commands after the escape character.
constexpr const char* kHelpTitle = "at the start of a line:";
constexpr const char* kHelpLeave = "leave";
constexpr const char* kHelpHelp = "this list";
constexpr const char* kHelpInfo = "tell about the session";
constexpr const char* kHelpLog = "turn the log off or on";
constexpr const char* kHelpStamps = "time stamps: UTC, since the last line, off";
constexpr const char* kHelpReadOnly = "read only: type nothing; or type again";
constexpr const char* kHelpForce = "open the session again by force, to type";
constexpr const char* kHelpBreak = "how to send a break";
constexpr const char* kHelpWindow = "type the command that sets the size of this window";
constexpr const char* kHelpFile = "type a file";
constexpr const char* kHelpSuspend = "suspend this program";
constexpr const char* kHelpEscape = "type $1";

constexpr const char* kLogOn = "log on: $1";
constexpr const char* kLogOff = "log off: $1";
constexpr const char* kNoLog = "there is no log; start with --log FILE or --log-strip FILE";
constexpr const char* kStampsOff = "time stamps off";
constexpr const char* kStampsIso = "time stamps in UTC";
constexpr const char* kStampsDelta = "time stamps: seconds since the line before";
constexpr const char* kReadOnly = "read only: nothing that is typed is sent";
constexpr const char* kReadWrite = "what is typed is sent again";
constexpr const char* kWatchingOnly = "who watches types nothing; $1f opens the session to type";
constexpr const char* kBreak =
    "the protocol carries no break; on the server's machine, qel status --break $1 sends one where the line can";
constexpr const char* kNoWindow = "the size of this window is not known";
constexpr const char* kNoSession = "there is no session at the moment";
constexpr const char* kForcing = "opening partition $1 again by force";

constexpr const char* kInfoTraffic = "$1 bytes received, $2 sent, $3 held";
constexpr const char* kInfoOutput = "the partition's last output came $1 ago";
constexpr const char* kInfoNoOutput = "the partition has put out nothing so far";
constexpr const char* kInfoHeard = "the server was heard $1 ago";
constexpr const char* kInfoRoundTrip = "it last answered in $1 ms";
constexpr const char* kSeconds = "$1 s";

constexpr const char* kFilePrompt = "qel: file to type (return alone cancels): ";
constexpr const char* kFileCancelled = "no file is typed";
constexpr const char* kFileBegins = "typing $1 ($2 bytes); control-C stops it";
constexpr const char* kFileProgress = "$1 of $2 bytes of the file are typed";
constexpr const char* kFileDone = "the file is typed: $1 bytes";
constexpr const char* kFileStopped = "stopped after $1 bytes of the file";

// Files.
constexpr const char* kCannotLog = "cannot write the log $1";
constexpr const char* kCannotRecord = "cannot write the recording $1";
constexpr const char* kCannotRead = "cannot read $1";
constexpr const char* kRecordingTitle = "partition $1 of $2";

// Without a person.
constexpr const char* kWaitsForOutput = "output that matches $1";
constexpr const char* kWaitsForCommand = "the end of $1";
constexpr const char* kStepLate = "timed out after $1 s (--timeout): waiting for $2";
constexpr const char* kStepUnfinished = "the session ended while waiting for $1: $2";
constexpr const char* kCommandStatus = "the command exited with status $1";

constexpr const char* kTimedOut = "timed out after $1 s (--timeout): $2";

// Watching.
constexpr const char* kNoWatching = "the server lets nobody watch partition $1: its sessions have connection 0 only";
constexpr const char* kWatchersFull = "15 consoles watch partition $1 already; wait until one leaves";

// Connecting again.
constexpr const char* kLost = "$1; connecting again";
constexpr const char* kNextAttempt = "$1; next attempt in $2 s";
constexpr const char* kBackAgain = "connected again after $1 s; output may be missing";

// The command line.
constexpr const char* kSameFile = "$1 and $2 need a file each";
constexpr const char* kNotAnEscape = "$1 is not one printable character, ^ and a character from @ to _, or none";
constexpr const char* kEscapeIsCommand = "$1 is a command after the escape character";
constexpr const char* kNotTypedText =
    "$1 has a backslash that is not followed by r, n, t, e, a backslash, or x and two digits";
constexpr const char* kNotARegex = "$1 is not a regular expression: $2";
constexpr const char* kNoProfile = "there is no profile $1";
constexpr const char* kNoPartition = "there is no partition $1";
constexpr const char* kNotAPartition = "$1 is no partition id from 0 to 65535 and no PROFILE/PARTITION";
constexpr const char* kDidYouMean = "; did you mean $1?";
constexpr const char* kSeeList = "; qel list shows what there is";
constexpr const char* kSlashInProfile = "the name of a profile must not contain a slash";

} // namespace texts

} // namespace qel::tool
