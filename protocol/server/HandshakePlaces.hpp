#pragma once

#include <qel/common/net/IPAddress.hpp>
#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/ServerState.hpp>

#include <map>
#include <string>

namespace qel::protocol {

/// Counts the connections that have not identified themselves, in all and by where they come from, and says which are
/// too many.
/// Thread safety: any thread.
class HandshakePlaces {
public:
    /// The place of one connection. Gives it back when it is destroyed.
    /// Lifetime: not longer than the HandshakePlaces. Thread safety: one thread at a time.
    class Place {
    public:
        /// No place: for a connection that is not counted.
        Place() noexcept = default;
        Place(Place&& other) noexcept;
        Place& operator=(Place&& other) noexcept;
        ~Place();

        /// Gives it back early.
        void release() noexcept;

        explicit operator bool() const noexcept { return mOwner != nullptr; }

        /// Why there is none, for the log.
        const char* getRefusal() const noexcept { return mRefusal; }
        /// The same for the counters.
        ConnectionRefusal getReason() const noexcept { return mReason; }

    private:
        friend class HandshakePlaces;
        Place(const char* refusal, ConnectionRefusal reason) noexcept : mRefusal(refusal), mReason(reason) {}
        Place(HandshakePlaces& owner, std::string source) noexcept;

        HandshakePlaces* mOwner = nullptr; // null: no place
        std::string mSource;
        const char* mRefusal = "";
        ConnectionRefusal mReason = ConnectionRefusal::Other;
    };

    /// @param total, perSource  more than 0
    HandshakePlaces(unsigned int total, unsigned int perSource) noexcept;

    HandshakePlaces(const HandshakePlaces&) = delete;
    HandshakePlaces& operator=(const HandshakePlaces&) = delete;

    /// @param source  as sourceOf() names it
    /// @return none if there are already as many as allowed, in all or from this source
    /// @throws std::bad_alloc
    Place take(const std::string& source);

private:
    void pGiveBack(const std::string& source) noexcept;

    const unsigned int mTotal;
    const unsigned int mPerSource;

    Mutex mMutex;
    unsigned int mTaken QEL_GUARDED_BY(mMutex) = 0;
    std::map<std::string, unsigned int> mTakenBySource QEL_GUARDED_BY(mMutex); // without zeros
};

/// Where a connection comes from, as far as one peer can be told from another: "192.0.2.7", "2001:db8::/64".
///
/// An IPv4 address counts by itself, mapped into IPv6 or not. Of an IPv6 address the first 64 bits count: who has one
/// of the addresses of such a network usually has all of them.
/// @throws std::bad_alloc
std::string sourceOf(const IPAddress& address);

} // namespace qel::protocol
