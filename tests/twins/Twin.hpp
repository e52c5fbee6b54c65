#pragma once

#include <qel/common/io/Stream.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/net/SocketStream.hpp>
#include <qel/common/security/SSLContext.hpp>
#include <qel/protocol/WakeUp.hpp>

#include <cstdint>
#include <functional>
#include <list>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

/// @file
/// Servers with one fault each. A twin stands before a server of this project, takes the frames of both directions
/// apart, and changes those that its fault is about; everything else passes as it is. So each fault is what it says and
/// nothing more, and what a tester finds in a twin is found because of this fault.

namespace qel::test {

/// The bytes of a frame, with what faults ask about and change.
class TwinFrame {
public:
    explicit TwinFrame(std::string bytes) : mBytes(std::move(bytes)) {}

    const std::string& bytes() const { return mBytes; }
    std::string& bytes() { return mBytes; }

    unsigned int number(std::size_t offset, std::size_t width) const;
    void put(std::size_t offset, std::size_t width, std::uint32_t value);

    unsigned int function() const { return number(12, 2); }
    unsigned int operation() const { return number(20, 2); }
    unsigned int flags() const { return number(14, 1); }
    unsigned int status() const { return number(22, 2); }
    bool is(unsigned int aFunction, unsigned int anOperation) const
    {
        return function() == aFunction && operation() == anOperation;
    }
    bool isResponse() const { return (flags() & 0xC0U) == 0x40; }
    bool isRequest() const { return (flags() & 0xC0U) == 0x80; }
    bool isNotice() const { return (flags() & 0xC0U) == 0; }

    std::size_t header() const { return number(3, 1) == 0 ? 24 : 32; }
    std::string payload() const { return mBytes.substr(std::min(header(), mBytes.size()), number(16, 4)); }
    /// Replaces the payload; the pad is dropped. For the new header.
    void setPayload(const std::string& payload);

    /// A response to this frame, a request.
    TwinFrame response(unsigned int status) const;

private:
    std::string mBytes;
};

/// One connection through a twin.
class TwinLink {
public:
    TwinLink(Stream& console, Stream& server) : mConsole(console), mServer(server) {}

    // What a fault may do.
    void toConsole(const TwinFrame& frame) { pWrite(mConsole, frame.bytes()); }
    void toServer(const TwinFrame& frame) { pWrite(mServer, frame.bytes()); }
    /// Ends the connection at once, without what is still on its way.
    void cut() { mCut = true; }

    // What a fault may keep between frames.
    unsigned int count = 0;
    bool flag = false;
    std::string text;
    std::vector<TwinFrame> kept;

    bool isCut() const { return mCut; }
    /// Nothing has gone through yet.
    bool isNew() const { return mIsNew; }

private:
    void pWrite(Stream& stream, const std::string& bytes);

    Stream& mConsole;
    Stream& mServer;
    bool mCut = false;
    bool mIsNew = true;
};

/// What a twin does wrong. Each member may be empty: then what it is about passes as it is.
struct Fault {
    /// Of the steps to TLS.
    enum class Tls {
        None,
        GrantsAnything,     ///< any first message is taken for the request
        AnswersTwice,       ///< with two upgrade messages
        AnswersWithPayload, ///< the upgrade message has a payload
        AnswersAsRequest,   ///< the upgrade message is a request: flags 0x80
        IgnoresEarlyData,   ///< what comes with the request is not seen
        StaysInTheClear,    ///< answers messages in the clear after the answer
        RefusesOldHeader,   ///< closes the connection for a request with the old header
        AbortsWithPayload,  ///< the abort message has a payload
        StaysAfterAbort,    ///< the connection is not closed
        DoesNotAskForCertificates,
        AcceptsOtherRoots,
        AcceptsOldTls,     ///< TLS 1.2
        UpgradesInside,    ///< a request for TLS inside TLS is granted
        AnswersGarbage,    ///< malformed first bytes get the upgrade message
        WaitsAfterGarbage, ///< the connection stays when what comes is not TLS
        OneAtATime,        ///< a connection holds up the next one; also without TLS
        StaysAtTheEnd,     ///< the end of the stream is not noticed in the steps to TLS
    };

    std::string name;              ///< in tests/twins/found.txt, which says which cases must fail
    std::vector<std::string> only; ///< for a fault that nearly every case meets: only these cases are run
    std::function<void(TwinLink&, TwinFrame)> up;           ///< a frame of the console, its length right
    std::function<void(TwinLink&, TwinFrame)> down;         ///< a frame of the server
    std::function<bool(TwinLink&, std::string& bytes)> raw; ///< all that has come and not been handed on; true: go on
    bool dropsHalfClose = false;        ///< the end of the console's stream ends the connection at once
    bool staysAtTheEnd = false;         ///< the end of the console's stream is not noticed where no frame is complete
    bool outlivesItsConsole = false;    ///< the end of the console's stream is not passed on
    bool staysOpen = false;             ///< the end of the server's stream is not passed on
    bool endsIdle = false;              ///< a connection on which nothing has come for 200 ms is ended
    bool inTime = false;                ///< stands before a server whose deadlines are short
    unsigned int mostConnections = ~0U; ///< further ones are closed at once
    Tls tls = Tls::None;
};

/// A twin at work. Thread safety: one thread owns it.
class Twin {
public:
    /// Listens and starts its threads.
    /// @param server  behind it, without TLS  @param context  null: plain connections
    Twin(IPEndpoint server, const Fault& fault, SSLServerContext* context);
    /// Cuts the connections and joins the threads.
    ~Twin();
    Twin(const Twin&) = delete;
    Twin& operator=(const Twin&) = delete;

    const IPEndpoint& endpoint() const { return mEndpoint; }

private:
    void pAccept();
    void pServe(std::unique_ptr<SocketStream> console) noexcept;
    std::unique_ptr<Stream> pAdmit(std::unique_ptr<SocketStream> console);
    void pPump(Stream& console, int consoleFd);
    void pUp(TwinLink& link, std::string& bytes);
    void pDown(TwinLink& link, std::string& bytes);

    const IPEndpoint mServer;
    const Fault& mFault;
    SSLServerContext* const mContext;
    Socket mListener;
    const IPEndpoint mEndpoint;
    protocol::WakeUp mStop;
    std::thread mAccepter;
    std::list<std::thread> mThreads; // of the accepting thread
};

/// The faults of the conversation, and those of the steps to TLS.
std::vector<Fault> serverFaults();
std::vector<Fault> tlsFaults();

} // namespace qel::test
