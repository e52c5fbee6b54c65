// A registry with entries of the program's own: which factory each frame finds, and what the factory may do.

#include <qel/common/QelInternalMessageRegistry.hpp>
#include <qel/common/QelMessageRegistry.hpp>

#include "support/Bytes.hpp"
#include "support/CapturedLog.hpp"
#include "support/RawFrame.hpp"
#include "support/RegistryFrames.hpp"

#include <array>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <new>
#include <set>
#include <stdexcept>
#include <tuple>
#include <type_traits>
#include <typeinfo>
#include <vector>

namespace qel {
namespace {

using test::CapturedLog;
using test::classOf;
using test::deserialize;
using test::frameOfIdentity;
using test::heapCopy;
using test::RawFrame;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::StrEq;
using testing::Throws;
using testing::ThrowsMessage;

using Classification = QelMessageClassification;
using Identifier = QelMessageRegistry::Identifier;

class Example : public QelMessageMetadata<Example, QelMessageFunctionQelKrog, QelMessageOpRunMacro,
                                          QelMessageClassification::Request> {
public:
    using QelMessageMetadata::QelMessageMetadata;
    ~Example() override = default;
};

RawFrame exampleFrame() { return frameOfIdentity(Example::getMessageID()); }

QelMessageRegistry registryWith(QelMessageRegistry::Factory factory)
{
    return QelMessageRegistry({{Example::getMessageID(), std::move(factory)}});
}

TEST(QelMessageRegistryEntries, OfAListHasExactlyItsEntries)
{
    const QelMessageRegistry registry({QelMessageRegistry::Entry<Example>()});
    EXPECT_EQ(classOf(*deserialize(registry, exampleFrame().bytes())), typeid(Example));
    EXPECT_EQ(
        classOf(*deserialize(registry, frameOfIdentity(Identifier(0x6003, 0x0107, Classification::Request)).bytes())),
        typeid(QelMessage));
}

TEST(QelMessageRegistryEntries, OfAnEmptyListHasNoEntries)
{
    const QelMessageRegistry registry(
        std::initializer_list<std::pair<const Identifier, QelMessageRegistry::Factory>>{});
    EXPECT_EQ(classOf(*deserialize(registry, exampleFrame().bytes())), typeid(QelMessage));
}

TEST(QelMessageRegistryEntries, UsesTheFirstOfSeveralEntriesForOneIdentity)
{
    const auto second = [](const char*, unsigned int) -> std::unique_ptr<QelMessage> {
        throw std::logic_error("the second entry was used");
    };
    const QelMessageRegistry registry({QelMessageRegistry::Entry<Example>(), {Example::getMessageID(), second}});
    EXPECT_EQ(classOf(*deserialize(registry, exampleFrame().bytes())), typeid(Example));
}

TEST(QelMessageRegistryEntries, EntryIsTheIdentityAndAFactory)
{
    const auto entry = QelMessageRegistry::Entry<Example>();
    EXPECT_EQ(entry.first, Identifier(0x800A, 0x0005, Classification::Request));
    const std::vector<char> frame = exampleFrame().bytes();
    const std::unique_ptr<QelMessage> message = entry.second(frame.data(), static_cast<unsigned int>(frame.size()));
    EXPECT_EQ(classOf(*message), typeid(Example));
}

TEST(QelMessageRegistryEntries, FindsTheFactoryOfAnIdentity)
{
    const QelMessageRegistry registry({QelMessageRegistry::Entry<Example>()});
    const QelMessageRegistry::Factory* const factory = registry.findFactory(Example::getMessageID());
    ASSERT_NE(factory, nullptr);
    EXPECT_EQ(registry.findFactory(Example::getMessageID()), factory) << "it is the registry's own, not a copy";
    const std::vector<char> frame = exampleFrame().bytes();
    EXPECT_EQ(classOf(*(*factory)(frame.data(), static_cast<unsigned int>(frame.size()))), typeid(Example));
}

TEST(QelMessageRegistryEntries, HasNoFactoryForAnUnknownIdentity)
{
    const QelMessageRegistry registry({QelMessageRegistry::Entry<Example>()});
    EXPECT_EQ(registry.findFactory(Identifier(0x800A, 0x0005, Classification::Response)), nullptr);
    EXPECT_EQ(registry.findFactory(Identifier(0x800A, 0x0006, Classification::Request)), nullptr);
    EXPECT_EQ(registry.findFactory(Identifier(0x800B, 0x0005, Classification::Request)), nullptr);
}

TEST(QelMessageRegistryEntries, TellsIdentitiesApartByEachPart)
{
    const auto largest = static_cast<Classification::Value>(0xFFFFFFFF);
    const auto build = QelMessageRegistry::Entry<Example>().second;
    const Identifier all[] = {{1, 0, {}},      {0, 1, {}},      {0, 0, Classification::Request},
                              {0xFFFF, 0, {}}, {0, 0xFFFF, {}}, {0, 0, largest},
                              {1, 1, largest}};
    const QelMessageRegistry registry(
        {{all[0], build}, {all[1], build}, {all[2], build}, {all[3], build}, {all[4], build}, {all[5], build}});
    std::set<const void*> found;
    for (const Identifier& identifier : all)
        found.insert(registry.findFactory(identifier));
    EXPECT_EQ(found.size(), 7U) << "six entries, and null for the last";
}

/// A registry of some identities that differ in few bits; each message comes from the factory of its own.
template <std::size_t Count>
void findsEachOf(const std::array<Identifier, Count>& identities)
{
    SCOPED_TRACE(Count);
    std::set<Identifier> made;
    const auto entry = [&made](const Identifier& identity) {
        const auto factory = [&made, identity](const char* buffer, unsigned int length) {
            made.insert(identity);
            return std::make_unique<QelMessage>(buffer, length);
        };
        return std::pair<const Identifier, QelMessageRegistry::Factory>(identity, factory);
    };
    const QelMessageRegistry registry =
        std::apply([&entry](const auto&... all) { return QelMessageRegistry({entry(all)...}); }, identities);
    for (const Identifier& identity : identities) {
        const Identifier other(std::get<0>(identity) ^ 0x8000U, std::get<1>(identity), std::get<2>(identity));
        EXPECT_EQ(registry.findFactory(other), nullptr);
        made.clear();
        deserialize(registry, frameOfIdentity(identity).bytes());
        EXPECT_THAT(made, ElementsAre(identity));
    }
}

template <std::size_t Count>
std::array<Identifier, Count> neighbours()
{
    constexpr Classification::Value kinds[] = {Classification::Request, Classification::Response,
                                               Classification::Async};
    std::array<Identifier, Count> identities;
    for (std::size_t i = 0; i < Count; ++i) {
        const auto function = static_cast<unsigned short>(0x6001 + i % 3);
        const auto operation = static_cast<unsigned short>(0x0100 + i / 9);
        identities.at(i) = {function, operation, kinds[i / 3 % 3]};
    }
    return identities;
}

TEST(QelMessageRegistryEntries, FindsEachOfManyEntries)
{
    findsEachOf(neighbours<1>());
    findsEachOf(neighbours<2>());
    findsEachOf(neighbours<3>());
    findsEachOf(neighbours<33>());
    findsEachOf(neighbours<300>());
}

TEST(QelMessageRegistryEntries, FactoryThrowsTheReasonOfARefusal)
{
    const QelMessageRegistry registry;
    const auto* const factory = registry.findFactory(Identifier(0x6002, 0x0402, Classification::Request));
    ASSERT_NE(factory, nullptr);
    const std::vector<char> frame = RawFrame::newForm().function(0x6002).operation(0x0402).flags(0x80).bytes();
    EXPECT_THAT(([&] { (*factory)(heapCopy(frame).get(), static_cast<unsigned int>(frame.size())); }),
                ThrowsMessage<QelMessageValidationException>(StrEq("dataLength shorter than actual data size")));
    EXPECT_EQ(classOf(*deserialize(registry, frame)), typeid(QelMessage));
}

TEST(QelMessageRegistryEntries, PassesTheBytesToTheFactoryInPlace)
{
    const char* seenBuffer = nullptr;
    unsigned int seenLength = 0;
    const QelMessageRegistry registry = registryWith([&](const char* buffer, unsigned int length) {
        seenBuffer = buffer;
        seenLength = length;
        return std::make_unique<QelMessage>();
    });
    const std::vector<char> frame = exampleFrame().bytes();
    EXPECT_NE(registry.deserialize(frame.data(), 32), nullptr);
    EXPECT_EQ(seenBuffer, frame.data());
    EXPECT_EQ(seenLength, 32U);
}

TEST(QelMessageRegistryEntries, FallsBackOnEveryValidationException)
{
    const QelMessageRegistry registry = registryWith([](const char*, unsigned int) -> std::unique_ptr<QelMessage> {
        throw QelMessageStatusException(QelMessage());
    });
    EXPECT_EQ(classOf(*deserialize(registry, exampleFrame().bytes())), typeid(QelMessage));
}

TEST(QelMessageRegistryEntries, PassesOtherExceptionsAndLogsNothing)
{
    CapturedLog log;
    const std::vector<char> frame = exampleFrame().bytes();
    EXPECT_THAT(
        [&] {
            deserialize(registryWith([](const char*, unsigned int) -> std::unique_ptr<QelMessage> {
                            throw std::range_error("out of range");
                        }),
                        frame);
        },
        ThrowsMessage<std::range_error>(StrEq("out of range")));
    EXPECT_THAT(
        [&] {
            deserialize(
                registryWith([](const char*, unsigned int) -> std::unique_ptr<QelMessage> { throw std::bad_alloc(); }),
                frame);
        },
        Throws<std::bad_alloc>());
    EXPECT_THAT(
        [&] {
            deserialize(registryWith([](const char*, unsigned int) -> std::unique_ptr<QelMessage> {
                            throw std::runtime_error("its base is not enough");
                        }),
                        frame);
        },
        ThrowsMessage<std::runtime_error>(StrEq("its base is not enough")));
    EXPECT_THAT(log.lines(), IsEmpty());
}

TEST(QelMessageRegistryEntries, IsImmutableOnceBuilt)
{
    static_assert(!std::is_copy_assignable<QelMessageRegistry>::value, "threads read it without a lock");
    static_assert(!std::is_move_assignable<QelMessageRegistry>::value, "threads read it without a lock");
    static_assert(!std::is_copy_assignable<QelInternalMessageRegistry>::value, "all threads of the process read it");

    const QelMessageRegistry original({QelMessageRegistry::Entry<Example>()});
    const QelMessageRegistry copy(original);
    EXPECT_EQ(classOf(*deserialize(copy, exampleFrame().bytes())), typeid(Example));
}

TEST(QelMessageRegistryEntries, CopyDoesNotNeedTheOriginal)
{
    auto original = std::make_unique<const QelMessageRegistry>(
        std::initializer_list<std::pair<const Identifier, QelMessageRegistry::Factory>>{
            QelMessageRegistry::Entry<Example>()});
    const QelMessageRegistry copy(*original);
    EXPECT_NE(copy.findFactory(Example::getMessageID()), original->findFactory(Example::getMessageID()));
    original.reset();
    EXPECT_EQ(classOf(*deserialize(copy, exampleFrame().bytes())), typeid(Example));
}

} // namespace
} // namespace qel
