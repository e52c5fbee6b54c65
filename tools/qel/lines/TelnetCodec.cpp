#include "lines/TelnetCodec.hpp"

#include <qel/protocol/Logging.hpp>

#include <initializer_list>
#include <new>
#include <utility>

namespace qel::tool {

namespace {

// RFC 2217: the option, its commands, and the values that are used.
constexpr std::uint8_t kComPort = 44;
constexpr std::uint8_t kSetSpeed = 1;
constexpr std::uint8_t kSetDataSize = 2;
constexpr std::uint8_t kSetParity = 3;
constexpr std::uint8_t kSetStopSize = 4;
constexpr std::uint8_t kSetControl = 5;
constexpr std::uint8_t kAnswer = 100; // the peer adds it to the command that it answers
constexpr char kNoFlowControl = 1;
constexpr char kHardwareFlowControl = 3;
constexpr char kBreakOn = 5;
constexpr char kBreakOff = 6;

/// What may be agreed on; everything else is refused.
constexpr telnet_telopt_t kOptions[] = {
    {TELNET_TELOPT_BINARY, TELNET_WILL, TELNET_DO},
    {TELNET_TELOPT_SGA, TELNET_WILL, TELNET_DO},
    {TELNET_TELOPT_ECHO, TELNET_WONT, TELNET_DO},
    {kComPort, TELNET_WILL, TELNET_DONT},
    {-1, 0, 0},
};

std::string bigEndian(std::uint32_t number)
{
    constexpr int kByteBits = 8;
    std::string bytes;
    for (int shift = 24; shift >= 0; shift -= kByteBits)
        bytes.push_back(static_cast<char>(number >> shift));
    return bytes;
}

char parityCode(SerialSettings::Parity parity)
{
    switch (parity) {
    case SerialSettings::Parity::Odd:
        return 2;
    case SerialSettings::Parity::Even:
        return 3;
    case SerialSettings::Parity::None:
        break;
    }
    return 1;
}

/// The value that a command sets, as in the RFC.
std::string valueOf(std::uint8_t command, const SerialSettings& settings)
{
    switch (command) {
    case kSetSpeed:
        return bigEndian(settings.speed);
    case kSetDataSize:
        return std::string(1, static_cast<char>(settings.dataBits));
    case kSetParity:
        return std::string(1, parityCode(settings.parity));
    case kSetStopSize:
        return std::string(1, static_cast<char>(settings.stopBits));
    default:
        return std::string(1, settings.hardwareFlowControl ? kHardwareFlowControl : kNoFlowControl);
    }
}

const char* nameOf(std::uint8_t command)
{
    constexpr const char* kNames[] = {"speed", "data bits", "parity", "stop bits", "flow control"};
    return kNames[command - kSetSpeed];
}

} // namespace

TelnetCodec::TelnetCodec(std::optional<SerialSettings> settings, std::string name)
    : mSettings(settings), mName(std::move(name)), mTelnet(::telnet_init(kOptions, pHandleEvent, 0, this))
{
    if (mTelnet == nullptr) throw std::bad_alloc();
    for (const unsigned char option : std::initializer_list<unsigned char>{TELNET_TELOPT_BINARY, TELNET_TELOPT_SGA}) {
        ::telnet_negotiate(mTelnet.get(), TELNET_WILL, option);
        ::telnet_negotiate(mTelnet.get(), TELNET_DO, option);
    }
    ::telnet_negotiate(mTelnet.get(), TELNET_WILL, kComPort);
}

TelnetCodec::~TelnetCodec() = default;

std::string TelnetCodec::receive(const char* bytes, std::size_t length)
{
    mData.clear();
    ::telnet_recv(mTelnet.get(), bytes, length);
    if (mOutput.size() > kMaxOutput) pFail("the peer asks and does not read the answers");
    return std::exchange(mData, std::string());
}

void TelnetCodec::send(const std::string& data)
{
    std::string text = data;
    // Without binary transmission a carriage return that is not part of an end of line has a null character after it.
    for (std::size_t at = 0; !mSendsBinary && (at = text.find('\r', at)) != std::string::npos; at += 2)
        text.insert(at + 1, 1, '\0');
    ::telnet_send(mTelnet.get(), text.data(), text.size());
}

bool TelnetCodec::beginBreak()
{
    if (mControlsPort) {
        pSetValue(kSetControl, std::string(1, kBreakOn));
    } else {
        ::telnet_iac(mTelnet.get(), TELNET_BREAK);
    }
    return mControlsPort;
}

void TelnetCodec::checkAgreement() const
{
    if (agrees()) return;
    protocol::logLine(LogLevel::Warn, mName, ": the peer does not take ", mSettings->str(),
                      ": it does not speak RFC 2217");
}

void TelnetCodec::endBreak() { pSetValue(kSetControl, std::string(1, kBreakOff)); }

/// Nothing may be thrown through the library, which is written in C.
void TelnetCodec::pHandleEvent(telnet_t* /*telnet*/, telnet_event_t* event, void* self) noexcept
{
    auto& codec = *static_cast<TelnetCodec*>(self);
    try {
        if (codec.mFailure.empty()) codec.pHandle(*event);
    } catch (...) {
        codec.mFailure = "out of memory"; // short enough to need none
    }
}

void TelnetCodec::pHandle(const telnet_event_t& event)
{
    switch (event.type) {
    case TELNET_EV_DATA:
        pTakeData(event.data.buffer, event.data.size);
        break;
    case TELNET_EV_SEND:
        mOutput.append(event.data.buffer, event.data.size);
        break;
    case TELNET_EV_DO:
    case TELNET_EV_DONT:
        pHandleOffer(event.neg.telopt, event.type == TELNET_EV_DO);
        break;
    case TELNET_EV_WILL:
    case TELNET_EV_WONT:
        if (event.neg.telopt == TELNET_TELOPT_BINARY) mReceivesBinary = event.type == TELNET_EV_WILL;
        break;
    case TELNET_EV_SUBNEGOTIATION:
        if (event.sub.telopt == kComPort) pCheckAnswer(event);
        break;
    case TELNET_EV_COMPRESS: // the library takes compression without being asked, and a small input may expand to a lot
        pFail("the peer compresses its data without agreement");
        break;
    case TELNET_EV_WARNING: // a subnegotiation that is too long, or malformed: what follows would be taken for data
    case TELNET_EV_ERROR:
        pFail(std::string("the peer breaks the telnet protocol: ") + event.error.msg);
        break;
    default:
        break;
    }
}

void TelnetCodec::pTakeData(const char* bytes, std::size_t length)
{
    for (std::size_t i = 0; i < length; ++i) {
        const bool isPadding = mHasReturned && !mReceivesBinary && bytes[i] == '\0'; // see send()
        mHasReturned = bytes[i] == '\r';
        if (!isPadding) mData.push_back(bytes[i]);
    }
}

/// The peer has answered what this side offered.
void TelnetCodec::pHandleOffer(std::uint8_t option, bool isTaken)
{
    if (option == TELNET_TELOPT_BINARY) mSendsBinary = isTaken;
    if (option != kComPort) return;
    mControlsPort = isTaken;
    if (mControlsPort && mSettings && !mHasSetPort) pSetPort();
}

void TelnetCodec::pSetPort()
{
    mHasSetPort = true; // once, however often a peer changes its mind
    for (std::uint8_t command = kSetSpeed; command <= kSetControl; ++command)
        pSetValue(command, valueOf(command, *mSettings));
}

void TelnetCodec::pSetValue(std::uint8_t command, const std::string& value)
{
    const std::string content = static_cast<char>(command) + value;
    ::telnet_subnegotiation(mTelnet.get(), kComPort, content.data(), content.size());
}

/// The peer answers a setting with the value that it has set.
void TelnetCodec::pCheckAnswer(const telnet_event_t& event)
{
    if (!mSettings || event.sub.size < 2) return;
    const auto answer = static_cast<std::uint8_t>(event.sub.buffer[0]);
    if (answer < kAnswer + kSetSpeed || answer > kAnswer + kSetStopSize) return;
    const auto command = static_cast<std::uint8_t>(answer - kAnswer);
    const std::string value(event.sub.buffer + 1, event.sub.size - 1);
    if (value == valueOf(command, *mSettings)) return;
    protocol::logLine(LogLevel::Warn, mName, ": the peer does not take ", mSettings->str(), ": it has set another ",
                      nameOf(command));
}

void TelnetCodec::pFail(const std::string& reason)
{
    if (mFailure.empty()) mFailure = reason;
}

} // namespace qel::tool
