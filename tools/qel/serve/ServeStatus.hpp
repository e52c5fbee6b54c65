#pragma once

#include <qel/common/util/Mutex.hpp>
#include <qel/protocol/Server.hpp>

#include "base/Library.hpp"
#include "serve/ServePlan.hpp"
#include "status/StatusReport.hpp"
#include "status/StatusServer.hpp"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <sys/types.h>
#include <vector>

namespace qel::tool {

/// What "qel serve" answers over its status socket. docs/serve.md has the requests.
///
/// Lifetime: borrows the server. Thread safety: any thread.
class ServeStatus {
public:
    /// @param plan  what the server has been started with
    ServeStatus(Server& server, const ServePlan& plan);

    /// Notes what is in force after a reload.
    /// @param hasLoaded  whether the server has loaded its certificates: their dates are read anew
    void note(const ServePlan& plan, bool hasLoaded);

    /// The answer to a request: one line of JSON without its end.
    std::string answer(const std::string& line, uid_t user);

    StatusReport report() const;

private:
    nlohmann::ordered_json pAnswer(const std::string& line, uid_t user);
    nlohmann::ordered_json pClose(const std::string& target, uid_t user);
    nlohmann::ordered_json pBreak(const std::string& target, uid_t user);

    Server& mServer;
    const unsigned int mMaxConsoles;
    const std::vector<std::string> mListen;

    mutable Mutex mMutex; ///< guards what follows; nothing is called under it
    std::chrono::hours mWarnExpiry QEL_GUARDED_BY(mMutex){0};
    std::vector<CertificateReport> mCertificates QEL_GUARDED_BY(mMutex);
};

/// Answers over the socket that the plan names, or over the default one.
/// @return null: the plan wants none, or there is no default that is free
/// @throws CommandFailure  CannotConnect: the plan's socket cannot be made
std::unique_ptr<StatusServer> startStatus(ServeStatus& status, const ServePlan& plan);

} // namespace qel::tool
