#include "check/server/Checks.hpp"

#include <utility>

namespace qel::tool::check {

Frame onlyResponse(Wire& wire, const Draft& request)
{
    Frame response = wire.expectStatus(request, 0);
    wire.fence();
    wire.expectNothingKept("one response and nothing else");
    return response;
}

void requireResponseHeader(const Frame& response, unsigned int function, unsigned int operation)
{
    Trial::require(response.is(function, operation),
                   "the function and operation of the request, " + messageName(function, operation),
                   messageName(response.function, response.operation));
    Trial::require(response.flags == 0x40, "the flags 0x40", "flags " + hexNumber(response.flags, 2));
    Trial::require(response.version == 0x20, "the new header", "header version " + hexNumber(response.version, 2));
    Trial::requireEqual("a pad of", 0, response.padLength);
    Trial::require(response.bytes.substr(26, 6) == std::string(6, '\0'), "zero in mReserved2 and mReserved3",
                   "other bytes");
}

void requireNoticeHeader(const Frame& notice)
{
    Trial::require(notice.flags == 0, "the flags 0x00", "flags " + hexNumber(notice.flags, 2));
    Trial::require(notice.version == 0x20, "the new header", "header version " + hexNumber(notice.version, 2));
    Trial::requireEqual("a pad of", 0, notice.padLength);
    Trial::requireEqual("the status", 0, notice.status);
}

void requirePayload(const Frame& frame, std::size_t length)
{
    Trial::requireEqual("a payload of this many bytes:", static_cast<std::uint32_t>(length),
                        static_cast<std::uint32_t>(frame.payload.size()));
}

void requireZero(const Frame& frame, std::size_t begin, std::size_t end, const std::string& what)
{
    const std::string field = frame.payload.substr(begin, end - begin);
    Trial::require(field == std::string(end - begin, '\0'), "zero in " + what, "other bytes");
}

Wire& connected(Trial& trial) { return trial.connect(); }
Wire& identified(Trial& trial) { return trial.console(); }
Wire& withSession(Trial& trial) { return trial.session(); }

Case getsStatus(std::string id, std::string requirement, const char* anchor, Level level, Prepare prepare,
                Draft request, unsigned int status, unsigned int needs)
{
    return {std::move(id),
            std::move(requirement),
            anchor,
            level,
            needs,
            [prepare, request = std::move(request), status](Trial& trial) {
                prepare(trial).expectStatus(request, status);
            }};
}

Case isInvalid(std::string id, std::string requirement, const char* anchor, Prepare prepare, Draft request)
{
    return {
        std::move(id),
        std::move(requirement),
        anchor,
        Level::Wire,
        kNothing,
        [prepare, request = std::move(request)](Trial& trial) { prepare(trial).expectStatus(request, kInvalidData); }};
}

Case isIgnored(std::string id, std::string requirement, const char* anchor, Level level, Prepare prepare, Draft message)
{
    return {std::move(id),
            std::move(requirement),
            anchor,
            level,
            kNothing,
            [prepare, message = std::move(message)](Trial& trial) {
                Wire& wire = prepare(trial);
                wire.send(message);
                wire.fence();
                wire.expectNothingKept("no answer");
            }};
}

} // namespace qel::tool::check
