#include "server/RefusalCounts.hpp"

#include <qel/common/QelMessageExceptions.hpp>
#include <qel/common/io/StreamIOException.hpp>
#include <qel/protocol/Error.hpp>

#include "base/StreamFailure.hpp"
#include "server/Admission.hpp"

namespace qel::protocol {

namespace {

ConnectionRefusal refusalOf(CertificateRejected::Reason reason) noexcept
{
    switch (reason) {
    case CertificateRejected::Reason::NamePin:
    case CertificateRejected::Reason::FingerprintPin:
        return ConnectionRefusal::NotPinned;
    default:
        return ConnectionRefusal::CertificateRejected;
    }
}

} // namespace

std::array<std::uint64_t, kConnectionRefusals> RefusalCounts::get() const noexcept
{
    std::array<std::uint64_t, kConnectionRefusals> counts{};
    for (std::size_t i = 0; i < counts.size(); ++i)
        counts[i] = mCounts[i].load(std::memory_order_relaxed);
    return counts;
}

ConnectionRefusal currentRefusal() noexcept
{
    try {
        throw;
    } catch (const NoMoreConsoles&) {
        return ConnectionRefusal::TooManyConsoles;
    } catch (const DeadlinePassed&) {
        return ConnectionRefusal::NotInTime;
    } catch (const ClosedByPeer&) {
        return ConnectionRefusal::Left;
    } catch (const CertificateRejected& error) {
        return refusalOf(error.getReason());
    } catch (const ProtocolBroken&) {
        return ConnectionRefusal::Malformed;
    } catch (const QelMessageValidationException&) {
        return ConnectionRefusal::Malformed;
    } catch (const StreamIOException& error) {
        return isDeadline(error) ? ConnectionRefusal::NotInTime : ConnectionRefusal::Left;
    } catch (...) {
        return ConnectionRefusal::Other;
    }
}

const char* refusalWord(ConnectionRefusal reason) noexcept
{
    switch (reason) {
    case ConnectionRefusal::TooManyHandshakes:
        return "handshakes";
    case ConnectionRefusal::TooManyFromAddress:
        return "address";
    case ConnectionRefusal::TooManyConsoles:
        return "consoles";
    case ConnectionRefusal::NotInTime:
        return "deadline";
    case ConnectionRefusal::Malformed:
        return "malformed";
    case ConnectionRefusal::CertificateRejected:
        return "certificate";
    case ConnectionRefusal::NotPinned:
        return "pin";
    case ConnectionRefusal::RequestRefused:
        return "request";
    case ConnectionRefusal::Left:
        return "left";
    case ConnectionRefusal::Other:
        break;
    }
    return "other";
}

} // namespace qel::protocol
