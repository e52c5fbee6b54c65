#include "integration/TlsConsole.hpp"

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>

#include "support/Authority.hpp"
#include "support/Process.hpp"

#include <gtest/gtest.h>

namespace qel::test {

TlsConsole::TlsConsole(const std::string& endpoint)
{
    const IPEndpoint to(endpoint);
    Socket socket(to.getFamily(), SOCK_STREAM | SOCK_CLOEXEC, 0);
    socket.connect(to, Loopback::kDeadline);
    mStream = std::make_unique<SocketStream>(std::move(socket));
    mStream->setReadDeadline(Process::kDeadline);
}

void TlsConsole::ask()
{
    QelMessageStream(*mStream, QelInternalMessageRegistry::getInstance()).write(QelMessageUpgradeConnectionAsync());
}

unsigned int TlsConsole::takeAnswer()
{
    const auto answer = QelMessageStream(*mStream, QelInternalMessageRegistry::getInstance()).read();
    EXPECT_EQ(answer->getFunction(), QelMessageFunctionQel);
    return answer->getOperation();
}

void TlsConsole::startTls(const SSLCredentials& credentials)
{
    mContext.setCredentials(credentials);
    mTls = std::make_unique<SSLStream>(mContext, std::move(mStream));
    mTls->handshake();
    mMessages = std::make_unique<LoopbackMessages>(*mTls);
}

void TlsConsole::comeIn(const std::string& toolId)
{
    ask();
    ASSERT_EQ(takeAnswer(), static_cast<unsigned int>(QelMessageOpUpgradeConnection));
    startTls(Authority::trusted().clientCredentials());
    ASSERT_EQ(mMessages->ask(QelMessageGetEnclTypeAndInterfaceVersionReq(1, 5, 1, 0, toolId))->getStatus(), 0U);
}

bool TlsConsole::isClosed()
{
    char byte = 0;
    Stream& stream = mTls ? static_cast<Stream&>(*mTls) : *mStream;
    return stream.read(&byte, 1) == 0;
}

} // namespace qel::test
