#include "server/HandshakePlaces.hpp"

#include <utility>

namespace qel::protocol {

HandshakePlaces::Place::Place(HandshakePlaces& owner, std::string source) noexcept
    : mOwner(&owner), mSource(std::move(source))
{}

HandshakePlaces::Place::Place(Place&& other) noexcept
    : mOwner(std::exchange(other.mOwner, nullptr)), mSource(std::move(other.mSource))
{}

HandshakePlaces::Place& HandshakePlaces::Place::operator=(Place&& other) noexcept
{
    std::swap(mOwner, other.mOwner); // the other one gives back what this one had
    std::swap(mSource, other.mSource);
    return *this;
}

HandshakePlaces::Place::~Place() { release(); }

void HandshakePlaces::Place::release() noexcept
{
    if (mOwner != nullptr) std::exchange(mOwner, nullptr)->pGiveBack(mSource);
}

HandshakePlaces::HandshakePlaces(unsigned int total, unsigned int perSource) noexcept
    : mTotal(total), mPerSource(perSource)
{}

HandshakePlaces::Place HandshakePlaces::take(const std::string& source)
{
    std::string copy = source; // before anything is counted, as it may fail
    const MutexLock lock(mMutex);
    if (mTaken >= mTotal) {
        return {"too many connections are in their handshake", ConnectionRefusal::TooManyHandshakes};
    }
    unsigned int& taken = mTakenBySource[source];
    if (taken >= mPerSource) {
        return {"too many connections from its address are in their handshake", ConnectionRefusal::TooManyFromAddress};
    }
    ++taken;
    ++mTaken;
    return {*this, std::move(copy)};
}

void HandshakePlaces::pGiveBack(const std::string& source) noexcept
{
    const MutexLock lock(mMutex);
    --mTaken;
    const auto found = mTakenBySource.find(source);
    if (--found->second == 0) mTakenBySource.erase(found);
}

std::string sourceOf(const IPAddress& address)
{
    if (address.getFamily() == IPFamily::IPv4) return address.str();
    const IPv6Address& whole = address.getIPv6();
    if (whole.isIPv4Mapped()) {
        constexpr unsigned int kPrefixBytes = 12;
        return IPAddress(IPFamily::IPv4, whole.bytes().data() + kPrefixBytes, IPv4Address::kNumBytes).str();
    }
    const IPv6Address network{0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF};
    return (whole & network).str() + "/64";
}

} // namespace qel::protocol
