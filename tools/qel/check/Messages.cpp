#include "check/Messages.hpp"

#include <utility>

namespace qel::tool::check {

namespace {

constexpr std::size_t kToolIdSlot = 32;

std::string slot(const std::string& toolId)
{
    std::string bytes = toolId;
    bytes.resize(kToolIdSlot, '\0');
    return bytes;
}

unsigned int lengthOr(unsigned int given, const std::string& text)
{
    return given == ~0U ? static_cast<unsigned int>(text.size()) : given;
}

std::string byteOf(unsigned int value) { return bigEndian16(value).substr(1); }

} // namespace

Draft interfaceRequest(unsigned int operation) { return Draft::request(kInterface, operation); }

std::string versionPayload(const VersionFields& fields)
{
    return bigEndian32(fields.interfaceVersion) + bigEndian32(fields.toolType) +
           bigEndian16(lengthOr(fields.toolIdLength, fields.toolId)) + bigEndian16(fields.major) +
           bigEndian16(fields.minor) + bigEndian16(fields.reserved) + slot(fields.toolId);
}

Draft versionRequest(std::uint32_t toolType, const std::string& toolId)
{
    VersionFields fields;
    fields.toolType = toolType;
    fields.toolId = toolId;
    return interfaceRequest(kVersion).payload(versionPayload(fields));
}

std::string broadcastPayload(const BroadcastFields& fields)
{
    return bigEndian16(fields.offset) + byteOf(fields.type) + byteOf(0) +
           bigEndian16(lengthOr(fields.textLength, fields.text)) + bigEndian16(0) + bigEndian32(fields.toolType) +
           bigEndian16(lengthOr(fields.toolIdLength, fields.toolId)) + slot(fields.toolId) + fields.between +
           fields.text;
}

Draft broadcastRequest(const BroadcastFields& fields)
{
    return interfaceRequest(kBroadcast).payload(broadcastPayload(fields));
}

Draft unicast(std::uint32_t toolType, const std::string& toolId, const std::string& text)
{
    BroadcastFields fields;
    fields.type = 1;
    fields.toolType = toolType;
    fields.toolId = toolId;
    fields.text = text;
    return broadcastRequest(fields);
}

Draft capabilitiesRequest(std::uint32_t length, const std::string& bits)
{
    return interfaceRequest(kCapabilities).payload(bigEndian32(length) + bits);
}

Draft setMode(unsigned int mode, const std::string& text, unsigned int length)
{
    return interfaceRequest(kSetMode).payload(byteOf(mode) + byteOf(0) + bigEndian16(lengthOr(length, text)) + text);
}

Draft setMetadata(const std::string& bytes, unsigned int length)
{
    return interfaceRequest(kSetMetadata).payload(bigEndian16(lengthOr(length, bytes)) + bytes);
}

std::string serialAddress(unsigned int partition, unsigned int number)
{
    return bigEndian16(partition) + bigEndian16(number);
}

Draft openSerial(unsigned int partition, unsigned int number, unsigned int flags)
{
    return Draft::request(kSerial, kOpenSerial)
        .payload(serialAddress(partition, number) + bigEndian16(flags) + bigEndian16(0));
}

Draft closeSerial(unsigned int partition, unsigned int number, unsigned int force)
{
    return Draft::request(kSerial, kCloseSerial).payload(serialAddress(partition, number) + byteOf(force));
}

Draft setUpSerial(unsigned int partition, unsigned int number)
{
    return Draft::request(kSerial, kSetUpSerial).payload(serialAddress(partition, number));
}

Draft maxSerial() { return Draft::request(kSerial, kMaxSerial); }

Draft dataToPartition(unsigned int partition, unsigned int number, const std::string& data, unsigned int length)
{
    return Draft::notice(kSerial, kDataToPartition)
        .payload(serialAddress(partition, number) + bigEndian16(lengthOr(length, data)) + data);
}

Draft upgradeNotice() { return Draft::notice(kHandshake, kUpgrade); }

std::vector<NamedRequest> requestsAfterVersion()
{
    std::vector<NamedRequest> requests{
        {"open-session", openSession()},
        {"close-session", closeSession()},
        {"capabilities", capabilitiesRequest(4, std::string(4, '\xFF'))},
        {"limits", limitsRequest()},
        {"broadcast", broadcastRequest({})},
        {"time", timeRequest()},
        {"set-mode", setMode(1, "")},
        {"get-mode", interfaceRequest(kGetMode)},
        {"set-metadata", setMetadata("")},
        {"get-metadata", interfaceRequest(kGetMetadata)},
    };
    for (NamedRequest& request : serialRequests(1))
        requests.push_back(std::move(request));
    return requests;
}

std::vector<NamedRequest> serialRequests(unsigned int partition)
{
    return {{"open-serial", openSerial(partition, 0)},
            {"close-serial", closeSerial(partition, 0)},
            {"max-serial", maxSerial()},
            {"set-up-serial", setUpSerial(partition, 0)}};
}

} // namespace qel::tool::check
