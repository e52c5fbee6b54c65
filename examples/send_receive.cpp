// Both ends of a connection in one program: the console sends its version request over loopback TCP, the hypervisor
// receives it as the class it is.

#include <qel/common/QelMessageCast.hpp>
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelVersion.hpp>
#include <qel/common/io/QelMessageStream.hpp>
#include <qel/common/net/IPEndpoint.hpp>
#include <qel/common/net/Listen.hpp>
#include <qel/common/net/Socket.hpp>
#include <qel/common/net/SocketStream.hpp>

#include <chrono>
#include <exception>
#include <iostream>
#include <memory>
#include <sys/socket.h>
#include <utility>

int main()
try {
    qel::QelMessageRegistry registry; // knows the public messages; may be shared by all connections and threads

    qel::Socket listener = qel::listenOn(qel::IPEndpoint("127.0.0.1:0"), 1);
    const qel::IPEndpoint endpoint = listener.getSocketName();
    qel::Socket socket(endpoint.getFamily(), SOCK_STREAM | SOCK_CLOEXEC, 0);
    socket.connect(endpoint, std::chrono::seconds(5));

    qel::SocketStream consoleEnd(std::move(socket));
    qel::QelMessageStream console(consoleEnd, registry);
    console.write(qel::QelMessageGetEnclTypeAndInterfaceVersionReq(1, 2, 1, 0, "console-1"));

    qel::SocketStream hypervisorEnd(listener.accept());
    qel::QelMessageStream hypervisor(hypervisorEnd, registry);
    hypervisorEnd.setReadDeadline(std::chrono::seconds(5));
    std::unique_ptr<qel::QelMessage> message = hypervisor.read();
    const auto request = qel::qelMessageCast<qel::QelMessageGetEnclTypeAndInterfaceVersionReq>(message);

    std::cout << "QEL common library " << qel::version() << "\n"
              << "received " << request->getLogID() << "\n"
              << "from tool " << request->getToolId() << " of type " << request->getToolType() << "\n";
    return 0;
} catch (const std::exception& failure) {
    std::cerr << "send_receive: " << failure.what() << "\n";
    return 1;
}
