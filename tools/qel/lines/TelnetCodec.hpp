#pragma once

#include <qel/protocol/SerialSettings.hpp>

#include "base/Library.hpp"

#include <cstddef>
#include <cstdint>
#include <libtelnet.h>
#include <memory>
#include <optional>
#include <string>

namespace qel::tool {

/// The protocol of one telnet connection: turns what the peer sends into data, and data into what is sent. It does no
/// input or output.
///
/// Sources: RFC 854, 855, 856, 857, 858, 1143, 2217; libtelnet.h. Thread safety: none.
class TelnetCodec {
public:
    /// Bytes that may wait to be sent before receive() gives the peer up.
    static constexpr std::size_t kMaxOutput = 64 * 1024;

    /// What is asked of the peer at once is in output().
    /// @param settings  of the peer's serial port; none: it keeps its own
    /// @param name      of the line, for the log
    /// @throws std::bad_alloc
    TelnetCodec(std::optional<SerialSettings> settings, std::string name);
    ~TelnetCodec();
    TelnetCodec(const TelnetCodec&) = delete;
    TelnetCodec& operator=(const TelnetCodec&) = delete;

    /// Takes bytes of the peer. Answers go to output().
    /// @return the data in them, at most as many bytes
    std::string receive(const char* bytes, std::size_t length);

    /// Puts data into output().
    void send(const std::string& data);

    /// To be called some time after the beginning: logs a line at Warn if there are settings and the peer has not taken
    /// control of its port. A refusal is no event of libtelnet, and a peer may say nothing at all.
    void checkAgreement() const;
    /// Whether there is nothing to be logged about.
    bool agrees() const { return !mSettings || mHasSetPort; }

    /// Begins a break. @return whether it has to be ended: by RFC 2217 it lasts until then, by telnet's own it does not
    bool beginBreak();
    void endBreak();

    /// What is to be sent; the caller removes what it has sent.
    std::string& output() noexcept { return mOutput; }

    /// How the peer has broken the protocol, for people; empty: it has not.
    const std::string& failure() const noexcept { return mFailure; }

private:
    struct Free {
        void operator()(telnet_t* telnet) const noexcept { ::telnet_free(telnet); }
    };

    static void pHandleEvent(telnet_t* telnet, telnet_event_t* event, void* self) noexcept;
    void pHandle(const telnet_event_t& event);
    void pHandleOffer(std::uint8_t option, bool isTaken);
    void pTakeData(const char* bytes, std::size_t length);
    void pSetPort();
    void pSetValue(std::uint8_t command, const std::string& value);
    void pCheckAnswer(const telnet_event_t& event);
    void pFail(const std::string& reason);

    const std::optional<SerialSettings> mSettings;
    const std::string mName;
    std::unique_ptr<telnet_t, Free> mTelnet;
    std::string mData; // received
    std::string mOutput;
    std::string mFailure;
    bool mSendsBinary = false;    // the peer has agreed
    bool mReceivesBinary = false; // the peer does it
    bool mHasReturned = false;    // the last byte received was a carriage return
    bool mControlsPort = false;   // the peer takes RFC 2217
    bool mHasSetPort = false;     // its settings were sent
};

} // namespace qel::tool
