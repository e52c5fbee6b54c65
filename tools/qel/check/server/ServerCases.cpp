#include "check/server/ServerCases.hpp"

#include "check/server/Checks.hpp"

namespace qel::tool::check {

Cases serverCases()
{
    return joined(frameHeaderCases, frameStreamCases, versionCases, sessionCases, requestCases, responseCases,
                  capabilitiesCases, timeCases, modeCases, metadataCases, broadcastCases, serialCases, serialDataCases,
                  tlsCases, plainCases, robustCases);
}

} // namespace qel::tool::check
