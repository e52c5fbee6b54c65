// A test of both ends without sockets: what a console may change on a hypervisor of our own, and what not.
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/protocol/Console.hpp>
#include <qel/protocol/Error.hpp>
#include <qel/protocol/MemoryStream.hpp>
#include <qel/protocol/Server.hpp>

#include <cstdlib>

class Machine : public qel::protocol::Hypervisor {
    qel::QelMessageStatusCodes mayRequest(const qel::protocol::Peer&, const qel::QelMessage& request) override
    {
        const bool sets = dynamic_cast<const qel::QelMessageSetGlobalSaveAreaMetadataReq*>(&request) != nullptr;
        return sets ? qel::QelMessageStatusInvalidOperation : qel::QelMessageStatusNoError;
    }
};

int main()
{
    Machine machine;
    qel::protocol::ServerOptions options;
    options.plain = true;
    options.listen.clear(); // nowhere: the connections come from serve()
    qel::protocol::Server server(machine, options);

    auto streams = qel::protocol::makeMemoryStreams();
    server.serve(std::move(streams.first), "the test");
    qel::protocol::ConsoleOptions plain("memory:1");
    plain.plain = true;
    qel::protocol::Console console(std::move(streams.second), plain);
    console.request(qel::QelMessageSetGlobalModeAttributeReq(7, "9105-22A"));
    if (console.request(qel::QelMessageGetGlobalModeAttributeReq())->getMode() != 7) return EXIT_FAILURE;
    try {
        console.request(qel::QelMessageSetGlobalSaveAreaMetadataReq("text"));
    } catch (const qel::protocol::StatusError& error) {
        return error.getStatus() == qel::QelMessageStatusInvalidOperation ? EXIT_SUCCESS : EXIT_FAILURE;
    }
    return EXIT_FAILURE;
}
