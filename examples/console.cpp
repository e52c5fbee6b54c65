// A console: asks a hypervisor for the time of day, runs one command in partition 1 and prints its output.
#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/protocol/Console.hpp>

#include <exception>
#include <iostream>

int main(int count, char** words)
try {
    if (count != 2 && count != 4) throw std::invalid_argument("usage: console SERVER:PORT [DIRECTORY NAME]");
    qel::protocol::ConsoleOptions options(words[1]);
    options.plain = count == 2; // loopback addresses only; otherwise TLS, with credentials as "qel ca" writes them
    if (!options.plain) options.credentials = qel::protocol::Credentials::fromDirectory(words[2], words[3]);
    if (!options.plain) options.pins.names = {"server"};
    qel::protocol::Console console(options, std::chrono::seconds(5)); // connected, protected, introduced

    const auto time = console.request(qel::QelMessageGetQelTodReq()); // a QelMessageGetQelTodRsp, or an exception
    std::cout << qel::protocol::timeOf(*time) << " seconds since 1970" << std::endl;
    qel::protocol::SerialSession serial = console.openSerial(1);
    serial.write("uname -srm; exit\n");
    char buffer[4096];
    while (const std::size_t length = serial.read(buffer, sizeof(buffer)))
        std::cout.write(buffer, static_cast<std::streamsize>(length));
    std::cout << serial.describeEnd() << std::endl;
    console.leave();
} catch (const std::exception& error) {
    return std::cerr << "console: " << error.what() << std::endl, 1;
}
