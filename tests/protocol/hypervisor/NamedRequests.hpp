#pragma once

#include "protocol/hypervisor/HypervisorFixture.hpp"

#include <vector>

namespace qel::test {

/// A request and what a failing test calls it.
struct NamedRequest {
    const char* name;
    QelMessageGeneric message;
};

/// One well-formed request of each kind but the version request.
inline std::vector<NamedRequest> otherRequests()
{
    return {
        {"open session", QelMessageInterfaceCmpOpenKrogSessionReq()},
        {"close session", QelMessageInterfaceCmpCloseKrogSessionReq()},
        {"capabilities", QelMessageExchIntCapabilitiesReq(QelCapabilities("1"))},
        {"limits", QelMessageGetInterfaceLimitsReq()},
        {"broadcast", QelMessageDaxBroadcastReq(0, 1, 0, "", "x")},
        {"time", QelMessageGetQelTodReq()},
        {"set mode", QelMessageSetGlobalModeAttributeReq(1, "m")},
        {"get mode", QelMessageGetGlobalModeAttributeReq()},
        {"set metadata", QelMessageSetGlobalSaveAreaMetadataReq("m")},
        {"get metadata", QelMessageGetGlobalSaveAreaMetadataReq()},
        {"open serial", QelMessageVirtualSerialOpenReq(1, 0, false)},
        {"close serial", QelMessageVirtualSerialCloseReq(1, 0, false)},
        {"max sessions", QelMessageVirtualSerialGetMaxSessionsReq()},
        {"set up serial", QelMessageVirtualSerialSetupSessionReq(1, 0)},
    };
}

/// The requests that have a payload, with one that is too short.
inline std::vector<NamedRequest> unparsableRequests()
{
    return {
        {"capabilities", request(0x6003, 0x0104, "abc")},  {"broadcast", request(0x6003, 0x0106, "abc")},
        {"set mode", request(0x6003, 0x0108, "abc")},      {"set metadata", request(0x6003, 0x010A, "a")},
        {"open serial", request(0x6002, 0x0402, "abc")},   {"close serial", request(0x6002, 0x0403, "abc")},
        {"set up serial", request(0x6002, 0x0406, "abc")},
    };
}

} // namespace qel::test
