#include <qel/common/QelMessageInterfaceComponent.hpp>
#include <qel/common/QelMessageRegistry.hpp>
#include <qel/common/QelMessageVirtualSerial.hpp>

#include "Contest.hpp"
#include "messages.pb.h"
#include "messages_generated.h"

#include <cstdio>
#include <cstring>
#include <memory>
#include <ostream>
#include <streambuf>
#include <string>
#include <vector>

namespace qel::bench {

namespace {

// Both make a frame of 100 bytes.
constexpr std::size_t kFrameLength = 100;
constexpr std::size_t kSerialDataLength = 62; // after 32 bytes of header and 6 fixed ones
constexpr std::size_t kBroadcastLength = 22;  // after 32 bytes of header and 46 fixed ones

constexpr std::uint16_t kLparId = 7;
constexpr std::uint16_t kConnection = 0;
constexpr std::uint8_t kBroadcastType = 1;
constexpr std::uint32_t kToolType = 3;

const std::string& toolId()
{
    static const std::string id = "console-22";
    return id;
}

const std::string& bytes(std::size_t length)
{
    static const std::string longest(kSerialDataLength, 'x');
    static const std::string shorter(kBroadcastLength, 'x');
    return length == kSerialDataLength ? longest : shorter;
}

/// Serial data for an operating system: few fields, most of the frame is data.
struct SerialData {
    using Message = QelMessageVirtualSerialDataToOsAsync;
    using Flat = flat::SerialData;

    static Message build() { return Message(kLparId, kConnection, kSerialDataLength, bytes(kSerialDataLength).data()); }
    static void read(const Message& message)
    {
        benchmark::DoNotOptimize(message.getLpId());
        benchmark::DoNotOptimize(message.getVssConnectionNumber());
        benchmark::DoNotOptimize(message.getSerialDataLength());
        benchmark::DoNotOptimize(message.getSerialData());
    }

    static flatbuffers::Offset<Flat> buildFlat(flatbuffers::FlatBufferBuilder& builder)
    {
        const auto data = builder.CreateVector(reinterpret_cast<const std::uint8_t*>(bytes(kSerialDataLength).data()),
                                               kSerialDataLength);
        return flat::CreateSerialData(builder, kLparId, kConnection, data);
    }
    static void readFlat(const Flat& message)
    {
        benchmark::DoNotOptimize(message.lpar_id());
        benchmark::DoNotOptimize(message.connection());
        benchmark::DoNotOptimize(message.data()->size());
        benchmark::DoNotOptimize(message.data()->data());
    }

    static void fillProto(proto::Frame& frame)
    {
        proto::SerialData& message = *frame.mutable_serial_data();
        message.set_lpar_id(kLparId);
        message.set_connection(kConnection);
        message.set_data(bytes(kSerialDataLength));
    }
    static bool readProto(const proto::Frame& frame)
    {
        if (!frame.has_serial_data()) return false;
        const proto::SerialData& message = frame.serial_data();
        benchmark::DoNotOptimize(message.lpar_id());
        benchmark::DoNotOptimize(message.connection());
        benchmark::DoNotOptimize(message.data().size());
        benchmark::DoNotOptimize(message.data().data());
        return true;
    }
};

/// A broadcast from one console to another: numbers, a text and data.
struct Broadcast {
    using Message = QelMessageDaxBroadcastReq;
    using Flat = flat::Broadcast;

    static Message build()
    {
        return Message(kBroadcastType, kBroadcastLength, kToolType, toolId(), bytes(kBroadcastLength).data());
    }
    static void read(const Message& message)
    {
        benchmark::DoNotOptimize(message.getBroadcastMode());
        benchmark::DoNotOptimize(message.getToolType());
        benchmark::DoNotOptimize(message.getToolId());
        benchmark::DoNotOptimize(message.getDaxPacket());
    }

