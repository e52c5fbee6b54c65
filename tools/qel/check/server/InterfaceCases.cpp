#include <qel/common/util/TimeProvider.hpp>

#include "check/Anchors.hpp"
#include "check/Trial.hpp"
#include "check/server/Checks.hpp"
#include "check/server/ServerCases.hpp"

#include <cstdlib>
#include <ctime>
#include <string>

namespace qel::tool::check {

namespace {

using namespace anchors;

const std::string kAll(4, '\xFF');

/// Sends capabilities. @return the bits of the response
std::string offered(Trial& trial, const Draft& request)
{
    const Frame response = trial.console().expectStatus(request, 0);
    return response.payload.substr(std::min<std::size_t>(4, response.payload.size()));
}

Case offer(const char* name, const char* requirement, const char* anchor, Level level, Draft request,
           std::function<void(const std::string&)> check)
{
    return {std::string("capabilities/") + name,
            requirement,
            anchor,
            level,
            kNothing,
            [request = std::move(request), check = std::move(check)](Trial& trial) { check(offered(trial, request)); }};
}

void isNone(const std::string& bits)
{
    Trial::require(bits == std::string(bits.size(), '\0'), "no capability", "some");
}

void isFourBytes(const std::string& bits)
{
    Trial::requireEqual("bytes of capabilities:", 4, static_cast<std::uint32_t>(bits.size()));
}

Cases offerCases()
{
    const auto anything = [](const std::string&) {};
    return {
        offer("none", "A console that has no capability gets none.", kRequests, Level::Rule,
              capabilitiesRequest(4, std::string(4, '\0')), isNone),
        offer("length-0", "A length of 0 is valid and carries no bits: none is common.", kCapabilitiesReq, Level::Wire,
              capabilitiesRequest(0, ""), isNone),
        offer("length-8", "A longer field is accepted; its further bytes are ignored.", kCapabilitiesReq, Level::Wire,
              capabilitiesRequest(8, kAll + kAll), anything),
        offer("length-256", "A field of 256 bytes is accepted.", kCapabilitiesReq, Level::Wire,
              capabilitiesRequest(256, std::string(256, '\xFF')), anything),
        offer("length-8-answered-in-4", "The response has 4 bytes, whatever length was offered.", kRequests,
              Level::Rule, capabilitiesRequest(8, kAll + kAll), isFourBytes),
        offer("length-0-answered-in-4", "The response has 4 bytes also when none was offered.", kRequests, Level::Rule,
              capabilitiesRequest(0, ""), isFourBytes),
        offer("payload-longer", "Bytes after the capabilities are ignored.", "wire-format.md#payload", Level::Wire,
              capabilitiesRequest(4, std::string(4, '\0') + kAll), isNone),
        {"capabilities/common", "The response has the capabilities that both ends have: each bit is offered too.",
         kRequests, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             const std::string whole = wire.expectStatus(capabilitiesRequest(4, kAll), 0).payload.substr(4);
             const std::string half("\xA5\x5A\x0F\xF0");
             const std::string some = wire.expectStatus(capabilitiesRequest(4, half), 0).payload.substr(4);
             for (std::size_t i = 0; i < std::min(whole.size(), some.size()); ++i) {
                 Trial::requireEqual("byte " + std::to_string(i) + " of the common capabilities:",
                                     static_cast<unsigned char>(whole[i] & half[i]),
                                     static_cast<unsigned char>(some[i]));
             }
         }},
    };
}

Cases invalidCases()
{
    Cases cases;
    const auto add = [&](const char* name, const char* what, Draft request) {
        cases.push_back(isInvalid(std::string("capabilities/invalid/") + name, std::string(what) + " get status 3.",
                                  kCapabilitiesReq, identified, std::move(request)));
    };
    add("empty", "Capabilities without payload", interfaceRequest(kCapabilities));
    add("3-bytes", "Capabilities with a payload of 3 bytes", interfaceRequest(kCapabilities).payload("123"));
    add("length-1", "Capabilities with a length of 1", capabilitiesRequest(1, kAll));
    add("length-3", "Capabilities with a length of 3", capabilitiesRequest(3, kAll));
    add("length-6", "Capabilities with a length of 6", capabilitiesRequest(6, kAll + kAll));
    add("beyond-payload", "Capabilities with a length of one byte more than there are",
        capabilitiesRequest(8, kAll + "123"));
    add("length-wraps", "Capabilities with a length that wraps the sum in 32 bits",
        capabilitiesRequest(0xFFFFFFFCU, kAll));
    return cases;
}

/// The time of a response as seconds since 1970.
std::time_t timeOf(const Frame& frame)
{
    const auto digits = [&](std::size_t offset) {
        const unsigned int byte = frame.byteAt(offset);
        return static_cast<int>(byte / 16 * 10 + byte % 16);
    };
    std::tm time{};
    time.tm_year = digits(0) * 100 + digits(1) - 1900;
    time.tm_mon = digits(2) - 1;
    time.tm_mday = digits(3);
    time.tm_hour = digits(4);
    time.tm_min = digits(5);
    time.tm_sec = digits(6);
    return ::timegm(&time);
}

} // namespace

Cases capabilitiesCases() { return joined(offerCases, invalidCases); }

Cases timeCases()
{
    return {
        {"time/utc",
         "The time of day is in UTC: it differs from that of this machine by less than 14 minutes, if the clocks "
         "agree.",
         kRequests, Level::Rule, kNothing,
         [](Trial& trial) {
             constexpr std::time_t kMost = 14 * 60; // time zones differ by quarters of an hour
             const std::time_t theirs = timeOf(trial.console().expectStatus(timeRequest(), 0));
             const std::time_t ours = std::chrono::system_clock::to_time_t(TimeProvider::system());
             const auto difference = std::abs(static_cast<long>(theirs - ours));
             Trial::require(difference < kMost, "the time in UTC",
                            "a difference of " + std::to_string(difference) + " s");
         }},
        {"time/not-backwards", "A later response does not have an earlier time.", kRequests, Level::Rule, kNothing,
         [](Trial& trial) {
             Wire& wire = trial.console();
             const std::time_t first = timeOf(wire.expectStatus(timeRequest(), 0));
             const std::time_t second = timeOf(wire.expectStatus(timeRequest(), 0));
             Trial::require(second >= first, "a time that is not earlier", "an earlier time");
         }},
        getsStatus("time/with-payload", "The payload of the time request is ignored.", kMessages, Level::Wire,
                   identified, timeRequest().payload("payload"), 0),
        getsStatus("time/without-session", "The time needs no session.", kStates, Level::Rule, identified,
                   timeRequest(), 0),
    };
}

} // namespace qel::tool::check
