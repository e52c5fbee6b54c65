#include "client/ConnectOptions.hpp"

#include "base/OptionChecks.hpp"

#include <cstddef>
#include <limits>
#include <unistd.h>

namespace qel::tool {

namespace {

constexpr std::size_t kToolIdBytes = 32;
constexpr double kMinTimeout = 0.001;
constexpr double kMaxTimeout = 24 * 60 * 60;

} // namespace

std::chrono::milliseconds ConnectOptions::timeout() const
{
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::duration<double>(timeoutSeconds));
}

void addConnectOptions(CLI::App& app, ConnectOptions& options)
{
    app.add_option("--connect", options.endpoint, "Server to connect to: 127.0.0.1:PORT or [::1]:PORT")
        ->required()
        ->type_name("ENDPOINT")
        ->check(endpointValidator());
    addTransportOptions(app, options.transport);
    app.add_option("--timeout", options.timeoutSeconds, "Timeout in seconds for connecting and all responses together")
        ->type_name("SECONDS")
        ->check(numberIn(kMinTimeout, kMaxTimeout))
        ->capture_default_str();
    app.add_option("--tool-type", options.identity.toolType, "Tool type of this console")
        ->transform(integerIn(0, std::numeric_limits<std::uint32_t>::max()))
        ->capture_default_str();
    app.add_option("--tool-id", options.identity.toolId,
                   "Tool id of this console, at most 32 bytes (default: qel-<process id>)")
        ->check(textUpTo(kToolIdBytes));
}

IdentityOptions completeIdentity(const IdentityOptions& options)
{
    IdentityOptions identity = options;
    if (identity.toolId.empty()) identity.toolId = "qel-" + std::to_string(::getpid());
    return identity;
}

} // namespace qel::tool
