#include "client/ConnectOptions.hpp"

#include "base/OptionChecks.hpp"

#include <cstddef>
#include <limits>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr std::size_t kToolIdBytes = 32;
constexpr double kShortestTimeout = 0.001;
constexpr double kLongestTimeout = 24 * 60 * 60;

} // namespace

std::chrono::milliseconds ConnectOptions::timeout() const
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(timeoutSeconds));
}

void addConnectOptions(CLI::App& app, ConnectOptions& options)
{
    app.add_option("--connect", options.endpoint, "The hypervisor end, as 127.0.0.1:PORT or [::1]:PORT")
        ->required()
        ->type_name("ENDPOINT")
        ->check(endpointValidator());
    addTransportOptions(app, options.transport);
    app.add_option("--timeout", options.timeoutSeconds, "Seconds for connecting and all answers together")
        ->type_name("SECONDS")
        ->check(numberIn(kShortestTimeout, kLongestTimeout))
        ->capture_default_str();
    app.add_option("--tool-type", options.identity.toolType, "Type that this console introduces itself with")
        ->transform(integerIn(0, std::numeric_limits<std::uint32_t>::max()))
        ->capture_default_str();
    app.add_option("--tool-id", options.identity.toolId,
                   "Id that this console introduces itself with, at most 32 bytes; qel-<process id> unless given")
        ->check(textUpTo(kToolIdBytes));
}

IdentityOptions completeIdentity(const IdentityOptions& options)
{
    IdentityOptions identity = options;
    if (identity.toolId.empty()) identity.toolId = "qel-" + std::to_string(::getpid());
    return identity;
}

} // namespace qel::tool