    static flatbuffers::Offset<Flat> buildFlat(flatbuffers::FlatBufferBuilder& builder)
    {
        const auto id = builder.CreateString(toolId());
        const auto data = builder.CreateVector(reinterpret_cast<const std::uint8_t*>(bytes(kBroadcastLength).data()),
                                               kBroadcastLength);
        return flat::CreateBroadcast(builder, kBroadcastType, kToolType, id, data);
    }
    static void readFlat(const Flat& message)
    {
        benchmark::DoNotOptimize(message.type());
        benchmark::DoNotOptimize(message.tool_type());
        benchmark::DoNotOptimize(message.tool_id()->str()); // a string of its own, as ours is
        benchmark::DoNotOptimize(message.message()->data());
    }

    static void fillProto(proto::Frame& frame)
    {
        proto::Broadcast& message = *frame.mutable_broadcast();
        message.set_type(kBroadcastType);
        message.set_tool_type(kToolType);
        message.set_tool_id(toolId());
        message.set_message(bytes(kBroadcastLength));
    }
    static bool readProto(const proto::Frame& frame)
    {
        if (!frame.has_broadcast()) return false;
        const proto::Broadcast& message = frame.broadcast();
        benchmark::DoNotOptimize(message.type());
        benchmark::DoNotOptimize(message.tool_type());
        benchmark::DoNotOptimize(message.tool_id());
        benchmark::DoNotOptimize(message.message().data());
        return true;
    }
};

// What every frame carries besides its body.
constexpr std::uint8_t kFlags = QelMessageClassification::toFlags(QelMessageClassification::Request);

template <typename Kind>
void finishFlat(flatbuffers::FlatBufferBuilder& builder, std::uint32_t callerId)
{
    const auto body = Kind::buildFlat(builder).Union();
    builder.Finish(
        flat::CreateFrame(builder, callerId, kFlags, 0, 0, flat::BodyTraits<typename Kind::Flat>::enum_value, body));
}

template <typename Kind>
void fillProto(proto::Frame& frame, std::uint32_t callerId)
{
    frame.set_caller_id(callerId);
    frame.set_flags(kFlags);
    Kind::fillProto(frame);
}

/// The frame as it is received.
template <typename Kind>
std::vector<char> frameOf(benchmark::State& state)
{
    const typename Kind::Message message = Kind::build();
    if (message.msgLength() != kFrameLength) state.SkipWithError("the frame is not 100 bytes long");
    return std::vector<char>(message.serialize(), message.serialize() + message.msgLength());
}

// A received frame is an object of its class, in one block, and the bytes it owns, in another.
template <typename Kind>
void copyIntoTwoBlocks(benchmark::State& state)
{
    const std::vector<char> received = frameOf<Kind>(state);
    for (auto _ : state) {
        std::unique_ptr<char[]> object(new char[sizeof(typename Kind::Message)]);
        benchmark::DoNotOptimize(object.get());
        std::unique_ptr<char[]> copy(new char[received.size()]);
        std::memcpy(copy.get(), received.data(), received.size());
        benchmark::DoNotOptimize(copy.get());
        benchmark::ClobberMemory();
    }
}

// What no way of receiving or building can do without: memory of its own, and a copy.
template <typename Kind>
void copyIntoNewMemory(benchmark::State& state)
{
    const std::vector<char> received = frameOf<Kind>(state);
    for (auto _ : state) {
        std::unique_ptr<char[]> copy(new char[received.size()]);
        std::memcpy(copy.get(), received.data(), received.size());
        benchmark::DoNotOptimize(copy.get());
        benchmark::ClobberMemory();
    }
}

template <typename Kind>
void deserialiseOurs(benchmark::State& state)
{
    const std::vector<char> received = frameOf<Kind>(state);
    const QelMessageRegistry registry;
    for (auto _ : state) {
        const std::unique_ptr<QelMessage> message =
            registry.deserialize(received.data(), static_cast<unsigned int>(received.size()));
        benchmark::DoNotOptimize(message->getCallerId());
        Kind::read(static_cast<const typename Kind::Message&>(*message));
    }
}

// The same without the registry: the class is known, and no field is read.
template <typename Kind>
void constructOurs(benchmark::State& state)
{
    const std::vector<char> received = frameOf<Kind>(state);
    for (auto _ : state) {
        const std::unique_ptr<QelMessage> message =
            std::make_unique<typename Kind::Message>(received.data(), static_cast<unsigned int>(received.size()));
        benchmark::DoNotOptimize(message.get());
    }
}

// Only the registry: from the bytes to the factory.
template <typename Kind>
void findOurs(benchmark::State& state)
{
    const std::vector<char> received = frameOf<Kind>(state);
    const QelMessageRegistry registry;
    const auto* const header = reinterpret_cast<const QelMessageRegistry::FastHeader*>(received.data());
    for (auto _ : state)
        benchmark::DoNotOptimize(registry.findFactory(header->getIdentifier()));
}

template <typename Kind>
void readIdentity(benchmark::State& state)
{
    const std::vector<char> received = frameOf<Kind>(state);
    const auto* const header = reinterpret_cast<const QelMessageRegistry::FastHeader*>(received.data());
    for (auto _ : state) {
        const QelMessageRegistry::Identifier identifier = header->getIdentifier();
        benchmark::DoNotOptimize(identifier);
    }
}

template <typename Kind>
bool readFlat(const std::uint8_t* received, std::size_t length)
{
    flatbuffers::Verifier verifier(received, length);
    if (!verifier.VerifyBuffer<flat::Frame>(nullptr)) return false;
    const auto* const frame = flatbuffers::GetRoot<flat::Frame>(received);
    const auto* const message = frame->template body_as<typename Kind::Flat>();
    if (message == nullptr) return false;
    benchmark::DoNotOptimize(frame->caller_id());
    Kind::readFlat(*message);
    return true;
}

template <typename Kind>
void deserialiseFlat(benchmark::State& state)
{
    flatbuffers::FlatBufferBuilder builder;
    finishFlat<Kind>(builder, 1);
    const std::vector<std::uint8_t> received(builder.GetBufferPointer(),
                                             builder.GetBufferPointer() + builder.GetSize());
    for (auto _ : state) {
        std::unique_ptr<std::uint8_t[]> copy(new std::uint8_t[received.size()]);
        std::memcpy(copy.get(), received.data(), received.size());
        benchmark::DoNotOptimize(copy.get());
        if (!readFlat<Kind>(copy.get(), received.size())) state.SkipWithError("not verified");
    }
}

template <typename Kind>
void deserialiseProto(benchmark::State& state)
{
    proto::Frame sent;
    fillProto<Kind>(sent, 1);
    const std::string received = sent.SerializeAsString();
    for (auto _ : state) {
        const auto frame = std::make_unique<proto::Frame>();
        if (!frame->ParseFromString(received)) state.SkipWithError("not parsed");
        benchmark::DoNotOptimize(frame->caller_id());
        if (!Kind::readProto(*frame)) state.SkipWithError("another message");
    }
}

template <typename Kind>
void buildOurs(benchmark::State& state)
{
    for (auto _ : state) {
        const typename Kind::Message message = Kind::build();
        benchmark::DoNotOptimize(message.serialize());
        benchmark::ClobberMemory();
    }
}

template <typename Kind>
void buildFlatReused(benchmark::State& state)
{
    flatbuffers::FlatBufferBuilder builder;
    std::uint32_t callerId = 0;
    for (auto _ : state) {
        builder.Clear();
        finishFlat<Kind>(builder, ++callerId);
        benchmark::DoNotOptimize(builder.GetBufferPointer());
        benchmark::ClobberMemory();
    }
}

template <typename Kind>
void buildProtoReused(benchmark::State& state)
{
    proto::Frame frame;
    std::string serialised;
    std::uint32_t callerId = 0;
    for (auto _ : state) {
        frame.Clear();
        fillProto<Kind>(frame, ++callerId);
        frame.SerializeToString(&serialised);
        benchmark::DoNotOptimize(serialised.data());
        benchmark::ClobberMemory();
    }
}

void validateOurs(benchmark::State& state)
{
    const std::vector<char> received = frameOf<SerialData>(state);
    const unsigned int length = static_cast<unsigned int>(received.size());
    for (auto _ : state) {
        benchmark::DoNotOptimize(QelMessage::CommonHeader::validate(received.data(), length));
    }
}

// The header's lengths read and added up, with nothing else checked.
void addUpLengths(benchmark::State& state)
{
    const std::vector<char> received = frameOf<SerialData>(state);
    for (auto _ : state) {
        const char* frame = received.data();
        benchmark::DoNotOptimize(frame);
        const auto* const header = reinterpret_cast<const QelMessage::CommonHeader*>(frame);
        benchmark::DoNotOptimize(header->mMsgLength.value() == 32 + header->mDataLength.value() + header->mPadLength);
    }
}

/// Takes text and keeps nothing, so that only the printing is measured.
class DroppingBuffer : public std::streambuf {
protected:
    std::streamsize xsputn(const char*, std::streamsize count) override { return count; }
    int_type overflow(int_type character) override { return traits_type::not_eof(character); }
};

template <typename Print>
void printInto(benchmark::State& state, const Print& print)
{
    const SerialData::Message message = SerialData::build();
    DroppingBuffer buffer;
    std::ostream os(&buffer);
    for (auto _ : state)
        print(os, message);
}

void printId(benchmark::State& state)
{
    printInto(state, [](std::ostream& os, const QelMessage& message) { os << message.getLogID(); });
}

void printDump(benchmark::State& state)
{
    printInto(state, [](std::ostream& os, const QelMessage& message) { os << message.debug(); });
}

// The same numbers and the same digits by the C library.
void printIdByC(benchmark::State& state)
{
    printInto(state, [](std::ostream& os, const QelMessage& message) {
        char text[128];
        const int length = std::snprintf(
            text, sizeof(text), "[CID: 0x%08X, FN: 0x%04X, OP: 0x%04X, FL: 0x%02X, DL: %u, ST: 0x%08X:%04X]",
            message.getCallerId(), static_cast<unsigned>(message.getFunction()),
            static_cast<unsigned>(message.getOperation()), static_cast<unsigned>(message.getFlags()),
            message.dataLength(), static_cast<unsigned>(message.getStatus()),
            static_cast<unsigned>(message.getStatusDetail()));
        os.write(text, length);
    });
}

// Only the hex digits of the frame, by the C library.
void printBytesByC(benchmark::State& state)
{
    printInto(state, [](std::ostream& os, const QelMessage& message) {
        char text[8];
        for (unsigned int i = 0; i < message.msgLength(); ++i) {
            const int length =
                std::snprintf(text, sizeof(text), "%02X", static_cast<unsigned char>(message.serialize()[i]));
            os.write(text, length);
        }
    });
}

template <typename Kind>
void addMessageContests(const std::string& kind)
{
    contest("deserialise 100 bytes, read 5 fields: " + kind)
        .ours(deserialiseOurs<Kind>)
        .floor("a copy into new memory", 0, copyIntoNewMemory<Kind>)
        .peer("two blocks of memory and a copy", 0, copyIntoTwoBlocks<Kind>)
        .peer("FlatBuffers: copy, verify, read", 1.15, deserialiseFlat<Kind>)
        .peer("protobuf: a fresh object", 0.4, deserialiseProto<Kind>);
    contest("deserialise, the class known, reading nothing: " + kind)
        .ours(constructOurs<Kind>)
        .floor("two blocks of memory and a copy", 0, copyIntoTwoBlocks<Kind>);
    contest("find the class of a frame: " + kind)
        .ours(findOurs<Kind>)
        .floor("reading the identity", 0, readIdentity<Kind>);
    contest("build 100 bytes from arguments: " + kind)
        .ours(buildOurs<Kind>)
        .floor("a copy into new memory", 0, copyIntoNewMemory<Kind>)
        .peer("FlatBuffers: a reused builder", 1.0, buildFlatReused<Kind>)
        .peer("protobuf: a reused object", 0.5, buildProtoReused<Kind>);
}

} // namespace

void addFrameContests()
{
    addMessageContests<Broadcast>("broadcast");
    addMessageContests<SerialData>("serial data");
    contest("validate a header").ours(validateOurs).floor("adding up the lengths", 0, addUpLengths);
    contest("print an ID").ours(printId).floor("snprintf of the same text", 0, printIdByC);
    contest("print a full dump, 100-byte frame").ours(printDump).floor("snprintf of the bytes alone", 0, printBytesByC);
}

} // namespace qel::bench
